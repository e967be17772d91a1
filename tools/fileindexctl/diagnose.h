// Why a configuration file or lock gets in the way, in words for the administrator.
#ifndef FILEINDEXCTL_DIAGNOSE_H
#define FILEINDEXCTL_DIAGNOSE_H

#include <string>
#include <vector>

namespace fileindexctl {

// The problems of folder.conf and status.conf as the library reads them: unreadable, not
// JSON, or a member of an unexpected type ("status.conf: member \"no_space\" is a string,
// expected an object"). Empty when both are fine (a missing file is an empty one).
std::vector<std::string> ConfigProblems();

// "process 1234 (fileindexctl)" holding the folder.conf or status.conf lock, from the
// kernel's lock table; empty when no other process is seen holding either.
std::string LockHolder();

// The first log line of the library without its "unit:line " prefix.
std::string StripLogPrefix(const std::string& line);

}  // namespace fileindexctl

#endif
