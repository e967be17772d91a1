// The fixed paths of the system (configuration files, lock files, the daemon socket)
// are made here and only here. FILEINDEX_SYSROOT, when set (and the caller is not
// set-user-ID), is prefixed to them; production never sets it.
#ifndef FILEINDEX_INTERNAL_SYSROOT_H
#define FILEINDEX_INTERNAL_SYSROOT_H

#include <string>

namespace TAVO {
namespace FILEINDEX {
namespace internal {

std::string SystemPath(const char* fixedPath);

}  // namespace internal
}  // namespace FILEINDEX
}  // namespace TAVO

#endif
