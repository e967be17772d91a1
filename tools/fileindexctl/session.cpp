#include "session.h"

#include <fileindex/error.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>
#include <tavo/platform.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <random>
#include <stdexcept>

#include "diagnose.h"
#include "output.h"
#include "syslog_capture.h"

// The host platform's error texts; absent on another platform.
extern "C" const char* TAVOHostErrorText(int code) __attribute__((weak));

namespace fileindexctl {

namespace FI = TAVO::FILEINDEX;

namespace {

void ClearErrors() {
  FI::ErrorHandler::SetError(FI::FILEINDEX_ERR_NONE);
  VLIBCErrSetEx(0, "", 0);
}

std::string Hex(int code) {
  char text[16];
  std::snprintf(text, sizeof(text), "0x%04X", static_cast<unsigned>(code));
  return text;
}

std::string PlatformText(int code) { return TAVOHostErrorText != nullptr ? TAVOHostErrorText(code) : ""; }

// A call failed only at a configuration lock when it set error 9 and logged nothing but
// the lock's own line: then it changed nothing and may simply be run again.
bool OnlyLockFailed(int code, const std::vector<std::string>& lines) {
  if (code != FI::FILEINDEX_ERR_LOCK || lines.empty()) return false;
  for (const std::string& line : lines) {
    if (line.find("Failed to lock") == std::string::npos) return false;
  }
  return true;
}

// Which step of a change failed after the configuration was saved, from the library's line.
std::string FailedStep(const std::vector<std::string>& lines) {
  static const struct {
    const char* marker;
    const char* step;
  } kSteps[] = {
      {"TAVtifydCfg", "the watch list"},
      {"MonitorQueue", "the watch list"},
      {"VLIBServiceStart", "starting fileindexd"},
      {"VLIBServiceStop", "stopping fileindexd"},
      {"Spotlight", "switching Samba's Spotlight"},
      {"SendCammandToDaemon", "telling the indexing daemon"},
      {"daemon", "telling the indexing daemon"},
      {"AddCustomEvent", "writing the event queue"},
      {"Update failed", "writing the event queue"},
      {"Clean", "removing the index data"},
      {"Notify", "notifying the administrators"},
  };
  for (const std::string& line : lines) {
    for (const auto& step : kSteps) {
      if (line.find(step.marker) != std::string::npos) return step.step;
    }
  }
  return lines.empty() ? "a later step" : StripLogPrefix(lines.back());
}

double Seconds(std::chrono::steady_clock::time_point since) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - since).count();
}

}  // namespace

const char* ErrorName(int code) {
  switch (code) {
    case 0:
      return "FILEINDEX_ERR_NONE";
    case 1:
      return "FILEINDEX_ERR_BAD_PARAM";
    case 2:
      return "FILEINDEX_ERR_BAD_PATH";
    case 3:
      return "FILEINDEX_ERR_RESERVED";
    case 4:
      return "FILEINDEX_ERR_NO_SUCH_FOLDER";
    case 5:
      return "FILEINDEX_ERR_EXCEED_MAX_FOLDER";
    case 6:
      return "FILEINDEX_ERR_LOAD_CONFIG";
    case 7:
      return "FILEINDEX_ERR_SAVE_CONFIG";
    case 8:
      return "FILEINDEX_ERR_MALFORMED_CONFIG";
    case 9:
      return "FILEINDEX_ERR_LOCK";
    default:
      return "unknown";
  }
}

void Session::WaitNotice() {
  if (noticed_) return;
  noticed_ = true;
  std::string holder = LockHolder();
  std::fprintf(stderr, "fileindexctl: waiting for the configuration lock (%s) for up to %g s\n",
               holder.empty() ? "held by another process" : holder.c_str(), options_.waitSeconds);
}

