#include "queue_events.h"

#include <memory>

namespace fileindex_queue {

std::string FormatQueueLine(std::uint32_t code, const std::string& path, const std::string& pathOld,
                            const Json::Value& data) {
  Json::Value record(Json::objectValue);
  record["event"] = code;
  record["path"] = path;
  if (code == kRenamed) record["path_old"] = pathOld;
  record["data"] = data;
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, record) + "\n";
}

bool ParseQueueLine(const char* line, std::size_t size, QueueEvent& event) {
  static const std::unique_ptr<Json::CharReader> reader = [] {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    builder["failIfExtra"] = true;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
  }();
  Json::Value value;
  std::string errors;
  try {
    if (!reader->parse(line, line + size, &value, &errors) || !value.isObject()) return false;
    const Json::Value& code = value["event"];
    const Json::Value& path = value["path"];
    if (!code.isConvertibleTo(Json::uintValue) || !path.isString()) return false;
    event.code = code.asUInt();
    event.path = path.asString();
    event.pathOld.clear();
    if (event.code == kRenamed && value["path_old"].isString()) event.pathOld = value["path_old"].asString();
    return true;
  } catch (const Json::Exception&) {
    return false;  // nesting too deep for the reader, or a number out of range
  }
}

}  // namespace fileindex_queue
