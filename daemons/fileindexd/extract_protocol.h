// What fileindexd and its extraction worker say to each other over their socket pair.
//
// Each message is a frame: two 32-bit lengths (little-endian), then that many bytes of a
// JSON object and that many bytes of text. fileindexd sends one request at a time,
//   {"path": "/volume1/photo/a.jpg", "hint": 4}          (hint: the kind the name suggests)
// and the worker answers with the file's content (the fields of fileindex_store::Content)
// and its text. A worker says {"ready": true} first, once it has started; one that stops
// answering is killed, and one that dies is started again.
#ifndef FILEINDEXD_EXTRACT_PROTOCOL_H
#define FILEINDEXD_EXTRACT_PROTOCOL_H

#include <content.h>

#include <cstdint>
#include <string>

namespace fileindexd {

// The largest frame either side accepts: the text of a file and room for its fields.
constexpr std::size_t kMaxFrame = fileindex_store::kMaxTextPerFile + 64 * 1024;

std::string EncodeFrame(const std::string& json, const std::string& text);
std::string EncodeRequest(const std::string& path, fileindex_store::Kind hint);
std::string EncodeResult(const fileindex_store::Content& content, const std::string& text);
bool DecodeRequest(const std::string& json, std::string& path, fileindex_store::Kind& hint);
bool DecodeResult(const std::string& json, fileindex_store::Content& content);

// Collects bytes as they arrive and cuts them into frames.
class FrameReader {
 public:
  void Append(const char* data, std::size_t size) { m_buffer.append(data, size); }
  enum class Status { kFrame, kNeedMore, kInvalid };
  Status Next(std::string& json, std::string& text);
  void Clear() { m_buffer.clear(); }

 private:
  std::string m_buffer;
};

}  // namespace fileindexd

#endif
