// The fast queue readers against the strict JSON parse: they decide only lines the parser reads the
// same way; folder status / pending-reindex answer and log as a plain scan with the parser would.
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>

#include <algorithm>
#include <random>

#include "internal/json_io.h"
#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using namespace std::string_literals;
using internal::QueueLineKind;

namespace {

using Rng = std::mt19937_64;
std::vector<std::string> Split(const std::string& list) {  // the items of a '|'-separated list
  std::vector<std::string> items(1);
  for (char c : list) c == '|' ? items.emplace_back() : items.back() += c;
  return items;
}
std::string OneOf(Rng& rng, const std::vector<std::string>& items) { return items[rng() % items.size()]; }
std::string OneOf(Rng& rng, const std::string& list) { return OneOf(rng, Split(list)); }

// Random queue lines around one folder: escapes, surrogates, raw bytes, loose numbers, look-alike
// keys, nesting, blanks, plus byte-level damage.
std::string LooseLine(Rng& rng, const std::string& folder) {
  auto path = [&] {
    std::string text = "\"" + (rng() % 4 == 0 ? "/other/f"s : folder + OneOf(rng, "|/a|x|\\/d"s));
    while (rng() % 100 < 35)
      text += OneOf(rng, "\\\"|\\ud83d\\ude00|\\ud800\\u0041|\\udc00|\\u12|\\u0000|\xff|\0"s);
    return text + "\"";
  };
  const std::string events = "1|256|65536|4294967295|4294967296|-1|-0|02|1.5|null|\"5\"", sp = "||| |\t";
  std::vector<std::string> members;
  if (rng() % 100 < 85)
    members = {"\"event\":" + OneOf(rng, events), "\"path\"" + OneOf(rng, sp) + ":" + path()};
  if (!members.empty() && rng() % 2) std::swap(members[0], members[1]);
  for (size_t i = rng() % 4; i > 0; --i) {
    const std::string key = OneOf(rng, "\"event\"|\"path\"|\"path_old\"|\"data\"|\"\\u0065vent\""s);
    const std::string value = key == "\"event\"" ? OneOf(rng, events)
                              : key[1] == 'p' || rng() % 3 == 0
                                  ? path()
                                  : OneOf(rng, "1e400|01|nul|null|[1,[2,{}]]|[1,]|\"s\""s);
    members.insert(members.begin() + static_cast<long>(rng() % (members.size() + 1)), key + ":" + value);
  }
  std::string line = OneOf(rng, sp) + "{";
  for (size_t i = 0; i < members.size(); ++i) line += (i ? "," + OneOf(rng, sp) : "") + members[i];
  line += "}" + OneOf(rng, sp);
  for (size_t n = rng() % 100 < 70 ? 0 : 1 + rng() % 2; n > 0 && !line.empty(); --n) {
    const size_t at = rng() % line.size(), how = rng() % 4;
    if (how == 0) line.erase(at, 1);
    if (how == 1) line.insert(at, 1, "\"{}[],:\\ 0-e.+/utfn\t"[rng() % 20]);
    if (how == 2) line.resize(at);
    if (how == 3) line += rng() % 2 ? " x" : ",";
  }
  return line;
}

// Lines in the daemon's own compact form and near misses of it, for the run reader: numbers at the
// edges, escapes and raw bytes in names, flat and nested "data", blanks and bytes after the object.
std::string CompactLine(Rng& rng, const std::string& folder) {
  auto path = [&] {
    return "\"" + folder +
           OneOf(rng,
                 "|/a|/" + std::string(rng() % 600, 'x') + "|/\\\"|/\\u00e9|/\t\x01\xff|/a\0b|/a\"|/\\"s) +
           "\"";
  };
  const std::string data = OneOf(
      rng,
      R"(null|true|false|nul|{}|{"inode":1,"size":-0,"mtime":123456789012345}|{"a":01}|{"a":1e5}|{"a":1.0}|)"
      R"({"a":1234567890123456}|{"a":-}|{"a":"s","b":true,"c":null,"d":false}|{"a":"\""}|{"a":[1]}|{"a":{}}|)"
      R"({"a":1,}|{"a" :1}|{"a":truex}|{"path":"/x","event":1}|{"a\u0062":1}|{"":""|{"a":")" +
          std::string(rng() % 600, 'd') + "\"}");
  std::vector<std::string> members{
      "\"event\":" + OneOf(rng, "2|256|65536|0|4294967295|4294967296|12345678901|01|-1|1.5|2e1|9"s),
      "\"path\":" + path()};
  for (const std::string& member : Split(OneOf(
           rng, {"", "", "\"path_old\":" + path(), "\"data\":" + data, "\"data\":" + data,
                 "\"data\":" + data + "|\"x\":1", "\"path_old\":7", "\"path\":" + path(), "\"event\":1"})))
    if (!member.empty()) members.push_back(member);
  // The JSON library writes members in the order of their names; other writers keep their own.
  const uint64_t order = rng() % 4;
  if (order == 0) std::sort(members.begin(), members.end());
  if (order == 1) std::shuffle(members.begin(), members.end(), rng);
  std::string line = "{" + members[0];
  for (size_t i = 1; i < members.size(); ++i) line += "," + members[i];
  line += "}" + OneOf(rng, "||| |\r|x|\0|}"s);
  if (rng() % 10 == 0) line.resize(rng() % (line.size() + 1));
  if (rng() % 10 == 0) line.insert(rng() % (line.size() + 1), 1, "\"\\{},:0 \t"[rng() % 10]);
  if (rng() % 10 == 0 && !line.empty()) line.erase(rng() % line.size(), 1);
  return line;
}