bool Session::Call(const std::string& operation, const std::function<bool()>& call, const std::string& what,
                   const std::function<bool()>& applied) {
  static std::mt19937 random{std::random_device{}()};
  const auto start = std::chrono::steady_clock::now();
  std::vector<std::string> lines;
  std::string exception;
  int code = 0;
  int savedErrno = 0;
  for (;;) {
    ClearErrors();
    size_t mark = LogMark();
    bool ok = false;
    errno = 0;
    try {
      ok = call();
    } catch (const std::exception& e) {
      exception = e.what();
    }
    savedErrno = errno;
    lines = LogLinesSince(mark);
    code = static_cast<int>(FI::ErrorHandler::GetError());
    if (ok) {
      if (options_.verbose) AddNotes(operation, lines);
      return true;
    }
    if (!exception.empty() || !OnlyLockFailed(code, lines)) break;
    double elapsed = Seconds(start);
    if (elapsed >= options_.waitSeconds) break;
    if (elapsed >= 1.0) WaitNotice();
    // A holder keeps the lock for tens of milliseconds; short random sleeps keep waiters
    // from retrying in step with each other.
    double left = options_.waitSeconds - elapsed;
    double sleep = std::min(left, std::uniform_int_distribution<int>(2, 25)(random) / 1000.0);
    ::usleep(static_cast<useconds_t>(sleep * 1e6));
  }
  waited_ = Seconds(start);

  Failure failure;
  failure.operation = operation;
  failure.code = code;
  failure.name = ErrorName(code);
  failure.platformCode = VLIBCErrGet();
  if (failure.platformCode != 0) {
    failure.platformFile = VLIBCErrorGetFile() != nullptr ? VLIBCErrorGetFile() : "";
    failure.platformLine = VLIBCErrorGetLine();
  }
  failure.log = lines;
  if (!exception.empty()) {
    // The library let a type error of a configuration file through; name the member.
    std::vector<std::string> problems = ConfigProblems();
    failure.name = "MALFORMED_CONFIG";
    failure.message = (what.empty() ? operation : what) + ": " +
                      (problems.empty() ? "unexpected error: " + exception : problems.front());
    failure.log.push_back("exception: " + exception);
  } else {
    Explain(failure, what.empty() ? operation : what, savedErrno);
    if (failure.exit == kExitFailed && applied) {
      bool saved = false;
      try {
        saved = applied();
      } catch (const std::exception&) {
      }
      if (saved) {
        failure.exit = kExitPartial;
        failure.name = "PARTIALLY_APPLIED";
        failure.message = (what.empty() ? operation : what) + ": saved; applying it failed at " +
                          FailedStep(lines) +
                          (failure.platformCode != 0 && !PlatformText(failure.platformCode).empty()
                               ? " (" + PlatformText(failure.platformCode) + ")"
                               : "");
      }
    }
  }
  failures_.push_back(failure);
  return false;
}

void Session::Explain(Failure& failure, const std::string& what, int savedErrno) {
  std::string reason;
  switch (failure.code) {
    case FI::FILEINDEX_ERR_LOCK: {
      failure.exit = kExitLockTimeout;
      std::string holder = LockHolder();
      char waited[32];
      std::snprintf(waited, sizeof(waited), "%.1f", waited_);
      reason = "gave up waiting for the configuration lock after " + std::string(waited) + " s" +
               (holder.empty() ? "" : " (" + holder + ")");
      break;
    }
    case FI::FILEINDEX_ERR_LOAD_CONFIG:
    case FI::FILEINDEX_ERR_MALFORMED_CONFIG: {
      std::vector<std::string> problems = ConfigProblems();
      reason = problems.empty() ? "the configuration cannot be read" : problems.front();
      break;
    }
    case FI::FILEINDEX_ERR_SAVE_CONFIG: {
      reason = "cannot save the configuration";
      static const std::string kMarker = "Failed to save json to ";
      for (const std::string& line : failure.log) {
        std::string::size_type at = line.find(kMarker);
        if (at != std::string::npos) reason = "cannot save " + line.substr(at + kMarker.size());
      }
      if (savedErrno != 0) reason += std::string(": ") + std::strerror(savedErrno);
      break;
    }
    case FI::FILEINDEX_ERR_NO_SUCH_FOLDER:
      reason = "no such folder";
      break;
    case FI::FILEINDEX_ERR_EXCEED_MAX_FOLDER:
      reason = "too many folders (at most 1000)";
      break;
    default:
      break;
  }
  if (reason.empty() && failure.platformCode != 0) {
    reason = PlatformText(failure.platformCode);
    if (failure.platformCode == 0x0100 && savedErrno != 0)
      reason += std::string(": ") + std::strerror(savedErrno);
  }
  if (reason.empty() && failure.code == FI::FILEINDEX_ERR_BAD_PATH) reason = "no such share";
  if (reason.empty() && failure.code == FI::FILEINDEX_ERR_BAD_PARAM) reason = "invalid argument";
  if (reason.empty() && !failure.log.empty()) reason = StripLogPrefix(failure.log.back());
  if (reason.empty()) reason = "failed";
  failure.message = what + ": " + reason;
}

