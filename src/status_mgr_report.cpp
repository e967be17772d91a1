// The status words of the whole service and of one folder, from the shares' queue
// files, the pause time and the no-space flags.
#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <set>
#include <string>
#include <vector>

#ifdef __SSE2__
#include <emmintrin.h>
#endif

#include "internal/listing_pass.h"
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

// Whether the n bytes at a and b are the same: 16 at a time without a call, and without
// a branch on where they differ (most paths share the folders' long common start).
inline bool SameBytes(const char* a, const char* b, size_t n) {
#ifdef __SSE2__
  if (n >= 16) {
    unsigned differ = 0;
    size_t i = 0;
    for (; i + 16 < n; i += 16) {
      const __m128i x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(a + i));
      const __m128i y = _mm_loadu_si128(reinterpret_cast<const __m128i*>(b + i));
      differ |= static_cast<unsigned>(_mm_movemask_epi8(_mm_cmpeq_epi8(x, y))) ^ 0xFFFFu;
    }
    // The last 16 bytes, overlapping what was compared already.
    const __m128i x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(a + n - 16));
    const __m128i y = _mm_loadu_si128(reinterpret_cast<const __m128i*>(b + n - 16));
    differ |= static_cast<unsigned>(_mm_movemask_epi8(_mm_cmpeq_epi8(x, y))) ^ 0xFFFFu;
    return differ == 0;
  }
#endif
  // Shorter runs, such as what tells sibling folders apart, as two overlapping words.
  auto word = [](const char* p, size_t size) {
    uint64_t value = 0;
    std::memcpy(&value, p, size);
    return value;
  };
  if (n >= 8) return ((word(a, 8) ^ word(b, 8)) | (word(a + n - 8, 8) ^ word(b + n - 8, 8))) == 0;
  if (n >= 4) return ((word(a, 4) ^ word(b, 4)) | (word(a + n - 4, 4) ^ word(b + n - 4, 4))) == 0;
  for (size_t i = 0; i < n; ++i) {
    if (a[i] != b[i]) return false;
  }
  return true;
}

// The folders of one queue read, each a full path followed by "/": which of them an
// event's path lies in, that is whether "path" + "/" starts with the folder + "/" (the
// event concerns the folder itself or something inside it, on whole path components).
// The bytes that all the folders share are compared once per path, and the byte after
// a folder's length once for all the folders of that length; each folder's last eight
// bytes, as one word, rule it out before its own comparison.
class FolderSet {
 public:
  explicit FolderSet(const std::vector<std::string>& folderSlashes) : folders_(folderSlashes) {
    common_ = folders_.empty() ? 0 : folders_[0].size() - 1;
    for (size_t i = 0; i < folders_.size(); ++i) {
      const std::string& folder = folders_[i];
      size_t n = 0;
      while (n < common_ && n + 1 < folder.size() && folder[n] == folders_[0][n]) ++n;
      common_ = n;
      const size_t size = folder.size() - 1;
      auto group =
          std::find_if(groups_.begin(), groups_.end(), [size](const Group& g) { return g.size == size; });
      if (group == groups_.end()) group = groups_.insert(groups_.end(), Group{size, {}});
      group->members.push_back(Member{i, size >= 8 ? Word(folder.data() + size - 8) : 0});
    }
  }

  // Marks in found[i] each folder that the path lies in; how many were not marked yet.
  size_t Mark(const char* path, size_t size, std::vector<char>& found) const {
    if (size < common_ || !SameBytes(path, folders_[0].data(), common_)) return 0;
    size_t marked = 0;
    for (const Group& group : groups_) {
      const size_t n = group.size;
      if (size < n || (size > n && path[n] != '/')) continue;
      const uint64_t tail = n >= 8 ? Word(path + n - 8) : 0;
      for (const Member& member : group.members) {
        if (member.tail != tail || found[member.index]) continue;
        if (SameBytes(path + common_, folders_[member.index].data() + common_, n - common_)) {
          found[member.index] = 1;
          ++marked;
        }
      }
    }
    return marked;
  }

 private:
  struct Member {
    size_t index;
    uint64_t tail;  // the folder's last eight bytes, when it has eight
  };
  struct Group {
    size_t size;  // the length of its folders, without the "/"
    std::vector<Member> members;
  };
  static uint64_t Word(const char* p) {
    uint64_t word;
    std::memcpy(&word, p, 8);
    return word;
  }

  const std::vector<std::string>& folders_;
  std::vector<Group> groups_;
  size_t common_;
};

bool QueuePresent(const std::string& queuePath) {
  return IsFileExist(queuePath) || IsFileExist(queuePath + ".tmp");
}

bool QueuePathOf(const std::string& share, std::string& queuePath) {
  char buffer[kQueuePathSize] = {0};
  if (FILEIDXQueuePathGet(share.c_str(), buffer, sizeof(buffer)) < 0) return false;
  queuePath = buffer;
  return true;
}

