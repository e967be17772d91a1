// status.conf: the pause time, the per-share flags and the updated marks.
#include <fileindex/status.h>
#include <fileindex/utils.h>

#include "internal/log.h"
#include "internal/sysroot.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "status";
const char kResumeTime[] = "resume_time";
const char kNeedReindex[] = "need_reindex";
const char kNoSpace[] = "no_space";
const Json::Int64 kNotPaused = -1;

// A member of the top-level document, or null when absent. A status.conf that holds
// something other than an object loads unchecked; its readers then see no members
// instead of the JSON library's type error.
const Json::Value* FindTopLevel(const Json::Value& document, const std::string& key) {
  if (!document.isObject()) return nullptr;
  return document.find(key.data(), key.data() + key.size());
}

bool IsShareFlagged(const Json::Value& document, const char* flag, const std::string& share) {
  const Json::Value* flags = FindTopLevel(document, flag);
  return flags != nullptr && flags->isObject() && flags->isMember(share);
}

// Makes sure the flag member exists; a missing one comes in as null and turns into an
// object on first use. A member of another type is deliberately left as it is, so the
// next access on it fails inside the JSON library and the error reaches the caller.
Json::Value& FlagMember(Json::Value& document, const char* flag) {
  if (!document.isMember(flag) || !document[flag].isObject()) document[flag];
  return document[flag];
}
}  // namespace

Status::Status() {}

Status::~Status() {}

bool Status::Load() { return LoadJson(); }

bool Status::Save() { return SaveJson(); }

std::string Status::GetLockPath() const { return internal::SystemPath("/tmp/fileidx_cfg_status.lock"); }

std::string Status::GetPath() const { return internal::SystemPath("/usr/tavo/etc/fileindex/status.conf"); }

bool Status::Pause(long long resume_time) {
  m_jsDocument[kResumeTime] = static_cast<Json::Int64>(resume_time);
  return true;
}

bool Status::Resume() {
  m_jsDocument[kResumeTime] = kNotPaused;
  return true;
}

bool Status::GetPauseInfo(long long& resume_time) {
  const Json::Value* stored = FindTopLevel(m_jsDocument, kResumeTime);
  try {
    Json::Int64 value = stored == nullptr ? kNotPaused : stored->asInt64();
    resume_time = value;
  } catch (const Json::Exception&) {
    FIDX_LOG("json exception");
    return false;
  }
  return true;
}

bool Status::SetUpdated(const std::string& key) {
  m_jsDocument[key] = true;
  return true;
}

bool Status::IsUpdated(const std::string& key) {
  const Json::Value* mark = FindTopLevel(m_jsDocument, key);
  // A value asBool cannot read (a string, an array, an object such as a flag member
  // used as a mark's name) is not a mark.
  return mark != nullptr && mark->isConvertibleTo(Json::booleanValue) && mark->asBool();
}

bool Status::ShareSetNeedReindex(const std::string& share, bool set) {
  Json::Value& flags = FlagMember(m_jsDocument, kNeedReindex);
  if (set) {
    flags[share] = true;
  } else {
    flags.removeMember(share);
  }
  return true;
}

bool Status::ShareIsNeedReindex(const std::string& share) {
  return IsShareFlagged(m_jsDocument, kNeedReindex, share);
}

bool Status::ShareSetNoSpace(const std::string& share, bool set) {
  Json::Value& flags = FlagMember(m_jsDocument, kNoSpace);
  if (set) {
    // Only the first marking of a share tells the administrators.
    if (!flags.isMember(share) && !NotifyNoSpace()) FIDX_LOG("NotifyNoSpace failed");
    flags[share] = true;
  } else {
    flags.removeMember(share);
  }
  return true;
}

bool Status::ShareIsNoSpace(const std::string& share) {
  return IsShareFlagged(m_jsDocument, kNoSpace, share);
}

}  // namespace FILEINDEX
}  // namespace TAVO
