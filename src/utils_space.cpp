// The share space check and the administrators' out-of-space notification.
#include <fileindex/utils.h>
#include <tavo/platform.h>

#include "internal/log.h"
#include "internal/share_record.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "utils";
const unsigned long long kRequiredSpace = 10485760ULL;  // 10 MiB
const int kErrNoSpace = 0x2900;
const int kErrQuotaExceeded = 0x2400;
const char kNotifier[] = "/usr/tavo/bin/tavovemnotify";
}  // namespace

bool IsShareSpaceEnough(const std::string& share) {
  internal::ShareRecord record;
  if (internal::GetShareRecord(share.c_str(), record) < 0) {
    FIDX_LOG("TAVOShareGet failed, share=%s", share.c_str());
    return false;
  }
  if (TAVOQuotaIsEnough(0, record->szPath, kRequiredSpace) != 0) return true;
  // Only these two platform errors mean the space is short; any other failure of the
  // check must not stop indexing.
  if (VLIBCErrGet() == kErrNoSpace) return false;
  if (VLIBCErrGet() == kErrQuotaExceeded) return false;
  return true;
}

bool NotifyNoSpace() {
  static const char* const kArgv[] = {
      kNotifier,
      "-e",
      "false",
      "-c",
      "TAVO.KOR.AdminCenter.Application",
      "@administrators",
      "fileindex:fileindex_title",
      "fileindex:notify_no_space",
      "<a data-tavo-app=\"TAVO.KOR.AdminCenter.Application\" "
      "data-tavo-fn=\"TAVO.KOR.AdminCenter.MediaIndex.Main\" "
      "data-tavo-tab=\"fileIndex\">",
      "</a>",
      nullptr,
  };
  // The platform takes a char* const[] but does not write through it.
  return VLIBCExecv(kNotifier, const_cast<char* const*>(kArgv), 1) == 0;
}

}  // namespace FILEINDEX
}  // namespace TAVO
