// The indexing service end to end, each figure beside a naive baseline measured on the
// same data in the same run:
//   1. the first full index of a generated tree by the real daemons in a sandbox (files/s,
//      the daemon's peak memory), beside a naive crawler that inserts into a plain table;
//   2. a file created in an indexed folder until a search finds it (median, p95);
//   3. word-prefix searches over an index of a million entries (p50, p95), beside a
//      LIKE '%word%' scan of a plain table holding the same rows;
//   4. Samba's Spotlight queries through fileindexd's HTTP endpoint over the same million
//      entries (a name prefix, a kind, ...: p50, p95 of the round trip on loopback), beside
//      the same questions put to the plain table;
//   5. the contents of generated photos, audio, videos, PDFs and text files extracted by the
//      daemon's worker (files/s per kind), beside the same extraction in this process with
//      no worker and no index; the index's size against the corpus; searches while it works;
// and the index's size on disk per entry.
//
//   fileindex_bench_service [--files N] [--dirs N] [--entries N] [--creations N] [--content-files N]
//
// Everything lives in a private tmpfs mounted for the run (or, when mounting is not
// allowed, a directory in /dev/shm); the daemons it starts are stopped by process id and
// the directory removed on the way out, also on SIGINT and SIGTERM.
#include <fcntl.h>
#include <fileindex/fileindex_c.h>
#include <httplib.h>
#include <json/json.h>
#include <signal.h>
#include <spotlight_endpoint.h>
#include <sqlite3.h>
#include <store.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cinttypes>
#include <cmath>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "content_samples.h"
#include "extractors.h"

#ifndef FILEINDEX_BENCH_CTL
#define FILEINDEX_BENCH_CTL "fileindexctl"
#endif

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using fileindex_store::Kind;

double Seconds(Clock::time_point from, Clock::time_point to) {
  return std::chrono::duration<double>(to - from).count();
}

std::string Format(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string Format(const char* format, ...) {
  char buffer[512];
  va_list args;
  va_start(args, format);
  std::vsnprintf(buffer, sizeof(buffer), format, args);
  va_end(args);
  return buffer;
}

std::string Duration(double seconds) {
  if (seconds >= 1) return Format("%.2f s", seconds);
  if (seconds >= 1e-3) return Format("%.2f ms", seconds * 1e3);
  return Format("%.1f us", seconds * 1e6);
}

// 1000000 as "1m", 200000 as "200k".
std::string Count(std::size_t n) {
  if (n >= 1000000 && n % 1000000 == 0) return std::to_string(n / 1000000) + "m";
  if (n >= 1000 && n % 1000 == 0) return std::to_string(n / 1000) + "k";
  return std::to_string(n);
}

double Percentile(std::vector<double> values, double q) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  std::size_t rank = static_cast<std::size_t>(std::ceil(q * static_cast<double>(values.size())));
  return values[std::min(values.size(), std::max<std::size_t>(rank, 1)) - 1];
}

// ---------------------------------------------------------------------------------------
// The summary table, in the style of the library's benchmark.

struct Row {
  std::string scenario, variant, figure, versus, target;
};
std::vector<Row> g_rows;
std::vector<std::string> g_notes;

void AddRow(const std::string& scenario, const std::string& variant, const std::string& figure,
            const std::string& versus = "", const std::string& target = "") {
  g_rows.push_back({scenario, variant, figure, versus, target});
  std::printf("  %s / %s: %s %s\n", scenario.c_str(), variant.c_str(), figure.c_str(), versus.c_str());
  std::fflush(stdout);
}

std::string Faster(double baseline, double measured) {
  if (baseline <= 0 || measured <= 0) return "";
  double ratio = baseline / measured;
  return ratio >= 1 ? Format("%.1fx faster", ratio) : Format("%.2fx slower", 1 / ratio);
}

std::string Verdict(bool met, const std::string& target) { return target + (met ? ": met" : ": MISSED"); }

void PrintTable() {
  std::printf("\n%-26s %-16s %-30s %-16s  %s\n", "scenario", "variant", "figure", "vs baseline", "target");
  for (const Row& row : g_rows) {
    std::printf("%-26s %-16s %-30s %-16s  %s\n", row.scenario.c_str(), row.variant.c_str(),
                row.figure.c_str(), row.versus.c_str(), row.target.c_str());
  }
  for (const std::string& note : g_notes) std::printf("  %s\n", note.c_str());
}

// ---------------------------------------------------------------------------------------
// The workspace, the daemons and the way out.

std::string g_workspace;
bool g_mounted = false;
bool g_keep = false;
// The workspace's path again, for the signal handler, which may not touch std::string.
char g_workspacePath[256];  // leave the workspace for a look at the daemons' logs
volatile sig_atomic_t g_daemonPids[2] = {0, 0};