// The rule from the strict parse: "event" converts to an unsigned integer, "path" is a string.
bool NaiveRead(const std::string& line, internal::QueueEvent& out) {
  Json::Value doc;
  if (!internal::JsonFromString(doc, line) || !doc.isObject() || !doc.isMember("event") ||
      !doc.isMember("path") || !doc["event"].isConvertibleTo(Json::uintValue) || !doc["path"].isString())
    return false;
  const bool old = doc.isMember("path_old") && doc["path_old"].isString();
  out = {doc["event"].asUInt(), doc["path"].asString(), old ? doc["path_old"].asString() : "<none>", old};
  return true;
}

std::string Show(const internal::QueueEventView& v) {
  return std::to_string(v.event) + "|" + std::string(v.path, v.pathSize) + "|" +
         (v.pathOld ? std::string(v.pathOld, v.pathOldSize) : "<none>");
}

// Alone, in a short run, at the head of a run long enough for the run reader and through ViewQueueLine,
// the fast readers agree with ParseQueueLine and the rule wherever they decide; counts valid events.
QueueLineKind ExpectSameReading(const std::string& line, size_t* valid = nullptr) {
  internal::QueueEvent n, event;
  const bool ok = NaiveRead(line, n);
  const std::string what = ::testing::PrintToString(line), run = line + "\n{\"event\":1}\n",
                    longRun = line + std::string(1025, '\n');
  EXPECT_EQ(internal::ParseQueueLine(line.data(), line.size(), event), ok) << what;
  internal::QueueEventView view, inRun, alone, byRun;
  const char *end = nullptr, *runEnd = nullptr, *byRunEnd = nullptr;
  const QueueLineKind kind = internal::ClassifyQueueLine(line.data(), line.data() + line.size(), view, end);
  EXPECT_EQ(internal::ClassifyQueueLine(run.data(), run.data() + run.size(), inRun, runEnd), kind) << what;
  EXPECT_EQ(internal::ViewQueueLine(line.data(), line.size(), alone), kind == QueueLineKind::kEvent) << what;
  EXPECT_EQ(internal::QueueRunClassifier(longRun.data(), longRun.data() + longRun.size())
                .Classify(longRun.data(), byRun, byRunEnd),
            kind)
      << what;
  EXPECT_FALSE(kind == QueueLineKind::kNotEvent && ok) << "refused an event: " << what;
  if (valid) *valid += ok;
  if (kind != QueueLineKind::kEvent) return kind;
  EXPECT_TRUE(ok && end == line.data() + line.size() && runEnd == run.data() + line.size() &&
              byRunEnd == longRun.data() + line.size())
      << what;
  for (const internal::QueueEventView* v : {&view, &inRun, &alone, &byRun})
    EXPECT_EQ(Show(*v), std::to_string(n.event) + "|" + n.path + "|" + n.pathOld) << what;
  return kind;
}

