// The fast queue reader against the strict JSON parse: it may decide only lines the parser
// reads the same way, and folder status / pending-reindex must answer and log as a plain
// line-by-line scan with the full parser would.
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>

#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "internal/json_io.h"
#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using internal::QueueLineKind;

namespace {

// Random queue lines around one folder: events with escapes, surrogates, raw bytes, loose
// numbers, duplicate or look-alike keys, nesting, plus byte-level damage.
class LineGen {
 public:
  LineGen(uint64_t seed, std::string folder) : rng_(seed), folder_(std::move(folder)) {}
  std::string Line() {
    std::string line = Object();
    static const std::string alphabet = "\"{}[],:\\ 0-e.+/utfn\t";
    for (size_t n = Pick(100) < 70 ? 0 : 1 + Pick(2); n > 0 && !line.empty(); --n) {
      const size_t at = Pick(line.size()), how = Pick(4);
      if (how == 0) line.erase(at, 1);
      if (how == 1) line.insert(at, 1, alphabet[Pick(alphabet.size())]);
      if (how == 2) line.resize(at);
      if (how == 3) line += Pick(2) ? " x" : ",";
    }
    return line;
  }

 private:
  size_t Pick(size_t n) { return static_cast<size_t>(rng_() % n); }
  const std::string& OneOf(const std::vector<std::string>& v) { return v[Pick(v.size())]; }
  std::string Path() {
    static const std::vector<std::string> tails{"", "/a", "x", "/", "\\/d", "\\u002fe"};
    static const std::vector<std::string> pieces{
        "a", "\\/", "\\\"", "\\\\", "\\n", "\\u00e9", "\\ud83d\\ude00", "\\ud800\\u0041", "\\udc00", "\\ud800",
        "\\u12", "\\x", "\\u0000", "\xc3\xa9", "\t", "\x01", "\xff", std::string(1, '\0')};
    std::string text = "\"" + (Pick(4) == 0 ? std::string("/other/f") : folder_ + OneOf(tails));
    while (Pick(100) < 35) text += OneOf(pieces);
    return text + "\"";
  }
  std::string Object() {
    static const std::vector<std::string> events{
        "0",   "1",        "256",          "65536", "4294967295", "4294967296", "-1", "-0", "02", "+2", "2.",
        "1.5", "6.5536e4", "4294967295.0", "-0.0",  "null",       "true",       "\"5\"", "[]", "-", "18446744073709551616"};
    static const std::vector<std::string> values{"-12", "1234567890123456789", "1e400", "01", "+1", "NaN", "nul",
                                                 "null", "[1,[2,{}]]", "{\"a\":[1,-0]}", "[1,]", "\"s\""};
    static const std::vector<std::string> keys{"\"event\"", "\"path\"", "\"path_old\"", "\"data\"", "\"\"",
                                               "\"\\u0065vent\"", "\"pa\\u0074h\"", "\"path \""};
    static const std::vector<std::string> spaces{"", "", "", "", " ", "\t", "\r"};
    std::vector<std::string> members;
    if (Pick(100) < 85) {
      members = {"\"event\":" + OneOf(spaces) + OneOf(events), "\"path\"" + OneOf(spaces) + ":" + Path()};
      if (Pick(2)) std::swap(members[0], members[1]);
    }
    for (size_t i = Pick(4); i > 0; --i) {
      const std::string key = OneOf(keys);
      const std::string value = key == "\"event\"" ? OneOf(events) : key[1] == 'p' || Pick(3) == 0 ? Path() : OneOf(values);
      members.insert(members.begin() + static_cast<long>(Pick(members.size() + 1)), key + ":" + value);
    }
    std::string text = OneOf(spaces) + "{";
    for (size_t i = 0; i < members.size(); ++i) text += (i ? "," + OneOf(spaces) : "") + members[i];
    return text + "}" + OneOf(spaces);
  }
  std::mt19937_64 rng_;
  std::string folder_;
};

// The rule from the strict parse: an object whose "event" converts to an unsigned integer
// and whose "path" is a string; "path_old" when it is a string.
struct Naive {
  bool valid = false, hasPathOld = false;
  unsigned event = 0;
  std::string path, pathOld;
};

Naive NaiveRead(const std::string& line) {
  Naive out;
  Json::Value doc;
  if (!internal::JsonFromString(doc, line) || !doc.isObject() || !doc.isMember("event") ||
      !doc.isMember("path") || !doc["event"].isConvertibleTo(Json::uintValue) || !doc["path"].isString())
    return out;
  const bool hasOld = doc.isMember("path_old") && doc["path_old"].isString();
  return {true, hasOld, doc["event"].asUInt(), doc["path"].asString(), hasOld ? doc["path_old"].asString() : ""};
}

// Alone, at the head of a run, and through ViewQueueLine, the fast reader must agree with
// ParseQueueLine and the rule wherever it decides. Returns its verdict.
QueueLineKind ExpectSameReading(const std::string& line) {
  const Naive n = NaiveRead(line);
  const std::string what = ::testing::PrintToString(line), run = line + "\n{\"event\":1,\"path\":\"/next\"}\n";
  internal::QueueEvent event;
  EXPECT_EQ(internal::ParseQueueLine(line.data(), line.size(), event), n.valid) << what;
  internal::QueueEventView view, inRun, alone;
  const char *end = nullptr, *runEnd = nullptr;
  const QueueLineKind kind = internal::ClassifyQueueLine(line.data(), line.data() + line.size(), view, end);
  EXPECT_EQ(internal::ClassifyQueueLine(run.data(), run.data() + run.size(), inRun, runEnd), kind) << what;
  EXPECT_EQ(internal::ViewQueueLine(line.data(), line.size(), alone), kind == QueueLineKind::kEvent) << what;
  EXPECT_FALSE(kind == QueueLineKind::kNotEvent && n.valid) << "refused an event: " << what;
  if (kind != QueueLineKind::kEvent) return kind;
  EXPECT_TRUE(n.valid) << "took a non-event: " << what;
  EXPECT_EQ(end, line.data() + line.size()) << what;
  EXPECT_EQ(runEnd, run.data() + line.size()) << what;
  for (const internal::QueueEventView* v : {&view, &inRun, &alone}) {
    EXPECT_EQ(v->event, n.event) << what;
    EXPECT_EQ(std::string(v->path, v->pathSize), n.path) << what;
    EXPECT_EQ(v->pathOld ? std::string(v->pathOld, v->pathOldSize) : "<none>", n.hasPathOld ? n.pathOld : "<none>")
        << what;
  }
  return kind;
}

// Common shapes must be decided fast (else every line pays for a document) and right; common
// breakage refused without the parser; parser quirks and loose numbers left to the parser.
TEST(QueueLineDifferential, HandPickedLinesReadAsTheParserReadsThem) {
  const std::pair<QueueLineKind, std::vector<std::string>> table[] = {
      {QueueLineKind::kEvent,
       {R"({"event":256,"path":"/v/q","path_old":"/v/p/a"})", R"({"event":256,"path":"/v/q","path_old":7})",
        R"({"event":256,"path":"/v/q","path_old":"/v/p","path_old":null})", R"({"event":4294967295,"path":""})",
        R"({"event":null,"path":"/a"})", R"({"path":"/x","event":"x","data":{"path":"/y"},"path":"/b","event":3})",
        R"( { "event" : 2 , "path" : "/a" } )", "{\"event\":2,\"path\":\"/a\tb\x01\x7f\xc3\xa9\xff\"}\r",
        R"({"event":2,"path":"\/v\/\"q\"/\\/\b\f\n\r\t\u00e9\u5199\ud83d\ude00\ud800\u0041\udc00\u0000"})",
        R"({"event":2,"path":"/a","data":[[[[1]]],"\ud800\udc00",123456789012345678,-0],"":1})",
        std::string("{\"event\":2,\"path\":\"/a\0b\"}", 25),
        "{\"event\":2,\"path\":\"" + std::string(70000, 'l') + "\"}"}},
      {QueueLineKind::kNotEvent,
       {"", "\r", "{}", "[1]", "null", R"({"event":2,"path":"/v/p\u00)", R"({"event":2,"path":"/v/p",)",
        R"({"event":2,"data":{"a":[1,-)", R"({"event":2,"path":"/a"} x)", R"({"event":2,"path":"/a"}{})",
        R"({"event":"8","path":"/a"})", R"({"event":-1,"path":"/a"})", R"({"event":4294967296,"path":"/a"})",
        R"({"event":2,"path":"/a","path":null})", R"({"path":"/a"})"}},
      {QueueLineKind::kUndecided,
       {R"({"event":1.5,"path":"/a"})", R"({"event":-0,"path":"/a"})", R"({"event":02,"path":"/a"})",
        R"({"event":2,"path":"/a","data":1e400})", R"({"event":2,"path":"/a",})", R"({"\u0065vent":2,"path":"/a"})",
        R"({"event":2,"path":"/a\ud800"})", R"({"event":2,/**/"path":"/a"})",
        "\xef\xbb\xbf{\"event\":2,\"path\":\"/a\"}", std::string("{\"event\":2,\"path\":\"/a\"}\0/x", 26),
        "{\"event\":2,\"path\":\"/a\",\"d\":" + std::string(5000, '[') + std::string(5000, ']') + "}"}}};
  for (const auto& group : table)
    for (const std::string& line : group.second)
      EXPECT_EQ(ExpectSameReading(line), group.first) << ::testing::PrintToString(line);
}