bool IsOurDaemon(pid_t pid) {
  // The process still runs a program with our sandbox's root on its command line.
  std::ifstream in("/proc/" + std::to_string(pid) + "/cmdline");
  std::string cmdline((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  return !g_workspace.empty() && cmdline.find(g_workspace) != std::string::npos;
}

void StopDaemons() {
  for (int signal : {SIGTERM, SIGKILL}) {
    bool any = false;
    for (auto& slot : g_daemonPids) {
      pid_t pid = static_cast<pid_t>(slot);
      if (pid <= 0) continue;
      if (!IsOurDaemon(pid)) {
        slot = 0;
        continue;
      }
      ::kill(pid, signal);
      any = true;
    }
    if (!any) return;
    // A clean stop commits the work in hand and checkpoints the index.
    for (int i = 0; i < 1000; ++i) {
      bool alive = false;
      for (auto& slot : g_daemonPids) alive = alive || (slot > 0 && IsOurDaemon(static_cast<pid_t>(slot)));
      if (!alive) break;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
  for (auto& slot : g_daemonPids) slot = 0;
}

void RemoveWorkspace() {
  if (g_workspace.empty()) return;
  StopDaemons();
  g_workspacePath[0] = '\0';
  if (g_keep) {
    std::printf("workspace kept: %s%s\n", g_workspace.c_str(), g_mounted ? " (umount it when done)" : "");
    g_workspace.clear();
    return;
  }
  if (g_mounted) {
    if (::umount2(g_workspace.c_str(), MNT_DETACH) != 0)
      std::fprintf(stderr, "cannot unmount %s: %s\n", g_workspace.c_str(), std::strerror(errno));
    ::rmdir(g_workspace.c_str());
  } else {
    std::error_code ignored;
    fs::remove_all(g_workspace, ignored);
  }
  g_workspace.clear();
}

void OnSignal(int signal) {
  // Only async-signal-safe calls: the daemons are killed, and the workspace unmounted or
  // removed by rm in a child process.
  for (auto& slot : g_daemonPids) {
    if (slot > 0) ::kill(static_cast<pid_t>(slot), SIGKILL);
  }
  if (g_workspacePath[0] != '\0') {
    if (g_mounted) {
      ::umount2(g_workspacePath, MNT_DETACH);
      ::rmdir(g_workspacePath);
    } else {
      pid_t pid = ::fork();
      if (pid == 0) {
        ::execl("/bin/rm", "rm", "-rf", g_workspacePath, static_cast<char*>(nullptr));
        ::_exit(127);
      }
      if (pid > 0) ::waitpid(pid, nullptr, 0);
    }
  }
  ::_exit(128 + signal);
}

bool MakeWorkspace() {
  char mountPoint[] = "/tmp/fileindex-bench.XXXXXX";
  if (::mkdtemp(mountPoint) != nullptr) {
    if (::geteuid() == 0 &&
        ::mount("tmpfs", mountPoint, "tmpfs", MS_NOSUID | MS_NODEV, "size=8g,mode=0755") == 0) {
      g_workspace = mountPoint;
      g_mounted = true;
      return true;
    }
    ::rmdir(mountPoint);
  }
  char shm[] = "/dev/shm/fileindex-bench.XXXXXX";
  if (::mkdtemp(shm) == nullptr) return false;
  g_workspace = shm;
  return true;
}

long VmHwmKb(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.compare(0, 6, "VmHWM:") == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

// The sum of the fields first..last of /proc/PID/stat, clock ticks, in seconds; -1 when
// the process is gone.
double StatSeconds(pid_t pid, int first, int last) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  std::string::size_type close = text.rfind(')');
  if (close == std::string::npos) return -1;
  std::istringstream fields(text.substr(close + 2));
  std::string field;
  unsigned long long ticks = 0;
  // The first field after the command's name is field 3 (the state).
  for (int i = 3; i <= last && fields >> field; ++i) {
    if (i >= first) ticks += std::strtoull(field.c_str(), nullptr, 10);
  }
  return static_cast<double>(ticks) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

// CPU time (user and system, fields 14 and 15) a process has used so far, in seconds.
double CpuSeconds(pid_t pid) { return StatSeconds(pid, 14, 15); }

// CPU time of a process's children: those it has reaped (fields 16 and 17), and those
// alive now.
double ChildrenCpuSeconds(pid_t pid) {
  double seconds = StatSeconds(pid, 16, 17);
  if (seconds < 0) return -1;
  std::ifstream children("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) + "/children");
  for (long child; children >> child;) seconds += std::max(CpuSeconds(static_cast<pid_t>(child)), 0.0);
  return seconds;
}

double ThreadCpuNow() {
  struct timespec ts;
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
}

struct Output {
  int status = -1;
  std::string out;
};

// Runs a program, its standard output captured and its standard error in the workspace's log.
Output Run(const std::vector<std::string>& args) {
  Output result;
  int pipeFds[2];
  if (::pipe2(pipeFds, O_CLOEXEC) != 0) return result;
  pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(pipeFds[1], 1);
    int log =
        ::open((g_workspace + "/commands.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (log >= 0) ::dup2(log, 2);
    std::vector<char*> argv;
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    ::execv(argv[0], argv.data());
    std::_Exit(127);
  }
  ::close(pipeFds[1]);
  char buffer[4096];
  ssize_t n;
  while ((n = ::read(pipeFds[0], buffer, sizeof(buffer))) > 0)
    result.out.append(buffer, static_cast<size_t>(n));
  ::close(pipeFds[0]);
  int status = 0;
  if (pid > 0 && ::waitpid(pid, &status, 0) == pid && WIFEXITED(status)) result.status = WEXITSTATUS(status);
  return result;
}

// ---------------------------------------------------------------------------------------
// Names: words drawn from a vocabulary with a skewed frequency, so that some words are
// common and most are rare, as in real trees.

const char* const kWords[] = {
    "holiday",     "beach",    "family",   "birthday", "wedding",    "party",     "summer",    "winter",
    "spring",      "autumn",   "garden",   "mountain", "river",      "lake",      "city",      "paris",
    "london",      "berlin",   "tokyo",    "rome",     "madrid",     "camping",   "hiking",    "school",
    "office",      "project",  "report",   "invoice",  "budget",     "contract",  "meeting",   "notes",
    "draft",       "final",    "review",   "scan",     "receipt",    "tax",       "insurance", "bank",
    "statement",   "letter",   "resume",   "thesis",   "lecture",    "recipe",    "kitchen",   "house",
    "car",         "bike",     "dog",      "cat",      "horse",      "baby",      "kids",      "mother",
    "father",      "grandma",  "concert",  "live",     "album",      "track",     "remix",     "demo",
    "podcast",     "episode",  "season",   "movie",    "trailer",    "clip",      "tutorial",  "backup",
    "archive",     "export",   "import",   "sample",   "test",       "old",       "new",       "copy",
    "edit",        "raw",      "sunset",   "sunrise",  "forest",     "island",    "harbour",   "bridge",
    "castle",      "museum",   "festival", "football", "tennis",     "swimming",  "skiing",    "snow",
    "rain",        "storm",    "night",    "morning",  "evening",    "portrait",  "landscape", "panorama",
    "selfie",      "group",    "team",     "class",    "graduation", "christmas", "easter",    "newyear",
    "anniversary", "vacation", "trip",     "journey",  "road",       "train",     "plane",     "airport",
    "hotel",       "cabin",    "farm",     "market",   "street",     "church",    "quartz",    "zephyr",
    "lumen",       "orbit",    "nimbus",   "vertex",   "cobalt",     "ember",     "fjord",     "glacier",
    "harvest",     "ivory",    "jasmine",  "kestrel",  "lagoon",     "meadow",    "nectar",    "opal",
};
const std::size_t kWordCount = sizeof(kWords) / sizeof(kWords[0]);

struct ExtensionMix {
  const char* ext;
  int weight;
};
// Roughly a family share: mostly photos, then documents, audio, video and the rest.
const ExtensionMix kExtensions[] = {
    {"jpg", 30}, {"jpeg", 3}, {"png", 6}, {"heic", 3}, {"cr2", 2},  {"pdf", 8}, {"docx", 5},
    {"txt", 4},  {"xlsx", 2}, {"odt", 1}, {"mp3", 9},  {"flac", 3}, {"m4a", 2}, {"mp4", 5},
    {"mkv", 2},  {"mov", 3},  {"zip", 3}, {"iso", 1},  {"dat", 2},  {"bak", 2}, {"", 2},
};

class NameMaker {
 public:
  explicit NameMaker(std::uint32_t seed) : m_rng(seed) {
    // Skewed word weights: the k-th word is drawn about k^-0.6 times as often as the first.
    std::vector<double> weights;
    for (std::size_t k = 0; k < kWordCount; ++k)
      weights.push_back(std::pow(static_cast<double>(k + 1), -0.6));
    m_word = std::discrete_distribution<std::size_t>(weights.begin(), weights.end());
    std::vector<int> extWeights;
    for (const ExtensionMix& mix : kExtensions) extWeights.push_back(mix.weight);
    m_ext = std::discrete_distribution<std::size_t>(extWeights.begin(), extWeights.end());
  }

  std::string Word() { return kWords[m_word(m_rng)]; }
  std::uint32_t Uniform(std::uint32_t below) {
    return std::uniform_int_distribution<std::uint32_t>(0, below - 1)(m_rng);
  }

  std::string FileName() {
    const char* ext = kExtensions[m_ext(m_rng)].ext;
    std::string name;
    if ((std::strcmp(ext, "jpg") == 0 || std::strcmp(ext, "cr2") == 0) && Uniform(3) == 0) {
      name = Format("%s%04u", Uniform(2) ? "IMG_" : "DSC", Uniform(10000));
    } else {
      static const char* const kSeparators[] = {"_", " ", "-"};
      const char* separator = kSeparators[Uniform(3)];
      name = Word();
      for (std::uint32_t words = Uniform(3); words > 0; --words) name += separator + Word();
      if (Uniform(2) == 0) name += Format("%s%u", separator, Uniform(1000));
    }
    return *ext != '\0' ? name + "." + ext : name;
  }

  std::string DirName(std::uint32_t index) {
    if (Uniform(2) == 0)
      return Format("%u %s %s %u", 2010 + Uniform(16), Word().c_str(), Word().c_str(), index);
    return Format("%s %u", Word().c_str(), index);
  }

  // Modification times spread over ten years.
  std::int64_t Mtime() { return 1450000000 + static_cast<std::int64_t>(Uniform(315360000)); }
  std::int64_t Size() { return static_cast<std::int64_t>(Uniform(1u << 24)); }

 private:
  std::mt19937 m_rng;
  std::discrete_distribution<std::size_t> m_word;
  std::discrete_distribution<std::size_t> m_ext;
};

// A tree of `files` files in `dirs` directories (the root not counted): a hundredth of
// the directories at the top, the rest below them, the files dealt out in turn.
bool MakeTree(const std::string& root, std::size_t files, std::size_t dirs) {
  NameMaker names(1);
  if (::mkdir(root.c_str(), 0755) != 0) return false;
  std::vector<std::string> directories;
  std::size_t top = std::max<std::size_t>(1, dirs / 100);
  std::vector<std::string> tops;
  for (std::size_t i = 0; i < top && directories.size() < dirs; ++i) {
    tops.push_back(root + "/" + names.DirName(static_cast<std::uint32_t>(i)));
    directories.push_back(tops.back());
  }
  for (std::size_t i = 0; directories.size() < dirs; ++i)
    directories.push_back(tops[i % tops.size()] + "/" + names.DirName(static_cast<std::uint32_t>(i)));
  for (const std::string& dir : directories) {
    if (::mkdir(dir.c_str(), 0755) != 0) return false;
  }
  std::vector<std::set<std::string>> used(directories.size());
  for (std::size_t i = 0; i < files; ++i) {
    std::size_t d = i % directories.size();
    std::string name = names.FileName();
    while (!used[d].insert(name).second) name = std::to_string(names.Uniform(100000)) + "_" + name;
    int fd = ::open((directories[d] + "/" + name).c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    if (fd < 0) return false;
    // Sparse on tmpfs: sizes cost no memory.
    bool ok = ::ftruncate(fd, names.Size()) == 0;
    struct timespec times[2] = {{names.Mtime(), 0}, {0, UTIME_OMIT}};
    times[1] = times[0];
    ok = ok && ::futimens(fd, times) == 0;
    ::close(fd);
    if (!ok) return false;
  }
  return true;
}

// ---------------------------------------------------------------------------------------
// The naive crawler (run as a child process of its own so that its peak memory is its own).

const char kNaiveSchema[] =
    "CREATE TABLE files(path TEXT NOT NULL, name TEXT NOT NULL, ext TEXT NOT NULL, is_dir INTEGER NOT NULL,"
    " size INTEGER NOT NULL, mtime INTEGER NOT NULL, kind INTEGER NOT NULL)";

int NaiveCrawl(const std::string& tree, const std::string& dbFile, bool onePerRow, double limitSeconds) {
  sqlite3* db = nullptr;
  if (sqlite3_open(dbFile.c_str(), &db) != SQLITE_OK ||
      sqlite3_exec(db, kNaiveSchema, nullptr, nullptr, nullptr) != SQLITE_OK) {
    std::fprintf(stderr, "naive crawl: %s\n", sqlite3_errmsg(db));
    return 1;
  }
  sqlite3_stmt* insert = nullptr;
  sqlite3_prepare_v2(db, "INSERT INTO files VALUES (?, ?, ?, ?, ?, ?, ?)", -1, &insert, nullptr);
  Clock::time_point start = Clock::now();
  if (!onePerRow) sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
  std::uint64_t entries = 0;
  bool complete = true;
  for (const fs::directory_entry& item : fs::recursive_directory_iterator(tree)) {
    const std::string path = item.path().string();
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) continue;
    const std::string name = item.path().filename().string();
    const bool isDir = S_ISDIR(st.st_mode);
    const std::string ext = isDir ? "" : fileindex_store::ExtensionOf(name);
    sqlite3_bind_text(insert, 1, path.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_text(insert, 2, name.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_text(insert, 3, ext.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_int(insert, 4, isDir);
    sqlite3_bind_int64(insert, 5, st.st_size);
    sqlite3_bind_int64(insert, 6, st.st_mtim.tv_sec);
    sqlite3_bind_int(insert, 7, static_cast<int>(fileindex_store::KindOfExtension(ext)));
    if (sqlite3_step(insert) != SQLITE_DONE) {
      std::fprintf(stderr, "naive crawl: %s\n", sqlite3_errmsg(db));
      return 1;
    }
    sqlite3_reset(insert);
    ++entries;
    if ((entries & 1023) == 0 && limitSeconds > 0 && Seconds(start, Clock::now()) > limitSeconds) {
      complete = false;
      break;
    }
  }
  if (!onePerRow) sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
  double seconds = Seconds(start, Clock::now());
  sqlite3_finalize(insert);
  sqlite3_close(db);
  std::printf("%" PRIu64 " %.6f %ld %d %.6f\n", entries, seconds, VmHwmKb(::getpid()), complete ? 1 : 0,
              CpuSeconds(::getpid()));
  return 0;
}

struct NaiveResult {
  bool ok = false;
  std::uint64_t entries = 0;
  double seconds = 0;
  long hwmKb = 0;
  bool complete = false;
  double cpuSeconds = 0;
};

NaiveResult RunNaiveCrawl(const std::string& tree, const std::string& dbFile, bool onePerRow, double limit) {
  NaiveResult result;
  Output output = Run(
      {"/proc/self/exe", "--naive-crawl", tree, dbFile, onePerRow ? "row" : "one", Format("%.0f", limit)});
  int complete = 0;
  result.ok =
      output.status == 0 && std::sscanf(output.out.c_str(), "%" SCNu64 " %lf %ld %d %lf", &result.entries,
                                        &result.seconds, &result.hwmKb, &complete, &result.cpuSeconds) == 5;
  result.complete = complete != 0;
  return result;
}

// ---------------------------------------------------------------------------------------
// The sandbox.

class Sandbox {
 public:
  explicit Sandbox(std::string root) : m_root(std::move(root)) {}
  ~Sandbox() { StopDaemons(); }

  const std::string& root() const { return m_root; }

  Output Ctl(std::vector<std::string> args) const {
    args.insert(args.begin(), {FILEINDEX_BENCH_CTL, "--sysroot", m_root, "--no-syslog"});
    return Run(args);
  }

  // Said on stderr when it fails.
  bool Init() {
    if (Run({FILEINDEX_BENCH_CTL, "sandbox", "init", m_root}).status == 0) return true;
    std::fprintf(stderr, "sandbox init failed (see %s/commands.log)\n", g_workspace.c_str());
    return false;
  }

  bool Status(Json::Value& status) const {
    Output output = Ctl({"--json", "status"});
    Json::CharReaderBuilder builder;
    std::string errors;
    std::istringstream in(output.out);
    return output.status == 0 && Json::parseFromStream(builder, in, &status, &errors);
  }

  bool WaitFinished(double timeoutSeconds) const {
    Clock::time_point until = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                                 std::chrono::duration<double>(timeoutSeconds));
    Json::Value status;
    while (Clock::now() < until) {
      if (Status(status) && status["status"].asString() == "finished") return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
  }

  // Records the daemons' process ids so that the way out stops them whatever happens.
  bool RecordDaemons() {
    int slot = 0;
    for (const char* name : {"fileindexd", "tavotifyd"}) {
      std::ifstream in(m_root + "/var/run/" + name + ".pid");
      long pid = 0;
      if (!(in >> pid) || pid <= 0) return false;
      g_daemonPids[slot++] = static_cast<sig_atomic_t>(pid);
    }
    return true;
  }
  pid_t Daemon(int slot) const { return static_cast<pid_t>(g_daemonPids[slot]); }

  std::string DatabaseDirectory(const std::string& share) const {
    ::setenv("FILEINDEX_SYSROOT", m_root.c_str(), 1);
    char buffer[4096] = {0};
    std::string dir = FILEIDXDBPathGet(share.c_str(), buffer, sizeof(buffer)) < 0 ? "" : buffer;
    ::unsetenv("FILEINDEX_SYSROOT");
    return dir;
  }

 private:
  std::string m_root;
};

// The folder's first crawl is complete: its mark is written with the last of its entries.
bool FolderCrawled(sqlite3* db, const std::string& folder) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(db, "SELECT crawled FROM folders WHERE path = ?", -1, &statement, nullptr) !=
      SQLITE_OK)
    return false;
  sqlite3_bind_text(statement, 1, folder.c_str(), -1, SQLITE_TRANSIENT);
  bool crawled = sqlite3_step(statement) == SQLITE_ROW && sqlite3_column_int(statement, 0) != 0;
  sqlite3_finalize(statement);
  return crawled;
}

std::uint64_t IndexBytes(const std::string& dbDir) {
  std::uint64_t bytes = 0;
  for (const char* suffix : {"", "-wal", "-shm"}) {
    struct stat st;
    if (::stat((fileindex_store::IndexFilePath(dbDir) + suffix).c_str(), &st) == 0)
      bytes += static_cast<std::uint64_t>(st.st_size);
  }
  return bytes;
}

struct Options {
  std::size_t files = 200000;
  std::size_t dirs = 20000;
  std::size_t entries = 1000000;
  std::size_t creations = 100;
  double naiveLimit = 20;           // seconds the one-transaction-per-row crawler may take
  std::size_t contentFiles = 2000;  // per kind (videos: a tenth)
  bool spotlight = true;
};

// Scenarios 1 and 2: the real daemons on a generated tree.
// Starts the sandbox's daemons with the folder /photo/2019 and opens the photo share's
// index read-only (dbDir its directory); null, said on stderr, when either fails.
sqlite3* StartDaemons(Sandbox& sandbox, std::string& dbDir) {
  std::printf("starting the daemons...\n");
  std::fflush(stdout);
  if (sandbox.Ctl({"folders", "add", "/photo/2019"}).status != 0 || !sandbox.WaitFinished(30) ||
      !sandbox.RecordDaemons()) {
    std::fprintf(stderr, "the daemons did not start (see %s/var/log)\n", sandbox.root().c_str());
    return nullptr;
  }
  dbDir = sandbox.DatabaseDirectory("photo");
  sqlite3* db = nullptr;
  if (dbDir.empty() || sqlite3_open_v2(fileindex_store::IndexFilePath(dbDir).c_str(), &db,
                                       SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    std::fprintf(stderr, "no index in %s\n", dbDir.c_str());
    sqlite3_close(db);
    return nullptr;
  }
  sqlite3_busy_timeout(db, 5000);
  return db;
}

bool ServiceScenarios(const Options& options) {
  Sandbox sandbox(g_workspace + "/root");
  if (!sandbox.Init()) return false;
  const std::string share = sandbox.root() + "/volume1/photo";
  const std::string tree = share + "/bench";
  std::printf("generating %zu files in %zu directories in %s...\n", options.files, options.dirs,
              tree.c_str());
  std::fflush(stdout);
  Clock::time_point start = Clock::now();
  if (!MakeTree(tree, options.files, options.dirs)) {
    std::fprintf(stderr, "cannot make the tree: %s\n", std::strerror(errno));
    return false;
  }
  std::printf("  generated in %.2f s\n", Seconds(start, Clock::now()));
  const std::uint64_t expected = options.files + options.dirs + 1;  // the folder's own entry too
  const std::string scenario = "first_index_" + Count(options.files);

  // The baselines first, while no daemon runs.
  std::printf("naive crawlers...\n");
  std::fflush(stdout);
  const std::string naiveDir = g_workspace + "/naive";
  ::mkdir(naiveDir.c_str(), 0700);
  NaiveResult perRow = RunNaiveCrawl(tree, naiveDir + "/per_row.sqlite3", true, options.naiveLimit);
  NaiveResult oneTx = RunNaiveCrawl(tree, naiveDir + "/one_tx.sqlite3", false, 0);
  struct stat naiveSt;
  std::uint64_t naiveBytes = ::stat((naiveDir + "/one_tx.sqlite3").c_str(), &naiveSt) == 0
                                 ? static_cast<std::uint64_t>(naiveSt.st_size)
                                 : 0;
  fs::remove_all(naiveDir);

  // The daemons start with a small folder, so the figure is the crawl's alone.
  std::string dbDir;
  sqlite3* db = StartDaemons(sandbox, dbDir);
  if (db == nullptr) return false;

  std::printf("first full index by fileindexd...\n");
  std::fflush(stdout);
  const double daemonCpuBefore = CpuSeconds(sandbox.Daemon(0));
  const double notifierCpuBefore = CpuSeconds(sandbox.Daemon(1));
  start = Clock::now();
  if (sandbox.Ctl({"folders", "add", "/photo/bench"}).status != 0) {
    std::fprintf(stderr, "folders add failed\n");
    sqlite3_close(db);
    return false;
  }
  Clock::time_point crawled;
  bool done = false;
  double daemonCpu = 0, notifierCpu = 0;
  const Clock::time_point giveUp = start + std::chrono::seconds(300);
  while (Clock::now() < giveUp) {
    if (FolderCrawled(db, "bench")) {
      crawled = Clock::now();
      done = true;
      daemonCpu = CpuSeconds(sandbox.Daemon(0)) - daemonCpuBefore;
      notifierCpu = CpuSeconds(sandbox.Daemon(1)) - notifierCpuBefore;
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  sqlite3_close(db);
  if (!done) {
    std::fprintf(stderr, "the crawl did not finish within 300 s\n");
    return false;
  }
  const bool finished = sandbox.WaitFinished(120);
  Clock::time_point finishedAt = Clock::now();
  const double daemonCpuFinished = CpuSeconds(sandbox.Daemon(0)) - daemonCpuBefore;
  std::string error;
  auto reader = fileindex_store::IndexReader::Open(dbDir, error);
  std::map<std::string, std::uint64_t> counts;
  if (!reader || !reader->CountByFolder(counts)) {
    std::fprintf(stderr, "cannot count the index: %s\n",
                 reader ? reader->LastError().c_str() : error.c_str());
    return false;
  }
  const std::uint64_t indexed = counts["bench"];
  const double crawlSeconds = Seconds(start, crawled);
  const double filesPerSec = static_cast<double>(options.files) / crawlSeconds;
  const double naiveOneRate = oneTx.ok ? static_cast<double>(oneTx.entries) / oneTx.seconds : 0;
  const double naiveRowRate = perRow.ok ? static_cast<double>(perRow.entries) / perRow.seconds : 0;
  // The naive crawlers count every entry (files and directories): compare like with like.
  const double entriesPerSec = static_cast<double>(indexed) / crawlSeconds;
  AddRow(scenario, "fileindexd", Format("%.0f files/s (%.2f s)", filesPerSec, crawlSeconds),
         naiveOneRate > 0 ? Faster(1 / naiveOneRate, 1 / entriesPerSec) : "",
         Verdict(filesPerSec >= 50000, ">= 50000 files/s"));
  AddRow(scenario, "fileindexd", Format("%.0f entries/s", entriesPerSec), "",
         indexed == expected ? Format("all %" PRIu64 " entries", expected)
                             : Format("INDEXED %" PRIu64 " OF %" PRIu64, indexed, expected));
  // CPU time is what the machine's load does not change (the daemon runs at nice 10).
  const double naiveCpuRate =
      oneTx.ok && oneTx.cpuSeconds > 0 ? static_cast<double>(oneTx.entries) / oneTx.cpuSeconds : 0;
  const double daemonCpuRate = daemonCpu > 0 ? static_cast<double>(indexed) / daemonCpu : 0;
  AddRow(scenario, "fileindexd_cpu",
         Format("%.0f files/CPU-s (%.2f CPU-s)",
                daemonCpu > 0 ? static_cast<double>(options.files) / daemonCpu : 0, daemonCpu),
         naiveCpuRate > 0 && daemonCpuRate > 0 ? Faster(1 / naiveCpuRate, 1 / daemonCpuRate) : "",
         Format("tavotifyd %.2f CPU-s meanwhile", notifierCpu));
  AddRow(scenario, "until_finished", Format("%.2f s", Seconds(start, finishedAt)), "",
         (finished ? "status finished" : "STATUS NOT FINISHED") +
             Format(", fileindexd %.2f CPU-s", daemonCpuFinished));
  if (perRow.ok) {
    AddRow(scenario, "naive_tx_per_row",
           Format("%.0f entries/s", naiveRowRate) +
               (perRow.complete ? Format(" (%.2f s)", perRow.seconds)
                                : Format(" (%" PRIu64 " in %.0f s)", perRow.entries, perRow.seconds)),
           "",
           Format("%.0f entries/CPU-s",
                  perRow.cpuSeconds > 0 ? static_cast<double>(perRow.entries) / perRow.cpuSeconds : 0));
  }
  if (oneTx.ok)
    AddRow(scenario, "naive_one_tx", Format("%.0f entries/s (%.2f s)", naiveOneRate, oneTx.seconds), "",
           Format("%.0f entries/CPU-s", naiveCpuRate));

  const long hwm = VmHwmKb(sandbox.Daemon(0));
  const long notifierHwm = VmHwmKb(sandbox.Daemon(1));
  AddRow("peak_memory", "fileindexd", Format("%.1f MB VmHWM", static_cast<double>(hwm) / 1024),
         oneTx.ok ? Format("naive %.1f MB", static_cast<double>(oneTx.hwmKb) / 1024) : "",
         Verdict(hwm > 0 && hwm < 64 * 1024, "< 64 MB"));
  AddRow("peak_memory", "tavotifyd", Format("%.1f MB VmHWM", static_cast<double>(notifierHwm) / 1024));
  // The index is measured once the daemon has stopped and folded its write-ahead log in:
  // a log grown during the crawl (and the extraction after it) is not the index's size.
  auto indexSize = [&, naiveBytes] {
    const std::uint64_t bytes = IndexBytes(dbDir);
    AddRow("index_size", "fileindexd",
           Format("%.0f B/entry (%.1f MB)", static_cast<double>(bytes) / static_cast<double>(indexed),
                  static_cast<double>(bytes) / 1e6),
           oneTx.ok ? Format("naive %.0f B/entry",
                             static_cast<double>(naiveBytes) / static_cast<double>(oneTx.entries))
                    : "");
  };

  // Scenario 2: a file created in an indexed folder until a search finds it.
  std::printf("created files until searchable...\n");
  std::fflush(stdout);
  std::vector<std::string> dirs;
  for (const fs::directory_entry& item : fs::recursive_directory_iterator(tree)) {
    if (item.is_directory()) dirs.push_back(item.path().string());
    if (dirs.size() >= options.creations) break;
  }
  std::vector<double> latencies, polls;
  std::size_t missed = 0;
  for (std::size_t i = 0; i < options.creations; ++i) {
    const std::string word = Format("zq%04zux", i);
    const std::string path = dirs[i % dirs.size()] + "/new " + word + " scan.pdf";
    fileindex_store::Query query;
    query.words = {word};
    Clock::time_point created = Clock::now();
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    if (fd < 0) {
      std::fprintf(stderr, "cannot create %s: %s\n", path.c_str(), std::strerror(errno));
      return false;
    }
    ::close(fd);
    bool found = false;
    while (!found && Clock::now() < created + std::chrono::seconds(10)) {
      std::vector<fileindex_store::Hit> hits;
      Clock::time_point before = Clock::now();
      if (!reader->Search(query, hits)) {
        std::fprintf(stderr, "search failed: %s\n", reader->LastError().c_str());
        return false;
      }
      Clock::time_point after = Clock::now();
      polls.push_back(Seconds(before, after));
      found = !hits.empty();
      if (found) latencies.push_back(Seconds(created, after));
      if (!found) std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    if (!found) ++missed;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  const double median = Percentile(latencies, 0.5);
  AddRow("created_file_searchable", "fileindexd",
         Format("p50 %s, p95 %s", Duration(median).c_str(), Duration(Percentile(latencies, 0.95)).c_str()),
         missed > 0 ? Format("%zu NOT FOUND", missed) : Format("n=%zu", latencies.size()),
         Verdict(missed == 0 && !latencies.empty() && median < 1.0, "p50 < 1 s"));
  AddRow("created_file_searchable", "one_index_poll",
         Format("p50 %s, p95 %s", Duration(Percentile(polls, 0.5)).c_str(),
                Duration(Percentile(polls, 0.95)).c_str()),
         Format("n=%zu", polls.size()));
  reader.reset();
  StopDaemons();
  indexSize();
  return true;
}

// ---------------------------------------------------------------------------------------
// Scenario 4: contents, kind by kind.

struct ContentKind {
  std::string folder;  // below the share "photo"
  std::string label;
  std::size_t files;
};

// Files of one kind in dir: varied fields, so that no two are alike.
bool MakeContentFiles(const std::string& label, const std::string& dir, std::size_t count) {
  namespace cs = content_samples;
  fs::create_directories(dir);
  std::mt19937 rng(7);
  auto word = [&rng]() { return std::string(kWords[rng() % kWordCount]); };
  for (std::size_t i = 0; i < count; ++i) {
    const std::string base = dir + "/" + word() + " " + std::to_string(i);
    bool ok = true;
    if (label == "photo") {
      cs::Exif exif;
      exif.make = i % 2 ? "Kestrel" : "Osprey";
      exif.model = "K-" + std::to_string(i % 50);
      exif.taken = Format("20%02zu:%02zu:%02zu 10:11:12", 10 + i % 15, 1 + i % 12, 1 + i % 28);
      ok = cs::WritePhoto(base + ".jpg", exif, 64, 48);
    } else if (label == "audio") {
      cs::Tags tags;
      tags.artist = word() + " " + word();
      tags.album = word();
      tags.title = word() + " " + word() + " " + word();
      tags.year = static_cast<unsigned>(1970 + i % 50);
      static const char* const kAudio[] = {".mp3", ".flac", ".ogg"};
      ok = cs::WriteAudio(base + kAudio[i % 3], tags, 1);
    } else if (label == "video") {
      ok = cs::WriteVideo(base + ".mkv", word() + " " + word(), 10, 64, 48);
    } else if (label == "pdf") {
      std::vector<std::string> pages;
      for (int page = 0; page < 3; ++page) {
        std::string text;
        for (int w = 0; w < 60; ++w) text += word() + " ";
        pages.push_back(text);
      }
      cs::Write(base + ".pdf", cs::Pdf(pages, word()));
    } else {
      std::string text;
      for (int w = 0; w < 600; ++w) text += word() + (w % 12 == 11 ? "\n" : " ");
      cs::Write(base + ".txt", text);
    }
    if (!ok) return false;
  }
  return true;
}

std::uint64_t TreeBytes(const std::string& dir) {
  std::uint64_t bytes = 0;
  for (const fs::directory_entry& item : fs::recursive_directory_iterator(dir))
    if (item.is_regular_file()) bytes += item.file_size();
  return bytes;
}

// Files of the folder whose contents are in the index (extracted, failed or skipped).
std::int64_t ContentCount(sqlite3* db, const std::string& folder, std::int64_t* failed = nullptr) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(db,
                         "SELECT count(*), sum(c.state != 1) FROM contents c JOIN entries e ON e.id = c.id"
                         " AND e.mtime = c.mtime AND e.size = c.size WHERE e.folder = ?",
                         -1, &statement, nullptr) != SQLITE_OK)
    return -1;
  sqlite3_bind_text(statement, 1, folder.c_str(), -1, SQLITE_TRANSIENT);
  std::int64_t count = -1;
  if (sqlite3_step(statement) == SQLITE_ROW) {
    count = sqlite3_column_int64(statement, 0);
    if (failed != nullptr) *failed = sqlite3_column_int64(statement, 1);
  }
  sqlite3_finalize(statement);
  return count;
}

bool ContentScenario(const Options& options) {
  Sandbox sandbox(g_workspace + "/content-root");
  if (!sandbox.Init()) return false;
  const std::string share = sandbox.root() + "/volume1/photo";
  const std::size_t n = options.contentFiles;
  const std::vector<ContentKind> kinds = {{"c_photo", "photo", n},
                                          {"c_audio", "audio", n},
                                          {"c_video", "video", std::max<std::size_t>(n / 10, 1)},
                                          {"c_pdf", "pdf", n},
                                          {"c_text", "text", n}};
  std::printf("generating content files (%zu per kind, videos %zu)...\n", n, kinds[2].files);
  std::fflush(stdout);
  Clock::time_point start = Clock::now();
  std::uint64_t corpusBytes = 0;
  for (const ContentKind& kind : kinds) {
    if (!MakeContentFiles(kind.label, share + "/" + kind.folder, kind.files)) {
      std::fprintf(stderr, "cannot make the %s files\n", kind.label.c_str());
      return false;
    }
    corpusBytes += TreeBytes(share + "/" + kind.folder);
  }
  std::printf("  generated in %.2f s (%.1f MB)\n", Seconds(start, Clock::now()),
              static_cast<double>(corpusBytes) / 1e6);

  // The baseline: the same extractors called in this process, one file after another,
  // with no worker, no limits and nothing written.
  std::string error;
  if (!fileindexd::InitExtractors(error)) {
    std::fprintf(stderr, "%s\n", error.c_str());
    return false;
  }
  std::map<std::string, double> inProcessRate;
  for (const ContentKind& kind : kinds) {
    const double cpuBefore = ThreadCpuNow();
    std::size_t files = 0;
    for (const fs::directory_entry& item : fs::directory_iterator(share + "/" + kind.folder)) {
      fileindex_store::Content content;
      std::string text;
      fileindexd::ExtractFile(
          item.path().string(),
          fileindex_store::KindOfExtension(fileindex_store::ExtensionOf(item.path().filename())),
          fileindexd::ExtractLimits(), content, text);
      ++files;
    }
    inProcessRate[kind.label] = static_cast<double>(files) / std::max(ThreadCpuNow() - cpuBefore, 1e-9);
  }

  std::string dbDir;
  sqlite3* db = StartDaemons(sandbox, dbDir);
  if (db == nullptr) return false;
  auto reader = fileindex_store::ContentReader::Open(dbDir, error);
  if (!reader) {
    std::fprintf(stderr, "%s\n", error.c_str());
    sqlite3_close(db);
    return false;
  }
  std::uint64_t namesOnlyBytes = 0;
  std::vector<double> searches;
  std::mt19937 rng(11);
  for (const ContentKind& kind : kinds) {
    std::printf("extracting %s...\n", kind.label.c_str());
    std::fflush(stdout);
    const double cpuBefore = CpuSeconds(sandbox.Daemon(0));
    const double workerBefore = ChildrenCpuSeconds(sandbox.Daemon(0));
    start = Clock::now();
    if (sandbox.Ctl({"folders", "add", "/photo/" + kind.folder}).status != 0) {
      std::fprintf(stderr, "folders add failed\n");
      sqlite3_close(db);
      return false;
    }
    std::int64_t done = 0, failed = 0;
    const Clock::time_point giveUp = start + std::chrono::seconds(600);
    while (Clock::now() < giveUp &&
           (done = ContentCount(db, kind.folder, &failed)) < static_cast<std::int64_t>(kind.files)) {
      // Searches meanwhile: a word of names and a word of texts, as a user would.
      fileindex_store::ContentQuery query;
      if (rng() % 2) {
        query.names.words = {kWords[rng() % kWordCount]};
      } else {
        query.text = {kWords[rng() % kWordCount]};
      }
      std::vector<fileindex_store::ContentHit> hits;
      Clock::time_point before = Clock::now();
      if (!reader->Search(query, hits)) {
        std::fprintf(stderr, "search failed: %s\n", reader->LastError().c_str());
        sqlite3_close(db);
        return false;
      }
      searches.push_back(Seconds(before, Clock::now()));
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    const double seconds = Seconds(start, Clock::now());
    const double cpu = CpuSeconds(sandbox.Daemon(0)) - cpuBefore;
    const double workerCpu = ChildrenCpuSeconds(sandbox.Daemon(0)) - workerBefore;
    const double rate = static_cast<double>(done) / seconds;
    std::string versus = Faster(1 / inProcessRate[kind.label], 1 / rate);
    std::string target = Format("in-process %.0f files/CPU-s", inProcessRate[kind.label]);
    if (kind.label == "pdf")
      target += Format("; desktop ~16.7 PDFs/s: %s", rate >= 1000.0 / 60 ? "met" : "MISSED");
    AddRow("content_" + kind.label, "fileindexd",
           Format("%.0f files/s (%" PRId64 " in %.2f s)", rate, done, seconds), versus, target);
    if (failed != 0 || done < static_cast<std::int64_t>(kind.files))
      g_notes.push_back(Format("content_%s: %" PRId64 " of %zu done, %" PRId64 " failed or skipped",
                               kind.label.c_str(), done, kind.files, failed));
    AddRow("content_" + kind.label, "worker_cpu",
           Format("%.0f files/CPU-s (%.2f CPU-s)", workerCpu > 0 ? static_cast<double>(done) / workerCpu : 0,
                  workerCpu),
           workerCpu > 0 ? Faster(1 / inProcessRate[kind.label], workerCpu / static_cast<double>(done)) : "",
           Format("fileindexd %.2f CPU-s", cpu));
    if (namesOnlyBytes == 0) namesOnlyBytes = IndexBytes(dbDir);
  }
  sqlite3_close(db);
  AddRow("content_search_while", "ContentReader",
         Format("p50 %s p95 %s", Duration(Percentile(searches, 0.5)).c_str(),
                Duration(Percentile(searches, 0.95)).c_str()),
         Format("n=%zu", searches.size()), Verdict(Percentile(searches, 0.95) < 0.020, "p95 < 20 ms"));
  StopDaemons();
  const std::uint64_t indexBytes = IndexBytes(dbDir);
  AddRow("content_index_size", "fileindexd",
         Format("%.1f MB for %.1f MB of files", static_cast<double>(indexBytes) / 1e6,
                static_cast<double>(corpusBytes) / 1e6),
         Format("%.1f%% of the corpus",
                100.0 * static_cast<double>(indexBytes) / static_cast<double>(corpusBytes)),
         Format("%.0f B per file",
                static_cast<double>(indexBytes) / static_cast<double>(kinds[0].files * 4 + kinds[2].files)));
  return true;
}

// ---------------------------------------------------------------------------------------
// Scenario 3: searches over a million entries.

struct SearchCase {
  std::vector<std::string> words;
};

// Scenario 4: Finder's searches as Samba sends them, through the endpoint, over the index
// that scenario 3 built; the share's files exist, since answers hold existing files only.
bool SpotlightScenario(const Options& options, const std::string& dbDir, sqlite3* plain) {
  const std::string share = g_workspace + "/share";
  std::printf("creating the share's %zu files...\n", options.entries);
  std::fflush(stdout);
  sqlite3_stmt* paths = nullptr;
  sqlite3_prepare_v2(plain, "SELECT path FROM files", -1, &paths, nullptr);
  std::set<std::string> made;
  while (sqlite3_step(paths) == SQLITE_ROW) {
    const std::string path = share + "/" + reinterpret_cast<const char*>(sqlite3_column_text(paths, 0));
    const std::string dir = path.substr(0, path.rfind('/'));
    if (made.insert(dir).second) fs::create_directories(dir);
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    if (fd >= 0) ::close(fd);
  }
  sqlite3_finalize(paths);

  fileindexd::SpotlightSearch search;
  search.SetShares({{"share", share, dbDir, {""}}});
  fileindexd::SpotlightEndpoint endpoint(search);
  std::string error;
  int port = 0;
  if (!endpoint.Start("127.0.0.1", 0, error, &port)) {
    std::fprintf(stderr, "spotlight endpoint: %s\n", error.c_str());
    return false;
  }
  httplib::Client client("127.0.0.1", port);
  client.set_keep_alive(true);  // as Samba: one connection per client session
  client.set_tcp_nodelay(true);
  struct Case {
    const char* label;       // "name prefix" and "kind" cases make the two figures with a target
    const char* expression;  // what Samba writes for Finder
    const char* naive;       // the same question to the plain table
  };
  const Case cases[] = {
      {"name prefix", "file.filename:holiday*", "name LIKE 'holiday%'"},
      {"name prefix", "file.filename:bea*", "name LIKE 'bea%'"},
      {"name prefix", "file.filename:img*", "name LIKE 'img%'"},
      {"name prefix", "file.filename:nowordlikethis*", "name LIKE 'nowordlikethis%'"},
      {"any word", "sun*", "name LIKE '%sun%'"},
      {"kind", "file.content_type:(image\\/jpeg)", "ext IN ('jpg', 'jpeg')"},
      {"kind", "file.content_type:(audio\\/*)", "kind = 2"},
      {"kind + size", "file.content_type:(application\\/pdf) AND file.filesize:{1000000 TO *}",
       "ext = 'pdf' AND size > 1000000"},
      {"name AND NOT kind", "file.filename:report* AND (NOT file.content_type:(application\\/pdf))",
       "name LIKE 'report%' AND ext <> 'pdf'"},
  };
  const int kRuns = 25, kBaselineRuns = 3;
  std::vector<double> prefixTimes, kindTimes, allBaseline;
  for (const Case& c : cases) {
    Json::Value request;
    request["from"] = 0;
    request["size"] = 50;
    request["_source"].append("path.real");
    request["query"]["query_string"]["query"] =
        "(" + std::string(c.expression) + ") AND path.real.fulltext:\"" + share + "\"";
    const std::string body = Json::FastWriter().write(request);
    std::vector<double> times;
    Json::Value answer;
    // One request first, untimed, as Finder's first page before the ones that follow.
    for (int run = -1; run < kRuns; ++run) {
      Clock::time_point before = Clock::now();
      auto response = client.Post("/_all/_search", body, "application/json");
      if (run >= 0) times.push_back(Seconds(before, Clock::now()));
      if (!response || response->status != 200) {
        std::fprintf(stderr, "spotlight %s: %d %s\n", c.expression, response ? response->status : -1,
                     response ? response->body.c_str() : "no answer");
        return false;
      }
      if (run == 0) Json::Reader().parse(response->body, answer);
    }
    std::vector<double> baseline;
    const std::string naive = std::string("SELECT count(*) FROM files WHERE ") + c.naive;
    const std::string naivePage = std::string("SELECT path FROM files WHERE ") + c.naive + " LIMIT 50";
    for (int run = 0; run < kBaselineRuns; ++run) {
      Clock::time_point before = Clock::now();
      for (const std::string& sql : {naive, naivePage}) {
        sqlite3_stmt* statement = nullptr;
        sqlite3_prepare_v2(plain, sql.c_str(), -1, &statement, nullptr);
        while (sqlite3_step(statement) == SQLITE_ROW) {
        }
        sqlite3_finalize(statement);
      }
      baseline.push_back(Seconds(before, Clock::now()));
    }
    // The two figures with a target: name prefixes alone, kinds alone.
    const std::string label = c.label;
    if (label == "name prefix") prefixTimes.insert(prefixTimes.end(), times.begin(), times.end());
    if (label == "kind") kindTimes.insert(kindTimes.end(), times.begin(), times.end());
    allBaseline.insert(allBaseline.end(), baseline.begin(), baseline.end());
    AddRow(
        Format("spotlight_%s", Count(options.entries).c_str()), Format("%s: %s", c.label, c.expression),
        Format("p50 %s p95 %s", Duration(Percentile(times, 0.5)).c_str(),
               Duration(Percentile(times, 0.95)).c_str()),
        Faster(Percentile(baseline, 0.5), Percentile(times, 0.5)),
        Format("total %s, %u shown; plain table p50 %s", answer["hits"]["total"]["value"].asString().c_str(),
               answer["hits"]["hits"].size(), Duration(Percentile(baseline, 0.5)).c_str()));
  }
  AddRow(Format("spotlight_%s", Count(options.entries).c_str()), "name prefix queries",
         Format("p50 %s p95 %s", Duration(Percentile(prefixTimes, 0.5)).c_str(),
                Duration(Percentile(prefixTimes, 0.95)).c_str()),
         "", Verdict(Percentile(prefixTimes, 0.95) < 0.050, "p95 < 50 ms") + " (file.filename:word*)");
  AddRow(Format("spotlight_%s", Count(options.entries).c_str()), "kind queries",
         Format("p50 %s p95 %s", Duration(Percentile(kindTimes, 0.5)).c_str(),
                Duration(Percentile(kindTimes, 0.95)).c_str()),
         "", Verdict(Percentile(kindTimes, 0.95) < 0.050, "p95 < 50 ms") + " (file.content_type:...)");
  AddRow(Format("spotlight_%s", Count(options.entries).c_str()), "plain table",
         Format("p50 %s p95 %s", Duration(Percentile(allBaseline, 0.5)).c_str(),
                Duration(Percentile(allBaseline, 0.95)).c_str()),
         "", Format("count + first page, n=%zu", allBaseline.size()));
  endpoint.Stop();
  return true;
}

bool SearchScenario(const Options& options) {
  const std::string dbDir = g_workspace + "/million";
  std::string error;
  auto writer = fileindex_store::IndexWriter::Open(dbDir, error);
  if (!writer) {
    std::fprintf(stderr, "cannot open %s: %s\n", dbDir.c_str(), error.c_str());
    return false;
  }
  const std::string plainFile = g_workspace + "/plain.sqlite3";
  sqlite3* plain = nullptr;
  if (sqlite3_open(plainFile.c_str(), &plain) != SQLITE_OK ||
      sqlite3_exec(plain, kNaiveSchema, nullptr, nullptr, nullptr) != SQLITE_OK) {
    std::fprintf(stderr, "cannot create %s\n", plainFile.c_str());
    return false;
  }
  sqlite3_stmt* insert = nullptr;
  sqlite3_prepare_v2(plain, "INSERT INTO files VALUES (?, ?, ?, ?, ?, ?, ?)", -1, &insert, nullptr);

  std::printf("building an index of %zu entries with IndexWriter...\n", options.entries);
  std::fflush(stdout);
  NameMaker names(2);
  std::vector<std::string> parents;
  for (std::uint32_t i = 0; i < std::max<std::size_t>(1, options.entries / 10); ++i) {
    std::string dir = names.DirName(i);
    parents.push_back(i < 100 || parents.empty() ? dir : parents[i % 100] + "/" + dir);
  }
  std::vector<fileindex_store::Entry> batch;
  double writeSeconds = 0, writeCpu = 0;
  sqlite3_exec(plain, "BEGIN", nullptr, nullptr, nullptr);
  // Directory by directory, as a crawl writes them.
  const std::size_t perParent = (options.entries + parents.size() - 1) / parents.size();
  std::size_t written = 0;
  for (std::size_t p = 0; p < parents.size() && written < options.entries; ++p) {
    std::set<std::string> used;
    for (std::size_t k = 0; k < perParent && written < options.entries; ++k, ++written) {
      fileindex_store::Entry entry;
      entry.parent = parents[p];
      entry.name = names.FileName();
      while (!used.insert(entry.name).second)
        entry.name = std::to_string(names.Uniform(100000)) + "_" + entry.name;
      entry.size = names.Size();
      entry.mtime = names.Mtime();
      const std::string ext = fileindex_store::ExtensionOf(entry.name);
      entry.kind = fileindex_store::KindOfExtension(ext);
      batch.push_back(entry);
      const std::string path = entry.parent + "/" + entry.name;
      sqlite3_bind_text(insert, 1, path.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(insert, 2, entry.name.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(insert, 3, ext.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_int(insert, 4, 0);
      sqlite3_bind_int64(insert, 5, entry.size);
      sqlite3_bind_int64(insert, 6, entry.mtime);
      sqlite3_bind_int(insert, 7, static_cast<int>(entry.kind));
      sqlite3_step(insert);
      sqlite3_reset(insert);
      if (batch.size() == 10000 || written + 1 == options.entries) {
        Clock::time_point before = Clock::now();
        const double cpuBefore = ThreadCpuNow();
        if (!writer->Begin()) return false;
        for (const fileindex_store::Entry& item : batch) {
          if (!writer->Put(item)) {
            std::fprintf(stderr, "put: %s\n", writer->LastError().c_str());
            return false;
          }
        }
        if (!writer->Commit()) return false;
        writeSeconds += Seconds(before, Clock::now());
        writeCpu += ThreadCpuNow() - cpuBefore;
        batch.clear();
      }
    }
  }
  sqlite3_exec(plain, "COMMIT", nullptr, nullptr, nullptr);
  sqlite3_finalize(insert);
  writer->Checkpoint();
  writer.reset();
  AddRow(Format("index_write_%s", Count(options.entries).c_str()), "IndexWriter",
         Format("%.0f entries/s (%.1f s)", static_cast<double>(options.entries) / writeSeconds, writeSeconds),
         "",
         Format("%.0f entries/CPU-s, 10k per transaction", static_cast<double>(options.entries) / writeCpu));
  const std::uint64_t bytes = IndexBytes(dbDir);
  struct stat plainSt;
  ::stat(plainFile.c_str(), &plainSt);
  AddRow(Format("index_size_%s", Count(options.entries).c_str()), "store",
         Format("%.0f B/entry (%.0f MB)", static_cast<double>(bytes) / static_cast<double>(options.entries),
                static_cast<double>(bytes) / 1e6),
         Format("plain %.0f B/entry",
                static_cast<double>(plainSt.st_size) / static_cast<double>(options.entries)));

  auto reader = fileindex_store::IndexReader::Open(dbDir, error);
  sqlite3* fts = nullptr;
  if (!reader || sqlite3_open_v2(fileindex_store::IndexFilePath(dbDir).c_str(), &fts, SQLITE_OPEN_READONLY,
                                 nullptr) != SQLITE_OK) {
    std::fprintf(stderr, "cannot read the index\n");
    return false;
  }
  // Prefixes of decreasing selectivity: a common word, the first letters of common words,
  // middling and rare words, a camera's file names, two words at once, and no match.
  const std::vector<SearchCase> cases = {
      {{"holiday"}}, {{"ho"}},  {{"bea"}},       {{"report"}},          {{"mus"}},  {{"kestrel"}},
      {{"img"}},     {{"sun"}}, {{"fam", "bi"}}, {{"beach", "sunset"}}, {{"glac"}}, {{"nowordlikethis"}},
  };
  const int kRuns = 25;
  const int kBaselineRuns = 3;
  std::vector<double> all, allBaseline, allCpu;
  std::printf("searching...\n");
  std::fflush(stdout);
  sqlite3_stmt* like = nullptr;
  sqlite3_prepare_v2(plain,
                     "SELECT path, name, is_dir, size, mtime, kind FROM files WHERE name LIKE ?"
                     " ORDER BY mtime DESC LIMIT 50",
                     -1, &like, nullptr);
  sqlite3_stmt* count = nullptr;
  sqlite3_prepare_v2(fts, "SELECT count(*) FROM names WHERE names MATCH ?", -1, &count, nullptr);
  sqlite3_stmt* likeCount = nullptr;
  sqlite3_prepare_v2(plain, "SELECT count(*) FROM files WHERE name LIKE ?", -1, &likeCount, nullptr);
  for (const SearchCase& c : cases) {
    fileindex_store::Query query;
    query.words = c.words;
    query.limit = 50;
    std::string label;
    for (const std::string& word : c.words) label += (label.empty() ? "" : " ") + word;
    const std::string match = fileindex_store::MatchExpression(c.words);
    sqlite3_bind_text(count, 1, match.c_str(), -1, SQLITE_TRANSIENT);
    double matched =
        sqlite3_step(count) == SQLITE_ROW ? static_cast<double>(sqlite3_column_int64(count, 0)) : -1;
    sqlite3_reset(count);
    std::vector<double> times;
    std::size_t hitCount = 0;
    for (int run = 0; run < kRuns; ++run) {
      std::vector<fileindex_store::Hit> hits;
      Clock::time_point before = Clock::now();
      const double cpuBefore = ThreadCpuNow();
      if (!reader->Search(query, hits)) {
        std::fprintf(stderr, "search: %s\n", reader->LastError().c_str());
        return false;
      }
      times.push_back(Seconds(before, Clock::now()));
      allCpu.push_back(ThreadCpuNow() - cpuBefore);
      hitCount = hits.size();
    }
    all.insert(all.end(), times.begin(), times.end());
    // The baseline knows one word only: the first, anywhere in the name.
    const std::string pattern = "%" + c.words[0] + "%";
    sqlite3_bind_text(likeCount, 1, pattern.c_str(), -1, SQLITE_TRANSIENT);
    double likeMatched =
        sqlite3_step(likeCount) == SQLITE_ROW ? static_cast<double>(sqlite3_column_int64(likeCount, 0)) : -1;
    sqlite3_reset(likeCount);
    std::vector<double> baseline;
    for (int run = 0; run < kBaselineRuns; ++run) {
      Clock::time_point before = Clock::now();
      sqlite3_bind_text(like, 1, pattern.c_str(), -1, SQLITE_TRANSIENT);
      while (sqlite3_step(like) == SQLITE_ROW) {
      }
      sqlite3_reset(like);
      baseline.push_back(Seconds(before, Clock::now()));
    }
    allBaseline.insert(allBaseline.end(), baseline.begin(), baseline.end());
    const double n = static_cast<double>(options.entries);
    AddRow(Format("prefix_search_%s", Count(options.entries).c_str()), "\"" + label + "\"",
           Format("p50 %s p95 %s", Duration(Percentile(times, 0.5)).c_str(),
                  Duration(Percentile(times, 0.95)).c_str()),
           Faster(Percentile(baseline, 0.5), Percentile(times, 0.5)),
           Format("matches %.2f%% (%zu shown); LIKE %.2f%%, p50 %s", 100 * matched / n, hitCount,
                  100 * likeMatched / n, Duration(Percentile(baseline, 0.5)).c_str()));
  }
  AddRow(Format("prefix_search_%s", Count(options.entries).c_str()), "all_queries",
         Format("p50 %s p95 %s", Duration(Percentile(all, 0.5)).c_str(),
                Duration(Percentile(all, 0.95)).c_str()),
         Faster(Percentile(allBaseline, 0.95), Percentile(all, 0.95)),
         Verdict(Percentile(all, 0.95) < 0.020, "p95 < 20 ms") +
             Format(" (CPU time p50 %s p95 %s)", Duration(Percentile(allCpu, 0.5)).c_str(),
                    Duration(Percentile(allCpu, 0.95)).c_str()));
  AddRow(Format("prefix_search_%s", Count(options.entries).c_str()), "naive_like",
         Format("p50 %s p95 %s", Duration(Percentile(allBaseline, 0.5)).c_str(),
                Duration(Percentile(allBaseline, 0.95)).c_str()),
         "", Format("n=%zu", allBaseline.size()));
  sqlite3_finalize(like);
  sqlite3_finalize(count);
  sqlite3_finalize(likeCount);
  sqlite3_close(fts);
  reader.reset();
  const bool spotlight = options.spotlight ? SpotlightScenario(options, dbDir, plain) : true;
  sqlite3_close(plain);
  return spotlight;
}

void Usage() {
  std::fprintf(stderr,
               "usage: fileindex_bench_service [--files N] [--dirs N] [--entries N] [--creations N]"
               " [--content-files N] [--naive-limit SECONDS] [--only service|search|spotlight|content] "
               "[--keep yes]\n");
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 6 && std::strcmp(argv[1], "--naive-crawl") == 0)
    return NaiveCrawl(argv[2], argv[3], std::strcmp(argv[4], "row") == 0, std::atof(argv[5]));
  Options options;
  std::string only;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (i + 1 >= argc) {
      Usage();
      return 2;
    }
    const char* value = argv[++i];
    if (arg == "--files") {
      options.files = std::strtoul(value, nullptr, 10);
    } else if (arg == "--dirs") {
      options.dirs = std::strtoul(value, nullptr, 10);
    } else if (arg == "--entries") {
      options.entries = std::strtoul(value, nullptr, 10);
    } else if (arg == "--creations") {
      options.creations = std::strtoul(value, nullptr, 10);
    } else if (arg == "--content-files") {
      options.contentFiles = std::strtoul(value, nullptr, 10);
    } else if (arg == "--naive-limit") {
      options.naiveLimit = std::atof(value);
    } else if (arg == "--keep") {
      g_keep = std::strcmp(value, "yes") == 0;
    } else if (arg == "--only") {
      only = value;
      options.spotlight = only != "search";
      if (only == "spotlight") only = "search";
    } else {
      Usage();
      return 2;
    }
  }
  if (options.files == 0 || options.dirs == 0 || options.entries == 0 || options.creations == 0) {
    Usage();
    return 2;
  }
  if (!MakeWorkspace()) {
    std::fprintf(stderr, "cannot make a workspace: %s\n", std::strerror(errno));
    return 1;
  }
  std::snprintf(g_workspacePath, sizeof(g_workspacePath), "%s", g_workspace.c_str());
  std::atexit(RemoveWorkspace);
  struct sigaction action {};
  action.sa_handler = OnSignal;
  ::sigaction(SIGINT, &action, nullptr);
  ::sigaction(SIGTERM, &action, nullptr);
  std::printf("workspace %s (%s)\n", g_workspace.c_str(),
              g_mounted ? "tmpfs mounted for the run" : "in /dev/shm");
  std::fflush(stdout);

  bool ok = true;
  if (only.empty() || only == "service") ok = ServiceScenarios(options) && ok;
  if (only.empty() || only == "search") ok = SearchScenario(options) && ok;
  if (only.empty() || only == "content") ok = ContentScenario(options) && ok;
  g_notes.push_back(
      "naive crawlers: recursive_directory_iterator + lstat, rows into a plain SQLite table"
      " (no full-text index); tx_per_row commits each row (default rollback journal), one_tx"
      " commits once");
  g_notes.push_back(
      "naive_like: SELECT ... WHERE name LIKE '%word%' ORDER BY mtime DESC LIMIT 50 on a plain"
      " table of the same rows (no index), first word only");
  PrintTable();
  RemoveWorkspace();
  return ok ? 0 : 1;
}
