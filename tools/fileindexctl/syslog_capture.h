// The library writes its log lines through syslog; this executable defines the syslog
// functions itself, keeps every line for the command's report and passes it on to the
// C library's syslog.
#ifndef FILEINDEXCTL_SYSLOG_CAPTURE_H
#define FILEINDEXCTL_SYSLOG_CAPTURE_H

#include <string>
#include <vector>

namespace fileindexctl {

// The number of lines captured so far; a call's lines are those after its mark.
size_t LogMark();
std::vector<std::string> LogLinesSince(size_t mark);
// When false, captured lines are not passed on to the system log.
void SetForwardToSyslog(bool forward);

}  // namespace fileindexctl

#endif
