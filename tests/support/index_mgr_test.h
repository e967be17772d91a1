// Fixture for the index manager's writers: folder.conf, a share's queue and index files, the
// fake daemon on the library's socket and the state of folder.conf's lock.
#ifndef FILEINDEX_TESTS_INDEX_MGR_TEST_H
#define FILEINDEX_TESTS_INDEX_MGR_TEST_H

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <initializer_list>
#include <string>
#include <vector>

#include "support/fake_daemon.h"
#include "support/sysroot_test.h"

class IndexMgrTest : public SysrootTest {
 protected:
  void TearDown() override {
    daemon_.Stop();
    SysrootTest::TearDown();
  }

  void StartDaemon() { ASSERT_TRUE(daemon_.Start(SocketPath())); }

  std::string Db(const std::string& share) const { return EaDir(share) + "/TAVO@.fileindexdb"; }
  std::string LockPath() const { return Rooted("/tmp/fileidx_cfg_folder.lock"); }

  static Json::Value Record(const std::string& path, const std::string& name, bool document, bool audio,
                            bool video, bool photo) {
    Json::Value record = Flags(document, audio, video, photo);
    record["path"] = path, record["name"] = name;
    return record;
  }

  static Json::Value Flags(bool document, bool audio, bool video, bool photo) {
    Json::Value flags(Json::objectValue);
    flags["document"] = document, flags["audio"] = audio, flags["video"] = video, flags["photo"] = photo;
    return flags;
  }

  static Json::Value Array(std::initializer_list<Json::Value> items) {
    Json::Value array(Json::arrayValue);
    for (const Json::Value& item : items) array.append(item);
    return array;
  }

  void WriteFolders(std::initializer_list<Json::Value> records) {
    Json::Value conf(Json::objectValue);
    for (const Json::Value& record : records) conf[record["path"].asString()] = record;
    WriteFile(FolderConfPath(), conf.toStyledString());
  }

  Json::Value FolderConf() const { return ReadJson(FolderConfPath()); }

  std::vector<Json::Value> QueueEvents(const std::string& share) const {  // the parsed queue lines
    std::vector<Json::Value> events;
    for (const std::string& line : ReadLines(Queue(share))) events.push_back(ParseJson(line));
    return events;
  }

  static Json::Value Event(int code, const std::string& full, const Json::Value& data) {
    Json::Value event(Json::objectValue);
    event["event"] = code, event["path"] = full, event["data"] = data;
    return event;
  }

  // The watch list the notification daemon should get for a share holding these folders.
  Json::Value Watch(const std::string& share, std::initializer_list<std::string> paths) const {
    Json::Value watch(Json::objectValue);
    watch["queue"] = Queue(share);
    watch["config"] = Json::Value(Json::arrayValue);
    for (const std::string& path : paths) {
      Json::Value& entry = watch["config"].append(Json::Value(Json::objectValue));
      entry["path"] = Full(path), entry["mask"] = 65486;
      entry["ignore"].append("@eaDir");
    }
    return watch;
  }

  std::vector<Json::Value> Commands() { return daemon_.Commands(); }  // {"type","data"} in order

  static Json::Value Command(const std::string& type, const std::string& key, const std::string& value) {
    Json::Value command(Json::objectValue);
    command["type"] = type, command["data"][key] = value;
    return command;
  }

  // Service, Spotlight and watch-list calls, in the order they were made.
  static std::vector<std::string> SideEffectCalls() {
    std::vector<std::string> out;
    for (const std::string& call : fake::Get().calls)
      for (const std::string prefix : {"VLIBService", "TAVOSMB", "MonitorQueue::"})
        if (call.compare(0, prefix.size(), prefix) == 0) out.push_back(call);
    return out;
  }

  // Whether another open file description can take folder.conf's lock right now.
  bool LockIsFree() const {
    int fd = ::open(LockPath().c_str(), O_RDWR | O_CLOEXEC);
    bool free = fd < 0 || ::flock(fd, LOCK_EX | LOCK_NB) == 0;
    if (fd >= 0) ::close(fd);
    return free;
  }

  FakeDaemon daemon_;
};

#endif
