// The libFuzzer entry points around one check of harness.h. The process gets one system
// root on a memory file system (configuration saves sync every write), removed at exit.
#ifndef FILEINDEX_FUZZ_TARGET_H
#define FILEINDEX_FUZZ_TARGET_H

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "harness.h"

namespace fuzzh {

inline void RemoveRoot();

inline const Env& FuzzProcess() {
  static Env* env = [] {
    char shm[] = "/dev/shm/fileindex-fuzz-XXXXXX";
    char tmp[] = "/tmp/fileindex-fuzz-XXXXXX";
    const char* dir = ::mkdtemp(shm);
    if (dir == nullptr) dir = ::mkdtemp(tmp);
    if (dir == nullptr) {
      std::perror("mkdtemp");
      std::abort();
    }
    Env* made = new Env{dir};
    ::setenv("FILEINDEX_SYSROOT", dir, 1);
    SetUpRoot(*made);
    // Lives as long as the process; the commands the library sends go nowhere.
    SinkDaemon* daemon = new SinkDaemon();
    if (!daemon->Start(made->Socket())) {
      std::perror("daemon socket");
      std::abort();
    }
    std::atexit(RemoveRoot);
    return made;
  }();
  return *env;
}

inline void RemoveRoot() {
  const std::string root = FuzzProcess().root;
  const std::string command = "rm -rf '" + root + "'";
  if (std::system(command.c_str()) != 0) std::fprintf(stderr, "cannot remove %s\n", root.c_str());
}

inline void Report(const std::string& problem) {
  if (problem.empty()) return;
  std::fprintf(stderr, "==fileindex fuzz== %s\n", problem.c_str());
  std::abort();
}

}  // namespace fuzzh

#define FILEINDEX_FUZZ_TARGET(check)                                        \
  extern "C" int LLVMFuzzerInitialize(int*, char***) {                      \
    fuzzh::FuzzProcess();                                                   \
    return 0;                                                               \
  }                                                                         \
  extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) { \
    fuzzh::Report(check(fuzzh::FuzzProcess(), data, size));                 \
    return 0;                                                               \
  }

#endif
