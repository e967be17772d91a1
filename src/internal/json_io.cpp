#include "internal/json_io.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <memory>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {

const Json::CharReaderBuilder& StrictReaderBuilder() {
  static const Json::CharReaderBuilder builder = [] {
    Json::CharReaderBuilder b;
    b["allowComments"] = false;
    b["allowTrailingCommas"] = false;
    b["allowSingleQuotes"] = false;
    b["allowSpecialFloats"] = false;
    b["allowNumericKeys"] = false;
    b["allowDroppedNullPlaceholders"] = false;
    b["strictRoot"] = false;
    b["rejectDupKeys"] = false;
    b["failIfExtra"] = true;
    b["collectComments"] = false;
    return b;
  }();
  return builder;
}

const Json::StreamWriterBuilder& CompactWriterBuilder() {
  static const Json::StreamWriterBuilder builder = [] {
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    b["emitUTF8"] = true;
    b["commentStyle"] = "None";
    return b;
  }();
  return builder;
}

bool WriteFully(int fd, const char* data, size_t size) {
  while (size > 0) {
    ssize_t n = ::write(fd, data, size);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// JsonCpp skips comments between object members even with allowComments off; a
// slash outside a string is never JSON, so refuse it before parsing.
bool HasSlashOutsideStrings(const char* p, const char* end) {
  bool inString = false;
  for (; p < end; ++p) {
    if (inString) {
      if (*p == '\\') {
        ++p;
      } else if (*p == '"') {
        inString = false;
      }
    } else if (*p == '"') {
      inString = true;
    } else if (*p == '/') {
      return true;
    }
  }
  return false;
}

std::string DirectoryOf(const std::string& path) {
  std::string::size_type slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

}  // namespace

bool JsonFromString(Json::Value& out, const std::string& text) {
  std::unique_ptr<Json::CharReader> reader(StrictReaderBuilder().newCharReader());
  Json::Value parsed;
  const char* begin = text.data();
  if (HasSlashOutsideStrings(begin, begin + text.size())) return false;
  // JsonCpp throws instead of failing on documents nested deeper than its stack limit.
  try {
    if (!reader->parse(begin, begin + text.size(), &parsed, nullptr)) return false;
  } catch (const std::exception&) {
    return false;
  }
  out.swap(parsed);
  return true;
}

bool JsonFromFile(Json::Value& out, const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  std::string text;
  char buffer[65536];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof(buffer));
    if (n < 0) {
      if (errno == EINTR) continue;
      ::close(fd);
      return false;
    }
    if (n == 0) break;
    text.append(buffer, static_cast<size_t>(n));
  }
  ::close(fd);
  return JsonFromString(out, text);
}

std::string JsonToString(const Json::Value& value) {
  return Json::writeString(CompactWriterBuilder(), value);
}

bool JsonToFile(const Json::Value& value, const std::string& path) {
  const std::string text = JsonToString(value);
  std::string tmpl = path + ".XXXXXX";
  // mkostemp creates the file exclusively (never through a planted link) and gets the configuration files' mode before any byte is written.
  int fd = ::mkostemp(&tmpl[0], O_CLOEXEC);
  if (fd < 0) return false;
  bool ok = ::fchmod(fd, 0644) == 0 && WriteFully(fd, text.data(), text.size()) &&
            ::fsync(fd) == 0;
  ok = (::close(fd) == 0) && ok;
  if (ok) ok = ::rename(tmpl.c_str(), path.c_str()) == 0;
  if (!ok) {
    ::unlink(tmpl.c_str());
    return false;
  }
  int dirfd = ::open(DirectoryOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dirfd >= 0) {
    ::fsync(dirfd);
    ::close(dirfd);
  }
  return true;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
