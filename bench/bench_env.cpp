#include "bench_env.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <stdexcept>

#include "internal/json_io.h"
#include "support/fake_platform.h"

namespace bench {

namespace {

void MakeDirs(const std::string& path) {
  for (size_t pos = path.find('/', 1);; pos = path.find('/', pos + 1)) {
    ::mkdir(path.substr(0, pos).c_str(), 0755);
    if (pos == std::string::npos) break;
  }
}

std::string Format(const char* fmt, unsigned value) {
  char buffer[128];
  std::snprintf(buffer, sizeof(buffer), fmt, value);
  return buffer;
}

// Names as they appear inside a JSON string: most plain, some raw UTF-8, some escaped
// the way JsonCpp's writers escape everything beyond ASCII.
std::string FileName(Rng& rng) {
  const unsigned n = rng.Below(1000000);
  const unsigned kind = rng.Below(100);
  if (kind < 40) return Format("IMG_%06u.JPG", n);
  if (kind < 60) return Format("DSC%05u.jpg", n % 100000);
  if (kind < 75) return Format("clip %04u.mp4", n % 10000);
  if (kind < 88) return Format("Scan %04u.pdf", n % 10000);
  if (kind < 91) return Format("\xc3\xa9t\xc3\xa9 %04u.jpg", n % 10000);
  if (kind < 94) return Format("\xe5\x86\x99\xe7\x9c\x9f %04u.jpg", n % 10000);
  if (kind < 96) return Format("\\u5199\\u771f %04u.jpg", n % 10000);
  if (kind < 98) return Format("\\ud83d\\ude00 %04u.png", n % 10000);
  return Format("say \\\"hi\\\" %04u.txt", n % 10000);
}

std::string SubDir(Rng& rng) {
  const unsigned n = rng.Below(100);
  switch (rng.Below(4)) {
    case 0:
      return Format("trip-%02u", n);
    case 1:
      return Format("album %02u", n);
    case 2:
      return Format("exports/%04u", n * 37);
    default:
      return "raw";
  }
}

class LineMaker {
 public:
  explicit LineMaker(const QueueRecipe& recipe) : recipe_(recipe), rng_(recipe.seed) {
    dirs_ = {recipe.folder, recipe.folder + "x", "2018", "misc", "Family Album", "video"};
  }

  std::string Path() {
    // The folder of interest holds about a third of the events, its sibling a tenth.
    const unsigned pick = rng_.Below(100);
    const std::string& dir = pick < 33 ? dirs_[0] : pick < 43 ? dirs_[1] : dirs_[2 + rng_.Below(4)];
    return recipe_.shareFull + "/" + dir + "/" + SubDir(rng_) + "/" + FileName(rng_);
  }

  std::string Valid() { return recipe_.writerOrder ? AsWritten(EventFirst()) : EventFirst(); }

  std::string EventFirst() {
    const unsigned kind = rng_.Below(100);
    const std::string path = Path();
    if (kind < 10) {
      return "{\"event\":256,\"path\":\"" + path + "\",\"path_old\":\"" + Path() + "\"}";
    }
    if (kind < 12) {
      return "{\"event\":131072,\"path\":\"" + recipe_.shareFull + "/" + recipe_.folder +
             "\",\"data\":{\"path\":\"/x/" + recipe_.folder + "\",\"name\":\"" + recipe_.folder +
             "\",\"document\":true,\"audio\":false,\"video\":true,\"photo\":true}}";
    }
    if (kind < 13) return "{\"event\":65536,\"path\":\"" + path + "\",\"data\":null}";
    static const unsigned kCodes[] = {2, 8, 8, 64, 128, 512, 1024};
    const std::string event = std::to_string(kCodes[rng_.Below(7)]);
    if (kind < 70) return "{\"event\":" + event + ",\"path\":\"" + path + "\"}";
    return "{\"event\":" + event + ",\"path\":\"" + path +
           "\",\"data\":{\"inode\":" + std::to_string(rng_.Below(90000000)) +
           ",\"size\":" + std::to_string(rng_.Below(50000000)) +
           ",\"mtime\":" + std::to_string(1700000000 + rng_.Below(10000000)) + "}}";
  }

  // The line as the daemons write it.
  static std::string AsWritten(const std::string& line) {
    Json::Value record;
    if (!TAVO::FILEINDEX::internal::JsonFromString(record, line))
      throw std::runtime_error("bad line " + line);
    if (!record.isMember("data")) record["data"] = Json::Value();
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    return Json::writeString(builder, record);
  }

  std::string Malformed() {
    const std::string line = Valid();
    switch (rng_.Below(6)) {
      case 0:
      case 1:
        // Half-written.
        return line.substr(0, 1 + rng_.Below(static_cast<unsigned>(line.size() - 1)));
      case 2:
        return "{\"event\":\"8\",\"path\":\"" + Path() + "\"}";
      case 3:
        return "{\"event\":-1,\"path\":\"" + Path() + "\"}";
      case 4:
        return line + " x";
      default:
        return "";
    }
  }

