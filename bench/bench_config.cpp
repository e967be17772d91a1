// folder.conf readers and writers: the path query, the administration page's listing and
// the upsert of one folder, each against what the obvious code would cost.
#include <benchmark/benchmark.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/utils.h>
#include <strings.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "bench_env.h"
#include "bench_registry.h"
#include "support/fake_daemon.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace bench {

namespace {

const unsigned kShares = 10;
const unsigned kFoldersPerShare = 100;
const uint64_t kListingQueueLines = 100000;

std::string ShareName(unsigned i) { return "share" + std::to_string(i); }
std::string FolderPath(unsigned share, unsigned folder) {
  char buffer[64];
  std::snprintf(buffer, sizeof(buffer), "/share%u/dir%03u", share, folder);
  return buffer;
}

// 10 shares of 100 folders each (the limit of 1000), names shuffled so that a page
// sorted by name spans every share; skipLast leaves the last folder out.
std::string FolderConf(Sysroot& root, bool skipLast) {
  Json::Value conf(Json::objectValue);
  Rng rng(7);
  for (unsigned s = 0; s < kShares; ++s) {
    for (unsigned f = 0; f < kFoldersPerShare; ++f) {
      if (skipLast && s == kShares - 1 && f == kFoldersPerShare - 1) continue;
      const std::string path = FolderPath(s, f);
      root.MakeFolder(path);
      conf[path] = FolderRecord(path, "Folder " + std::to_string(rng.Below(100000)), rng.Below(16));
    }
  }
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  return Json::writeString(writer, conf);
}

struct ConfigEnv {
  ConfigEnv() {
    for (unsigned s = 0; s < kShares; ++s) root.AddShare(ShareName(s));
    fullConf = FolderConf(root, false);
    WriteFile(root.FolderConfPath(), fullConf);
  }
  Sysroot root;
  std::string fullConf;
};

ConfigEnv& Conf() {
  static ConfigEnv env;
  return env;
}

// The same folders, and a queue of 100,000 lines in the first share; the other shares
// have none, as most shares are idle at any one time.
struct ListingEnv {
  ListingEnv() {
    Conf().root.Activate();
    QueueRecipe recipe;
    recipe.shareFull = Conf().root.Full("/" + ShareName(0));
    recipe.folder = "dir000";
    recipe.lines = kListingQueueLines;
    recipe.seed = 1;
    WriteQueue(Conf().root.QueuePath(ShareName(0)), recipe);
  }
};

void ActivateListing() {
  static ListingEnv env;
  Conf().root.Activate();
  WarmPageCache(Conf().root.QueuePath(ShareName(0)));
}

bool StartsWith(const std::string& s, const std::string& prefix) {
  return s.size() >= prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

// JsonCpp's default reader on the whole file.
bool NaiveLoad(const std::string& path, Json::Value& conf) {
  std::ifstream in(path);
  Json::Reader reader;
  return reader.parse(in, conf) && conf.isObject();
}

// A path inside the last folder, and one in no folder (beside the last one): both
// compare against every folder.
const char kQueryInside[] = "/share9/dir099/a/b";
const char kQueryOutside[] = "/share9/dir0990";

void QueryLibrary(benchmark::State& state, const char* path) {
  Conf().root.Activate();
  if (FILEIDXIsPathIndexed(kQueryInside) != 1 || FILEIDXIsPathIndexed(kQueryOutside) != 0) {
    state.SkipWithError("unexpected answer");
    return;
  }
  for (auto _ : state) {
    benchmark::DoNotOptimize(FILEIDXIsPathIndexed(path));
    fake::Get().calls.clear();
  }
}

void QueryBaseline(benchmark::State& state, const char* path) {
  Conf().root.Activate();
  const std::string query = std::string(path) + "/";
  for (auto _ : state) {
    Json::Value conf;
    bool indexed = false;
    if (NaiveLoad(Conf().root.FolderConfPath(), conf)) {
      for (const std::string& folder : conf.getMemberNames()) {
        if (StartsWith(query, folder + "/")) {
          indexed = true;
          break;
        }
      }
    }
    benchmark::DoNotOptimize(indexed);
  }
}

Json::Value Additional() {
  Json::Value additional(Json::arrayValue);
  additional.append("status");
  additional.append("is_valid");
  return additional;
}

const unsigned long kPage = 50;

void ListingLibrary(benchmark::State& state) {
  ActivateListing();
  const Json::Value additional = Additional();
  for (auto _ : state) {
    Json::Value result;
    if (!TAVO::FILEINDEX::IndexMgr::List(result, 0, kPage, "name", "", additional) ||
        result["folder"].size() != kPage) {
      state.SkipWithError("listing failed");
      break;
    }
    fake::Get().calls.clear();
    logcap::Clear();
  }
}

// The obvious listing: parse, sort the records by name, and compute the page's fields
// by scanning each folder's queue the naive way.
void ListingBaseline(benchmark::State& state) {
  ActivateListing();
  Sysroot& root = Conf().root;
  std::map<std::string, std::string> queues;
  for (unsigned s = 0; s < kShares; ++s) queues[ShareName(s)] = root.QueuePath(ShareName(s));
  for (auto _ : state) {
    Json::Value conf;
    if (!NaiveLoad(root.FolderConfPath(), conf)) {
      state.SkipWithError("cannot parse folder.conf");
      break;
    }
    std::vector<Json::Value> records;
    for (const Json::Value& record : conf) records.push_back(record);
    std::sort(records.begin(), records.end(), [](const Json::Value& a, const Json::Value& b) {
      return ::strcasecmp(a["name"].asCString(), b["name"].asCString()) < 0;
    });
    Json::Value result(Json::objectValue);
    result["total"] = static_cast<Json::UInt>(records.size());
    result["offset"] = 0;
    Json::Value& page = result["folder"] = Json::Value(Json::arrayValue);
    for (unsigned long i = 0; i < kPage && i < records.size(); ++i) {
      Json::Value record = records[i];
      const std::string path = record["path"].asString();
      const std::string share = path.substr(1, path.find('/', 1) - 1);
      const bool pending = NaiveIsPathInQueue(root.Full(path), queues[share]);
      record["additional"]["status"] = pending ? "processing" : "finished";
      record["additional"]["is_valid"] = TAVO::FILEINDEX::CanPathBeIndexed(path);
      page.append(record);
    }
    benchmark::DoNotOptimize(result);
    fake::Get().calls.clear();
    logcap::Clear();
  }
}

// 999 folders, a listening daemon; every iteration upserts the thousandth and the files
// are put back untimed.
struct UpsertEnv {
  UpsertEnv() {
    Conf().root.Activate();
    conf999 = FolderConf(Conf().root, true);
    folder = Json::Value(Json::arrayValue);
    folder.append(FolderRecord(FolderPath(kShares - 1, kFoldersPerShare - 1), "New folder", 5));
    queue = Conf().root.QueuePath(ShareName(kShares - 1));
  }
  std::string conf999;
  Json::Value folder;
  std::string queue;
};

UpsertEnv& UpsertData() {
  static UpsertEnv env;
  return env;
}

void Restore(UpsertEnv& env, FakeDaemon& daemon) {
  WriteFile(Conf().root.FolderConfPath(), env.conf999);
  if (::truncate(env.queue.c_str(), 0) != 0) WriteFile(env.queue, "");
  daemon.Clear();
  fake::Get().calls.clear();
  fake::Get().monitorCalls.clear();
  logcap::Clear();
}

void UpsertEndToEnd(benchmark::State& state) {
  UpsertEnv& env = UpsertData();
  Conf().root.Activate();
  FakeDaemon daemon;
  if (!daemon.Start(Conf().root.SocketPath())) {
    state.SkipWithError("cannot start the fake daemon");
    return;
  }
  Restore(env, daemon);
  for (auto _ : state) {
    if (!TAVO::FILEINDEX::IndexMgr::Upsert(env.folder)) {
      state.SkipWithError("upsert failed");
      break;
    }
    state.PauseTiming();
    Restore(env, daemon);
    state.ResumeTiming();
  }
  daemon.Stop();
  WriteFile(Conf().root.FolderConfPath(), Conf().fullConf);
}

// The durable write of a 1000-folder folder.conf alone: temporary file, fsync, rename,
// fsync of the directory.
void SaveJsonOnly(benchmark::State& state) {
  Conf().root.Activate();
  WriteFile(Conf().root.FolderConfPath(), Conf().fullConf);
  TAVO::FILEINDEX::Folders folders;
  if (!folders.Load()) {
    state.SkipWithError("cannot load folder.conf");
    return;
  }
  for (auto _ : state) {
    if (!folders.SaveJson()) {
      state.SkipWithError("save failed");
      break;
    }
  }
}

}  // namespace

void RegisterConfigBenchmarks() {
  auto micros = [](benchmark::internal::Benchmark* b) { b->UseRealTime()->Unit(benchmark::kMicrosecond); };
  micros(benchmark::RegisterBenchmark("query_1000_folders/library", QueryLibrary, kQueryInside));
  micros(benchmark::RegisterBenchmark("query_1000_folders/baseline", QueryBaseline, kQueryInside));
  micros(benchmark::RegisterBenchmark("query_no_folder/library", QueryLibrary, kQueryOutside));
  micros(benchmark::RegisterBenchmark("query_no_folder/baseline", QueryBaseline, kQueryOutside));
  micros(benchmark::RegisterBenchmark("listing_page_50/library", ListingLibrary));
  micros(benchmark::RegisterBenchmark("listing_page_50/baseline", ListingBaseline));
  micros(benchmark::RegisterBenchmark("upsert_into_999/end_to_end", UpsertEndToEnd));
  micros(benchmark::RegisterBenchmark("upsert_into_999/save_json_only", SaveJsonOnly));
}

}  // namespace bench
