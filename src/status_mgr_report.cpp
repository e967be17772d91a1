// The status words of the whole service and of one folder, from the shares' queue
// files, the pause time and the no-space flags.
#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include <cstdint>
#include <cstring>
#include <ctime>
#include <set>
#include <string>
#include <vector>

#include "internal/log.h"
#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"

namespace TAVO {
namespace FILEINDEX {

namespace {
const char kLogUnit[] = "status_mgr";

// The source lines of these messages are fixed: log watchers match them.
const int kPathInQueueFullPathLine = 30;
const int kPathInQueueOpenLine = 37;
const int kPathInQueueMalformedLine = 47;
const int kFolderStatusShareLine = 88;
const int kFolderStatusQueuePathLine = 100;
const int kStatusShareLine = 135;
const int kStatusQueuePathLine = 146;

const int kQueuePathSize = 4096;
// The daemon's rename event, the one code whose "path_old" is read.
const unsigned kRenameEvent = 256;

const char kFinished[] = "finished";
const char kProcessing[] = "processing";
const char kPaused[] = "paused";
const char kNoSpace[] = "err_no_space";

// 0 pauses without end; any other value pauses until the clock reaches it, so -1 and
// every past time mean running. Signed 64-bit on both sides.
bool IsPaused(long long resumeTime) {
  if (resumeTime == 0) return true;
  return static_cast<int64_t>(std::time(nullptr)) < static_cast<int64_t>(resumeTime);
}

// Whether "path" + "/" starts with folder + "/": the event concerns the folder itself or
// something inside it, on whole path components. folderSlash already ends in "/".
inline bool LiesIn(const char* path, size_t size, const std::string& folderSlash) {
  const size_t n = folderSlash.size() - 1;
  // The byte after the folder's length rules out most paths before the comparison.
  if (size < n || (size > n && path[n] != '/')) return false;
  return n == 0 || std::memcmp(path, folderSlash.data(), n) == 0;
}

bool QueuePresent(const std::string& queuePath) {
  return IsFileExist(queuePath) || IsFileExist(queuePath + ".tmp");
}

bool QueuePathOf(const std::string& share, std::string& queuePath) {
  char buffer[kQueuePathSize] = {0};
  if (FILEIDXQueuePathGet(share.c_str(), buffer, sizeof(buffer)) < 0) return false;
  queuePath = buffer;
  return true;
}

// Whether the queue file holds an event inside the folder with this share path. The
// whole file is always read, so that every malformed line gets its log line.
bool IsPathInQueue(const std::string& path, const std::string& queuePath) {
  if (!IsFileExist(queuePath)) return false;
  std::string full;
  if (!GetFullPath(full, path)) {
    FIDX_LOG_AT(kPathInQueueFullPathLine, "Cannot get full path: %s", path.c_str());
    return false;
  }
  const std::string folderSlash = full + "/";

  internal::QueueLineReader reader;
  if (!reader.Open(queuePath)) {
    FIDX_LOG_AT(kPathInQueueOpenLine, "Failed to open queue=%s, reason=%m", queuePath.c_str());
    return false;
  }
  bool found = false;
  internal::QueueEventView view;
  internal::QueueEvent event;
  const char* data;
  size_t size;
  // Whole runs of lines: the fast reader finds where each line ends as it reads it.
  while (reader.NextLines(data, size)) {
    const char* const end = data + size;
    for (const char* line = data; line < end;) {
      const char* lineEnd = nullptr;
      const internal::QueueLineKind kind = internal::ClassifyQueueLine(line, end, view, lineEnd);
      if (kind == internal::QueueLineKind::kEvent) {
        if (LiesIn(view.path, view.pathSize, folderSlash) ||
            (view.event == kRenameEvent && view.pathOld != nullptr &&
             LiesIn(view.pathOld, view.pathOldSize, folderSlash))) {
          found = true;
        }
      } else {
        lineEnd = static_cast<const char*>(std::memchr(line, '\n', static_cast<size_t>(end - line)));
        if (lineEnd == nullptr) lineEnd = end;
        const size_t lineSize = static_cast<size_t>(lineEnd - line);
        // A line the fast reader could not decide goes to the full parser, which has the
        // last word.
        if (kind == internal::QueueLineKind::kNotEvent || !internal::ParseQueueLine(line, lineSize, event)) {
          FIDX_LOG_AT(kPathInQueueMalformedLine, "Malformed command: %s",
                      std::string(line, lineSize).c_str());
        } else if (LiesIn(event.path.data(), event.path.size(), folderSlash) ||
                   (event.event == kRenameEvent &&
                    LiesIn(event.pathOld.data(), event.pathOld.size(), folderSlash))) {
          // Another code's old path reads as empty, which lies in no folder.
          found = true;
        }
      }
      line = lineEnd < end ? lineEnd + 1 : end;
    }
  }
  return found;
}
}  // namespace

bool StatusMgr::GetStatus(std::string& status) {
  std::vector<Folder> folders;
  if (!IndexMgr::List(folders)) return false;

  std::set<std::string> shares;
  for (const Folder& folder : folders) {
    std::string share;
    // Checked before indexability: even a folder that would be skipped fails the call.
    if (!GetShareNameByPath(share, folder.GetPath())) {
      FIDX_LOG_AT(kStatusShareLine, "Failed to get share name from path: %s", folder.GetPath().c_str());
      return false;
    }
    if (CanPathBeIndexed(folder.GetPath())) shares.insert(share);
  }

  bool pending = false;
  for (const std::string& share : shares) {
    std::string queuePath;
    if (!QueuePathOf(share, queuePath)) {
      FIDX_LOG_AT(kStatusQueuePathLine, "FILEIDXQueuePathGet failed, share=%s", share.c_str());
      return false;
    }
    if (QueuePresent(queuePath)) {
      pending = true;
      break;
    }
  }
  // An idle service is finished, paused or not.
  if (!pending) {
    status = kFinished;
    return true;
  }

  long long resumeTime = -1;
  if (!GetPauseInfo(resumeTime)) return false;
  status = IsPaused(resumeTime) ? kPaused : kProcessing;
  return true;
}

std::string StatusMgr::GetFolderStatus(const std::string& path) {
  if (!CanPathBeIndexed(path)) return kPaused;

  std::string share;
  if (!GetShareNameByPath(share, path)) {
    FIDX_LOG_AT(kFolderStatusShareLine, "Failed to get share name from path: %s", path.c_str());
    return kFinished;
  }
  if (ShareIsNoSpace(share)) return kNoSpace;

  std::string queuePath;
  if (!QueuePathOf(share, queuePath)) {
    FIDX_LOG_AT(kFolderStatusQueuePathLine, "FILEIDXQueuePathGet failed, share=%s", share.c_str());
    return kFinished;
  }

  // An unreadable pause time counts as not paused, so the answer stays deterministic.
  long long resumeTime = -1;
  static_cast<void>(GetPauseInfo(resumeTime));

  if (!IsPathInQueue(path, queuePath) && !IsPathInQueue(path, queuePath + ".tmp")) return kFinished;
  return IsPaused(resumeTime) ? kPaused : kProcessing;
}

}  // namespace FILEINDEX
}  // namespace TAVO
