// Human-readable tables and JSON output.
#ifndef FILEINDEXCTL_OUTPUT_H
#define FILEINDEXCTL_OUTPUT_H

#include <json/json.h>

#include <cstdio>
#include <string>
#include <vector>

namespace fileindexctl {

// Columns aligned by the number of characters (not bytes) of UTF-8 text.
class Table {
 public:
  explicit Table(std::vector<std::string> headers) : headers_(std::move(headers)) {}
  void AddRow(std::vector<std::string> row) { rows_.push_back(std::move(row)); }
  void Print(std::FILE* out) const;

 private:
  std::vector<std::string> headers_;
  std::vector<std::vector<std::string>> rows_;
};

// Indented JSON with UTF-8 as is, and a newline.
void PrintJson(const Json::Value& value);
std::string CompactJson(const Json::Value& value);
// Strict parse of a command-line JSON argument.
bool ParseJson(const std::string& text, Json::Value& out, std::string& errors);

// "2024-05-01 14:03:00 CEST"
std::string LocalTime(long long epoch);
// "1h 59m", "3m", "45s"
std::string Duration(long long seconds);
// "in 2 h 10 min", "in 5 min", "in 3 d 4 h"
std::string InDuration(long long seconds);
// One line on the pause state, from the stored resume time.
std::string DescribePause(long long resume_time, long long now);

const char* YesNo(bool value);

}  // namespace fileindexctl

#endif
