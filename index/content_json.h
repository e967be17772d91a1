// A file's content as JSON members, in the two places that carry it so: the extraction
// worker's answers to fileindexd, and fileindexctl's --json output. (The store itself
// keeps no JSON.)
#ifndef FILEINDEX_STORE_CONTENT_JSON_H
#define FILEINDEX_STORE_CONTENT_JSON_H

#include <json/json.h>

#include <cstdint>
#include <string>

#include "content.h"

namespace fileindex_store {

struct ContentTextField {
  const char* name;
  std::string Content::*member;
};
struct ContentNumberField {
  const char* name;
  std::int64_t Content::*member;
};
inline constexpr ContentTextField kContentTextFields[] = {
    {"reason", &Content::reason}, {"title", &Content::title}, {"artist", &Content::artist},
    {"album", &Content::album},   {"genre", &Content::genre}, {"taken", &Content::taken},
    {"make", &Content::make},     {"model", &Content::model}, {"codecs", &Content::codecs},
    {"author", &Content::author}};
inline constexpr ContentNumberField kContentNumberFields[] = {{"year", &Content::year},
                                                              {"duration_ms", &Content::durationMs},
                                                              {"width", &Content::width},
                                                              {"height", &Content::height}};

// The metadata that is known: text and number fields that are set, the position when
// there is one, "text_truncated" when true. State, kind, type and text size are each
// writer's own.
inline void PutContentFields(const Content& content, Json::Value& out) {
  for (const auto& field : kContentTextFields) {
    if (!(content.*field.member).empty()) out[field.name] = content.*field.member;
  }
  for (const auto& field : kContentNumberFields) {
    if (content.*field.member != 0) out[field.name] = static_cast<Json::Int64>(content.*field.member);
  }
  if (content.hasPosition) {
    out["latitude"] = content.latitude;
    out["longitude"] = content.longitude;
  }
  if (content.textTruncated) out["text_truncated"] = true;
}

// What PutContentFields wrote, read back; members of another type read as absent.
inline void GetContentFields(const Json::Value& in, Content& content) {
  for (const auto& field : kContentTextFields) {
    const Json::Value& value = in[field.name];
    content.*field.member = value.isString() ? value.asString() : std::string();
  }
  for (const auto& field : kContentNumberFields) {
    const Json::Value& value = in[field.name];
    content.*field.member = value.isInt64() ? value.asInt64() : 0;
  }
  content.hasPosition = in["latitude"].isDouble() && in["longitude"].isDouble();
  if (content.hasPosition) {
    content.latitude = in["latitude"].asDouble();
    content.longitude = in["longitude"].asDouble();
  }
  content.textTruncated = in["text_truncated"].isBool() && in["text_truncated"].asBool();
}

}  // namespace fileindex_store

#endif
