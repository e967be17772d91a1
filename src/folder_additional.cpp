// The computed fields a folder listing may ask for besides the record itself.
#include <fileindex/error.h>
#include <fileindex/folder.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include "internal/json_io.h"
#include "internal/log.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "folder";
}  // namespace

bool Folder::GetAdditional(Json::Value& out, const std::string& name) const {
  // Both fields are computed from the share path as stored, not from the full path.
  if (name == "status") {
    out = StatusMgr::GetFolderStatus(m_strPath);
    return true;
  }
  if (name == "is_valid") {
    out = CanPathBeIndexed(m_strPath);
    return true;
  }
  FIDX_LOG("Unknown additional: %s", name.c_str());
  ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
  return false;
}

bool Folder::GetAdditional(Json::Value& out, const Json::Value& names) const {
  out = Json::Value(Json::objectValue);
  if (!names.isArray()) {
    FIDX_LOG("Bad param: %s", internal::JsonToString(names).c_str());
    ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
    return false;
  }
  for (const Json::Value& element : names) {
    // Fields added before a bad element stay in out.
    if (!element.isString()) {
      FIDX_LOG("Bad param: %s", internal::JsonToString(element).c_str());
      ErrorHandler::SetError(FILEINDEX_ERR_BAD_PARAM);
      return false;
    }
    const std::string name = element.asString();
    // A field that cannot be computed is listed as null; the others still are.
    if (!GetAdditional(out[name], name)) {
      FIDX_LOG("Failed to get additional: %s", name.c_str());
    }
  }
  return true;
}

Json::Value Folder::asJson(const Json::Value& additional) const {
  Json::Value record = asJson();
  if (!GetAdditional(record["additional"], additional)) {
    FIDX_LOG("GetAdditional failed");
  }
  return record;
}

}  // namespace FILEINDEX
}  // namespace TAVO