// Common shapes decided fast and right, common breakage refused, parser quirks left to the parser;
// then seeds with every one-byte deletion and delimiter insertion (a dropped colon check in the run
// reader's flat-object loop showed only there), and generated lines.
TEST(QueueLineDifferential, HandPickedAndGeneratedLinesReadAsTheParserReadsThem) {
  const std::pair<QueueLineKind, std::vector<std::string>> table[] = {
      {QueueLineKind::kEvent,
       {R"({"event":256,"path":"/v/q","path_old":"/v/p/a"})",
        R"({"event":4294967295,"path":"","path_old":7})",
        R"({"event":2,"path":"/a","path_old":"/b","path_old":[]})", "{\"event\":2,\"path\":\"/a\0b\"}"s,
        "{\"event\":2,\"path\":\"/a\tb\x01\x7f\xc3\xa9\xff\\u0000\\ud800\\u0041\"}\r",
        R"( {"path":"/x","event":"x","data":{"path":"/y"},"path":"/b" , "event":3} )",
        R"({"event":2,"path":"\/v\/\"q\"/\\/\b\f\n\r\t\u00e9\ud83d\ude00\udc00"})",
        "{\"event\":2,\"path\":\"" + std::string(70000, 'l') + "\"}"}},
      {QueueLineKind::kNotEvent,
       {"", R"({"event":2,"path":"/v/p\u00)", R"({"event":2,"path":"/a"} x)", R"({"event":"8","path":"/a"})",
        R"({"event":-1,"path":"/a"})", R"({"event":4294967296,"path":"/a"})", R"({"path":"/a"})"}},
      {QueueLineKind::kUndecided,
       {R"({"event":1.5,"path":"/a"})", R"({"event":-0,"path":"/a"})", R"({"\u0065vent":2,"path":"/a"})",
        R"({"event":2,"path":"/a\ud800"})", "{\"event\":2,\"path\":\"/a\"}\0/x"s,
        "{\"event\":2,\"path\":\"/a\",\"d\":" + std::string(5000, '[') + std::string(5000, ']') + "}"}}};
  for (const auto& [kind, lines] : table)
    for (const std::string& line : lines)
      EXPECT_EQ(ExpectSameReading(line), kind) << ::testing::PrintToString(line);
  int decided = 0;
  for (const char* s :
       {R"({"event":2,"path":"/v/p/a","data":{}})",
        R"({"data":{"inode":12,"size":0,"mtime":-1700000000},"event":2,"path":"/v/p/a"})",
        R"({"event":8,"path":"/a","data":{"a":"s","b":true,"c":null,"d":false}})",
        R"( {"path" : "/v/p", "event" : 256 , "path_old":"/v/q/b", "data":[1,-2,true,null,"s\n\"\u00e9"]} )",
        R"({"event":4294967295,"path":"","path_old":7})", R"({"event":01,"path":"/a","data":"\ud800"})",
        R"({"path":"/x","event":1,"data":{"path":"/y"},"path":"/b","event":3})",
        R"({"event":256,"path":"/v/p/b","path_old":"/v/q/c"})",
        R"({"event":4294967296,"path":"/v/p","data":{"inode":12,"size":0,"mtime":-1,"x":[1.5]}})",
        R"({"event":8,"path":"/v/\u0070","path_old":"/v/q\"","data":null})"}) {
    const std::string seed = s;
    decided += ExpectSameReading(seed) == QueueLineKind::kEvent;
    for (size_t i = 0; i < seed.size(); ++i) {
      decided += ExpectSameReading(seed.substr(0, i) + seed.substr(i + 1)) == QueueLineKind::kEvent;
      for (char c : std::string("\"{}[],:\\ 0-e"))
        decided += ExpectSameReading(seed.substr(0, i) + c + seed.substr(i)) == QueueLineKind::kEvent;
    }
  }
  EXPECT_GT(decided, 100);
  // Generated: both sides reached, and a good share decided fast, or the comparison proves little.
  size_t valid = 0, events = 0, refused = 0;
  const size_t kLines = 20000;
  Rng rng(1);
  for (size_t i = 0; i < kLines && !::testing::Test::HasFailure(); ++i) {
    const QueueLineKind kind = ExpectSameReading(LooseLine(rng, "/volume1/photo/2019"), &valid);
    events += kind == QueueLineKind::kEvent;
    refused += kind == QueueLineKind::kNotEvent;
  }
  EXPECT_TRUE(valid > kLines / 5 && valid < kLines * 4 / 5) << valid;
  EXPECT_TRUE(events > valid / 5 && refused > (kLines - valid) / 5) << events << " " << refused;
}

