// fileindex-extract: fileindexd's extraction worker. It reads requests from its standard
// input (one end of a socket pair), extracts each file's metadata and text, and answers on
// the same socket. It runs at the lowest CPU and I/O priority, under a memory limit; the
// daemon kills it when a file takes too long and starts another.
//
//   fileindex-extract [--memory-limit MIB]
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "extract_protocol.h"
#include "extractors.h"

namespace {

// ioprio_set(2) has no libc wrapper; the values are the kernel's.
const int kIoprioWhoProcess = 1;
const int kIoprioClassIdle = 3;
const int kIoprioClassShift = 13;

bool WriteAll(int fd, const std::string& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

#if defined(__SANITIZE_ADDRESS__)
// The address sanitizer's own memory limit stands in for the address-space limit, which
// cannot sit beside its shadow memory: past it, allocations fail as they would under the
// limit.
extern "C" const char* __asan_default_options() {
  return "soft_rss_limit_mb=768:allocator_may_return_null=1";
}
#endif

int main(int argc, char** argv) {
  unsigned long memoryMiB = 512;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--memory-limit") == 0 && i + 1 < argc) {
      memoryMiB = std::strtoul(argv[++i], nullptr, 10);
    } else {
      std::fprintf(stderr, "usage: fileindex-extract [--memory-limit MIB]\n");
      return 2;
    }
  }
  // Dies with the daemon, whatever it is doing.
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() == 1) return 1;
  ::setpriority(PRIO_PROCESS, 0, 19);
  if (::syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, kIoprioClassIdle << kIoprioClassShift) != 0)
    std::fprintf(stderr, "fileindex-extract: idle I/O priority refused: %s\n", std::strerror(errno));
  struct rlimit noCore = {0, 0};
  ::setrlimit(RLIMIT_CORE, &noCore);
#if defined(__SANITIZE_ADDRESS__)
  // The address sanitizer reserves terabytes of address space: no limit fits beside it.
  (void)memoryMiB;
#else
  if (memoryMiB > 0) {
    struct rlimit memory;
    memory.rlim_cur = memory.rlim_max = static_cast<rlim_t>(memoryMiB) << 20;
    if (::setrlimit(RLIMIT_AS, &memory) != 0)
      std::fprintf(stderr, "fileindex-extract: memory limit refused: %s\n", std::strerror(errno));
  }
#endif

  std::string error;
  if (!fileindexd::InitExtractors(error)) {
    std::fprintf(stderr, "fileindex-extract: %s\n", error.c_str());
    return 1;
  }
  // Ready: the daemon sends no file to a worker that could not start.
  if (!WriteAll(0, fileindexd::EncodeFrame("{\"ready\":true}", ""))) return 0;
  fileindexd::FrameReader reader;
  fileindexd::ExtractLimits limits;
  char buffer[65536];
  for (;;) {
    std::string json, text;
    fileindexd::FrameReader::Status status;
    while ((status = reader.Next(json, text)) == fileindexd::FrameReader::Status::kNeedMore) {
      ssize_t n = ::read(0, buffer, sizeof(buffer));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return 0;  // the daemon is gone or done with us
      reader.Append(buffer, static_cast<std::size_t>(n));
    }
    std::string path;
    fileindex_store::Kind hint;
    if (status == fileindexd::FrameReader::Status::kInvalid || !fileindexd::DecodeRequest(json, path, hint)) {
      std::fprintf(stderr, "fileindex-extract: malformed request\n");
      return 1;
    }
    fileindex_store::Content content;
    fileindexd::ExtractFile(path, hint, limits, content, text);
    if (!WriteAll(0, fileindexd::EncodeResult(content, text))) return 0;
  }
}
