// Services: a state file per service and an optional executable hook that does the work.
// The hook follows the init-script convention: "status" exits 0 when the service runs,
// "start", "stop" and "restart" exit 0 on success.
#include <tavo/platform.h>
#include <unistd.h>

#include <string>

#include "host_common.h"

namespace {

bool ValidServiceName(const char* service) {
  if (service == nullptr) return false;
  std::string name = service;
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
}

std::string StatePath(const std::string& service) {
  return tavo_host::Rooted("/run/tavo/service/" + service);
}

std::string HookPath(const std::string& service) {
  return tavo_host::Rooted("/etc/tavo/services/" + service);
}

bool IsRecordedRunning(const std::string& service) {
  std::string state;
  return tavo_host::ReadFile(StatePath(service), state) && state == "running\n";
}

bool RecordState(const std::string& service, const char* state) {
  const std::string path = StatePath(service);
  if (!tavo_host::MakeDirs(path.substr(0, path.rfind('/')), 0755) ||
      !tavo_host::WriteFileAtomic(path, std::string(state) + "\n", 0644)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrService);
    return false;
  }
  return true;
}

enum class Hook { kAbsent, kSucceeded, kFailed };

// Runs the service's hook with one action; sets the error channel when it fails.
Hook RunHook(const std::string& service, const char* action, bool quiet = false) {
  const std::string hook = HookPath(service);
  if (::access(hook.c_str(), F_OK) != 0) return Hook::kAbsent;
  if (!tavo_host::IsExecutableFile(hook)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrServiceHook);
    return Hook::kFailed;
  }
  if (tavo_host::Run(hook, {hook, action}, true) == 0) return Hook::kSucceeded;
  if (!quiet) TAVO_HOST_SET_ERROR(tavo_host::kErrService);
  return Hook::kFailed;
}

}  // namespace

// Starts the service unless it already runs (as its hook's "status" says, or, without a
// hook, as its state file says).
extern "C" int VLIBServiceStart(const char* szService, int /*flag*/) {
  if (!ValidServiceName(szService)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  const std::string hook = HookPath(szService);
  if (::access(hook.c_str(), F_OK) != 0) {
    if (IsRecordedRunning(szService)) return 0;
    return RecordState(szService, "running") ? 0 : -1;
  }
  if (!tavo_host::IsExecutableFile(hook)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrServiceHook);
    return -1;
  }
  if (RunHook(szService, "status", true) != Hook::kSucceeded &&
      RunHook(szService, "start") != Hook::kSucceeded) {
    return -1;
  }
  return RecordState(szService, "running") ? 0 : -1;
}

extern "C" int VLIBServiceStop(const char* szService, int /*flag*/) {
  if (!ValidServiceName(szService)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  if (RunHook(szService, "stop") == Hook::kFailed) return -1;
  return RecordState(szService, "stopped") ? 0 : -1;
}

extern "C" int VLIBServiceRestart(const char* szService) {
  if (!ValidServiceName(szService)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  if (RunHook(szService, "restart") == Hook::kFailed) return -1;
  return RecordState(szService, "running") ? 0 : -1;
}