TEST(QueueLineDifferential, GeneratedLinesReadAsTheParserReadsThem) {
  size_t valid = 0, events = 0, refused = 0;
  const size_t kLines = 20000;
  LineGen gen(1, "/volume1/photo/2019");
  for (size_t i = 0; i < kLines && !::testing::Test::HasFailure(); ++i) {
    const std::string line = gen.Line();
    valid += NaiveRead(line).valid;
    const QueueLineKind kind = ExpectSameReading(line);
    events += kind == QueueLineKind::kEvent;
    refused += kind == QueueLineKind::kNotEvent;
  }
  // Both sides reached, and a good share decided fast, or the comparison proves little.
  EXPECT_GT(valid, kLines / 5);
  EXPECT_LT(valid, kLines * 4 / 5);
  EXPECT_GT(events, valid / 5);
  EXPECT_GT(refused, (kLines - valid) / 5);
}

class QueueScanDifferential : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("photo");
    full_ = Rooted("/volume1/photo/2019");
    queue_ = Rooted("/volume1/photo/@eaDir/TAVO@file_index_queue");
    ASSERT_EQ(::mkdir(full_.c_str(), 0755), 0);
    ASSERT_EQ(::mkdir(Rooted("/volume1/photo/@eaDir").c_str(), 0755), 0);
  }

  // Folder status, its log, and whether a settings event is absorbed, against a plain scan.
  std::pair<bool, bool> ExpectSameAnswers(const std::string& text, const std::string& what) {
    bool inFolder = false, pending = false;
    std::vector<std::string> log;
    const std::string folder = full_ + "/";
    for (size_t start = 0, nl; start < text.size(); start = nl + 1) {
      nl = std::min(text.find('\n', start), text.size());
      const std::string line = text.substr(start, nl - start);
      const Naive e = NaiveRead(line);
      if (!e.valid) {  // syslog stops at a NUL; the capture keeps 16383 bytes
        log.push_back(("status_mgr:47 Malformed command: " + std::string(line.c_str())).substr(0, 16383));
        continue;
      }
      inFolder |= (e.path + "/").compare(0, folder.size(), folder) == 0 ||
                  (e.event == 256 && (e.pathOld + "/").compare(0, folder.size(), folder) == 0);
      pending |= e.event == 65536 && e.path == full_;
    }
    WriteFile(queue_, text);
    logcap::Clear();
    EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), inFolder ? "processing" : "finished") << what;
    EXPECT_EQ(logcap::Texts(), log) << what;
    EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value(Json::objectValue))) << what;
    EXPECT_EQ(ReadFile(queue_).size() == text.size(), pending) << what;
    return {inFolder, pending};
  }

  std::string full_, queue_;
};

