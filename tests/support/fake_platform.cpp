#include "support/fake_platform.h"

#include <strings.h>
#include <sys/stat.h>
#include <tavo/platform.h>
#include <tavo/tavotifyd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>

namespace fake {

namespace {
Platform* g_platform = new Platform();
bool g_clockSet = false;
long long g_clock = 0;

std::string Quote(const char* s) { return s == nullptr ? "(null)" : s; }

bool Record(const std::string& call, const char* function, int* forcedResult) {
  Get().calls.push_back(call);
  auto it = Get().forced.find(function);
  if (it == Get().forced.end()) return false;
  *forcedResult = it->second;
  return true;
}

bool Inside(const std::string& full, const std::string& dir) {
  return full.compare(0, dir.size(), dir) == 0 && (full.size() == dir.size() || full[dir.size()] == '/');
}
}  // namespace

Platform& Get() { return *g_platform; }

void Reset() {
  delete g_platform;
  g_platform = new Platform();
  g_clockSet = false;
}

Share& AddShare(const std::string& root, const std::string& volume, const std::string& name) {
  Share share;
  share.name = name;
  share.dir = root + volume + "/" + name;
  std::filesystem::create_directories(share.dir);
  Get().shares[name] = share;
  return Get().shares[name];
}

std::vector<std::string> CallsStartingWith(const std::string& prefix) {
  std::vector<std::string> out;
  for (const std::string& call : Get().calls) {
    if (call.compare(0, prefix.size(), prefix) == 0) out.push_back(call);
  }
  return out;
}

void SetClock(long long now) {
  g_clockSet = true;
  g_clock = now;
}

}  // namespace fake

