// An in-process fake of the appliance platform: scriptable answers, recorded calls
// and injectable failures. Linked into every unit-test executable, whose definitions
// of the platform functions take precedence over the platform library's.
#ifndef FILEINDEX_TESTS_FAKE_PLATFORM_H
#define FILEINDEX_TESTS_FAKE_PLATFORM_H

#include <json/json.h>

#include <map>
#include <set>
#include <string>
#include <vector>

namespace fake {

struct Share {
  std::string name;
  std::string dir;  // absolute directory, normally <sysroot>/volumeN/<name>
  bool readOnly = false;
  bool encrypted = false;
  bool encryption = false;
};

struct MonitorCall {
  std::string op;  // "upsert" or "delete"
  std::string name;
  int type = 0;
  Json::Value config;     // upsert: the queue description
  std::string queuePath;  // delete: the queue path
};

struct Platform {
  std::map<std::string, Share> shares;

  // File-system facts, keyed by exact full path.
  std::map<std::string, int> fsTypes;  // TAVOGetFSType; paths not listed get defaultFsType
  int defaultFsType = 0;
  std::set<int> remoteFsTypes;
  std::set<int> imageFsTypes;
  std::set<std::string> recyclePaths;   // TAVOShareIsShareRecycle non-zero
  std::set<std::string> snapshotPaths;  // VLIBFhsPathInSnapshot sets 1
  std::set<std::string> mountPoints;    // TAVOFSDirIsMntPoint returns 1
  std::set<std::string> hiddenDirs{"@eaDir"};

  // Quota: the result and the platform error set when it is 0.
  int quotaResult = 1;
  int quotaError = 0;

  // Services and Spotlight.
  bool spotlight = false;

  // Program execution: results of VLIBCExec / VLIBCExecv, and what ran.
  int execResult = 0;
  int execvResult = 0;
  std::vector<std::vector<std::string>> execs;  // argv of every run, program first

  // Notification daemon client.
  std::vector<MonitorCall> monitorCalls;
  int monitorUpsertResult = 1;
  int monitorDeleteResult = 1;

  // Every platform call in order, as "Function(arg,...)".
  std::vector<std::string> calls;

  // Forced results: when a function's name is present, it returns that value at once
  // (after being recorded) instead of answering from the data above.
  std::map<std::string, int> forced;

  // The platform error channel.
  int errCode = 0;
  std::string errFile;
  int errLine = 0;
};

Platform& Get();
// A fresh platform with no shares; also forgets the recorded calls.
void Reset();
// Adds share `name` with directory <root><volume>/<name> and creates that directory.
Share& AddShare(const std::string& root, const std::string& volume, const std::string& name);
// The recorded calls whose text starts with prefix.
std::vector<std::string> CallsStartingWith(const std::string& prefix);

// A controllable clock for time() until the next Reset(), which goes back to the real clock.
void SetClock(long long now);

}  // namespace fake

#endif
