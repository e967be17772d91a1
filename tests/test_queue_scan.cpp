// The fast queue readers against the strict JSON parse: they decide only lines the parser reads the
// same way; the folder status answers and logs as a plain scan with the parser would.
#include <fileindex/status_mgr.h>
#include <sys/stat.h>

#include <algorithm>
#include <random>

#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using namespace std::string_literals;
using internal::QueueLineKind;

namespace {

using Rng = std::mt19937_64;
std::string OneOf(Rng& rng, const std::string& list) {  // an item of a '|'-separated list
  std::vector<std::string> items(1);
  for (char c : list) c == '|' ? items.emplace_back() : items.back() += c;
  return items[rng() % items.size()];
}

// Random queue lines around one folder: escapes, surrogates, raw bytes, loose numbers, look-alike
// keys, nesting, flat objects, long names, blanks, plus byte-level damage.
std::string LooseLine(Rng& rng, const std::string& folder) {
  auto path = [&] {
    std::string text = "\"" + (rng() % 4 == 0 ? "/other/f"s : folder + OneOf(rng, "|/a|x|\\/d"s));
    if (rng() % 16 == 0) text += std::string(rng() % 3000, 'x');
    while (rng() % 100 < 35)
      text += OneOf(rng, "\\\"|\\ud83d\\ude00|\\ud800\\u0041|\\udc00|\\u12|\\u0000|\xff|\0"s);
    return text + "\"";
  };
  const std::string events = "1|256|65536|4294967295|4294967296|-1|-0|02|1.5|null|\"5\"", sp = "||| |\t";
  const std::string values =
      R"(1e400|01|nul|null|[1,[2,{}]]|[1,]|"s"|{"a":1,"b":"s","c":-0}|{"a":true,"b":null})";
  std::vector<std::string> members;
  if (rng() % 100 < 85)
    members = {"\"event\":" + OneOf(rng, events), "\"path\"" + OneOf(rng, sp) + ":" + path()};
  if (!members.empty() && rng() % 2) std::swap(members[0], members[1]);
  for (size_t i = rng() % 4; i > 0; --i) {
    const std::string key = OneOf(rng, "\"event\"|\"path\"|\"path_old\"|\"data\"|\"\\u0065vent\""s);
    const std::string value = key == "\"event\""                ? OneOf(rng, events)
                              : key[1] == 'p' || rng() % 3 == 0 ? path()
                                                                : OneOf(rng, values);
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

std::string Show(const internal::QueueEventView& v) {
  return std::to_string(v.event) + "|" + std::string(v.path, v.pathSize) + "|" +
         (v.pathOld ? std::string(v.pathOld, v.pathOldSize) : "<none>");
}

// Alone, at the head of a run long enough for the run reader and through ViewQueueLine, the fast
// readers agree with the strict ParseQueueLine wherever they decide; counts valid events and tells
// what an event reads as.
QueueLineKind ExpectAlike(const std::string& line, size_t* valid = nullptr, std::string* shown = nullptr) {
  internal::QueueEvent n;
  const bool ok = internal::ParseQueueLine(line.data(), line.size(), n);
  const std::string what = ::testing::PrintToString(line), longRun = line + std::string(1025, '\n');
  internal::QueueEventView view, alone, byRun;
  const char *end = nullptr, *byRunEnd = nullptr;
  const QueueLineKind kind = internal::ClassifyQueueLine(line.data(), line.data() + line.size(), view, end);
  EXPECT_EQ(internal::ViewQueueLine(line.data(), line.size(), alone), kind == QueueLineKind::kEvent) << what;
  internal::QueueRunClassifier longReader(longRun.data(), longRun.data() + longRun.size()),
      unread(longRun.data(), longRun.data() + longRun.size());
  EXPECT_EQ(unread.Classify(longRun.data(), byRun, byRunEnd, internal::QueuePaths::kUnread), kind) << what;
  EXPECT_EQ(longReader.Classify(longRun.data(), byRun, byRunEnd), kind) << what;
  EXPECT_FALSE(kind == QueueLineKind::kNotEvent && ok) << "refused an event: " << what;
  if (valid) *valid += ok;
  if (kind != QueueLineKind::kEvent) return kind;
  EXPECT_TRUE(ok && end == line.data() + line.size() && byRunEnd == longRun.data() + line.size()) << what;
  const std::string expected =
      std::to_string(n.event) + "|" + n.path + "|" + (n.hasPathOld ? n.pathOld : "<none>");
  for (const internal::QueueEventView* v : {&view, &alone, &byRun}) EXPECT_EQ(Show(*v), expected) << what;
  if (shown) *shown = expected;
  return kind;
}

// Common shapes decided fast and right, breakage refused, parser quirks left to the parser. Then runs
// (masks end mid-line, the last line may lack its newline) of every one-byte deletion and delimiter
// insertion of the short lines (a dropped colon check in the run reader's flat-object loop showed
// only there), then of generated lines: each reads alone as the parser reads it, and in its run alike.
void ExpectLinesAndRunsAlike() {
  const std::pair<QueueLineKind, std::vector<std::string>> table[] = {
      {QueueLineKind::kEvent,
       {R"({"event":256,"path":"/v/q","path_old":"/v/p/a"})",
        R"({"event":4294967295,"path":"","path_old":7})",
        "{\"event\":2,\"path\":\"/a\tb\x01\x7f\xc3\xa9\xff\\u0000\\ud800\\u0041\"}\r",
        R"( {"path":"/x","event":"x","data":{"path":"/y"},"path":"/b" , "event":3} )",
        R"({"event":2,"path":"\/v\/\"q\"/\\/\b\f\n\r\t\u00e9\ud83d\ude00\udc00"})",
        R"({"data":{"inode":12,"size":0,"mtime":-1700000000},"event":2,"path":"/v/p/a"})",
        R"({"event":8,"path":"/a","data":{"a":"s","b":true,"c":null,"d":false}})",
        R"({"event":8,"path":"/a","data":{"a}":1,"b,:{":-0,"":123456789012345,"z":70}})",
        R"({"data":{"n":1234567890123456,"size":0},"event":2,"path":"/a"})",
        R"({"data":{"":7,"m_T":-0},"event":2,"path":"/a"})", R"({"event":8,"path":"/a","data":{"x2":5}})",
        R"({"event":8,"path":"/a","data":{"inode":123456789,"size":123456789,"mtime":1700000000,"c":1}})",
        "{\"event\":2,\"path\":\"" + std::string(70000, 'l') + "\"}"}},
      {QueueLineKind::kNotEvent,
       {"", R"({"event":2,"path":"/v/p\u00)", R"({"event":2,"path":"/a"} x)", R"({"event":"8","path":"/a"})",
        R"({"event":4294967296,"path":"/a"})", R"({"path":"/a"})",
        R"({"event":8,"path":"/a","data":{"inode":123456789,"size":123456789,"mtime":1700000000,"c":12}} x)"}},
      {QueueLineKind::kUndecided,
       {R"({"event":1.5,"path":"/a"})", R"({"event":8,"path":"/a","data":{7,"a":2}})",
        R"({"event":8,"path":"/a","data":{"a":1}])", R"({"event":8,"path":"/a","data":{"a":1]})",
        R"({"event":8,"path":"/a","data":{"a":1b":2}})",
        "{\"event\":8,\"path\":\"/a\",\"data\":{\"a\":1\xb1}}", R"({"event":-0,"path":"/a"})",
        R"({"\u0065vent":2,"path":"/a"})", R"({"event":2,"path":"/a\ud800"})",
        R"({"event":2,"path":"/a\ud800\n0000/\ud800xu0000"})", R"({"event":2,"path":"/a\q"})",
        "{\"event\":2,\"path\":\"/a\"}\0/x"s, "{\"event\":2,\"path\":\"/a\\\0\"}"s,
        "{\"event\":2,\"path\":\"/a\",\"d\":" + std::string(5000, '[') + std::string(5000, ']') + "}"}}};
  std::string edited;
  for (const auto& [kind, lines] : table)
    for (const std::string& line : lines) {
      EXPECT_EQ(ExpectAlike(line), kind) << ::testing::PrintToString(line);
      for (size_t i = 0; line.size() < 200 && i < line.size(); ++i) {
        edited += line.substr(0, i) + line.substr(i + 1) + "\n";
        for (char c : std::string("\"{}[],:\\ 0-e\n"))
          edited += line.substr(0, i) + c + line.substr(i) + "\n";
      }
    }
  // Paths of every length up to three mask words, so that a path's closing quote falls in each
  // word the run reader's stop search looks at, whatever the line's offset.
  for (size_t n = 0; n < 200; ++n) edited += "{\"event\":2,\"path\":\"" + std::string(n, 'p') + "\"}\n";
  Rng rng(1);
  size_t lines = 0, valid = 0, events = 0, refused = 0;
  for (int round = 0; round <= 100 && !::testing::Test::HasFailure(); ++round) {
    std::string text = round == 0 ? edited : "";
    for (size_t n = round == 0 ? 0 : rng() % 400; n > 0; --n) text += LooseLine(rng, "/v/p") + "\n";
    if (rng() % 2) text += LooseLine(rng, "/v");
    const std::vector<char> exact(text.begin(), text.end());  // the sanitizers see a read past the run
    const char* const end = exact.data() + exact.size();
    internal::QueueRunClassifier run(exact.data(), end), unread(exact.data(), end);
    for (const char* line = exact.data(); line < end; ++lines, line = std::find(line, end, '\n') + 1) {
      const std::string alone(line, std::find(line, end, '\n'));
      std::string shown;
      const QueueLineKind kind = ExpectAlike(alone, &valid, &shown);
      internal::QueueEventView byRun;
      const char* runEnd = nullptr;
      ASSERT_EQ(run.Classify(line, byRun, runEnd), kind) << ::testing::PrintToString(alone);
      EXPECT_TRUE(kind != QueueLineKind::kEvent || (runEnd == line + alone.size() && Show(byRun) == shown))
          << ::testing::PrintToString(alone);
      ASSERT_EQ(unread.Classify(line, byRun, runEnd, internal::QueuePaths::kUnread), kind)
          << "paths unread: " << ::testing::PrintToString(alone);
      EXPECT_TRUE(kind != QueueLineKind::kEvent || runEnd == line + alone.size())
          << ::testing::PrintToString(alone);
      events += kind == QueueLineKind::kEvent;
      refused += kind == QueueLineKind::kNotEvent;
    }
  }
  // Both sides reached, and a good share decided fast, or the comparison proves little.
  EXPECT_TRUE(valid > lines / 5 && valid < lines * 4 / 5 && events > valid / 5 &&
              refused > (lines - valid) / 5)
      << valid << " " << events << " " << refused << " of " << lines;
}