// The first files open with a long line that puts the next one across a power-of-two
// offset from 16 KiB to 1 MiB: across the reader's first block edge, whatever its size.
TEST_F(QueueScanDifferential, GeneratedQueuesAnswerAndLogAsThePlainScan) {
  LineGen gen(11, full_);
  std::mt19937_64 rng(12);
  const std::vector<std::string> reindex{
      "{\"event\":65536,\"path\":\"" + full_ + "\"}",
      "{\"path\" : \"" + full_.substr(0, full_.size() - 1) + "\\u0039\", \"event\" : 65536}",
      "{\"event\":65536.0,\"path\":\"" + full_ + "\"}", "{\"event\":\"65536\",\"path\":\"" + full_ + "\"}",
      "{\"event\":65536,\"path\":\"" + full_ + "/\"}", "{\"event\":2,\"path\":\"" + full_ + "/b\""};
  int inFolder = 0, pending = 0;
  const int kFiles = 80;
  for (int file = 0; file < kFiles && !HasFailure(); ++file) {
    std::string text = file < 7 || rng() % 4 == 0 ? reindex[rng() % reindex.size()] + "\n" : "";
    if (file < 7) text = "{\"x\":\"" + std::string((16u << 10 << file) - 9 - rng() % 16, 'w') + "\"}\n" + text;
    for (int n = static_cast<int>(rng() % 20); n > 0; --n) {
      std::string line = gen.Line();  // few lines about the folder, so both answers occur
      if (line.find(full_) != std::string::npos && rng() % 3 != 0) line = "{\"event\":2,\"path\":\"/x\"}";
      text += line + (rng() % 8 == 0 ? "\r\n" : "\n");
    }
    if (rng() % 2 == 0) text += gen.Line();
    const auto answers = ExpectSameAnswers(text, "file " + std::to_string(file));
    inFolder += answers.first;
    pending += answers.second;
  }
  EXPECT_GT(inFolder, kFiles / 5);
  EXPECT_LT(inFolder, kFiles * 4 / 5);
  EXPECT_GT(pending, 3);
}

}  // namespace
