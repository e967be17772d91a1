// What one listing page shares between its folders: status.conf read once, and each
// queue file read once for all the page's folders in its share. Lives for the page only;
// nothing survives the call that builds it.
#ifndef FILEINDEX_INTERNAL_LISTING_PASS_H
#define FILEINDEX_INTERNAL_LISTING_PASS_H

#include <cstddef>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace TAVO {
namespace FILEINDEX {

class Status;

namespace internal {

// One read of a queue file on behalf of several folders.
struct SharedQueueScan {
  bool opened = false;
  int openErrno = 0;
  // Each folder's full path followed by "/", and whether the queue holds an event in it.
  std::map<std::string, bool> found;
  // The malformed lines in file order, to be logged again for each folder that reads
  // the queue; complete is false when there were too many to keep.
  std::vector<std::string> malformed;
  bool complete = true;
};

// Installed for the current thread while it exists; passes do not nest (an inner one
// leaves the outer one in place).
class ListingPass {
 public:
  explicit ListingPass(std::vector<std::string> paths);
  ~ListingPass();
  ListingPass(const ListingPass&) = delete;
  ListingPass& operator=(const ListingPass&) = delete;

  // The pass of this thread, or null.
  static ListingPass* Current();

  // The page's folders, as share paths.
  const std::vector<std::string>& Paths() const { return paths_; }

  // status.conf as loaded once for the page: null before the first load, and for good
  // after a load that failed (every reader then loads it itself, as without a pass).
  Status* LoadedStatus() { return status_.get(); }
  bool StatusTried() const { return statusTried_; }
  void KeepStatus(std::unique_ptr<Status> status);

  // The scan of this queue file, or null when it has not been read yet.
  SharedQueueScan* FindQueue(const std::string& queuePath);
  SharedQueueScan& AddQueue(const std::string& queuePath);

 private:
  std::vector<std::string> paths_;
  bool installed_ = false;
  bool statusTried_ = false;
  std::unique_ptr<Status> status_;
  std::unordered_map<std::string, SharedQueueScan> queues_;
};

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
