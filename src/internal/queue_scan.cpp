#include "internal/queue_scan.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <exception>

#include "internal/json_io.h"

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {
// Large enough that system calls are rare, small enough to stay in the core's cache
// while its lines are read.
const size_t kBlockSize = 256 << 10;

// The member of an object, without inserting one.
const Json::Value* Find(const Json::Value& object, const char* name) {
  return object.find(name, name + std::strlen(name));
}
}  // namespace

QueueLineReader::QueueLineReader() : fd_(-1), eof_(false), capacity_(0), pos_(nullptr), filled_(nullptr) {}

QueueLineReader::~QueueLineReader() {
  if (fd_ >= 0) ::close(fd_);
}

bool QueueLineReader::Open(const std::string& path) {
  if (fd_ >= 0) ::close(fd_);
  // O_NONBLOCK: a FIFO put in the queue's place must not hang the reader; it changes
  // nothing for a regular file.
  fd_ = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd_ < 0) return false;
  // The whole file is read once, front to back.
  ::posix_fadvise(fd_, 0, 0, POSIX_FADV_SEQUENTIAL);
  if (!block_) {
    capacity_ = kBlockSize;
    block_.reset(new char[capacity_]);
  }
  pos_ = filled_ = block_.get();
  eof_ = false;
  return true;
}

bool QueueLineReader::Refill() {
  if (eof_) return false;
  const size_t kept = static_cast<size_t>(filled_ - pos_);
  if (kept == capacity_) {
    // One line fills the whole block: make room for the rest of it.
    std::unique_ptr<char[]> bigger(new char[capacity_ * 2]);
    std::memcpy(bigger.get(), pos_, kept);
    block_.swap(bigger);
    capacity_ *= 2;
  } else if (kept > 0 && pos_ != block_.get()) {
    std::memmove(block_.get(), pos_, kept);
  }
  pos_ = block_.get();
  filled_ = pos_ + kept;
  for (;;) {
    const ssize_t n = ::read(fd_, block_.get() + kept, capacity_ - kept);
    if (n > 0) {
      filled_ += n;
      return true;
    }
    if (n < 0 && errno == EINTR) continue;
    eof_ = true;
    return false;
  }
}

bool QueueLineReader::NextLineSlow(const char*& data, size_t& size) {
  if (fd_ < 0) return false;
  // Searched already: the unread bytes hold no newline.
  size_t searched = static_cast<size_t>(filled_ - pos_);
  while (Refill()) {
    const char* from = pos_ + searched;
    const char* nl = static_cast<const char*>(std::memchr(from, '\n', static_cast<size_t>(filled_ - from)));
    if (nl != nullptr) {
      data = pos_;
      size = static_cast<size_t>(nl - pos_);
      pos_ = nl + 1;
      return true;
    }
    searched = static_cast<size_t>(filled_ - pos_);
  }
  if (pos_ == filled_) return false;
  data = pos_;
  size = static_cast<size_t>(filled_ - pos_);
  pos_ = filled_;
  return true;
}

bool QueueLineReader::NextLines(const char*& data, size_t& size) {
  if (fd_ < 0) return false;
  size_t searched = 0;
  for (;;) {
    const char* from = pos_ + searched;
    const void* last = ::memrchr(from, '\n', static_cast<size_t>(filled_ - from));
    if (last != nullptr) {
      data = pos_;
      size = static_cast<size_t>(static_cast<const char*>(last) + 1 - pos_);
      pos_ += size;
      return true;
    }
    searched = static_cast<size_t>(filled_ - pos_);
    if (!Refill()) break;
  }
  if (pos_ == filled_) return false;
  data = pos_;
  size = static_cast<size_t>(filled_ - pos_);
  pos_ = filled_;
  return true;
}

bool ForEachQueueLine(const std::string& path, const QueueLineVisitor& visit) {
  QueueLineReader reader;
  if (!reader.Open(path)) return false;
  const char* data;
  size_t size;
  while (reader.NextLine(data, size)) {
    if (!visit(data, size)) break;
  }
  return true;
}

bool ParseQueueLine(const char* data, size_t size, QueueEvent& out) {
  Json::Value line;
  try {
    if (!JsonFromString(line, std::string(data, size))) return false;
  } catch (const std::exception&) {
    // The JSON reader throws instead of failing on nesting beyond its depth limit; such a
    // line is malformed like any other.
    return false;
  }
  if (!line.isObject()) return false;
  const Json::Value* event = Find(line, "event");
  const Json::Value* path = Find(line, "path");
  if (event == nullptr || path == nullptr) return false;
  if (!event->isConvertibleTo(Json::uintValue) || !path->isString()) return false;
  out.event = event->asUInt();
  out.path = path->asString();
  const Json::Value* pathOld = Find(line, "path_old");
  out.hasPathOld = pathOld != nullptr && pathOld->isString();
  if (out.hasPathOld) {
    out.pathOld = pathOld->asString();
  } else {
    out.pathOld.clear();
  }
  return true;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
