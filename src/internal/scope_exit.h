// Runs a callable when the scope ends, on every way out.
#ifndef FILEINDEX_INTERNAL_SCOPE_EXIT_H
#define FILEINDEX_INTERNAL_SCOPE_EXIT_H

#include <utility>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

template <typename F>
class ScopeExit {
 public:
  explicit ScopeExit(F f) : f_(std::move(f)) {}
  ~ScopeExit() { f_(); }
  ScopeExit(const ScopeExit&) = delete;
  ScopeExit& operator=(const ScopeExit&) = delete;

 private:
  F f_;
};

// Calls Unlock() on a configuration object when the operation returns, whether or
// not the lock was ever taken.
template <typename C>
class UnlockOnExit {
 public:
  explicit UnlockOnExit(C& config) : config_(config) {}
  ~UnlockOnExit() { config_.Unlock(); }
  UnlockOnExit(const UnlockOnExit&) = delete;
  UnlockOnExit& operator=(const UnlockOnExit&) = delete;

 private:
  C& config_;
};

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
