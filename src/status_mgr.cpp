// Pause and resume, the updated marks and the per-share flags: one short status.conf
// transaction per call, and the daemon told where indexing changes.
#include <fileindex/error.h>
#include <fileindex/status.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include <cstdint>
#include <ctime>
#include <functional>
#include <memory>

#include "internal/listing_pass.h"
#include "internal/log.h"
#include "internal/scope_exit.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "status_mgr";

// The fixed source lines of the command failures, as callers and log watchers know them.
const int kPauseSendLine = 198;
const int kResumeSendLine = 221;
const int kReviveSendLine = 321;

using StatusChange = std::function<bool(Status&)>;
using AfterSave = std::function<bool()>;

// Lock, load, change, save; then the daemon command, if any, while the lock is still
// held. Unlocks on every way out, including a JSON error propagating from the change.
bool LockedWrite(const StatusChange& change, const AfterSave& afterSave = AfterSave()) {
  Status status;
  internal::UnlockOnExit<Status> unlock(status);
  if (!status.Lock(true)) return false;
  if (!status.Load()) return false;
  if (!change(status)) return false;
  if (!status.Save()) return false;
  return afterSave ? afterSave() : true;
}

bool Read(const std::function<bool(Status&)>& query) {
  // Within a listing page status.conf is loaded once and shared by every folder's
  // fields; a load that fails is not kept, so each reader then fails and logs as alone.
  if (internal::ListingPass* pass = internal::ListingPass::Current()) {
    if (Status* shared = pass->LoadedStatus()) return query(*shared);
    if (!pass->StatusTried()) {
      std::unique_ptr<Status> loaded(new Status);
      if (!loaded->Load()) {
        pass->KeepStatus(nullptr);
        return false;
      }
      pass->KeepStatus(std::move(loaded));
      return query(*pass->LoadedStatus());
    }
  }
  Status status;
  if (!status.Load()) return false;
  return query(status);
}

bool SendCommand(const char* command, const Json::Value& payload, int line) {
  if (SendCammandToDaemon(command, payload)) return true;
  FIDX_LOG_AT(line, "SendCammandToDaemon failed");
  return false;
}

// time(NULL) + 3600 * hours in 32-bit arithmetic, widened with its sign: a pause long
// enough to pass 2^31 wraps instead of being clamped. Done in unsigned arithmetic so
// the wrap is defined.
long long ResumeTimeAfter(int hours) {
  uint32_t sum = static_cast<uint32_t>(std::time(nullptr)) + 3600u * static_cast<uint32_t>(hours);
  return static_cast<int32_t>(sum);
}
}  // namespace

bool StatusMgr::Pause(const int& hours) {
  if (hours < 0) {
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }
  // The clock is read before the lock is taken.
  const long long resumeTime = hours == 0 ? 0 : ResumeTimeAfter(hours);
  return LockedWrite([resumeTime](Status& status) { return status.Pause(resumeTime); },
                     [resumeTime] {
                       Json::Value payload(Json::objectValue);
                       payload["resume_time"] = static_cast<Json::Int64>(resumeTime);
                       return SendCommand("pause", payload, kPauseSendLine);
                     });
}

bool StatusMgr::Resume() {
  return LockedWrite([](Status& status) { return status.Resume(); },
                     [] { return SendCommand("resume", Json::Value(Json::objectValue), kResumeSendLine); });
}

bool StatusMgr::GetPauseInfo(long long& resume_time) {
  return Read([&resume_time](Status& status) { return status.GetPauseInfo(resume_time); });
}

bool StatusMgr::SetUpdated(const std::string& key) {
  return LockedWrite([&key](Status& status) { return status.SetUpdated(key); });
}

bool StatusMgr::IsUpdated(const std::string& key) {
  return Read([&key](Status& status) { return status.IsUpdated(key); });
}

bool StatusMgr::ShareSetNeedReindex(const std::string& share, bool need) {
  return LockedWrite([&share, need](Status& status) { return status.ShareSetNeedReindex(share, need); });
}

bool StatusMgr::ShareIsNeedReindex(const std::string& share) {
  return Read([&share](Status& status) { return status.ShareIsNeedReindex(share); });
}

bool StatusMgr::ShareSetNoSpace(const std::string& share, bool no_space) {
  return LockedWrite([&share, no_space](Status& status) { return status.ShareSetNoSpace(share, no_space); });
}

bool StatusMgr::ShareIsNoSpace(const std::string& share) {
  return Read([&share](Status& status) { return status.ShareIsNoSpace(share); });
}

bool StatusMgr::ShareRevive(const std::string& share) {
  return LockedWrite([&share](Status& status) { return status.ShareSetNoSpace(share, false); },
                     [&share] {
                       Json::Value payload(Json::objectValue);
                       payload["share_name"] = share;
                       return SendCommand("revive_share_worker", payload, kReviveSendLine);
                     });
}

}  // namespace FILEINDEX
}  // namespace TAVO
