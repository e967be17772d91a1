// Decoding of the frames that fileindexd receives on its socket: a 4-byte length in
// host byte order, then that many bytes of JSON text ending in a zero byte. One frame
// per connection; the sender writes it and closes.
#ifndef FILEINDEX_TOOLS_FRAME_DECODER_H
#define FILEINDEX_TOOLS_FRAME_DECODER_H

#include <json/json.h>

#include <cstddef>
#include <cstdint>
#include <string>

namespace fileindex_frame {

struct DecodedFrame {
  bool ok = false;
  // The command object {"type": ..., "data": ...} when ok.
  Json::Value command;
  // A short reason when not ok ("short frame", "truncated frame", ...), and what the
  // JSON parser said, when it said something.
  std::string error;
  std::string detail;
  // The length field when at least 4 bytes arrived.
  bool hasLength = false;
  std::uint32_t length = 0;
  // Every byte the connection delivered.
  std::string raw;

  // The command when ok; otherwise {"error": reason, "received": bytes, "length": field,
  // "detail": ..., "head_hex": first bytes in hex}.
  Json::Value Report() const;
};

// Decodes everything one connection delivered. Never throws.
DecodedFrame DecodeFrame(const std::string& bytes);

// Compact one-line JSON, UTF-8 emitted as is. Never throws.
std::string CompactJson(const Json::Value& value);

enum class ReadResult { kEof, kLimit, kTimeout, kWoken, kError };

// Reads from fd until end of file, maxBytes, a read error, idleTimeoutMs without data, or
// wakeFd (when not -1) becoming readable. What arrived is appended to out in every case.
ReadResult ReadUntilEof(int fd, std::size_t maxBytes, int idleTimeoutMs, int wakeFd, std::string& out);

}  // namespace fileindex_frame

#endif
