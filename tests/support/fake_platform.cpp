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

// Records "function(args)"; a forced result is returned instead of answer(), a negative one
// with the platform error (code, file, line) set when code is not 0.
template <typename F>
int Answer(const char* function, const std::string& args, F answer, int code = 0, const char* file = "",
           int line = 0) {
  Get().calls.push_back(std::string(function) + "(" + args + ")");
  auto it = Get().forced.find(function);
  if (it == Get().forced.end()) return answer();
  if (it->second < 0 && code != 0) VLIBCErrSetEx(code, file, line);
  return it->second;
}

int In(const std::set<std::string>& set, const char* path) { return set.count(path) ? 1 : 0; }

bool Inside(const std::string& full, const std::string& dir) {
  return full.compare(0, dir.size(), dir) == 0 && (full.size() == dir.size() || full[dir.size()] == '/');
}

int ShareFlag(const char* function, PTAVOSHARE share, int* out, int value) {
  return Answer(function, Quote(share ? share->szName : nullptr), [&] { return *out = value, 0; });
}
}  // namespace

Platform& Get() { return *g_platform; }

void Reset() { *g_platform = Platform(), g_clockSet = false; }

Share& AddShare(const std::string& root, const std::string& volume, const std::string& name) {
  Share& share = Get().shares[name] = Share();
  share.name = name;
  share.dir = root + volume + "/" + name;
  std::filesystem::create_directories(share.dir);
  return share;
}

std::vector<std::string> CallsStartingWith(const std::string& prefix) {
  std::vector<std::string> out;
  for (const std::string& call : Get().calls)
    if (call.compare(0, prefix.size(), prefix) == 0) out.push_back(call);
  return out;
}

void SetClock(long long now) { g_clockSet = true, g_clock = now; }

}  // namespace fake

using fake::Answer;
using fake::Get;
using fake::Quote;

