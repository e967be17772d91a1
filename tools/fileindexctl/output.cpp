#include "output.h"

#include <ctime>
#include <memory>
#include <sstream>

namespace fileindexctl {

namespace {

size_t Width(const std::string& text) {
  size_t width = 0;
  for (unsigned char c : text) {
    if ((c & 0xC0) != 0x80) ++width;
  }
  return width;
}

}  // namespace

void Table::Print(std::FILE* out) const {
  std::vector<size_t> widths;
  for (const std::string& header : headers_) widths.push_back(Width(header));
  for (const auto& row : rows_) {
    for (size_t i = 0; i < row.size() && i < widths.size(); ++i)
      widths[i] = std::max(widths[i], Width(row[i]));
  }
  auto line = [&](const std::vector<std::string>& cells) {
    std::string text;
    for (size_t i = 0; i < cells.size() && i < widths.size(); ++i) {
      text += cells[i];
      if (i + 1 < cells.size()) text += std::string(widths[i] - Width(cells[i]) + 2, ' ');
    }
    std::fprintf(out, "%s\n", text.c_str());
  };
  line(headers_);
  for (const auto& row : rows_) line(row);
}

namespace {

// Two spaces per level, one member or element a line; empty containers and scalars inline.
void Pretty(const Json::Value& value, const std::string& indent, std::string& out) {
  const bool object = value.isObject();
  if ((!object && !value.isArray()) || value.empty()) {
    out += CompactJson(value);
    return;
  }
  const std::string inner = indent + "  ";
  out += object ? "{\n" : "[\n";
  bool first = true;
  if (object) {
    for (const std::string& name : value.getMemberNames()) {
      out += first ? "" : ",\n";
      out += inner + CompactJson(Json::Value(name)) + ": ";
      Pretty(value[name], inner, out);
      first = false;
    }
  } else {
    for (const Json::Value& element : value) {
      out += first ? "" : ",\n";
      out += inner;
      Pretty(element, inner, out);
      first = false;
    }
  }
  out += "\n" + indent + (object ? "}" : "]");
}

}  // namespace

void PrintJson(const Json::Value& value) {
  std::string text;
  Pretty(value, "", text);
  std::printf("%s\n", text.c_str());
}

std::string CompactJson(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

bool ParseJson(const std::string& text, Json::Value& out, std::string& errors) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["strictRoot"] = false;  // a lone scalar (null, 5) is a value too
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  return reader->parse(text.data(), text.data() + text.size(), &out, &errors);
}

std::string LocalTime(long long epoch) {
  std::time_t t = static_cast<std::time_t>(epoch);
  std::tm local = {};
  if (::localtime_r(&t, &local) == nullptr) return std::to_string(epoch);
  char text[64];
  std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S %Z", &local);
  return text;
}

std::string Duration(long long seconds) {
  if (seconds < 60) return std::to_string(seconds) + "s";
  long long minutes = seconds / 60;
  if (minutes < 60) return std::to_string(minutes) + "m";
  return std::to_string(minutes / 60) + "h " + std::to_string(minutes % 60) + "m";
}

std::string InDuration(long long seconds) {
  if (seconds < 60) return "in " + std::to_string(seconds) + " s";
  long long minutes = (seconds + 59) / 60;
  if (minutes < 60) return "in " + std::to_string(minutes) + " min";
  long long hours = minutes / 60;
  if (hours < 48) return "in " + std::to_string(hours) + " h " + std::to_string(minutes % 60) + " min";
  return "in " + std::to_string(hours / 24) + " d " + std::to_string(hours % 24) + " h";
}

std::string DescribePause(long long resume_time, long long now) {
  if (resume_time == 0) return "paused until resumed";
  if (resume_time == -1) return "not paused";
  if (resume_time > now)
    return "paused until " + LocalTime(resume_time) + " (" + InDuration(resume_time - now) + ")";
  if (resume_time > 0) return "pause ended at " + LocalTime(resume_time);
  return "not paused (resume time " + std::to_string(resume_time) + ")";
}

const char* YesNo(bool value) { return value ? "yes" : "no"; }

}  // namespace fileindexctl
