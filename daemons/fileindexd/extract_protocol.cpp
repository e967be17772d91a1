#include "extract_protocol.h"

#include <content_json.h>
#include <json/json.h>

#include <memory>
#include <sstream>

namespace fileindexd {

using fileindex_store::Content;
using fileindex_store::ExtractState;
using fileindex_store::Kind;

namespace {

void PutLength(std::string& out, std::uint32_t value) {
  for (int i = 0; i < 4; ++i) out += static_cast<char>((value >> (8 * i)) & 0xFF);
}

std::uint32_t GetLength(const std::string& in, std::size_t at) {
  std::uint32_t value = 0;
  for (int i = 3; i >= 0; --i) value = (value << 8) | static_cast<unsigned char>(in[at + i]);
  return value;
}

std::string Compact(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

bool Parse(const std::string& text, Json::Value& out) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  return reader->parse(text.data(), text.data() + text.size(), &out, nullptr) && out.isObject();
}

}  // namespace

std::string EncodeFrame(const std::string& json, const std::string& text) {
  std::string frame;
  frame.reserve(8 + json.size() + text.size());
  PutLength(frame, static_cast<std::uint32_t>(json.size()));
  PutLength(frame, static_cast<std::uint32_t>(text.size()));
  return frame + json + text;
}

std::string EncodeRequest(const std::string& path, Kind hint) {
  Json::Value request(Json::objectValue);
  request["path"] = path;
  request["hint"] = static_cast<int>(hint);
  return EncodeFrame(Compact(request), "");
}

std::string EncodeResult(const Content& content, const std::string& text) {
  Json::Value result(Json::objectValue);
  result["state"] = static_cast<int>(content.state);
  result["mime"] = content.mime;
  result["kind"] = static_cast<int>(content.kind);
  fileindex_store::PutContentFields(content, result);
  return EncodeFrame(Compact(result), text);
}

bool DecodeRequest(const std::string& json, std::string& path, Kind& hint) {
  Json::Value request;
  if (!Parse(json, request) || !request["path"].isString() || !request["hint"].isInt()) return false;
  path = request["path"].asString();
  int kind = request["hint"].asInt();
  if (kind < 0 || kind > static_cast<int>(Kind::kPhoto)) return false;
  hint = static_cast<Kind>(kind);
  return true;
}

bool DecodeResult(const std::string& json, Content& content) {
  Json::Value result;
  if (!Parse(json, result) || !result["state"].isInt() || !result["kind"].isInt()) return false;
  int state = result["state"].asInt(), kind = result["kind"].asInt();
  if (state < static_cast<int>(ExtractState::kDone) || state > static_cast<int>(ExtractState::kSkipped) ||
      kind < 0 || kind > static_cast<int>(Kind::kPhoto))
    return false;
  content = Content();
  content.state = static_cast<ExtractState>(state);
  content.kind = static_cast<Kind>(kind);
  content.mime = result["mime"].isString() ? result["mime"].asString() : std::string();
  fileindex_store::GetContentFields(result, content);
  return true;
}

FrameReader::Status FrameReader::Next(std::string& json, std::string& text) {
  if (m_buffer.size() < 8) return Status::kNeedMore;
  const std::size_t jsonSize = GetLength(m_buffer, 0), textSize = GetLength(m_buffer, 4);
  if (jsonSize > kMaxFrame || textSize > kMaxFrame || jsonSize + textSize > kMaxFrame)
    return Status::kInvalid;
  if (m_buffer.size() < 8 + jsonSize + textSize) return Status::kNeedMore;
  json.assign(m_buffer, 8, jsonSize);
  text.assign(m_buffer, 8 + jsonSize, textSize);
  m_buffer.erase(0, 8 + jsonSize + textSize);
  return Status::kFrame;
}

}  // namespace fileindexd