// Over whole runs as the scan hands them out (masks start anywhere, lines cross where they end, the
// last line may lack its newline) the run reader answers for every line what ClassifyQueueLine does.
TEST(QueueLineDifferential, RunsReadAsLineByLine) {
  Rng rng(5);
  size_t fast = 0, lines = 0;
  for (int round = 0; round < 400 && !::testing::Test::HasFailure(); ++round) {
    std::string text;
    for (size_t n = rng() % 200; n > 0; --n) text += CompactLine(rng, "/volume1/photo/2019") + "\n";
    if (rng() % 2) text += CompactLine(rng, "/v");
    const std::vector<char> exact(text.begin(), text.end());  // the sanitizers see a read past the run
    const char* const end = exact.data() + exact.size();
    internal::QueueRunClassifier run(exact.data(), end);
    for (const char* line = exact.data(); line < end; ++lines, line = std::find(line, end, '\n') + 1) {
      internal::QueueEventView byRun, alone;
      const char *runEnd = nullptr, *aloneEnd = nullptr;
      const QueueLineKind kind = run.Classify(line, byRun, runEnd);
      const std::string what = ::testing::PrintToString(std::string(line, std::find(line, end, '\n')));
      ASSERT_EQ(kind, internal::ClassifyQueueLine(line, end, alone, aloneEnd)) << what;
      if (kind != QueueLineKind::kEvent) continue;
      ++fast;
      EXPECT_EQ(runEnd, aloneEnd) << what;
      EXPECT_EQ(Show(byRun), Show(alone)) << what;
    }
  }
  EXPECT_TRUE(fast > lines / 10 && fast < lines * 9 / 10) << fast << " of " << lines;
}

// Queues of generated lines answer status, log, and absorb a settings event as a plain scan would.
// The first files put their second line across a power-of-two offset from 16 KiB to 1 MiB.
TEST_F(SysrootTest, GeneratedQueuesAnswerAndLogAsThePlainScan) {
  AddShare("photo");
  const std::string full = Rooted("/volume1/photo/2019"), ea = Rooted("/volume1/photo/@eaDir");
  ASSERT_EQ(::mkdir(full.c_str(), 0755) + ::mkdir(ea.c_str(), 0755), 0);
  Rng rng(11);
  const std::string event = "{\"event\":65536", path = ",\"path\":\"" + full;
  const std::vector<std::string> reindex{event + path, event + ".0" + path, event + path + "/"};
  int inFolders = 0, pendings = 0, kFiles = 80;
  for (int file = 0; file < kFiles && !HasFailure(); ++file) {
    std::vector<std::string> lines;
    if (file < 7) lines.push_back("[\"" + std::string((16u << 10 << file) - 5 - rng() % 16, 'w') + "\"]");
    if (file < 7 || rng() % 4 == 0) lines.push_back(OneOf(rng, reindex) + "\"}");
    for (int n = static_cast<int>(rng() % 20); n > 0; --n) {
      std::string& line =
          lines.emplace_back(LooseLine(rng, full));  // rarely about the folder: both answers occur
      if (rng() % 3 && line.find(full) != std::string::npos) line = R"({"event":2,"path":"/x"})";
      if (rng() % 8 == 0) line += "\r";
    }
    const std::string last = rng() % 2 == 0 ? LooseLine(rng, full) : "";  // without a newline
    std::string text, dir = full + "/";
    for (const std::string& line : lines) text += line + "\n";
    if (!last.empty()) lines.push_back(last);
    bool inFolder = false, pending = false;
    std::vector<std::string> log;
    for (const std::string& line : lines) {
      internal::QueueEvent e;
      if (!NaiveRead(line, e))  // syslog stops at a NUL; the capture keeps 16383 bytes
        log.push_back(("status_mgr:47 Malformed command: " + std::string(line.c_str())).substr(0, 16383));
      inFolder |=
          (e.path + "/").rfind(dir, 0) == 0 || (e.event == 256 && (e.pathOld + "/").rfind(dir, 0) == 0);
      pending |= e.event == 65536 && e.path == full;
    }
    WriteFile(ea + "/TAVO@file_index_queue", text + last);
    logcap::Clear();
    EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), inFolder ? "processing" : "finished") << file;
    EXPECT_EQ(logcap::Texts(), log) << file;
    EXPECT_TRUE(AddCustomEvent(131072, full, Json::Value(Json::objectValue))) << file;
    EXPECT_EQ(ReadFile(ea + "/TAVO@file_index_queue").size() == text.size() + last.size(), pending) << file;
    inFolders += inFolder;
    pendings += pending;
  }
  EXPECT_TRUE(inFolders > kFiles / 5 && inFolders < kFiles * 4 / 5 && pendings > 3) << inFolders << pendings;
}

}  // namespace