// Each way of reading flat objects that this processor has.
TEST(QueueLineDifferential, LinesAndRunsReadAsTheParserReadsThem) {
  const internal::FlatObjectReading best = internal::BestFlatObjectReading();
  for (auto reading : {internal::FlatObjectReading::kMemberByMember, internal::FlatObjectReading::kCompared,
                       internal::FlatObjectReading::kLookedUp}) {
    if (reading > best) break;
    SCOPED_TRACE(static_cast<int>(reading));
    internal::UseFlatObjectReading(reading);
    ExpectLinesAndRunsAlike();
  }
  internal::UseFlatObjectReading(best);
}

// Queues of generated lines answer the folder status and log as a plain scan would.
// The first files put their second line across a power-of-two offset from 16 KiB to 1 MiB.
TEST_F(SysrootTest, GeneratedQueuesAnswerAndLogAsThePlainScan) {
  AddShare("photo");
  const std::string full = Full("/photo/2019"), dir = full + "/", queue = Queue("photo");
  ASSERT_EQ(::mkdir(full.c_str(), 0755) + ::mkdir(EaDir("photo").c_str(), 0755), 0);
  Rng rng(11);
  int inFolders = 0, kFiles = 80;
  for (int file = 0; file < kFiles && !HasFailure(); ++file) {
    std::vector<std::string> lines;
    if (file < 7) lines.push_back("[\"" + std::string((16u << 10 << file) - 5 - rng() % 16, 'w') + "\"]");
    if (file < 7 || rng() % 4 == 0) lines.push_back("{\"event\":65536,\"path\":\"" + full + "\"}");
    // Read once the folder is found, when escaped paths are checked but no longer decoded.
    if (file < 7)
      lines.insert(lines.end(), {R"({"event":2,"path":"/x\u12"})", R"({"event":2,"path":"/\u00e9"})"});
    for (size_t n = rng() % 20; n > 0; --n) {  // lines about the folder thinned out: both answers occur
      std::string& line = lines.emplace_back(LooseLine(rng, full));
      if (rng() % 3 && line.find(full) != std::string::npos) line = R"({"event":2,"path":"/x"})";
      if (rng() % 8 == 0) line += "\r";
    }
    std::string text;
    bool inFolder = false;
    std::vector<std::string> log;
    for (const std::string& line : lines) {
      text += line + "\n";
      internal::QueueEvent e;
      if (!internal::ParseQueueLine(line.data(), line.size(),
                                    e))  // syslog stops at a NUL; the capture keeps 16383 bytes
        log.push_back(("status_mgr:47 Malformed command: " + std::string(line.c_str())).substr(0, 16383));
      inFolder |=
          (e.path + "/").rfind(dir, 0) == 0 || (e.event == 256 && (e.pathOld + "/").rfind(dir, 0) == 0);
    }
    if (!lines.empty() && !lines.back().empty() && rng() % 2) text.pop_back();  // the last without "\n"
    WriteFile(queue, text);
    logcap::Clear();
    EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), inFolder ? "processing" : "finished") << file;
    EXPECT_EQ(logcap::Texts(), log) << file;
    inFolders += inFolder;
  }
  EXPECT_TRUE(inFolders > kFiles / 5 && inFolders < kFiles * 4 / 5) << inFolders;
}

}  // namespace
