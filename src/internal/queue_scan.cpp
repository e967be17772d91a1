#include "internal/queue_scan.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <exception>
#include <memory>

#include "internal/json_io.h"

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {
const size_t kBlockSize = 1 << 20;

class Fd {
 public:
  explicit Fd(int fd) : fd_(fd) {}
  ~Fd() {
    if (fd_ >= 0) ::close(fd_);
  }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};
}  // namespace

bool ForEachQueueLine(const std::string& path, const QueueLineVisitor& visit) {
  Fd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (fd.get() < 0) return false;

  std::unique_ptr<char[]> block(new char[kBlockSize]);
  // The start of a line that continues beyond the block read so far.
  std::string carry;
  for (;;) {
    ssize_t n = ::read(fd.get(), block.get(), kBlockSize);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    const char* p = block.get();
    const char* end = p + n;
    while (p < end) {
      const char* nl = static_cast<const char*>(std::memchr(p, '\n', static_cast<size_t>(end - p)));
      if (nl == nullptr) {
        carry.append(p, static_cast<size_t>(end - p));
        break;
      }
      bool more;
      if (carry.empty()) {
        more = visit(p, static_cast<size_t>(nl - p));
      } else {
        carry.append(p, static_cast<size_t>(nl - p));
        more = visit(carry.data(), carry.size());
        carry.clear();
      }
      if (!more) return true;
      p = nl + 1;
    }
  }
  if (!carry.empty()) visit(carry.data(), carry.size());
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
  const Json::Value* event = line.find("event", "event" + 5);
  const Json::Value* path = line.find("path", "path" + 4);
  if (event == nullptr || path == nullptr) return false;
  if (!event->isConvertibleTo(Json::uintValue) || !path->isString()) return false;
  out.event = event->asUInt();
  out.path = path->asString();
  const Json::Value* pathOld = line.find("path_old", "path_old" + 8);
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
