// Services and Samba's Spotlight switch. Completed by the host-platform work; until
// then services are recorded as state files and Spotlight as a state file.
#include <fcntl.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "host_common.h"

namespace {

std::string StatePath(const std::string& service) { return tavo_host::Rooted("/run/tavo/service/" + service); }

bool WriteState(const std::string& path, const std::string& state) {
  std::ofstream out(path, std::ios::trunc);
  out << state << "\n";
  return static_cast<bool>(out);
}

int SetServiceState(const char* service, const char* state) {
  if (service == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  if (!WriteState(StatePath(service), state)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrService);
    return -1;
  }
  return 0;
}

}  // namespace

extern "C" int VLIBServiceStart(const char* szService, int /*flag*/) { return SetServiceState(szService, "running"); }

extern "C" int VLIBServiceStop(const char* szService, int /*flag*/) { return SetServiceState(szService, "stopped"); }

extern "C" int VLIBServiceRestart(const char* szService) { return SetServiceState(szService, "running"); }

extern "C" int TAVOSMBIsEnableSpotlight(void) {
  std::ifstream in(tavo_host::Rooted("/run/tavo/spotlight"));
  std::string state;
  in >> state;
  return state == "yes" ? 1 : 0;
}

extern "C" int TAVOSMBSetSpotlight(int blEnable) {
  if (!WriteState(tavo_host::Rooted("/run/tavo/spotlight"), blEnable ? "yes" : "no")) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSamba);
    return -1;
  }
  return 0;
}
