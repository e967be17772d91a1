// Checks of command-line input, made before anything is written.
#ifndef FILEINDEXCTL_INPUT_H
#define FILEINDEXCTL_INPUT_H

#include <string>

namespace fileindexctl {

// A share path ("/photo/2019") with repeated and trailing slashes removed. False, with
// the reason, for a path that does not start with "/", names no share, or holds "." or
// ".." components, control characters or invalid UTF-8.
bool NormaliseSharePath(const std::string& path, std::string& out, std::string& why);

// The rule that keeps a share path from being indexed ("recycle bin", "read-only share",
// "a symbolic link leaving the share", ...), or empty when it may be indexed.
std::string IndexRule(const std::string& sharePath);

// The text with control characters (and every byte of invalid UTF-8) written as \xNN, for messages.
std::string Printable(const std::string& text);

// Whether the share table knows the share.
bool ShareExists(const std::string& name);
// The share name of a share path ("photo" for "/photo/2019").
std::string ShareOf(const std::string& sharePath);

// The hours of a pause: "5" or "5h", "3d", "1w". False, with the reason, for anything
// else or a pause that would end past what the stored time can hold.
bool ParsePauseHours(const std::string& text, long long now, int& hours, std::string& why);
// The whole hours from now until a local date-time "YYYY-MM-DD HH:MM[:SS]" (or with a
// "T"), rounded up, since a pause lasts whole hours.
bool ParseUntil(const std::string& text, long long now, int& hours, std::string& why);

}  // namespace fileindexctl

#endif