bool Session::Ask(const std::string& operation, const std::function<bool()>& call) {
  ClearErrors();
  size_t mark = LogMark();
  bool answer = false;
  try {
    answer = call();
  } catch (const std::exception& e) {
    std::vector<std::string> problems = ConfigProblems();
    Fail(operation, problems.empty() ? std::string("unexpected error: ") + e.what() : problems.front(),
         "MALFORMED_CONFIG");
  }
  std::vector<std::string> lines = LogLinesSince(mark);
  if (options_.verbose) AddNotes(operation, lines);
  return answer;
}

void Session::Fail(const std::string& what, const std::string& message, const std::string& name, int exit) {
  Failure failure;
  failure.operation = what;
  failure.message = what.empty() || what == "usage" ? message : what + ": " + message;
  failure.name = name;
  failure.exit = exit;
  failures_.push_back(failure);
}

void Session::AddNotes(const std::string& operation, const std::vector<std::string>& lines) {
  for (const std::string& line : lines) {
    Json::Value note;
    note["operation"] = operation;
    note["log"] = line;
    notes_.append(note);
  }
}

namespace {

Json::Value ErrorJson(const Failure& failure) {
  Json::Value error(Json::objectValue);
  error["code"] = failure.code;
  error["name"] = failure.name;
  error["message"] = failure.message;
  error["operation"] = failure.operation;
  error["log"] = Json::Value(Json::arrayValue);
  for (const std::string& line : failure.log) error["log"].append(line);
  if (failure.platformCode != 0) {
    error["platform_error"]["code"] = failure.platformCode;
    error["platform_error"]["text"] = PlatformText(failure.platformCode);
    error["platform_error"]["file"] = failure.platformFile;
    error["platform_error"]["line"] = failure.platformLine;
  }
  return error;
}

}  // namespace

int ReportEarly(bool json, const std::string& message, const std::string& name, int exit) {
  if (json) {
    Failure failure;
    failure.message = message;
    failure.name = name;
    failure.operation = "usage";
    Json::Value out(Json::objectValue);
    out["ok"] = false;
    out["exit"] = exit;
    out["error"] = ErrorJson(failure);
    PrintJson(out);
  } else {
    std::fprintf(stderr, "fileindexctl: %s\n", message.c_str());
  }
  std::fflush(stdout);
  return exit;
}

int Session::Finish(const Json::Value& result, const std::function<void()>& human, bool no) {
  if (failures_.empty()) {
    if (options_.json) {
      Json::Value out = result.isObject() ? result : Json::Value(Json::objectValue);
      out["ok"] = true;
      if (notes_.size() > 0) out["log"] = notes_;
      PrintJson(out);
    } else {
      if (human) human();
      std::fflush(stdout);
      for (const Json::Value& note : notes_) {
        std::fprintf(stderr, "  log (%s): %s\n", note["operation"].asCString(), note["log"].asCString());
      }
    }
    std::fflush(stdout);
    return no ? kExitNo : kExitOk;
  }
  // The most telling status: a lock timeout, then usage, then a plain failure, then partial.
  int exit = kExitPartial;
  for (const Failure& failure : failures_) {
    if (failure.exit == kExitLockTimeout || exit == kExitLockTimeout)
      exit = kExitLockTimeout;
    else if (failure.exit == kExitUsage || exit == kExitUsage)
      exit = kExitUsage;
    else if (failure.exit == kExitFailed)
      exit = kExitFailed;
  }
  if (options_.json) {
    Json::Value out(Json::objectValue);
    out["ok"] = false;
    out["exit"] = exit;
    out["error"] = ErrorJson(failures_.front());
    if (failures_.size() > 1) {
      for (size_t i = 1; i < failures_.size(); ++i) out["more_errors"].append(ErrorJson(failures_[i]));
    }
    PrintJson(out);
    std::fflush(stdout);
    return exit;
  }
  std::fflush(stdout);
  for (const Failure& failure : failures_) {
    std::fprintf(stderr, "fileindexctl: %s\n", failure.message.c_str());
    if (!options_.verbose) continue;
    if (failure.code != 0) {
      std::fprintf(stderr, "  %s: error %d (%s)\n", failure.operation.c_str(), failure.code,
                   ErrorName(failure.code));
    }
    if (failure.platformCode != 0) {
      std::fprintf(stderr, "  platform error %s (%s) at %s:%d\n", Hex(failure.platformCode).c_str(),
                   PlatformText(failure.platformCode).c_str(), failure.platformFile.c_str(),
                   failure.platformLine);
    }
    for (const std::string& line : failure.log) std::fprintf(stderr, "  log: %s\n", line.c_str());
  }
  return exit;
}

}  // namespace fileindexctl
