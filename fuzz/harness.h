// The checks behind the fuzz targets, shared by the libFuzzer executables and by the unit
// test that replays the seed corpora and the saved regression inputs. Each Check* function
// feeds one input to the library and returns what went wrong: an empty string when every
// property held.
//
// The environment is a system root with three shares on /volume1 (photo, video, music),
// the fake platform of the unit tests and a daemon socket that swallows every frame.
// Inputs may write "@ROOT@" where the (random) system root belongs.
#ifndef FILEINDEX_FUZZ_HARNESS_H
#define FILEINDEX_FUZZ_HARNESS_H

#include <dirent.h>
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <json/json.h>
#include <poll.h>
#include <strings.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "internal/folder_conf_view.h"
#include "internal/json_io.h"
#include "internal/queue_scan.h"
#if __has_include("internal/queue_line_view.h")
#include "internal/queue_line_view.h"
#define FILEINDEX_FUZZ_HAVE_LINE_VIEW 1
#endif
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace fuzzh {

namespace fi = ::TAVO::FILEINDEX;

const char* const kShares[] = {"photo", "video", "music"};
// A fixed clock, so that pause times compare the same way on every run.
const long long kNow = 1600000000;

// Accepts connections on the daemon socket and reads each to its end, keeping nothing.
class SinkDaemon {
 public:
  SinkDaemon() = default;
  SinkDaemon(const SinkDaemon&) = delete;
  SinkDaemon& operator=(const SinkDaemon&) = delete;
  ~SinkDaemon() { Stop(); }

  bool Start(const std::string& path) {
    struct sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof(addr.sun_path)) return false;
    std::memcpy(addr.sun_path, path.data(), path.size());
    ::unlink(path.c_str());
    listen_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (listen_ < 0) return false;
    if (::bind(listen_, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0 ||
        ::listen(listen_, 128) != 0 || ::pipe2(wake_, O_CLOEXEC) != 0) {
      ::close(listen_);
      listen_ = -1;
      return false;
    }
    path_ = path;
    thread_ = std::thread([this] { Serve(); });
    return true;
  }

  void Stop() {
    if (listen_ < 0) return;
    char c = 'x';
    while (::write(wake_[1], &c, 1) < 0 && errno == EINTR) {
    }
    thread_.join();
    ::close(listen_);
    ::close(wake_[0]);
    ::close(wake_[1]);
    ::unlink(path_.c_str());
    listen_ = -1;
  }

 private:
  void Serve() {
    for (;;) {
      struct pollfd fds[2] = {{listen_, POLLIN, 0}, {wake_[0], POLLIN, 0}};
      if (::poll(fds, 2, -1) < 0) {
        if (errno == EINTR) continue;
        return;
      }
      if (fds[1].revents != 0) return;
      int conn = ::accept4(listen_, nullptr, nullptr, SOCK_CLOEXEC);
      if (conn < 0) continue;
      char buffer[4096];
      for (;;) {
        struct pollfd in = {conn, POLLIN, 0};
        if (::poll(&in, 1, 1000) <= 0) break;
        ssize_t n = ::read(conn, buffer, sizeof(buffer));
        if (n <= 0 && !(n < 0 && errno == EINTR)) break;
      }
      ::close(conn);
    }
  }

  std::string path_;
  int listen_ = -1;
  int wake_[2] = {-1, -1};
  std::thread thread_;
};

struct Env {
  std::string root;

  std::string Conf(const char* name) const { return root + "/usr/tavo/etc/fileindex/" + name; }
  std::string FolderConf() const { return Conf("folder.conf"); }
  std::string StatusConf() const { return Conf("status.conf"); }
  std::string FolderLock() const { return root + "/tmp/fileidx_cfg_folder.lock"; }
  std::string StatusLock() const { return root + "/tmp/fileidx_cfg_status.lock"; }
  std::string Socket() const { return root + "/var/run/fileindexd.sock"; }
  std::string ShareDir(const std::string& share) const { return root + "/volume1/" + share; }
  std::string Full(const std::string& path) const { return root + "/volume1" + path; }
  std::string Queue(const std::string& share) const {
    return ShareDir(share) + "/@eaDir/TAVO@file_index_queue";
  }
};

inline void MakeDirs(const std::string& path) {
  for (size_t pos = path.find('/', 1);; pos = path.find('/', pos + 1)) {
    ::mkdir(path.substr(0, pos).c_str(), 0755);
    if (pos == std::string::npos) break;
  }
}

inline bool ReadBytes(const std::string& path, std::string& out) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::stringstream text;
  text << in.rdbuf();
  out = text.str();
  return true;
}

