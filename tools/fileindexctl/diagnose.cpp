#include "diagnose.h"

#include <fileindex/folders.h>
#include <fileindex/status.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

#include "output.h"

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

const char* TypeName(const Json::Value& value) {
  switch (value.type()) {
    case Json::nullValue:
      return "null";
    case Json::intValue:
    case Json::uintValue:
      return "an integer";
    case Json::realValue:
      return "a number";
    case Json::stringValue:
      return "a string";
    case Json::booleanValue:
      return "a boolean";
    case Json::arrayValue:
      return "an array";
    case Json::objectValue:
      return "an object";
  }
  return "a value";
}

std::string BaseName(const std::string& path) { return path.substr(path.rfind('/') + 1); }

// Reads and parses one file; a missing file is an empty document.
bool ReadDocument(const std::string& path, Json::Value& document, std::vector<std::string>& problems) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    if (errno == ENOENT) return false;
    problems.push_back(BaseName(path) + ": " + std::strerror(errno));
    return false;
  }
  std::stringstream text;
  text << in.rdbuf();
  std::string errors;
  if (!ParseJson(text.str(), document, errors)) {
    std::string first = errors.substr(0, errors.find('\n'));
    if (first.compare(0, 2, "* ") == 0) first.erase(0, 2);
    problems.push_back(BaseName(path) + ": not valid JSON (" + (text.str().empty() ? "empty file" : first) +
                       ")");
    return false;
  }
  if (!document.isObject()) {
    problems.push_back(BaseName(path) + ": the document is " + TypeName(document) + ", expected an object");
    return false;
  }
  return true;
}

void Expect(std::vector<std::string>& problems, const std::string& file, const std::string& member,
            const Json::Value& value, bool ok, const char* expected) {
  if (!ok) {
    problems.push_back(file + ": member \"" + member + "\" is " + TypeName(value) + ", expected " + expected);
  }
}

}  // namespace

std::vector<std::string> ConfigProblems() {
  std::vector<std::string> problems;
  Json::Value folders;
  const std::string folderPath = FI::Folders().GetPath();
  if (ReadDocument(folderPath, folders, problems)) {
    const std::string file = BaseName(folderPath);
    for (const std::string& key : folders.getMemberNames()) {
      const Json::Value& record = folders[key];
      Expect(problems, file, key, record, record.isObject(), "an object");
      if (!record.isObject()) continue;
      for (const char* name : {"path", "name"}) {
        if (record.isMember(name))
          Expect(problems, file, key + "\" member \"" + name, record[name], record[name].isString(),
                 "a string");
      }
      for (const char* name : {"document", "audio", "video", "photo"}) {
        if (record.isMember(name))
          Expect(problems, file, key + "\" member \"" + name, record[name], record[name].isBool(),
                 "a boolean");
      }
    }
  }
  Json::Value status;
  const std::string statusPath = FI::Status().GetPath();
  if (ReadDocument(statusPath, status, problems)) {
    const std::string file = BaseName(statusPath);
    for (const std::string& key : status.getMemberNames()) {
      const Json::Value& value = status[key];
      if (key == "resume_time") {
        Expect(problems, file, key, value, value.isInt64(), "an integer");
      } else if (key == "need_reindex" || key == "no_space") {
        Expect(problems, file, key, value, value.isObject(), "an object");
      } else {
        Expect(problems, file, key, value, value.isBool(), "a boolean");
      }
    }
  }
  return problems;
}

std::string LockHolder() {
  const std::string paths[] = {FI::Folders().GetLockPath(), FI::Status().GetLockPath()};
  std::ifstream locks("/proc/locks");
  std::vector<std::string> lines;
  for (std::string line; std::getline(locks, line);) lines.push_back(line);
  for (const std::string& path : paths) {
    struct stat st;
    if (::stat(path.c_str(), &st) != 0) continue;
    char id[64];
    std::snprintf(id, sizeof(id), "%02x:%02x:%llu", major(st.st_dev), minor(st.st_dev),
                  static_cast<unsigned long long>(st.st_ino));
    // "1: FLOCK  ADVISORY  WRITE 1234 08:01:5678 0 EOF"; blocked waiters ("->") hold nothing.
    for (const std::string& line : lines) {
      std::istringstream fields(line);
      std::string number, kind, mode, access, pid, device;
      fields >> number >> kind;
      if (kind == "->") continue;
      fields >> mode >> access >> pid >> device;
      if (kind != "FLOCK" || device != id || pid == std::to_string(::getpid())) continue;
      std::string comm;
      std::ifstream("/proc/" + pid + "/comm") >> comm;
      return "process " + pid + (comm.empty() ? "" : " (" + comm + ")") + " holding " + path;
    }
  }
  return "";
}

std::string StripLogPrefix(const std::string& line) {
  std::string::size_type space = line.find(' ');
  if (space == std::string::npos) return line;
  std::string prefix = line.substr(0, space);
  std::string::size_type colon = prefix.find(':');
  if (colon == std::string::npos || colon + 1 >= prefix.size()) return line;
  for (size_t i = colon + 1; i < prefix.size(); ++i) {
    if (prefix[i] < '0' || prefix[i] > '9') return line;
  }
  return line.substr(space + 1);
}

}  // namespace fileindexctl