  bool Broken() { return recipe_.malformedPerMille > 0 && rng_.Below(1000) < recipe_.malformedPerMille; }

 private:
  const QueueRecipe& recipe_;
  Rng rng_;
  std::vector<std::string> dirs_;
};

}  // namespace

Sysroot::Sysroot() {
  char tmpl[] = "/tmp/fileindex-bench-XXXXXX";
  if (::mkdtemp(tmpl) == nullptr) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  MakeDirs(root_ + "/usr/tavo/etc/fileindex");
  MakeDirs(root_ + "/tmp");
  MakeDirs(root_ + "/var/run");
  Activate();
}

Sysroot::~Sysroot() {
  const std::string cmd = "rm -rf '" + root_ + "'";
  if (std::system(cmd.c_str()) != 0) std::fprintf(stderr, "cannot remove %s\n", root_.c_str());
}

void Sysroot::Activate() const {
  ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);
  fake::Reset();
  for (const std::string& share : shares_) fake::AddShare(root_, "/volume1", share);
}

std::string Sysroot::AddShare(const std::string& name) {
  shares_.push_back(name);
  return fake::AddShare(root_, "/volume1", name).dir;
}

void Sysroot::MakeFolder(const std::string& path) const { MakeDirs(Full(path)); }

std::string Sysroot::QueuePath(const std::string& share) const {
  MakeDirs(Full("/" + share + "/@eaDir"));
  return Full("/" + share + "/@eaDir/TAVO@file_index_queue");
}

QueueStats WriteQueue(const std::string& path, const QueueRecipe& recipe, const std::string& extraLines) {
  std::FILE* out = std::fopen(path.c_str(), "wb");
  if (out == nullptr) throw std::runtime_error("cannot write " + path);
  LineMaker maker(recipe);
  QueueStats stats;
  std::string chunk;
  for (uint64_t i = 0; i < recipe.lines; ++i) {
    if (maker.Broken()) {
      chunk += maker.Malformed();
      ++stats.malformed;
    } else {
      chunk += maker.Valid();
    }
    chunk += '\n';
    if (chunk.size() >= (1 << 20)) {
      std::fwrite(chunk.data(), 1, chunk.size(), out);
      stats.bytes += chunk.size();
      chunk.clear();
    }
  }
  chunk += extraLines;
  std::fwrite(chunk.data(), 1, chunk.size(), out);
  stats.bytes += chunk.size();
  stats.lines = recipe.lines;
  if (std::fclose(out) != 0) throw std::runtime_error("cannot write " + path);
  return stats;
}

Json::Value FolderRecord(const std::string& path, const std::string& name, unsigned flags) {
  Json::Value record(Json::objectValue);
  record["path"] = path;
  record["name"] = name;
  record["document"] = (flags & 1) != 0;
  record["audio"] = (flags & 2) != 0;
  record["video"] = (flags & 4) != 0;
  record["photo"] = (flags & 8) != 0;
  return record;
}

void WriteFile(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  if (!out) throw std::runtime_error("cannot write " + path);
}

uint64_t FileSize(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
}

void WarmPageCache(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return;
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  while (::read(fd, buffer.get(), 1 << 20) > 0) {
  }
  ::close(fd);
}

namespace {

// A JSON document per line, parsed as the library parses its files.
bool NaiveParse(const std::string& line, Json::Value& value) {
  if (!TAVO::FILEINDEX::internal::JsonFromString(value, line)) return false;
  return value.isObject() && value.isMember("event") && value.isMember("path") &&
         value["event"].isConvertibleTo(Json::uintValue) && value["path"].isString();
}

bool StartsWith(const std::string& s, const std::string& prefix) {
  return s.size() >= prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

}  // namespace

bool NaiveIsPathInQueue(const std::string& folderFull, const std::string& queuePath) {
  std::ifstream in(queuePath);
  if (!in) return false;
  const std::string folder = folderFull + "/";
  bool found = false;
  std::string line;
  while (std::getline(in, line)) {
    Json::Value value;
    if (!NaiveParse(line, value)) {
      syslog(LOG_ERR, "%s:%d Malformed command: %s", "status_mgr", 47, line.c_str());
      continue;
    }
    if (StartsWith(value["path"].asString() + "/", folder) ||
        (value["event"].asUInt() == 256 && value.isMember("path_old") && value["path_old"].isString() &&
         StartsWith(value["path_old"].asString() + "/", folder))) {
      found = true;
    }
  }
  return found;
}

bool NaiveQueueHasReindex(const std::string& full, const std::string& queuePath) {
  std::ifstream in(queuePath);
  std::string line;
  while (std::getline(in, line)) {
    Json::Value value;
    if (NaiveParse(line, value) && value["event"].asUInt() == 65536 && value["path"].asString() == full) {
      return true;
    }
  }
  return false;
}

}  // namespace bench
