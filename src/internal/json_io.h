// JSON text and file I/O over JsonCpp: strict parsing, compact one-line output,
// durable atomic file writes.
#ifndef FILEINDEX_INTERNAL_JSON_IO_H
#define FILEINDEX_INTERNAL_JSON_IO_H

#include <json/json.h>

#include <string>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

// Parses the whole text; false for anything but one JSON value (comments and
// trailing garbage are refused).
bool JsonFromString(Json::Value& out, const std::string& text);
// Parses a whole file; false when unreadable or not valid JSON.
bool JsonFromFile(Json::Value& out, const std::string& path);
// The whole file as it is, for readers that parse it themselves; false when unreadable.
bool ReadWholeFile(const std::string& path, std::string& text);
// Compact JSON on one line, UTF-8 emitted as is.
std::string JsonToString(const Json::Value& value);
// Writes a temporary file beside path, fsyncs it, renames it over path and fsyncs the
// directory: readers see the old or the new file, never a torn one.
bool JsonToFile(const Json::Value& value, const std::string& path);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
