#include "internal/json_io.h"

#include <fcntl.h>
#include <sys/random.h>
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

// The configuration files' mode, set before any byte is written, then the text, synced.
bool WriteSynced(int fd, const std::string& text) {
  return ::fchmod(fd, 0644) == 0 && WriteFully(fd, text.data(), text.size()) && ::fsync(fd) == 0;
}

// Gives the unnamed (O_TMPFILE) file fd a fresh name beside path, in the form mkstemp
// uses. Linking by descriptor needs CAP_DAC_READ_SEARCH (the library runs as root);
// /proc serves other callers.
bool LinkUnnamed(int fd, const std::string& path, std::string& name) {
  static const char kLetters[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  char procPath[64];
  std::snprintf(procPath, sizeof(procPath), "/proc/self/fd/%d", fd);
  for (int attempt = 0; attempt < 100; ++attempt) {
    unsigned char random[6];
    if (::getrandom(random, sizeof(random), 0) != static_cast<ssize_t>(sizeof(random))) return false;
    name = path + ".";
    for (unsigned char r : random) name += kLetters[r % (sizeof(kLetters) - 1)];
    if (::linkat(fd, "", AT_FDCWD, name.c_str(), AT_EMPTY_PATH) == 0) return true;
    if (errno != EEXIST && ::linkat(AT_FDCWD, procPath, AT_FDCWD, name.c_str(), AT_SYMLINK_FOLLOW) == 0) {
      return true;
    }
    if (errno != EEXIST) return false;
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

bool ReadWholeFile(const std::string& path, std::string& text) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  text.clear();
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
  return true;
}

bool JsonFromFile(Json::Value& out, const std::string& path) {
  std::string text;
  return ReadWholeFile(path, text) && JsonFromString(out, text);
}

std::string JsonToString(const Json::Value& value) {
  return Json::writeString(CompactWriterBuilder(), value);
}

bool JsonToFile(const Json::Value& value, const std::string& path) {
  const std::string text = JsonToString(value);
  const std::string dir = DirectoryOf(path);
  std::string temporary;
  // Preferably the text is written and synced into an unnamed file of the directory
  // (O_TMPFILE), named only just before the rename: a process killed while writing (the
  // long part of a save) then leaves nothing behind, where a named temporary file would
  // stay in the configuration directory for good. File systems without O_TMPFILE, or a
  // file that cannot be named, take the named temporary file below.
  int fd = ::open(dir.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, 0644);
  if (fd >= 0) {
    const bool written = WriteSynced(fd, text);
    const bool named = written && LinkUnnamed(fd, path, temporary);
    const bool closed = ::close(fd) == 0;
    if (!written || (named && !closed)) {
      if (named) ::unlink(temporary.c_str());
      return false;
    }
    if (!named) temporary.clear();
  }
  if (temporary.empty()) {
    temporary = path + ".XXXXXX";
    // mkostemp creates the file exclusively (never through a planted link).
    fd = ::mkostemp(&temporary[0], O_CLOEXEC);
    if (fd < 0) return false;
    bool ok = WriteSynced(fd, text);
    ok = (::close(fd) == 0) && ok;
    if (!ok) {
      ::unlink(temporary.c_str());
      return false;
    }
  }
  if (::rename(temporary.c_str(), path.c_str()) != 0) {
    ::unlink(temporary.c_str());
    return false;
  }
  int dirfd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dirfd >= 0) {
    ::fsync(dirfd);
    ::close(dirfd);
  }
  return true;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
