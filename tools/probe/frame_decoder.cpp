#include "frame_decoder.h"

#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>

namespace fileindex_frame {

namespace {

const std::size_t kHeaderSize = 4;
const std::size_t kHeadHexBytes = 64;

bool ParseStrict(const std::string& text, Json::Value& out, std::string& errors) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  // Duplicate keys are a sender's oddity, not a framing fault.
  builder["rejectDupKeys"] = false;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  return reader->parse(text.data(), text.data() + text.size(), &out, &errors);
}

std::string HexHead(const std::string& bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string hex;
  std::size_t n = bytes.size() < kHeadHexBytes ? bytes.size() : kHeadHexBytes;
  for (std::size_t i = 0; i < n; ++i) {
    unsigned char c = static_cast<unsigned char>(bytes[i]);
    hex += kDigits[c >> 4];
    hex += kDigits[c & 0xf];
  }
  return hex;
}

DecodedFrame Fail(DecodedFrame frame, const std::string& error, const std::string& detail = std::string()) {
  frame.ok = false;
  frame.error = error;
  frame.command = Json::Value();
  frame.detail = detail;
  return frame;
}

}  // namespace

Json::Value DecodedFrame::Report() const {
  if (ok) return command;
  Json::Value report(Json::objectValue);
  report["error"] = error;
  report["received"] = static_cast<Json::UInt64>(raw.size());
  if (hasLength) report["length"] = length;
  if (!detail.empty()) report["detail"] = detail;
  report["head_hex"] = HexHead(raw);
  return report;
}

DecodedFrame DecodeFrame(const std::string& bytes) {
  DecodedFrame frame;
  try {
    frame.raw = bytes;
    if (bytes.empty()) return Fail(frame, "empty connection");
    if (bytes.size() < kHeaderSize) return Fail(frame, "short frame");
    std::uint32_t length;
    std::memcpy(&length, bytes.data(), kHeaderSize);
    frame.hasLength = true;
    frame.length = length;
    if (length == 0) return Fail(frame, "zero length");
    std::size_t body = bytes.size() - kHeaderSize;
    if (body < length) return Fail(frame, "truncated frame");
    if (body > length) return Fail(frame, "trailing bytes");
    if (bytes.back() != '\0') return Fail(frame, "missing terminator");
    std::string text = bytes.substr(kHeaderSize, length - 1);
    if (text.find('\0') != std::string::npos) return Fail(frame, "embedded zero byte");
    Json::Value value;
    std::string errors;
    if (!ParseStrict(text, value, errors)) return Fail(frame, "invalid json", errors);
    if (!value.isObject() || !value.isMember("type") || !value["type"].isString() ||
        !value.isMember("data") || value.size() != 2) {
      return Fail(frame, "not a command object", CompactJson(value));
    }
    frame.ok = true;
    frame.command = value;
    return frame;
  } catch (const std::exception& e) {
    return Fail(frame, "decoder exception", e.what());
  }
}

std::string CompactJson(const Json::Value& value) {
  try {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    builder["commentStyle"] = "None";
    return Json::writeString(builder, value);
  } catch (const std::exception&) {
    return "{\"error\":\"unprintable value\"}";
  }
}

ReadResult ReadUntilEof(int fd, std::size_t maxBytes, int idleTimeoutMs, int wakeFd, std::string& out) {
  char buffer[4096];
  std::size_t got = 0;
  for (;;) {
    if (got >= maxBytes) return ReadResult::kLimit;
    struct pollfd fds[2];
    fds[0].fd = fd;
    fds[0].events = POLLIN;
    fds[0].revents = 0;
    fds[1].fd = wakeFd;
    fds[1].events = POLLIN;
    fds[1].revents = 0;
    int ready = ::poll(fds, wakeFd < 0 ? 1 : 2, idleTimeoutMs);
    if (ready < 0) {
      if (errno == EINTR) continue;
      return ReadResult::kError;
    }
    if (ready == 0) return ReadResult::kTimeout;
    if (wakeFd >= 0 && (fds[1].revents & POLLIN) != 0) return ReadResult::kWoken;
    if (fds[0].revents == 0) continue;
    std::size_t want = maxBytes - got < sizeof(buffer) ? maxBytes - got : sizeof(buffer);
    ssize_t n = ::read(fd, buffer, want);
    if (n == 0) return ReadResult::kEof;
    if (n < 0) {
      if (errno == EINTR) continue;
      return ReadResult::kError;
    }
    out.append(buffer, static_cast<std::size_t>(n));
    got += static_cast<std::size_t>(n);
  }
}

}  // namespace fileindex_frame
