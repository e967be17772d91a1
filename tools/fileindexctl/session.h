// One run of fileindexctl: global options, library calls and their failure reports.
#ifndef FILEINDEXCTL_SESSION_H
#define FILEINDEXCTL_SESSION_H

#include <json/json.h>

#include <functional>
#include <string>
#include <vector>

namespace fileindexctl {

struct Options {
  bool json = false;
  bool verbose = false;
  int logLevel = -1;  // LOG_LEVEL for the library; -1 leaves it
  std::string sysroot;
};

// What went wrong in one library call.
struct Failure {
  std::string operation;
  int code = 0;
  int platformCode = 0;
  std::string platformFile;
  int platformLine = 0;
  std::vector<std::string> log;
};

class Session {
 public:
  explicit Session(const Options& options) : options_(options) {}

  const Options& options() const { return options_; }

  // Runs one library call. Error slots are cleared first (they are never cleared on
  // success), so what is reported afterwards belongs to this call. On failure the call's
  // error code, platform error and log lines are kept for Report().
  bool Call(const std::string& operation, const std::function<bool()>& call);
  // A query whose false is an answer, not a failure; its log lines are shown as notes.
  bool Ask(const std::string& operation, const std::function<bool()>& call);
  // A failure of the tool itself (bad input), reported like the library's.
  void Fail(const std::string& operation, const std::string& message);

  // Prints the result (JSON or the human text) on success, the failures otherwise;
  // returns the exit status.
  int Finish(const Json::Value& result, const std::function<void()>& human);

  bool failed() const { return !failures_.empty(); }

 private:
  void AddNotes(const std::string& operation, const std::vector<std::string>& lines);

  Options options_;
  std::vector<Failure> failures_;
  std::vector<std::string> messages_;
  Json::Value notes_{Json::arrayValue};  // {"operation", "log"} of calls that did not fail
};

// "FILEINDEX_ERR_LOCK" for 9.
const char* ErrorName(int code);

}  // namespace fileindexctl

#endif
