// Program execution by fork/exec/wait, without a shell.
#include <sys/wait.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "host_common.h"

namespace {

int RunAndWait(const char* program, char* const argv[]) {
  pid_t pid = ::fork();
  if (pid < 0) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrExec);
    return -1;
  }
  if (pid == 0) {
    ::execv(program, argv);
    ::_exit(127);
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) {
      TAVO_HOST_SET_ERROR(tavo_host::kErrExec);
      return -1;
    }
  }
  if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return 0;
  TAVO_HOST_SET_ERROR(tavo_host::kErrExec);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace

extern "C" int VLIBCExec(const char* szProgram, const char* szArg1, const char* szArg2,
                         const char* szArg3, const char* szArg4) {
  if (szProgram == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  std::vector<char*> argv{const_cast<char*>(szProgram)};
  for (const char* arg : {szArg1, szArg2, szArg3, szArg4}) {
    if (arg == nullptr) break;
    argv.push_back(const_cast<char*>(arg));
  }
  argv.push_back(nullptr);
  return RunAndWait(szProgram, argv.data());
}

extern "C" int VLIBCExecv(const char* szProgram, char* const argv[], int /*flag: wait*/) {
  if (szProgram == nullptr || argv == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  return RunAndWait(szProgram, argv);
}