extern "C" {

time_t time(time_t* out) noexcept {
  struct timespec ts = {static_cast<time_t>(fake::g_clock), 0};
  if (!fake::g_clockSet) clock_gettime(CLOCK_REALTIME, &ts);
  if (out != nullptr) *out = ts.tv_sec;
  return ts.tv_sec;
}

int TAVOShareGet(const char* szName, PTAVOSHARE* ppShare) {
  return Answer("TAVOShareGet", Quote(szName), [&] {
    auto it = Get().shares.find(szName == nullptr ? "" : szName);
    if (szName == nullptr || it == Get().shares.end()) return VLIBCErrSetEx(0x1400, "fake", 1), -1;
    PTAVOSHARE share = static_cast<PTAVOSHARE>(std::calloc(1, sizeof(TAVOSHARE)));
    share->szName = ::strdup(it->second.name.c_str());
    share->szComment = ::strdup("");
    share->szPath = ::strdup(it->second.dir.c_str());
    share->blEncrypted = it->second.encrypted;
    share->blEncryption = it->second.encryption;
    return *ppShare = share, 0;
  });
}

void TAVOShareFree(PTAVOSHARE pShare) {
  Get().calls.push_back("TAVOShareFree(" + Quote(pShare ? pShare->szName : nullptr) + ")");
  if (pShare == nullptr) return;
  std::free(pShare->szName), std::free(pShare->szComment), std::free(pShare->szPath), std::free(pShare);
}

int TAVOShareNamePathGet(const char* szFullPath, char* szName, int cbName, char* szPath, int cbPath) {
  return Answer("TAVOShareNamePathGet", Quote(szFullPath), [&] {
    const fake::Share* best = nullptr;  // the deepest share holding the path
    for (const auto& entry : Get().shares)
      if (fake::Inside(szFullPath, entry.second.dir) && (!best || entry.second.dir.size() > best->dir.size()))
        best = &entry.second;
    if (best == nullptr) return VLIBCErrSetEx(0x1400, "fake", 2), -1;
    std::snprintf(szName, cbName, "%s", best->name.c_str());
    std::snprintf(szPath, cbPath, "%s", best->dir.c_str());
    return 0;
  });
}

int VLIBShareIsEncryptedGet(PTAVOSHARE s, int* pbl) {
  return fake::ShareFlag("VLIBShareIsEncryptedGet", s, pbl, s && s->blEncrypted);
}
int VLIBShareIsEncryptionGet(PTAVOSHARE s, int* pbl) {
  return fake::ShareFlag("VLIBShareIsEncryptionGet", s, pbl, s && s->blEncryption);
}
int VLIBShareIsReadOnlyGet(PTAVOSHARE s, int* pbl) {
  return fake::ShareFlag("VLIBShareIsReadOnlyGet", s, pbl, s && s->blReadOnly);
}

int TAVOShareIsShareRecycle(const char* p) {
  return Answer("TAVOShareIsShareRecycle", Quote(p), [&] { return fake::In(Get().recyclePaths, p); });
}
int TAVOFSDirIsMntPoint(const char* p) {
  return Answer("TAVOFSDirIsMntPoint", Quote(p), [&] { return fake::In(Get().mountPoints, p); });
}
int VLIBFhsPathInSnapshot(const char* p, int* pbl) {
  return Answer("VLIBFhsPathInSnapshot", Quote(p),
                [&] { return *pbl = fake::In(Get().snapshotPaths, p), 0; });
}
int TAVOEAIsHiddenDir(const char* szName) {
  return Answer("TAVOEAIsHiddenDir", Quote(szName), [&] { return Quote(szName) == "@eaDir" ? 1 : 0; });
}

int TAVOGetFSType(const char* p, int flag) {
  return Answer("TAVOGetFSType", Quote(p) + "," + std::to_string(flag), [&] {
    auto it = Get().fsTypes.find(p);
    return it == Get().fsTypes.end() ? 0 : it->second;
  });
}
int TAVOFSIsRemoteFS(int t) {
  return Answer("TAVOFSIsRemoteFS", std::to_string(t), [&] { return Get().remoteFsTypes.count(t) ? 1 : 0; });
}
int TAVOFSIsImageFS(int t) {
  return Answer("TAVOFSIsImageFS", std::to_string(t), [&] { return Get().imageFsTypes.count(t) ? 1 : 0; });
}

int TAVOEAMKDir(int flag, const char* p) {
  return Answer("TAVOEAMKDir", std::to_string(flag) + "," + Quote(p), [&] {
    if (::mkdir(p, 0755) == 0 || errno == EEXIST) return 0;
    return VLIBCErrSetEx(0x100, "fake", 3), -1;
  });
}

int TAVOQuotaIsEnough(unsigned int uid, const char* p, unsigned long long cbSize) {
  return Answer("TAVOQuotaIsEnough", std::to_string(uid) + "," + Quote(p) + "," + std::to_string(cbSize), [] {
    if (Get().quotaResult == 0) VLIBCErrSetEx(Get().quotaError, "fake", 4);
    return Get().quotaResult;
  });
}

int VLIBServiceStart(const char* s, int flag) {
  return Answer(
      "VLIBServiceStart", Quote(s) + "," + std::to_string(flag), [] { return 0; }, 0x3000, "service.c", 10);
}
int VLIBServiceStop(const char* s, int flag) {
  return Answer(
      "VLIBServiceStop", Quote(s) + "," + std::to_string(flag), [] { return 0; }, 0x3001, "service.c", 20);
}
int VLIBServiceRestart(const char* s) {
  return Answer(
      "VLIBServiceRestart", Quote(s), [] { return 0; }, 0x3002, "service.c", 30);
}

int TAVOSMBIsEnableSpotlight(void) {
  return Answer("TAVOSMBIsEnableSpotlight", "", [] { return Get().spotlight ? 1 : 0; });
}
int TAVOSMBSetSpotlight(int on) {
  return Answer(
      "TAVOSMBSetSpotlight", std::to_string(on), [&] { return Get().spotlight = on != 0, 0; }, 0x3100,
      "smb.c", 40);
}

int VLIBCExec(const char* szProgram, const char* a1, const char* a2, const char* a3, const char* a4) {
  std::vector<std::string> argv{Quote(szProgram)};
  std::string args = argv[0];
  for (const char* a : {a1, a2, a3, a4}) {
    if (a == nullptr) break;
    argv.push_back(a), args += std::string(",") + a;
  }
  return Answer("VLIBCExec", args, [&] {
    Get().execs.push_back(argv);
    // rm -rf is carried out for real so that tests can see the files go.
    if (argv[0] == "/bin/rm" && argv.size() == 3 && argv[1] == "-rf")
      return std::system(("/bin/rm -rf '" + argv[2] + "'").c_str()) == 0 ? 0 : -1;
    return 0;
  });
}

int VLIBCExecv(const char* szProgram, char* const argv[], int flag) {
  return Answer("VLIBCExecv", Quote(szProgram) + "," + std::to_string(flag), [&] {
    std::vector<std::string> args;
    for (int i = 0; argv != nullptr && argv[i] != nullptr; ++i) args.push_back(argv[i]);
    Get().execs.push_back(args);
    return Get().execvResult;
  });
}

int VLIBCErrGet(void) { return Get().errCode; }
void VLIBCErrSetEx(int code, const char* szFile, int line) {
  fake::Platform& p = Get();
  p.errCode = code, p.errFile = szFile ? szFile : "", p.errLine = line;
  p.calls.push_back("VLIBCErrSetEx(" + std::to_string(code) + "," + p.errFile + "," + std::to_string(line) +
                    ")");
}
const char* VLIBCErrorGetFile(void) { return Get().errFile.c_str(); }
int VLIBCErrorGetLine(void) { return Get().errLine; }
int VLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b) { return strcasecmp(a, b); }

}  // extern "C"

namespace TAVO {
namespace TAVOTIFYD {

MonitorQueue::MonitorQueue(const Json::Value& config) : m_config(config) {
  Get().calls.push_back("MonitorQueue(" + config.toStyledString() + ")");
}
MonitorQueue::~MonitorQueue() = default;
MonitorQueue::MonitorQueue(const MonitorQueue& other) = default;
MonitorQueue& MonitorQueue::operator=(const MonitorQueue& other) = default;
const Json::Value& MonitorQueue::GetConfig() const { return m_config; }

int MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& name, _tag_monitor_queue_type_ type) {
  Get().monitorCalls.push_back({"upsert", name, type, queue.GetConfig(), ""});
  Get().calls.push_back("MonitorQueue::Upsert(" + name + ")");
  return Get().monitorUpsertResult;
}

int MonitorQueue::Delete(const std::string& queuePath, const std::string& name,
                         _tag_monitor_queue_type_ type) {
  Get().monitorCalls.push_back({"delete", name, type, Json::Value(), queuePath});
  Get().calls.push_back("MonitorQueue::Delete(" + queuePath + ")");
  return 1;
}

}  // namespace TAVOTIFYD
}  // namespace TAVO
