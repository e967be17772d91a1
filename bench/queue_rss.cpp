// Peak memory of a folder status over a large queue: the scan must use the same few
// megabytes whatever the file's size. Usage: fileindex_queue_rss [megabytes, default 1024]
// The queue is generated here; the scan runs in a fresh process.
#include <fcntl.h>
#include <fileindex/status_mgr.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

#include "bench_env.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace {

// A "Vm...:" line of /proc/self/status, in kB.
long StatusKb(const char* key) {
  std::ifstream in("/proc/self/status");
  std::string line;
  const size_t n = std::strlen(key);
  while (std::getline(in, line)) {
    if (line.compare(0, n, key) == 0) return std::atol(line.c_str() + n + 1);
  }
  return -1;
}

// Resets VmHWM to the current resident size, so that the next reading is the peak of
// what follows alone.
bool ResetPeak() {
  int fd = ::open("/proc/self/clear_refs", O_WRONLY | O_CLOEXEC);
  if (fd < 0) return false;
  const bool ok = ::write(fd, "5", 1) == 1;
  ::close(fd);
  return ok;
}

// In a fresh process, so that nothing the generation left behind hides the scan's peak:
// the folder status of /photo/2019 on the queue under root.
int Scan(const char* root) {
  ::setenv("FILEINDEX_SYSROOT", root, 1);
  fake::Reset();
  fake::AddShare(root, "/volume1", "photo");
  const std::string queue = std::string(root) + "/volume1/photo/@eaDir/TAVO@file_index_queue";
  bench::WarmPageCache(queue);

  const long rssBefore = StatusKb("VmRSS:");
  const bool reset = ResetPeak();
  const auto start = std::chrono::steady_clock::now();
  const std::string status = TAVO::FILEINDEX::StatusMgr::GetFolderStatus("/photo/2019");
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  const long hwmAfter = StatusKb("VmHWM:");

  const double megabytes = static_cast<double>(bench::FileSize(queue)) / 1e6;
  std::printf("queue %.0f MB: status \"%s\" in %.2f s (%.0f MB/s), %zu log lines\n", megabytes,
              status.c_str(), seconds, megabytes / seconds, logcap::Lines().size());
  if (!reset) {
    std::printf("the peak could not be reset (/proc/self/clear_refs): peak %ld kB, resident before %ld kB\n",
                hwmAfter, rssBefore);
    return 1;
  }
  std::printf("resident before the scan %ld kB, peak during it %ld kB: extra peak RSS %ld kB (%.2f MB)\n",
              rssBefore, hwmAfter, hwmAfter - rssBefore, static_cast<double>(hwmAfter - rssBefore) / 1024);
  return status == "processing" ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 3 && std::strcmp(argv[1], "--scan") == 0) return Scan(argv[2]);
  const unsigned long megabytes = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 1024;
  bench::Sysroot root;
  bench::QueueRecipe recipe;
  recipe.shareFull = root.AddShare("photo");
  recipe.folder = "2019";
  root.MakeFolder("/photo/2019");
  const std::string queue = root.QueuePath("photo");
  // Lines enough for the size asked, from the average of a sample.
  recipe.lines = 10000;
  const uint64_t sample = bench::WriteQueue(queue, recipe).bytes;
  recipe.lines = megabytes * 1000000ULL * 10000 / sample;
  const bench::QueueStats stats = bench::WriteQueue(queue, recipe);
  std::printf("generated %llu lines\n", static_cast<unsigned long long>(stats.lines));
  std::fflush(stdout);

  const pid_t child = ::fork();
  if (child == 0) {
    ::execl("/proc/self/exe", argv[0], "--scan", root.Root().c_str(), static_cast<char*>(nullptr));
    ::_exit(127);
  }
  int status = 1;
  if (child < 0 || ::waitpid(child, &status, 0) != child) return 1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
