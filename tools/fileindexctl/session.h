// One run of fileindexctl: global options, library calls and their failure reports.
#ifndef FILEINDEXCTL_SESSION_H
#define FILEINDEXCTL_SESSION_H

#include <json/json.h>

#include <functional>
#include <string>
#include <vector>

namespace fileindexctl {

// Exit statuses scripts may rely on.
enum Exit {
  kExitOk = 0,
  kExitFailed = 1,
  kExitUsage = 2,
  kExitNo = 3,           // a yes/no query answered "no"
  kExitPartial = 4,      // saved, but applying it failed at a later step
  kExitLockTimeout = 75  // gave up waiting for a configuration lock (EX_TEMPFAIL)
};

struct Options {
  bool json = false;
  bool verbose = false;
  int logLevel = -1;  // LOG_LEVEL for the library; -1 leaves it
  double waitSeconds = 30;
  std::string sysroot;
};

// What went wrong: one line for people, the details for -v and --json.
struct Failure {
  std::string operation;  // the library call, or the command for the tool's own refusals
  std::string message;    // "cannot add /photo/2019: ..."
  std::string name;       // FILEINDEX_ERR_* or the tool's own reason
  int code = 0;           // the library's error code, 0 when the tool refused by itself
  int exit = kExitFailed;
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
  // success), so what is reported afterwards belongs to this call. A call that fails only
  // because a configuration lock is held is retried until --wait runs out. An exception is
  // caught and named. When the call fails and `applied` (which must read without taking a
  // lock) says the change was saved anyway, the failure is reported as partial (exit 4).
  // `what` is the subject of the message ("add /photo/2019").
  bool Call(const std::string& operation, const std::function<bool()>& call, const std::string& what = "",
            const std::function<bool()>& applied = nullptr);
  // A query whose false is an answer, not a failure; its log lines are shown under -v.
  bool Ask(const std::string& operation, const std::function<bool()>& call);
  // A refusal of the tool itself (bad input, a rule), exit 1 unless told otherwise.
  void Fail(const std::string& what, const std::string& message, const std::string& name = "REFUSED",
            int exit = kExitFailed);
  void Usage(const std::string& message) { Fail("usage", message, "USAGE", kExitUsage); }

  // Prints the result (JSON or the human text) on success, the failures otherwise;
  // returns the exit status. `no` makes a successful run exit 3 (a query answered "no").
  int Finish(const Json::Value& result, const std::function<void()>& human, bool no = false);

  bool failed() const { return !failures_.empty(); }

 private:
  void AddNotes(const std::string& operation, const std::vector<std::string>& lines);
  void Explain(Failure& failure, const std::string& what, int savedErrno);
  void WaitNotice();

  Options options_;
  std::vector<Failure> failures_;
  Json::Value notes_{Json::arrayValue};  // {"operation", "log"} of calls that did not fail
  bool noticed_ = false;
  double waited_ = 0;
};

// "FILEINDEX_ERR_LOCK" for 9.
const char* ErrorName(int code);
// Prints a failure before a session exists (usage errors of the parser) and returns its exit status.
int ReportEarly(bool json, const std::string& message, const std::string& name, int exit);

}  // namespace fileindexctl

#endif
