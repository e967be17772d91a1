// The queue scans: a folder's status, which reads the share's whole queue, and the
// pending-reindex check that precedes every custom event. Each against the naive scan.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "bench_env.h"
#include "bench_registry.h"
#include "internal/queue_scan.h"
#include "support/log_capture.h"

namespace bench {

namespace {

const uint64_t kQueueLines = 1000000;

// Share "photo" with the folder /photo/2019 and a queue of a million lines, the last one
// a pending reindex of the folder (so that the reindex check reads the whole file).
struct QueueEnv {
  explicit QueueEnv(unsigned malformedPerMille, bool writerOrder = false) {
    QueueRecipe recipe;
    recipe.writerOrder = writerOrder;
    recipe.shareFull = root.AddShare("photo");
    recipe.folder = "2019";
    recipe.lines = kQueueLines;
    recipe.malformedPerMille = malformedPerMille;
    root.MakeFolder("/photo/2019");
    folderFull = root.Full("/photo/2019");
    queue = root.QueuePath("photo");
    stats = WriteQueue(queue, recipe, "{\"event\":65536,\"path\":\"" + folderFull + "\",\"data\":null}\n");
    record = FolderRecord("/photo/2019", "2019", 15);
  }
  Sysroot root;
  std::string folderFull;
  std::string queue;
  QueueStats stats;
  Json::Value record;
};

QueueEnv& CleanQueue() {
  static QueueEnv env(0);
  return env;
}

QueueEnv& DirtyQueue() {
  static QueueEnv env(10);
  return env;
}

QueueEnv& WrittenQueue() {
  static QueueEnv env(0, true);
  return env;
}

void Prepare(benchmark::State& state, QueueEnv& env) {
  env.root.Activate();
  WarmPageCache(env.queue);
  state.counters["lines"] = static_cast<double>(env.stats.lines);
  state.counters["malformed"] = static_cast<double>(env.stats.malformed);
}

void Finish(benchmark::State& state, const QueueEnv& env) {
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * env.stats.bytes));
}

// Both implementations must give the same answer and the same log lines before either
// is timed.
bool SameAnswers(benchmark::State& state, QueueEnv& env) {
  logcap::Clear();
  const std::string status = TAVO::FILEINDEX::StatusMgr::GetFolderStatus("/photo/2019");
  const std::vector<std::string> libraryLog = logcap::Texts();
  logcap::Clear();
  const bool naive = NaiveIsPathInQueue(env.folderFull, env.queue);
  const std::vector<std::string> naiveLog = logcap::Texts();
  logcap::Clear();
  if (status != "processing" || !naive) {
    state.SkipWithError(("unexpected answers: " + status).c_str());
    return false;
  }
  if (libraryLog != naiveLog || libraryLog.size() != env.stats.malformed) {
    state.SkipWithError("the log lines differ");
    return false;
  }
  return true;
}

void FolderStatusLibrary(benchmark::State& state, QueueEnv& (*envOf)()) {
  QueueEnv& env = envOf();
  Prepare(state, env);
  if (!SameAnswers(state, env)) return;
  for (auto _ : state) {
    benchmark::DoNotOptimize(TAVO::FILEINDEX::StatusMgr::GetFolderStatus("/photo/2019"));
    logcap::Clear();
  }
  Finish(state, env);
}

void FolderStatusBaseline(benchmark::State& state, QueueEnv& (*envOf)()) {
  QueueEnv& env = envOf();
  Prepare(state, env);
  for (auto _ : state) {
    benchmark::DoNotOptimize(NaiveIsPathInQueue(env.folderFull, env.queue));
    logcap::Clear();
  }
  Finish(state, env);
}

void PendingReindexLibrary(benchmark::State& state) {
  QueueEnv& env = CleanQueue();
  Prepare(state, env);
  const uint64_t before = FileSize(env.queue);
  for (auto _ : state) {
    // Absorbed by the reindex on the last line: nothing is written.
    benchmark::DoNotOptimize(TAVO::FILEINDEX::AddCustomEvent(131072, env.folderFull, env.record));
  }
  if (FileSize(env.queue) != before) state.SkipWithError("the event was written");
  Finish(state, env);
}

void PendingReindexBaseline(benchmark::State& state) {
  QueueEnv& env = CleanQueue();
  Prepare(state, env);
  for (auto _ : state) {
    if (!NaiveQueueHasReindex(env.folderFull, env.queue)) {
      state.SkipWithError("reindex not found");
      break;
    }
  }
  Finish(state, env);
}

// What reading the file costs at all: the ceiling of any scan.
void ReadFileOnly(benchmark::State& state) {
  QueueEnv& env = CleanQueue();
  Prepare(state, env);
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  for (auto _ : state) {
    int fd = ::open(env.queue.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
      state.SkipWithError("cannot open the queue");
      break;
    }
    ssize_t n;
    while ((n = ::read(fd, buffer.get(), 1 << 20)) > 0) benchmark::DoNotOptimize(buffer.get());
    ::close(fd);
  }
  Finish(state, env);
}