// Records the call; a forced result for the function is returned at once, a negative one
// with the platform error (code, file, line) set when code is not 0.
#define FAKE_RECORD_ERR(function, args, code, file, line)                               \
  do {                                                                                  \
    int forced_;                                                                        \
    if (fake::Record(std::string(#function "(") + (args) + ")", #function, &forced_)) { \
      if (forced_ < 0 && (code) != 0) VLIBCErrSetEx(code, file, line);                  \
      return forced_;                                                                   \
    }                                                                                   \
  } while (0)
#define FAKE_RECORD(function, args) FAKE_RECORD_ERR(function, args, 0, "", 0)

extern "C" {

time_t time(time_t* out) noexcept {
  time_t now;
  if (fake::g_clockSet) {
    now = static_cast<time_t>(fake::g_clock);
  } else {
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    now = ts.tv_sec;
  }
  if (out != nullptr) *out = now;
  return now;
}

int TAVOShareGet(const char* szName, PTAVOSHARE* ppShare) {
  FAKE_RECORD(TAVOShareGet, fake::Quote(szName));
  auto it = fake::Get().shares.find(szName == nullptr ? "" : szName);
  if (szName == nullptr || it == fake::Get().shares.end()) {
    VLIBCErrSetEx(0x1400, "fake", 1);
    return -1;
  }
  PTAVOSHARE share = static_cast<PTAVOSHARE>(std::calloc(1, sizeof(TAVOSHARE)));
  share->szName = ::strdup(it->second.name.c_str());
  share->szComment = ::strdup("");
  share->szPath = ::strdup(it->second.dir.c_str());
  share->blReadOnly = it->second.readOnly;
  share->blEncrypted = it->second.encrypted;
  share->blEncryption = it->second.encryption;
  *ppShare = share;
  return 0;
}

void TAVOShareFree(PTAVOSHARE pShare) {
  fake::Get().calls.push_back("TAVOShareFree(" + fake::Quote(pShare ? pShare->szName : nullptr) + ")");
  if (pShare == nullptr) return;
  std::free(pShare->szName);
  std::free(pShare->szComment);
  std::free(pShare->szPath);
  std::free(pShare);
}

int TAVOShareNamePathGet(const char* szFullPath, char* szName, int cbName, char* szPath, int cbPath) {
  FAKE_RECORD(TAVOShareNamePathGet, fake::Quote(szFullPath));
  const fake::Share* best = nullptr;
  for (const auto& entry : fake::Get().shares) {
    if (fake::Inside(szFullPath, entry.second.dir) &&
        (best == nullptr || entry.second.dir.size() > best->dir.size()))
      best = &entry.second;
  }
  if (best == nullptr) {
    VLIBCErrSetEx(0x1400, "fake", 2);
    return -1;
  }
  std::snprintf(szName, cbName, "%s", best->name.c_str());
  std::snprintf(szPath, cbPath, "%s", best->dir.c_str());
  return 0;
}

int TAVOShareIsShareRecycle(const char* szFullPath) {
  FAKE_RECORD(TAVOShareIsShareRecycle, fake::Quote(szFullPath));
  return fake::Get().recyclePaths.count(szFullPath) ? 1 : 0;
}

static int ShareFlag(const char* function, PTAVOSHARE share, int* out, bool value) {
  int forced;
  if (fake::Record(std::string(function) + "(" + fake::Quote(share ? share->szName : nullptr) + ")", function,
                   &forced))
    return forced;
  *out = value ? 1 : 0;
  return 0;
}

int VLIBShareIsEncryptedGet(PTAVOSHARE pShare, int* pbl) {
  return ShareFlag("VLIBShareIsEncryptedGet", pShare, pbl, pShare && pShare->blEncrypted);
}
int VLIBShareIsEncryptionGet(PTAVOSHARE pShare, int* pbl) {
  return ShareFlag("VLIBShareIsEncryptionGet", pShare, pbl, pShare && pShare->blEncryption);
}
int VLIBShareIsReadOnlyGet(PTAVOSHARE pShare, int* pbl) {
  return ShareFlag("VLIBShareIsReadOnlyGet", pShare, pbl, pShare && pShare->blReadOnly);
}

int TAVOGetFSType(const char* szPath, int flag) {
  FAKE_RECORD(TAVOGetFSType, fake::Quote(szPath) + "," + std::to_string(flag));
  auto it = fake::Get().fsTypes.find(szPath);
  return it == fake::Get().fsTypes.end() ? fake::Get().defaultFsType : it->second;
}

int TAVOFSIsRemoteFS(int fsType) {
  FAKE_RECORD(TAVOFSIsRemoteFS, std::to_string(fsType));
  return fake::Get().remoteFsTypes.count(fsType) ? 1 : 0;
}

int TAVOFSIsImageFS(int fsType) {
  FAKE_RECORD(TAVOFSIsImageFS, std::to_string(fsType));
  return fake::Get().imageFsTypes.count(fsType) ? 1 : 0;
}

int TAVOFSDirIsMntPoint(const char* szPath) {
  FAKE_RECORD(TAVOFSDirIsMntPoint, fake::Quote(szPath));
  return fake::Get().mountPoints.count(szPath) ? 1 : 0;
}

int VLIBFhsPathInSnapshot(const char* szPath, int* pblInSnapshot) {
  FAKE_RECORD(VLIBFhsPathInSnapshot, fake::Quote(szPath));
  *pblInSnapshot = fake::Get().snapshotPaths.count(szPath) ? 1 : 0;
  return 0;
}

int TAVOEAIsHiddenDir(const char* szName) {
  FAKE_RECORD(TAVOEAIsHiddenDir, fake::Quote(szName));
  return fake::Get().hiddenDirs.count(szName) ? 1 : 0;
}

int TAVOEAMKDir(int flag, const char* szPath) {
  FAKE_RECORD(TAVOEAMKDir, std::to_string(flag) + "," + fake::Quote(szPath));
  if (::mkdir(szPath, 0755) != 0 && errno != EEXIST) {
    VLIBCErrSetEx(0x100, "fake", 3);
    return -1;
  }
  return 0;
}

int TAVOQuotaIsEnough(unsigned int uid, const char* szPath, unsigned long long cbSize) {
  FAKE_RECORD(TAVOQuotaIsEnough,
              std::to_string(uid) + "," + fake::Quote(szPath) + "," + std::to_string(cbSize));
  if (fake::Get().quotaResult == 0) VLIBCErrSetEx(fake::Get().quotaError, "fake", 4);
  return fake::Get().quotaResult;
}

int VLIBServiceStart(const char* szService, int flag) {
  FAKE_RECORD_ERR(VLIBServiceStart, fake::Quote(szService) + "," + std::to_string(flag), 0x3000, "service.c",
                  10);
  return 0;
}

int VLIBServiceStop(const char* szService, int flag) {
  FAKE_RECORD_ERR(VLIBServiceStop, fake::Quote(szService) + "," + std::to_string(flag), 0x3001, "service.c",
                  20);
  return 0;
}

int VLIBServiceRestart(const char* szService) {
  FAKE_RECORD_ERR(VLIBServiceRestart, fake::Quote(szService), 0x3002, "service.c", 30);
  return 0;
}

int TAVOSMBIsEnableSpotlight(void) {
  FAKE_RECORD(TAVOSMBIsEnableSpotlight, "");
  return fake::Get().spotlight ? 1 : 0;
}

int TAVOSMBSetSpotlight(int blEnable) {
  FAKE_RECORD_ERR(TAVOSMBSetSpotlight, std::to_string(blEnable), 0x3100, "smb.c", 40);
  fake::Get().spotlight = blEnable != 0;
  return 0;
}

int VLIBCExec(const char* szProgram, const char* a1, const char* a2, const char* a3, const char* a4) {
  std::vector<std::string> argv{fake::Quote(szProgram)};
  for (const char* a : {a1, a2, a3, a4}) {
    if (a == nullptr) break;
    argv.push_back(a);
  }
  std::string call = "VLIBCExec(" + argv[0];
  for (size_t i = 1; i < argv.size(); ++i) call += "," + argv[i];
  int forced;
  if (fake::Record(call + ")", "VLIBCExec", &forced)) return forced;
  fake::Get().execs.push_back(argv);
  // rm -rf is carried out for real so that tests can see the files go.
  if (argv[0] == "/bin/rm" && argv.size() == 3 && argv[1] == "-rf") {
    std::string cmd = "/bin/rm -rf '" + argv[2] + "'";
    if (std::system(cmd.c_str()) != 0) return -1;
  }
  return fake::Get().execResult;
}

int VLIBCExecv(const char* szProgram, char* const argv[], int flag) {
  std::vector<std::string> args;
  for (int i = 0; argv != nullptr && argv[i] != nullptr; ++i) args.push_back(argv[i]);
  std::string call = "VLIBCExecv(" + fake::Quote(szProgram) + "," + std::to_string(flag) + ")";
  int forced;
  if (fake::Record(call, "VLIBCExecv", &forced)) return forced;
  fake::Get().execs.push_back(args);
  return fake::Get().execvResult;
}

int VLIBCErrGet(void) { return fake::Get().errCode; }

void VLIBCErrSetEx(int code, const char* szFile, int line) {
  fake::Get().errCode = code;
  fake::Get().errFile = szFile ? szFile : "";
  fake::Get().errLine = line;
  fake::Get().calls.push_back("VLIBCErrSetEx(" + std::to_string(code) + "," + fake::Get().errFile + "," +
                              std::to_string(line) + ")");
}

const char* VLIBCErrorGetFile(void) { return fake::Get().errFile.c_str(); }

int VLIBCErrorGetLine(void) { return fake::Get().errLine; }

int VLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b) { return strcasecmp(a, b); }

}  // extern "C"

namespace TAVO {
namespace TAVOTIFYD {

MonitorQueue::MonitorQueue(const Json::Value& config) : m_config(config) {
  fake::Get().calls.push_back("MonitorQueue(" + config.toStyledString() + ")");
}
MonitorQueue::~MonitorQueue() {}
MonitorQueue::MonitorQueue(const MonitorQueue& other) : m_config(other.m_config) {}
MonitorQueue& MonitorQueue::operator=(const MonitorQueue& other) {
  m_config = other.m_config;
  return *this;
}
const Json::Value& MonitorQueue::GetConfig() const { return m_config; }

int MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& name, _tag_monitor_queue_type_ type) {
  fake::Get().monitorCalls.push_back({"upsert", name, type, queue.GetConfig(), ""});
  fake::Get().calls.push_back("MonitorQueue::Upsert(" + name + ")");
  return fake::Get().monitorUpsertResult;
}

int MonitorQueue::Delete(const std::string& queuePath, const std::string& name,
                         _tag_monitor_queue_type_ type) {
  fake::Get().monitorCalls.push_back({"delete", name, type, Json::Value(), queuePath});
  fake::Get().calls.push_back("MonitorQueue::Delete(" + queuePath + ")");
  return fake::Get().monitorDeleteResult;
}

}  // namespace TAVOTIFYD
}  // namespace TAVO
