// Platform share records owned by a unique_ptr, so they are freed on every path.
#ifndef FILEINDEX_INTERNAL_SHARE_RECORD_H
#define FILEINDEX_INTERNAL_SHARE_RECORD_H

#include <tavo/platform.h>

#include <memory>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

struct ShareFree {
  void operator()(PTAVOSHARE share) const {
    if (share != nullptr) TAVOShareFree(share);
  }
};
using ShareRecord = std::unique_ptr<TAVOSHARE, ShareFree>;

// TAVOShareGet into an owned record; the platform's result is returned unchanged.
inline int GetShareRecord(const char* name, ShareRecord& out) {
  PTAVOSHARE raw = nullptr;
  int rc = TAVOShareGet(name, &raw);
  // A failed lookup obtained no record: nothing to free.
  out.reset(rc < 0 ? nullptr : raw);
  return rc;
}

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