inline void WriteBytes(const std::string& path, const std::string& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

inline std::string Substitute(std::string text, const std::string& token, const std::string& value) {
  for (size_t pos = text.find(token); pos != std::string::npos; pos = text.find(token, pos + value.size())) {
    text.replace(pos, token.size(), value);
  }
  return text;
}

// Printable, bounded rendering of an input for failure messages.
inline std::string Show(const std::string& bytes) {
  std::string out;
  for (size_t i = 0; i < bytes.size() && i < 300; ++i) {
    unsigned char c = static_cast<unsigned char>(bytes[i]);
    if (c >= 0x20 && c < 0x7f) {
      out += static_cast<char>(c);
    } else {
      char hex[8];
      std::snprintf(hex, sizeof(hex), "\\x%02x", c);
      out += hex;
    }
  }
  if (bytes.size() > 300) out += "...";
  return out;
}

// The system root for one process: directories, shares and the fixed clock. The fake
// platform must be fresh (the unit-test fixture resets it; a fuzz target starts fresh).
inline void SetUpRoot(const Env& env) {
  MakeDirs(env.root + "/usr/tavo/etc/fileindex");
  MakeDirs(env.root + "/tmp");
  MakeDirs(env.root + "/var/run");
  for (const char* share : kShares) {
    fake::AddShare(env.root, "/volume1", share);
    MakeDirs(env.ShareDir(share) + "/@eaDir");
  }
  // Folders may only be configured where a directory is.
  for (const char* folder : {"/photo/a/b", "/video/x", "/music/m"}) MakeDirs(env.Full(folder));
  fake::SetClock(kNow);
}

// Forgets what the previous input left: configuration files, queues, recorded calls, logs.
inline void ResetState(const Env& env) {
  ::unlink(env.FolderConf().c_str());
  ::unlink(env.StatusConf().c_str());
  for (const char* share : kShares) {
    ::unlink(env.Queue(share).c_str());
    ::unlink((env.Queue(share) + ".tmp").c_str());
  }
  fake::Platform& platform = fake::Get();
  platform.calls.clear();
  platform.monitorCalls.clear();
  platform.execs.clear();
  // Index data is removed with rm -rf; inputs must not spawn a process per run.
  platform.forced["VLIBCExec"] = 0;
  logcap::Clear();
  fi::ErrorHandler::g_error_code = fi::FILEINDEX_ERR_NONE;
}

inline const Json::Value* Member(const Json::Value& object, const char* key) {
  if (!object.isObject()) return nullptr;
  return object.find(key, key + std::strlen(key));
}

// ---------------------------------------------------------------------------------------
// Queue lines.

// ParseQueueLine (and the fast reader, when it decides) against the strict JSON parse
// and the rule: an object whose "event" converts to an unsigned integer and whose
// "path" is a string.
inline std::string CheckQueueLine(const std::string& line) {
  fi::internal::QueueEvent event;
  const bool parsed = fi::internal::ParseQueueLine(line.data(), line.size(), event);
  Json::Value doc;
  bool valid = false;
  if (fi::internal::JsonFromString(doc, line) && doc.isObject()) {
    const Json::Value* code = Member(doc, "event");
    const Json::Value* path = Member(doc, "path");
    valid = code != nullptr && path != nullptr && code->isConvertibleTo(Json::uintValue) && path->isString();
  }
  if (parsed != valid) {
    return std::string("ParseQueueLine ") + (parsed ? "accepts" : "refuses") + " a line the rule " +
           (valid ? "accepts" : "refuses") + ": " + Show(line);
  }
  std::string pathOld;
  bool hasPathOld = false;
  if (valid) {
    const Json::Value* old = Member(doc, "path_old");
    hasPathOld = old != nullptr && old->isString();
    if (hasPathOld) pathOld = old->asString();
    if (event.event != Member(doc, "event")->asUInt() || event.path != Member(doc, "path")->asString() ||
        event.hasPathOld != hasPathOld || event.pathOld != pathOld) {
      return "ParseQueueLine reads other values than the JSON parse: " + Show(line);
    }
  }
#ifdef FILEINDEX_FUZZ_HAVE_LINE_VIEW
  fi::internal::QueueEventView view;
  if (fi::internal::ViewQueueLine(line.data(), line.size(), view)) {
    if (!valid) return "ViewQueueLine accepts a line that is not an event: " + Show(line);
    if (view.event != event.event || std::string(view.path, view.pathSize) != event.path ||
        (view.pathOld != nullptr) != hasPathOld ||
        (view.pathOld != nullptr && std::string(view.pathOld, view.pathOldSize) != pathOld)) {
      return "ViewQueueLine reads other values than ParseQueueLine: " + Show(line);
    }
  }
#endif
  return std::string();
}

#ifdef FILEINDEX_FUZZ_HAVE_LINE_VIEW
// The bytes as one run of lines: the run reader answers for every line what
// ClassifyQueueLine answers, with the same values and line end for an event.
inline std::string CheckQueueRun(const uint8_t* data, size_t size) {
  // The fuzzer's own buffer, of exactly its size: a read past the run is seen.
  const char* const begin = reinterpret_cast<const char*>(data);
  const char* const end = begin + size;
  fi::internal::QueueRunClassifier run(begin, end), unread(begin, end);
  for (const char* line = begin; line < end;) {
    fi::internal::QueueEventView byRun, alone, kindOnly;
    const char* runEnd = nullptr;
    const char* aloneEnd = nullptr;
    const char* kindOnlyEnd = nullptr;
    const fi::internal::QueueLineKind kind = run.Classify(line, byRun, runEnd);
    const char* next = std::find(line, end, '\n');
    if (kind != fi::internal::ClassifyQueueLine(line, end, alone, aloneEnd))
      return "QueueRunClassifier decides otherwise than ClassifyQueueLine: " + Show(std::string(line, next));
    // The paths-unread reading also reads flat objects by comparisons, where the processor
    // has a faster way too.
    fi::internal::UseFlatObjectReading(fi::internal::FlatObjectReading::kCompared);
    const fi::internal::QueueLineKind kindUnread =
        unread.Classify(line, kindOnly, kindOnlyEnd, fi::internal::QueuePaths::kUnread);
    fi::internal::UseFlatObjectReading(fi::internal::BestFlatObjectReading());
    if (kindUnread != kind || (kind == fi::internal::QueueLineKind::kEvent && kindOnlyEnd != runEnd))
      return "QueueRunClassifier decides otherwise when the paths are unread: " +
             Show(std::string(line, next));
    if (kind == fi::internal::QueueLineKind::kEvent &&
        (runEnd != aloneEnd || byRun.event != alone.event ||
         std::string(byRun.path, byRun.pathSize) != std::string(alone.path, alone.pathSize) ||
         (byRun.pathOld != nullptr) != (alone.pathOld != nullptr) ||
         (byRun.pathOld != nullptr &&
          std::string(byRun.pathOld, byRun.pathOldSize) != std::string(alone.pathOld, alone.pathOldSize)))) {
      return "QueueRunClassifier reads other values than ClassifyQueueLine: " + Show(std::string(line, next));
    }
    line = next < end ? next + 1 : end;
  }
  return std::string();
}
#endif

// The bytes as the photo share's queue file: the line splitting, every line, the folder
// status of /photo/a and the absorption of a settings event by a pending reindex.
inline std::string CheckQueueFile(const Env& env, const uint8_t* data, size_t size) {
  ResetState(env);
  const std::string text =
      Substitute(std::string(reinterpret_cast<const char*>(data), size), "@ROOT@", env.root);
  const std::string queue = env.Queue("photo");
  WriteBytes(queue, text);

  std::vector<std::string> lines;
  if (!fi::internal::ForEachQueueLine(queue, [&lines](const char* line, size_t n) {
        lines.emplace_back(line, n);
        return true;
      })) {
    return "ForEachQueueLine cannot open the queue";
  }
  std::vector<std::string> expected;
  for (size_t start = 0; start < text.size();) {
    size_t nl = text.find('\n', start);
    if (nl == std::string::npos) nl = text.size();
    expected.push_back(text.substr(start, nl - start));
    start = nl + 1;
  }
  if (lines != expected) return "ForEachQueueLine splits the file differently: " + Show(text);

  const std::string full = env.Full("/photo/a");
  bool pending = false;
  bool reindexPending = false;
  for (const std::string& line : lines) {
    std::string problem = CheckQueueLine(line);
    if (!problem.empty()) return problem;
    fi::internal::QueueEvent event;
    if (!fi::internal::ParseQueueLine(line.data(), line.size(), event)) continue;
    const std::string prefix = full + "/";
    if ((event.path + "/").compare(0, prefix.size(), prefix) == 0) pending = true;
    if (event.event == 256 && (event.pathOld + "/").compare(0, prefix.size(), prefix) == 0) pending = true;
    if (event.event == 65536 && event.path == full) reindexPending = true;
  }

  const std::string status = fi::StatusMgr::GetFolderStatus("/photo/a");
  if (status != (pending ? "processing" : "finished")) {
    return "GetFolderStatus answers " + status + " for the queue " + Show(text);
  }

  if (!fi::AddCustomEvent(131072, full, Json::Value())) return "AddCustomEvent fails on " + Show(text);
  std::string after;
  ReadBytes(queue, after);
  if (after.compare(0, text.size(), text) != 0) return "AddCustomEvent changed existing queue bytes";
  const std::string appended = after.substr(text.size());
  if (reindexPending) {
    if (!appended.empty()) return "a pending reindex did not absorb the event: " + Show(text);
  } else {
    Json::Value record;
    if (appended.empty() || appended.back() != '\n' || appended.find('\n') != appended.size() - 1 ||
        !fi::internal::JsonFromString(record, appended.substr(0, appended.size() - 1)) ||
        !record.isObject() || record["event"] != 131072 || record["path"] != full ||
        !record["data"].isNull()) {
      return "the appended event is not one whole line: " + Show(appended) + " after " + Show(text);
    }
  }
  return std::string();
}

// ---------------------------------------------------------------------------------------
// folder.conf.

inline bool SameFolder(const fi::Folder& a, const fi::Folder& b) {
  return a.GetPath() == b.GetPath() && a.GetName() == b.GetName() && a.IsDocument() == b.IsDocument() &&
         a.IsAudio() == b.IsAudio() && a.IsVideo() == b.IsVideo() && a.IsPhoto() == b.IsPhoto() &&
         a.GetFullPath() == b.GetFullPath();
}

// A page of IndexMgr::List: its size and, for an ascending page by name or path, its order.
inline std::string CheckPage(const Json::Value& result, size_t total, unsigned long offset,
                             unsigned long limit, const std::string& sortBy, const std::string& direction) {
  if (!result.isObject() || !result["folder"].isArray() || result["total"].asUInt64() != total ||
      result["offset"].asUInt64() != offset) {
    return "malformed page " + fi::internal::JsonToString(result);
  }
  unsigned long n = 0;
  if (offset <= total) n = std::min<unsigned long>(total - offset, limit);
  const Json::Value& page = result["folder"];
  if (page.size() != n) {
    return "page of " + std::to_string(page.size()) + " folders for total " + std::to_string(total) +
           ", offset " + std::to_string(offset) + ", limit " + std::to_string(limit);
  }
  const bool byName = sortBy == "name";
  const bool byFlag = sortBy == "document" || sortBy == "audio" || sortBy == "video" || sortBy == "photo";
  if (direction == "DESC" || byFlag) return std::string();
  const char* key = byName ? "name" : "path";
  for (Json::ArrayIndex i = 1; i < page.size(); ++i) {
    if (strcasecmp(page[i][key].asCString(), page[i - 1][key].asCString()) < 0) {
      return "page out of order by " + std::string(key) + ": " + fi::internal::JsonToString(page);
    }
  }
  return std::string();
}

inline std::string CheckFolderConf(const Env& env, const uint8_t* data, size_t size) {
  ResetState(env);
  const std::string text(reinterpret_cast<const char*>(data), size);
  WriteBytes(env.FolderConf(), text);

  Json::Value doc;
  const bool parses = fi::internal::JsonFromString(doc, text);
  fi::Folders folders;
  const bool loaded = folders.Load();
  if (!parses || !doc.isObject()) {
    const fi::_tag_fileindex_err_ code =
        parses ? fi::FILEINDEX_ERR_MALFORMED_CONFIG : fi::FILEINDEX_ERR_LOAD_CONFIG;
    if (loaded || fi::ErrorHandler::GetError() != code) {
      return "Folders::Load of a bad folder.conf gives " + std::to_string(loaded) + " with code " +
             std::to_string(fi::ErrorHandler::GetError()) + ": " + Show(text);
    }
    return std::string();
  }
  if (!loaded) return "Folders::Load refuses a JSON object: " + Show(text);

  std::vector<fi::Folder> all;
  if (!folders.List(all) || all.size() != doc.size()) return "Folders::List lost folders: " + Show(text);
  // Members come in key order; the flags a record lacks carry over from the one before.
  bool flags[4] = {false, false, false, false};
  const char* const names[4] = {"document", "audio", "video", "photo"};
  size_t i = 0;
  for (Json::Value::const_iterator it = doc.begin(); it != doc.end(); ++it, ++i) {
    for (int f = 0; f < 4; ++f) {
      const Json::Value* flag = Member(*it, names[f]);
      if (flag != nullptr && flag->isBool()) flags[f] = flag->asBool();
    }
    const Json::Value* name = Member(*it, "name");
    const fi::Folder& folder = all[i];
    if (folder.GetPath() != it.name() ||
        folder.GetName() != (name != nullptr && name->isString() ? name->asString() : std::string()) ||
        folder.IsDocument() != flags[0] || folder.IsAudio() != flags[1] || folder.IsVideo() != flags[2] ||
        folder.IsPhoto() != flags[3]) {
      return "Folders::Load misreads the record " + Show(it.name()) + " of " + Show(text);
    }
  }
  if (!all.empty()) {
    Json::Value record;
    if (!folders.Get(record, all.front().GetPath()) || record != all.front().asJson()) {
      return "Folders::Get does not find a loaded folder";
    }
  }

  // What is saved loads back to the same folders.
  if (!folders.Save()) return "Folders::Save fails";
  fi::Folders again;
  std::vector<fi::Folder> reloaded;
  if (!again.Load() || !again.List(reloaded) || reloaded.size() != all.size()) {
    return "a saved folder.conf does not load back: " + Show(text);
  }
  for (size_t k = 0; k < all.size(); ++k) {
    if (!SameFolder(all[k], reloaded[k])) return "a saved folder changed: " + Show(all[k].GetPath());
  }

  if (all.size() <= 64) {
    static const char* const sortKeys[] = {"name", "path", "", "photo", "Name"};
    const unsigned char seed = size > 0 ? data[size / 2] : 0;
    const unsigned long offset = seed % (all.size() + 2);
    const unsigned long limit = (seed >> 3) % 8;
    const std::string sortBy = sortKeys[seed % 5];
    const std::string direction = (seed & 0x40) ? "DESC" : "ASC";
    Json::Value additional(Json::arrayValue);
    additional.append("is_valid");
    if (seed & 0x80) additional.append("status");
    Json::Value result;
    if (!fi::IndexMgr::List(result, offset, limit, sortBy, direction, additional)) {
      return "IndexMgr::List fails on a loadable folder.conf";
    }
    std::string problem = CheckPage(result, all.size(), offset, limit, sortBy, direction);
    if (!problem.empty()) return problem + " for " + Show(text);
  }
  return std::string();
}

// The fast reader of folder.conf against the strict parse, and every path query answered
// through it against the same query over the folders of a full load: the same answer,
// log lines and error code.
inline std::string CheckFolderConfView(const Env& env, const uint8_t* data, size_t size) {
  ResetState(env);
  const std::string text(reinterpret_cast<const char*>(data), size);
  // The records' values are checked against the parse by CheckFolderConf, through the load.
  std::vector<fi::internal::FolderConfRecord> records;
  if (fi::internal::ViewFolderConf(text.data(), text.size(), records)) {
    Json::Value doc;
    if (!fi::internal::JsonFromString(doc, text) || !doc.isObject())
      return "the fast reader decides what the strict parse refuses: " + Show(text);
    std::vector<std::string> viewed;
    for (const auto& record : records) viewed.emplace_back(record.path.data, record.path.size);
    if (viewed != doc.getMemberNames()) return "the fast reader lists other names: " + Show(text);
  }
  WriteBytes(env.FolderConf(), text);
  std::vector<std::string> probes{"/photo/a", "/photo/a/b/c", "/video", "/", ""};
  if (!records.empty())
    probes.emplace_back(std::string(records.back().path.data, records.back().path.size) + "/x");
  for (const std::string& probe : probes) {
    std::string answers[2];
    for (int full = 0; full < 2; ++full) {
      for (int i = 0; i < 3; ++i) {
        fi::ErrorHandler::g_error_code = fi::FILEINDEX_ERR_NONE;
        logcap::Clear();
        bool answer;
        if (full == 0) {
          answer = i == 0   ? fi::IndexMgr::IsPathIndexed(probe)
                   : i == 1 ? fi::IndexMgr::IsFullPathIndexed(env.Full(probe))
                            : fi::IndexMgr::IsPathContainIndexed(probe);
        } else {
          std::vector<fi::Folder> folders;
          answer = fi::IndexMgr::List(folders) && !folders.empty() &&
                   (i == 0   ? fi::IndexMgr::IsPathIndexed(probe, folders)
                    : i == 1 ? fi::IndexMgr::IsFullPathIndexed(env.Full(probe), folders)
                             : fi::IndexMgr::IsPathContainIndexed(probe, folders));
        }
        answers[full] += std::to_string(answer) + " " + std::to_string(fi::ErrorHandler::GetError()) + "\n";
        for (const std::string& line : logcap::Texts()) answers[full] += line + "\n";
      }
    }
    if (answers[0] != answers[1])
      return "a query differs from the full load for " + Show(probe) + ": " + Show(answers[0]) + " vs " +
             Show(answers[1]) + " on " + Show(text);
  }
  return std::string();
}

// ---------------------------------------------------------------------------------------
// status.conf.

inline std::string CheckStatusConf(const Env& env, const uint8_t* data, size_t size) {
  ResetState(env);
  const std::string text(reinterpret_cast<const char*>(data), size);
  WriteBytes(env.StatusConf(), text);
  // One folder with an (empty) queue, so that GetStatus consults the pause time.
  WriteBytes(env.FolderConf(),
             "{\"/photo/a\":{\"path\":\"/photo/a\",\"name\":\"a\",\"document\":true,\"audio\":true,"
             "\"video\":true,\"photo\":true}}");
  WriteBytes(env.Queue("photo"), "");

  Json::Value doc;
  const bool parses = fi::internal::JsonFromString(doc, text);
  fi::Status status;
  const bool loaded = status.Load();
  if (loaded != parses) return "Status::Load disagrees with the JSON parse: " + Show(text);
  if (!loaded) {
    if (fi::ErrorHandler::GetError() != fi::FILEINDEX_ERR_LOAD_CONFIG)
      return "a bad status.conf gives no code 6";
    return std::string();
  }

  // Readers answer without throwing, whatever the members hold.
  try {
    long long resume = 12345;
    bool expectedOk = true;
    long long expected = -1;
    if (const Json::Value* stored = Member(doc, "resume_time")) {
      try {
        expected = stored->asInt64();
      } catch (const Json::Exception&) {
        expectedOk = false;
        expected = 12345;
      }
    }
    const bool got = status.GetPauseInfo(resume);
    if (got != expectedOk || resume != expected) return "Status::GetPauseInfo misreads " + Show(text);
    long long viaMgr = 12345;
    if (fi::StatusMgr::GetPauseInfo(viaMgr) != got || viaMgr != resume) {
      return "StatusMgr::GetPauseInfo disagrees with Status::GetPauseInfo";
    }

    std::vector<std::string> keys{"resume_time", "need_reindex", "no_space", "photo", ""};
    if (doc.isObject() && !doc.empty()) keys.push_back(doc.begin().name());
    for (const std::string& key : keys) {
      const Json::Value* mark = doc.isObject() ? doc.find(key.data(), key.data() + key.size()) : nullptr;
      bool expectedMark = false;
      if (mark != nullptr) {
        try {
          expectedMark = mark->asBool();
        } catch (const Json::Exception&) {
          expectedMark = false;
        }
      }
      if (status.IsUpdated(key) != expectedMark || fi::StatusMgr::IsUpdated(key) != expectedMark) {
        return "IsUpdated(" + Show(key) + ") misreads " + Show(text);
      }
    }
    for (const char* flag : {"need_reindex", "no_space"}) {
      std::vector<std::string> shares{"photo", ""};
      const Json::Value* flags = Member(doc, flag);
      if (flags != nullptr && flags->isObject() && !flags->empty()) shares.push_back(flags->begin().name());
      for (const std::string& share : shares) {
        const bool expectedFlag = flags != nullptr && flags->isObject() && flags->isMember(share);
        const bool first = std::strcmp(flag, "no_space") == 0;
        const bool got1 = first ? status.ShareIsNoSpace(share) : status.ShareIsNeedReindex(share);
        const bool got2 =
            first ? fi::StatusMgr::ShareIsNoSpace(share) : fi::StatusMgr::ShareIsNeedReindex(share);
        if (got1 != expectedFlag || got2 != expectedFlag) {
          return std::string(flag) + " of " + Show(share) + " misread in " + Show(text);
        }
      }
    }

    std::string overall = "unset";
    const bool gotStatus = fi::StatusMgr::GetStatus(overall);
    if (gotStatus != got) return "GetStatus fails differently from the pause time read";
    if (gotStatus) {
      const bool paused = resume == 0 || kNow < resume;
      if (overall != (paused ? "paused" : "processing")) return "GetStatus answers " + overall;
    }
    const std::string folderStatus = fi::StatusMgr::GetFolderStatus("/photo/a");
    const bool noSpace = fi::StatusMgr::ShareIsNoSpace("photo");
    if (noSpace != (folderStatus == "err_no_space")) return "GetFolderStatus answers " + folderStatus;
  } catch (const std::exception& e) {
    return std::string("a reader threw ") + e.what() + " on " + Show(text);
  }

  // Writers may meet a wrongly typed member, which the JSON library reports by throwing:
  // that is their documented behaviour. What they did change must read back and save.
  const unsigned char seed = size > 0 ? data[size - 1] : 0;
  const std::string share =
      (seed & 1) ? "photo" : (doc.isObject() && !doc.empty() ? doc.begin().name() : "x");
  try {
    const bool set = (seed & 2) != 0;
    try {
      status.ShareSetNeedReindex(share, set);
      if (status.ShareIsNeedReindex(share) != set) return "ShareSetNeedReindex does not read back";
    } catch (const Json::Exception&) {
    }
    try {
      status.ShareSetNoSpace(share, !set);
      if (status.ShareIsNoSpace(share) != !set) return "ShareSetNoSpace does not read back";
    } catch (const Json::Exception&) {
    }
    try {
      const long long pause = (seed & 4) ? 0 : kNow + 3600;
      status.Pause(pause);
      long long back = 1;
      if (!status.GetPauseInfo(back) || back != pause) return "Pause does not read back";
      if (seed & 8) {
        status.SetUpdated(share);
        if (!status.IsUpdated(share)) return "SetUpdated does not read back";
      }
    } catch (const Json::Exception&) {
    }
  } catch (const std::exception& e) {
    return std::string("a writer threw ") + e.what() + " on " + Show(text);
  }
  if (!status.Save()) return "Status::Save fails";
  Json::Value saved;
  std::string savedText;
  if (!ReadBytes(env.StatusConf(), savedText) || !fi::internal::JsonFromString(saved, savedText)) {
    return "a saved status.conf does not parse";
  }
  fi::Status again;
  if (!again.Load()) return "a saved status.conf does not load";
  return std::string();
}

// ---------------------------------------------------------------------------------------
// The index manager with arbitrary JSON arguments.

// What the process's descriptors refer to, sockets left out: they come and go with the
// daemon sink's thread.
inline std::multiset<std::string> FilesOpen() {
  std::multiset<std::string> files;
  DIR* dir = ::opendir("/proc/self/fd");
  if (dir == nullptr) return files;
  while (struct dirent* entry = ::readdir(dir)) {
    if (entry->d_name[0] == '.' || std::atoi(entry->d_name) == ::dirfd(dir)) continue;
    char target[4096] = {0};
    const std::string link = std::string("/proc/self/fd/") + entry->d_name;
    if (::readlink(link.c_str(), target, sizeof(target) - 1) < 0) continue;
    if (std::strncmp(target, "socket:", 7) == 0) continue;
    files.insert(target);
  }
  ::closedir(dir);
  return files;
}

inline bool LockIsFree(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
  if (fd < 0) return true;
  const bool free = ::flock(fd, LOCK_EX | LOCK_NB) == 0;
  ::close(fd);
  return free;
}

// folder.conf, when present: an object of at most 1000 well-formed records keyed by path.
inline std::string CheckFolderConfShape(const Env& env, Json::Value& conf) {
  std::string text;
  conf = Json::Value(Json::objectValue);
  if (!ReadBytes(env.FolderConf(), text)) return std::string();
  if (!fi::internal::JsonFromString(conf, text) || !conf.isObject())
    return "folder.conf is torn: " + Show(text);
  if (conf.size() > 1000) return "folder.conf holds more than 1000 folders";
  for (Json::Value::const_iterator it = conf.begin(); it != conf.end(); ++it) {
    const Json::Value& record = *it;
    if (!record.isObject() || record["path"] != it.name() || !record["name"].isString() ||
        !record["document"].isBool() || !record["audio"].isBool() || !record["video"].isBool() ||
        !record["photo"].isBool()) {
      return "folder.conf holds a malformed record: " + Show(text);
    }
  }
  return std::string();
}

inline std::string CheckQueueShapes(const Env& env) {
  for (const char* share : kShares) {
    std::string text;
    if (!ReadBytes(env.Queue(share), text)) continue;
    if (!text.empty() && text.back() != '\n') return std::string("a queue line is cut in ") + share;
    std::istringstream in(text);
    std::string line;
    while (std::getline(in, line)) {
      fi::internal::QueueEvent event;
      if (!fi::internal::ParseQueueLine(line.data(), line.size(), event) ||
          (event.event != 65536 && event.event != 131072)) {
        return "the library wrote a bad queue line: " + Show(line);
      }
    }
  }
  return std::string();
}

const char kPresetFolders[] =
    "{\"/photo/a\":{\"path\":\"/photo/a\",\"name\":\"a\",\"document\":true,\"audio\":false,\"video\":true,"
    "\"photo\":true},\"/photo/a/b\":{\"path\":\"/photo/a/b\",\"name\":\"b\",\"document\":false,"
    "\"audio\":false,\"video\":false,\"photo\":true},\"/video/x\":{\"path\":\"/video/x\",\"name\":\"X\","
    "\"document\":false,\"audio\":false,\"video\":true,\"photo\":false}}";

// Input: an operation byte, two paging bytes, a flags byte, then a JSON argument (or,
// when it does not parse, the rest as one JSON string).
inline std::string CheckIndexMgr(const Env& env, const uint8_t* data, size_t size) {
  if (size < 4) return std::string();
  ResetState(env);
  const unsigned op = data[0] % 8;
  const unsigned long offset = data[1] % 8;
  const unsigned long limit = data[2] % 8;
  const unsigned flags = data[3];
  if (flags & 1) WriteBytes(env.FolderConf(), kPresetFolders);
  if (flags & 2) WriteBytes(env.StatusConf(), "{\"no_space\":{\"photo\":true},\"resume_time\":0}");
  const std::string text =
      Substitute(std::string(reinterpret_cast<const char*>(data) + 4, size - 4), "@ROOT@", env.root);
  Json::Value arg;
  if (!fi::internal::JsonFromString(arg, text)) arg = Json::Value(text);
  static const char* const sortKeys[] = {"name", "path", "document", "video"};
  const std::string sortBy = sortKeys[flags >> 6];
  const std::string direction = (flags & 4) ? "DESC" : "";

  std::string before;
  const bool existed = ReadBytes(env.FolderConf(), before);
  const std::multiset<std::string> filesOpen = FilesOpen();
  bool ok = false;
  Json::Value result;
  try {
    switch (op) {
      case 0:
        ok = fi::IndexMgr::Upsert(arg);
        break;
      case 1:
        ok = fi::IndexMgr::Set(arg);
        break;
      case 2:
        ok = fi::IndexMgr::Delete(arg);
        break;
      case 3:
        ok = fi::IndexMgr::Reindex(arg);
        break;
      case 4:
        ok = fi::IndexMgr::List(result, offset, limit, sortBy, direction, arg);
        break;
      case 5:
        ok = fi::IndexMgr::Get(result, arg.isString() ? arg.asString() : text);
        break;
      case 6:
        ok = fi::IndexMgr::Update(
            arg.isObject() && arg["path"].isString() ? arg["path"].asString() : "/photo/a", arg);
        break;
      default: {
        std::vector<fi::Folder> list;
        ok = fi::IndexMgr::List(list);
        // Adds the folders and removes them again by their paths.
        if (ok && arg.isArray() && fi::IndexMgr::Upsert(arg)) {
          Json::Value paths(Json::arrayValue);
          for (const Json::Value& element : arg) paths.append(element["path"]);
          ok = fi::IndexMgr::Delete(paths);
        }
        break;
      }
    }
  } catch (const std::exception& e) {
    return std::string("the index manager threw ") + e.what() + " for op " + std::to_string(op) + " on " +
           Show(text);
  }
  const std::string where = " (op " + std::to_string(op) + ", argument " + Show(text) + ")";

  if (!LockIsFree(env.FolderLock())) return "folder.conf's lock is still held" + where;
  if (!LockIsFree(env.StatusLock())) return "status.conf's lock is still held" + where;
  const std::multiset<std::string> filesAfter = FilesOpen();
  if (filesAfter != filesOpen) {
    std::string leaked;
    for (const std::string& file : filesAfter) {
      if (filesOpen.count(file) < filesAfter.count(file)) leaked += " " + file;
    }
    return "a file descriptor leaked:" + leaked + where;
  }
  Json::Value conf;
  std::string problem = CheckFolderConfShape(env, conf);
  if (problem.empty()) problem = CheckQueueShapes(env);
  if (!problem.empty()) return problem + where;

  std::string after;
  const bool exists = ReadBytes(env.FolderConf(), after);
  const bool unchanged = existed == exists && before == after;
  if ((op <= 2 && !arg.isArray()) || op == 3 || op == 4 || op == 5 || op == 6) {
    if (!unchanged) return "folder.conf changed" + where;
  }
  if (ok && op <= 1) {
    for (const Json::Value& element : arg) {
      if (!conf.isMember(element["path"].asString())) return "an upserted folder is missing" + where;
    }
  }
  if (ok && op == 2) {
    for (const Json::Value& element : arg) {
      if (conf.isMember(element.asString())) return "a deleted folder is still there" + where;
    }
  }
  if (op == 4) {
    if (!ok) return "IndexMgr::List fails" + where;
    problem = CheckPage(result, conf.size(), offset, limit, sortBy, direction);
    if (!problem.empty()) return problem + where;
  }
  if (op == 5 && ok != conf.isMember(arg.isString() ? arg.asString() : text)) return "IndexMgr::Get" + where;
  return std::string();
}

}  // namespace fuzzh

#endif