// Reads the queue and counts its lines; false when it cannot be opened or the count is
// not the one written (the count is checked, so that the reading is not optimized away).
bool CountLines(const QueueEnv& env, char* buffer) {
  int fd = ::open(env.queue.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  size_t lines = 0;
  ssize_t n;
  while ((n = ::read(fd, buffer, 1 << 20)) > 0) {
    const char* p = buffer;
    const char* const end = p + n;
    while ((p = static_cast<const char*>(std::memchr(p, '\n', static_cast<size_t>(end - p)))) != nullptr) {
      ++lines;
      ++p;
    }
  }
  ::close(fd);
  return lines == env.stats.lines + 1;
}

// Reading the file and counting its lines: what a scan that looks at every byte once
// could at best reach.
void ReadCountLines(benchmark::State& state, QueueEnv& (*envOf)()) {
  QueueEnv& env = envOf();
  Prepare(state, env);
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  for (auto _ : state) {
    if (!CountLines(env, buffer.get())) {
      state.SkipWithError("wrong line count");
      break;
    }
  }
  Finish(state, env);
}

// The folder status against reading the file and counting its lines, timed in turn, so
// that a change in the machine's load falls on both alike: the median over the pairs of
// the status's speed as a share of the line count's.
void StatusShareOfLineCount(benchmark::State& state, QueueEnv& (*envOf)()) {
  using Clock = std::chrono::steady_clock;
  QueueEnv& env = envOf();
  Prepare(state, env);
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  std::vector<double> shares;
  for (auto _ : state) {
    const Clock::time_point start = Clock::now();
    benchmark::DoNotOptimize(TAVO::FILEINDEX::StatusMgr::GetFolderStatus("/photo/2019"));
    const Clock::time_point scanned = Clock::now();
    if (!CountLines(env, buffer.get())) {
      state.SkipWithError("wrong line count");
      return;
    }
    shares.push_back(std::chrono::duration<double>(Clock::now() - scanned).count() /
                     std::chrono::duration<double>(scanned - start).count());
  }
  std::sort(shares.begin(), shares.end());
  auto quantile = [&](size_t quarters) { return shares.empty() ? 0 : shares[shares.size() * quarters / 4]; };
  state.counters["share"] = quantile(2);
  // The middle half of the pairs, to show how far the machine's load moved the share.
  state.counters["share_q1"] = quantile(1);
  state.counters["share_q3"] = quantile(3);
  state.counters["pairs"] = static_cast<double>(shares.size());
}

// The library's line splitting alone.
void LineReaderOnly(benchmark::State& state) {
  QueueEnv& env = CleanQueue();
  Prepare(state, env);
  for (auto _ : state) {
    size_t lines = 0;
    TAVO::FILEINDEX::internal::ForEachQueueLine(env.queue, [&](const char*, size_t) {
      ++lines;
      return true;
    });
    benchmark::DoNotOptimize(lines);
  }
  Finish(state, env);
}

}  // namespace

void RegisterQueueBenchmarks() {
  auto realTime = [](benchmark::internal::Benchmark* b) { b->UseRealTime()->Unit(benchmark::kMillisecond); };
  realTime(benchmark::RegisterBenchmark("queue_scan/library", FolderStatusLibrary, &CleanQueue));
  realTime(benchmark::RegisterBenchmark("queue_scan/baseline", FolderStatusBaseline, &CleanQueue));
  realTime(
      benchmark::RegisterBenchmark("queue_scan_1pct_malformed/library", FolderStatusLibrary, &DirtyQueue));
  realTime(
      benchmark::RegisterBenchmark("queue_scan_1pct_malformed/baseline", FolderStatusBaseline, &DirtyQueue));
  realTime(benchmark::RegisterBenchmark("queue_scan_as_written/library", FolderStatusLibrary, &WrittenQueue));
  realTime(
      benchmark::RegisterBenchmark("queue_scan_as_written/baseline", FolderStatusBaseline, &WrittenQueue));
  realTime(benchmark::RegisterBenchmark("pending_reindex/library", PendingReindexLibrary));
  realTime(benchmark::RegisterBenchmark("pending_reindex/baseline", PendingReindexBaseline));
  realTime(benchmark::RegisterBenchmark("read_file_only/reference", ReadFileOnly));
  realTime(benchmark::RegisterBenchmark("read_count_lines/reference", ReadCountLines, &CleanQueue));
  realTime(
      benchmark::RegisterBenchmark("read_count_lines_as_written/reference", ReadCountLines, &WrittenQueue));
  realTime(benchmark::RegisterBenchmark("line_reader_only/reference", LineReaderOnly));
  // Enough pairs for a steady median: the machine's speed drifts over seconds, and a
  // shorter run can fall within one slow spell.
  for (auto* pairs :
       {benchmark::RegisterBenchmark("queue_scan_share/paired", StatusShareOfLineCount, &CleanQueue),
        benchmark::RegisterBenchmark("queue_scan_as_written_share/paired", StatusShareOfLineCount,
                                     &WrittenQueue)})
    realTime(pairs->MinTime(10));
}

}  // namespace bench
