// Program execution by fork/exec/wait, without a shell.
#include <fcntl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <string>
#include <vector>

#include "host_common.h"

#ifndef CLOSE_RANGE_CLOEXEC
#define CLOSE_RANGE_CLOEXEC (1U << 2)
#endif

namespace tavo_host {

namespace {

// Between fork and exec only async-signal-safe calls are made.
void MarkDescriptorsCloseOnExec() {
#ifdef SYS_close_range
  if (::syscall(SYS_close_range, 3U, ~0U, CLOSE_RANGE_CLOEXEC) == 0) return;
#endif
  long max = ::sysconf(_SC_OPEN_MAX);
  if (max < 0 || max > 65536) max = 65536;
  for (int fd = 3; fd < max; ++fd) {
    int flags = ::fcntl(fd, F_GETFD);
    if (flags >= 0) ::fcntl(fd, F_SETFD, flags | FD_CLOEXEC);
  }
}

[[noreturn]] void ExecChild(const char* path, char* const argv[], int report) {
  // The library ignores SIGPIPE for its socket writes; a program must not inherit that.
  struct sigaction dfl = {};
  dfl.sa_handler = SIG_DFL;
  ::sigaction(SIGPIPE, &dfl, nullptr);
  sigset_t none;
  sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  MarkDescriptorsCloseOnExec();
  ::execv(path, argv);
  int error = errno;
  ssize_t ignored = ::write(report, &error, sizeof(error));
  (void)ignored;
  ::_exit(127);
}

// The program to run: the one under the system root when it exists there.
std::string ResolveProgram(const std::string& program) {
  if (program.empty() || program[0] != '/' || SystemRoot().empty()) return program;
  std::string rooted = Rooted(program);
  return IsExecutableFile(rooted) ? rooted : program;
}

int WaitFor(pid_t pid, int* status) {
  while (::waitpid(pid, status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  return 0;
}

}  // namespace

int Run(const std::string& program, const std::vector<std::string>& args, bool wait) {
  const std::string path = ResolveProgram(program);
  std::vector<char*> argv;
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  if (argv.empty()) argv.push_back(const_cast<char*>(program.c_str()));
  argv.push_back(nullptr);

  // The exec error (if any) comes back through a close-on-exec pipe: end of file means
  // the program is running.
  int report[2];
  if (::pipe2(report, O_CLOEXEC) != 0) {
    TAVO_HOST_SET_ERROR(kErrSystem);
    return -1;
  }
  pid_t pid = ::fork();
  if (pid < 0) {
    ::close(report[0]);
    ::close(report[1]);
    TAVO_HOST_SET_ERROR(kErrExec);
    return -1;
  }
  if (pid == 0) {
    ::close(report[0]);
    if (!wait) {
      // Detach: the grandchild runs the program and is reparented to init.
      ::setsid();
      pid_t grandchild = ::fork();
      if (grandchild != 0) ::_exit(grandchild < 0 ? 126 : 0);
    }
    ExecChild(path.c_str(), argv.data(), report[1]);
  }
  ::close(report[1]);
  int execError = 0;
  ssize_t n;
  do {
    n = ::read(report[0], &execError, sizeof(execError));
  } while (n < 0 && errno == EINTR);
  ::close(report[0]);

  int status = 0;
  if (WaitFor(pid, &status) != 0) {
    TAVO_HOST_SET_ERROR(kErrExec);
    return -1;
  }
  if (n == static_cast<ssize_t>(sizeof(execError))) {
    errno = execError;
    TAVO_HOST_SET_ERROR(kErrExec);
    return -1;
  }
  if (!wait) {
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return 0;
    TAVO_HOST_SET_ERROR(kErrExec);
    return -1;
  }
  if (WIFEXITED(status)) {
    if (WEXITSTATUS(status) == 0) return 0;
    TAVO_HOST_SET_ERROR(kErrExecStatus);
    return WEXITSTATUS(status);
  }
  TAVO_HOST_SET_ERROR(kErrExecStatus);
  return -1;
}

}  // namespace tavo_host

extern "C" int VLIBCExec(const char* szProgram, const char* szArg1, const char* szArg2, const char* szArg3,
                         const char* szArg4) {
  if (szProgram == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  std::vector<std::string> argv{szProgram};
  for (const char* arg : {szArg1, szArg2, szArg3, szArg4}) {
    if (arg == nullptr) break;
    argv.push_back(arg);
  }
  return tavo_host::Run(szProgram, argv, true);
}

// flag non-zero: wait for the program; zero: start it and return.
extern "C" int VLIBCExecv(const char* szProgram, char* const argv[], int flag) {
  if (szProgram == nullptr || argv == nullptr) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return -1;
  }
  std::vector<std::string> args;
  for (char* const* arg = argv; *arg != nullptr; ++arg) args.push_back(*arg);
  return tavo_host::Run(szProgram, args, flag != 0);
}