// Reads every line of an open queue file, marking in found[i] whether an event lies in
// the folder folderSlashes[i] (a full path followed by "/") and handing each malformed
// line to malformed. The whole file is always read, so that every malformed line is seen.
template <typename OnMalformed>
void ScanQueue(internal::QueueLineReader& reader, const std::vector<std::string>& folderSlashes,
               std::vector<char>& found, OnMalformed&& malformed) {
  found.assign(folderSlashes.size(), 0);
  const FolderSet folders(folderSlashes);
  size_t unfound = folderSlashes.size();
  auto mark = [&](const char* path, size_t size, unsigned code, const char* pathOld, size_t pathOldSize) {
    if (unfound == 0) return;
    unfound -= folders.Mark(path, size, found);
    // Another code's old path is not read: it lies in no folder.
    if (code == kRenameEvent && pathOld != nullptr) unfound -= folders.Mark(pathOld, pathOldSize, found);
  };
  internal::QueueEventView view;
  internal::QueueEvent event;
  const char* data;
  size_t size;
  // Whole runs of lines: the fast reader finds where each line ends as it reads it.
  while (reader.NextLines(data, size)) {
    const char* const end = data + size;
    internal::QueueRunClassifier run(data, end);
    for (const char* line = data; line < end;) {
      const char* lineEnd = nullptr;
      // Once every folder is found, the paths are no longer read: only whether each line
      // is an event.
      const internal::QueueLineKind kind = run.Classify(
          line, view, lineEnd, unfound != 0 ? internal::QueuePaths::kRead : internal::QueuePaths::kUnread);
      if (kind == internal::QueueLineKind::kEvent) {
        mark(view.path, view.pathSize, view.event, view.pathOld, view.pathOldSize);
      } else {
        lineEnd = static_cast<const char*>(std::memchr(line, '\n', static_cast<size_t>(end - line)));
        if (lineEnd == nullptr) lineEnd = end;
        const size_t lineSize = static_cast<size_t>(lineEnd - line);
        // A line the fast reader could not decide goes to the full parser, which has the
        // last word.
        if (kind == internal::QueueLineKind::kNotEvent || !internal::ParseQueueLine(line, lineSize, event)) {
          malformed(line, lineSize);
        } else {
          mark(event.path.data(), event.path.size(), event.event, event.pathOld.data(), event.pathOld.size());
        }
      }
      line = lineEnd < end ? lineEnd + 1 : end;
    }
  }
}

void LogMalformed(const char* line, size_t size) {
  FIDX_LOG_AT(kPathInQueueMalformedLine, "Malformed command: %s", std::string(line, size).c_str());
}

// Malformed lines kept for a page, in bytes; a queue with more is read per folder.
const size_t kKeptMalformedBytes = 1 << 20;

// The shared read of queuePath for the listing page's folders in the share of path
// (whose full path is full): each one's full path is the share's volume part followed
// by its share path, as GetFullPath builds it.
void ScanForPage(const internal::ListingPass& pass, const std::string& queuePath, const std::string& path,
                 const std::string& full, internal::SharedQueueScan& scan) {
  std::vector<std::string> folderSlashes{full + "/"};
  std::string share;
  if (full.size() >= path.size() && full.compare(full.size() - path.size(), path.size(), path) == 0 &&
      GetShareNameByPath(share, path)) {
    const std::string volume = full.substr(0, full.size() - path.size());
    for (const std::string& other : pass.Paths()) {
      std::string otherShare;
      if (other != path && !other.empty() && GetShareNameByPath(otherShare, other) && otherShare == share)
        folderSlashes.push_back(volume + other + "/");
    }
  }
  internal::QueueLineReader reader;
  scan.opened = reader.Open(queuePath);
  if (!scan.opened) {
    scan.openErrno = errno;
    return;
  }
  size_t keptBytes = 0;
  std::vector<char> found;
  ScanQueue(reader, folderSlashes, found, [&](const char* line, size_t size) {
    if (!scan.complete) return;
    keptBytes += size;
    if (keptBytes > kKeptMalformedBytes) {
      scan.complete = false;
      scan.malformed.clear();
      scan.malformed.shrink_to_fit();
      return;
    }
    scan.malformed.emplace_back(line, size);
  });
  for (size_t i = 0; i < folderSlashes.size(); ++i) scan.found[folderSlashes[i]] = found[i] != 0;
}

// Whether the queue file holds an event inside the folder with this share path. The
// whole file is always read, so that every malformed line gets its log line; within a
// listing page the file is read once for all the page's folders, and what each folder's
// own read would have logged is logged for it.
bool IsPathInQueue(const std::string& path, const std::string& queuePath) {
  if (!IsFileExist(queuePath)) return false;
  std::string full;
  if (!GetFullPath(full, path)) {
    FIDX_LOG_AT(kPathInQueueFullPathLine, "Cannot get full path: %s", path.c_str());
    return false;
  }
  const std::string folderSlash = full + "/";

  if (internal::ListingPass* pass = internal::ListingPass::Current()) {
    internal::SharedQueueScan* scan = pass->FindQueue(queuePath);
    if (scan == nullptr) {
      scan = &pass->AddQueue(queuePath);
      ScanForPage(*pass, queuePath, path, full, *scan);
    }
    if (!scan->opened) {
      errno = scan->openErrno;
      FIDX_LOG_AT(kPathInQueueOpenLine, "Failed to open queue=%s, reason=%m", queuePath.c_str());
      return false;
    }
    auto it = scan->found.find(folderSlash);
    // A folder the shared read did not cover (its share changed meanwhile) or a queue
    // with too many malformed lines to keep is read on its own below.
    if (it != scan->found.end() && scan->complete) {
      for (const std::string& line : scan->malformed) LogMalformed(line.data(), line.size());
      return it->second;
    }
  }

  internal::QueueLineReader reader;
  if (!reader.Open(queuePath)) {
    FIDX_LOG_AT(kPathInQueueOpenLine, "Failed to open queue=%s, reason=%m", queuePath.c_str());
    return false;
  }
  std::vector<char> found;
  ScanQueue(reader, {folderSlash}, found, LogMalformed);
  return found[0] != 0;
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
