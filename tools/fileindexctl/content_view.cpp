#include "content_view.h"

#include <content_json.h>

#include <cstdio>
#include <vector>

namespace fileindexctl {

using fileindex_store::Content;
using fileindex_store::ExtractState;
using fileindex_store::Kind;

std::string Duration(std::int64_t milliseconds) {
  const std::int64_t seconds = (milliseconds + 500) / 1000;
  char text[32];
  if (seconds >= 3600) {
    std::snprintf(text, sizeof(text), "%lld:%02lld:%02lld", static_cast<long long>(seconds / 3600),
                  static_cast<long long>(seconds / 60 % 60), static_cast<long long>(seconds % 60));
  } else {
    std::snprintf(text, sizeof(text), "%lld:%02lld", static_cast<long long>(seconds / 60),
                  static_cast<long long>(seconds % 60));
  }
  return text;
}

Json::Value ContentJson(const Content& content) {
  Json::Value item(Json::objectValue);
  item["state"] = fileindex_store::ExtractStateName(content.state);
  item["mime"] = content.mime;
  item["kind"] = fileindex_store::KindName(content.kind);
  if (content.textBytes != 0) item["text_bytes"] = static_cast<Json::Int64>(content.textBytes);
  fileindex_store::PutContentFields(content, item);
  return item;
}

std::string ContentSummary(const Content& content) {
  if (content.state == ExtractState::kFailed) return "failed: " + content.reason;
  if (content.state == ExtractState::kSkipped) return "not extracted: " + content.reason;
  std::vector<std::string> parts;
  auto add = [&parts](const std::string& part) {
    if (!part.empty()) parts.push_back(part);
  };
  const std::string size =
      content.width > 0 ? std::to_string(content.width) + "x" + std::to_string(content.height) : "";
  switch (content.kind) {
    case Kind::kPhoto: {
      std::string camera = content.make;
      if (!content.model.empty() && content.model.rfind(content.make, 0) != 0)
        camera += (camera.empty() ? "" : " ") + content.model;
      else if (!content.model.empty())
        camera = content.model;
      add(camera);
      add(content.taken.empty() ? "" : "taken " + content.taken);
      add(size);
      if (content.hasPosition) {
        char position[64];
        std::snprintf(position, sizeof(position), "%.5f,%.5f", content.latitude, content.longitude);
        add(position);
      }
      break;
    }
    case Kind::kAudio:
      add(content.artist);
      add(content.title.empty() ? "" : "\"" + content.title + "\"");
      add(content.album);
      add(content.year != 0 ? std::to_string(content.year) : "");
      add(content.genre);
      add(content.durationMs > 0 ? Duration(content.durationMs) : "");
      break;
    case Kind::kVideo:
      add(content.title.empty() ? "" : "\"" + content.title + "\"");
      add(content.durationMs > 0 ? Duration(content.durationMs) : "");
      add(size);
      add(content.codecs);
      break;
    case Kind::kDocument:
    case Kind::kOther:
      add(content.title.empty() ? "" : "\"" + content.title + "\"");
      add(content.author);
      add(content.textBytes > 0
              ? std::to_string(content.textBytes) + " bytes of text" + (content.textTruncated ? " (cut)" : "")
              : "");
      break;
  }
  std::string line;
  for (const std::string& part : parts) line += (line.empty() ? "" : ", ") + part;
  return line;
}

}  // namespace fileindexctl
