// Captures the library's syslog lines in the test process.
#ifndef FILEINDEX_TESTS_LOG_CAPTURE_H
#define FILEINDEX_TESTS_LOG_CAPTURE_H

#include <string>
#include <vector>

namespace logcap {

struct Line {
  int priority;
  std::string text;  // formatted, "%m" expanded
};

const std::vector<Line>& Lines();
std::vector<std::string> Texts();
void Clear();
bool Contains(const std::string& fragment);  // whether some line contains the fragment
int Count(const std::string& fragment);      // how many lines contain it

}  // namespace logcap

#endif
