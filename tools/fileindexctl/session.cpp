#include "session.h"

#include <fileindex/error.h>
#include <tavo/platform.h>

#include <cstdio>

#include "output.h"
#include "syslog_capture.h"

// The host platform's error texts; absent on another platform.
extern "C" const char* TAVOHostErrorText(int code) __attribute__((weak));

namespace fileindexctl {

namespace {

void ClearErrors() {
  TAVO::FILEINDEX::ErrorHandler::SetError(TAVO::FILEINDEX::FILEINDEX_ERR_NONE);
  VLIBCErrSetEx(0, "", 0);
}

std::string Hex(int code) {
  char text[16];
  std::snprintf(text, sizeof(text), "0x%04X", static_cast<unsigned>(code));
  return text;
}

std::string PlatformText(int code) { return TAVOHostErrorText != nullptr ? TAVOHostErrorText(code) : ""; }

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

bool Session::Call(const std::string& operation, const std::function<bool()>& call) {
  ClearErrors();
  size_t mark = LogMark();
  bool ok = call();
  std::vector<std::string> lines = LogLinesSince(mark);
  if (ok) {
    if (options_.verbose) AddNotes(operation, lines);
    return true;
  }
  Failure failure;
  failure.operation = operation;
  failure.code = static_cast<int>(TAVO::FILEINDEX::ErrorHandler::GetError());
  failure.platformCode = VLIBCErrGet();
  if (failure.platformCode != 0) {
    failure.platformFile = VLIBCErrorGetFile() != nullptr ? VLIBCErrorGetFile() : "";
    failure.platformLine = VLIBCErrorGetLine();
  }
  failure.log = lines;
  failures_.push_back(failure);
  return false;
}

bool Session::Ask(const std::string& operation, const std::function<bool()>& call) {
  ClearErrors();
  size_t mark = LogMark();
  bool answer = call();
  std::vector<std::string> lines = LogLinesSince(mark);
  if (!answer || options_.verbose) AddNotes(operation, lines);
  return answer;
}

void Session::Fail(const std::string& operation, const std::string& message) {
  Failure failure;
  failure.operation = operation;
  failure.code = -1;
  failure.log.push_back(message);
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

int Session::Finish(const Json::Value& result, const std::function<void()>& human) {
  if (failures_.empty()) {
    if (options_.json) {
      Json::Value out = result;
      if (notes_.size() > 0 && out.isObject()) out["log"] = notes_;
      PrintJson(out);
    } else {
      if (human) human();
      std::fflush(stdout);
      for (const Json::Value& note : notes_) {
        std::fprintf(stderr, "  log (%s): %s\n", note["operation"].asCString(), note["log"].asCString());
      }
    }
    std::fflush(stdout);
    return 0;
  }
  if (options_.json) {
    Json::Value out(Json::objectValue);
    out["ok"] = false;
    if (!result.isNull()) out["partial"] = result;
    for (const Failure& failure : failures_) {
      Json::Value item;
      item["operation"] = failure.operation;
      if (failure.code >= 0) {
        item["error"]["code"] = failure.code;
        item["error"]["name"] = ErrorName(failure.code);
      }
      if (failure.platformCode != 0) {
        item["platform_error"]["code"] = failure.platformCode;
        item["platform_error"]["text"] = PlatformText(failure.platformCode);
        item["platform_error"]["file"] = failure.platformFile;
        item["platform_error"]["line"] = failure.platformLine;
      }
      item["log"] = Json::Value(Json::arrayValue);
      for (const std::string& line : failure.log) item["log"].append(line);
      out["failures"].append(item);
    }
    PrintJson(out);
    std::fflush(stdout);
    return 1;
  }
  std::fflush(stdout);
  for (const Failure& failure : failures_) {
    if (failure.code < 0) {
      std::fprintf(stderr, "fileindexctl: %s: %s\n", failure.operation.c_str(), failure.log.front().c_str());
      continue;
    }
    std::string reason = "error " + std::to_string(failure.code) + " (" + ErrorName(failure.code) + ")";
    if (failure.code == 0) reason += ", no error code set by this call";
    std::fprintf(stderr, "fileindexctl: %s failed: %s\n", failure.operation.c_str(), reason.c_str());
    if (failure.platformCode != 0) {
      std::fprintf(stderr, "  platform error %s (%s) at %s:%d\n", Hex(failure.platformCode).c_str(),
                   PlatformText(failure.platformCode).c_str(), failure.platformFile.c_str(),
                   failure.platformLine);
    }
    if (failure.log.empty()) std::fprintf(stderr, "  (the library logged nothing for this call)\n");
    for (const std::string& line : failure.log) std::fprintf(stderr, "  log: %s\n", line.c_str());
  }
  return 1;
}

}  // namespace fileindexctl
