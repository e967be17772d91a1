#include "internal/listing_pass.h"

#include <fileindex/status.h>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

namespace {
thread_local ListingPass* g_current = nullptr;
}  // namespace

ListingPass::ListingPass(std::vector<std::string> paths) : paths_(std::move(paths)) {
  if (g_current == nullptr) {
    g_current = this;
    installed_ = true;
  }
}

ListingPass::~ListingPass() {
  if (installed_) g_current = nullptr;
}

ListingPass* ListingPass::Current() { return g_current; }

void ListingPass::KeepStatus(std::unique_ptr<Status> status) {
  statusTried_ = true;
  status_ = std::move(status);
}

SharedQueueScan* ListingPass::FindQueue(const std::string& queuePath) {
  auto it = queues_.find(queuePath);
  return it == queues_.end() ? nullptr : &it->second;
}

SharedQueueScan& ListingPass::AddQueue(const std::string& queuePath) { return queues_[queuePath]; }

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO
