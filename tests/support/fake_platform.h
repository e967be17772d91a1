// In-process fake of the appliance platform: scriptable answers, recorded calls, injectable
// failures. Linked into every unit test, where it overrides the platform library.
#ifndef FILEINDEX_TESTS_FAKE_PLATFORM_H
#define FILEINDEX_TESTS_FAKE_PLATFORM_H

#include <json/json.h>

#include <map>
#include <set>
#include <string>
#include <vector>

namespace fake {

struct Share {
  std::string name, dir;  // dir: absolute, normally <sysroot>/volumeN/<name>
  bool encrypted = false, encryption = false;
};

struct MonitorCall {
  std::string op;  // "upsert" or "delete"
  std::string name;
  int type = 0;
  Json::Value config;     // upsert: the queue description
  std::string queuePath;  // delete
};

struct Platform {
  std::map<std::string, Share> shares;
  // File-system facts, keyed by exact full path; unlisted paths have type 0.
  std::map<std::string, int> fsTypes;
  std::set<int> remoteFsTypes, imageFsTypes;
  std::set<std::string> recyclePaths, snapshotPaths, mountPoints;
  int quotaResult = 1, quotaError = 0;  // quotaError is raised when quotaResult is 0
  bool spotlight = false;
  int execvResult = 0;
  std::vector<std::vector<std::string>> execs;  // argv of every VLIBCExec/VLIBCExecv run
  std::vector<MonitorCall> monitorCalls;
  int monitorUpsertResult = 1;
  std::vector<std::string> calls;  // every platform call in order, as "Function(arg,...)"
  // A function named here is recorded, then returns this value at once.
  std::map<std::string, int> forced;
  int errCode = 0;  // the platform error channel
  std::string errFile;
  int errLine = 0;
};

Platform& Get();
// A fresh platform with no shares and no recorded calls; time() back to the real clock.
void Reset();
// Adds share `name` at <root><volume>/<name> and creates that directory.
Share& AddShare(const std::string& root, const std::string& volume, const std::string& name);
std::vector<std::string> CallsStartingWith(const std::string& prefix);
// Fixes time() until the next Reset().
void SetClock(long long now);

}  // namespace fake

#endif
