// The fast queue reading against the authority: the one-pass line reader must decide
// only lines that the strict JSON parse reads the same way, and the folder status and
// the pending-reindex check must answer and log exactly as a plain line-by-line scan
// with the full parser would.
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "internal/json_io.h"
#include "internal/queue_line_view.h"
#include "internal/queue_scan.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

// Random queue lines around one folder: mostly well-formed events, with everything the
// strict parser treats specially mixed in (escapes, surrogates, raw control bytes,
// duplicate members, loose numbers, nesting), and byte-level damage on top.
class LineGen {
 public:
  LineGen(uint64_t seed, std::string folder) : rng_(seed), folder_(std::move(folder)) {}

  std::string Line() {
    const size_t kind = Pick(100);
    if (kind < 65) return Space() + Object() + Space();
    if (kind < 90) return Mutate(Object());
    static const std::vector<std::string> odd{
        "",
        " ",
        "\r",
        "[1]",
        "5",
        "\"x\"",
        "null",
        "{}",
        "{\"event\":1,/**/\"path\":\"/a\"}",
        "\xef\xbb\xbf{\"event\":1,\"path\":\"/a\"}",
        std::string("{\"event\":1,\"path\":\"/a\"}\0x/", 26),
        "{\"\":1,}",
        "{\"event\":1,\"path\":\"/a\",\"\":2,}",
        std::string(70, '[') + std::string(70, ']'),
        "{\"event\":1,\"path\":\"/a\",\"d\":" + std::string(70, '[') + std::string(70, ']') + "}"};
    return odd[Pick(odd.size())];
  }

  // The folder's path, a path in it, and paths that only look close to it.
  std::string PathText() {
    static const std::vector<std::string> tails{"",  "/a",  "/a/b.jpg", "x",       "x/a",
                                                "/", "//c", "\\/d",     "\\u002fe"};
    std::string text = "\"";
    switch (Pick(5)) {
      case 0:
        text += "/other/share/f";
        break;
      case 1:
        break;
      default:
        text += folder_ + tails[Pick(tails.size())];
    }
    while (Chance(35)) text += Piece();
    return text + "\"";
  }

 private:
  size_t Pick(size_t n) { return static_cast<size_t>(rng_() % n); }
  bool Chance(size_t percent) { return Pick(100) < percent; }
  template <typename T>
  const T& OneOf(const std::vector<T>& items) {
    return items[Pick(items.size())];
  }

  std::string Space() {
    static const std::vector<std::string> spaces{" ", "\t", "\r", "  "};
    return Chance(85) ? "" : OneOf(spaces);
  }

  // Text inside a string: escapes valid and not, raw bytes the parser keeps as they are.
  std::string Piece() {
    static const std::vector<std::string> pieces{"a",
                                                 "/",
                                                 "\\/",
                                                 "\\\"",
                                                 "\\\\",
                                                 "\\n",
                                                 "\\t",
                                                 "\\b\\f\\r",
                                                 "\\u0041",
                                                 "\\u00e9",
                                                 "\\u5199",
                                                 "\\uFFFF",
                                                 "\\ud83d\\ude00",
                                                 "\\ud800\\u0041",
                                                 "\\udc00",
                                                 "\\ud800",
                                                 "\\u12",
                                                 "\\x",
                                                 "\\u0000",
                                                 "\xc3\xa9",
                                                 "\t",
                                                 "\x01",
                                                 "\x7f",
                                                 "\xff",
                                                 " ",
                                                 std::string(1, '\0'),
                                                 std::string(40, 'w')};
    return OneOf(pieces);
  }

  std::string Event() {
    static const std::vector<std::string> events{"0",
                                                 "1",
                                                 "2",
                                                 "256",
                                                 "256",
                                                 "65536",
                                                 "65536",
                                                 "131072",
                                                 "4294967295",
                                                 "4294967296",
                                                 "-1",
                                                 "-0",
                                                 "02",
                                                 "+2",
                                                 "2.",
                                                 "1.5",
                                                 "1e3",
                                                 "6.5536e4",
                                                 "4294967295.0",
                                                 "4294967295.5",
                                                 "4294967296.0",
                                                 "-0.5",
                                                 "-0.0",
                                                 "null",
                                                 "true",
                                                 "false",
                                                 "\"5\"",
                                                 "[]",
                                                 "{}",
                                                 "-",
                                                 "18446744073709551615",
                                                 "18446744073709551616",
                                                 "99999999999999999999",
                                                 "1E2",
                                                 "00",
                                                 "0.0",
                                                 "1x",
                                                 "12345678901"};
    return OneOf(events);
  }

  std::string Number() {
    static const std::vector<std::string> numbers{"0",
                                                  "-0",
                                                  "7",
                                                  "-12",
                                                  "123456789012345678",
                                                  "1234567890123456789",
                                                  "99999999999999999999999",
                                                  "1.5",
                                                  "-2.5e-3",
                                                  "1e400",
                                                  "-",
                                                  "+1",
                                                  "01",
                                                  ".5",
                                                  "5.",
                                                  "1e",
                                                  "NaN",
                                                  "Infinity",
                                                  "-Infinity"};
    return OneOf(numbers);
  }

  std::string Value(int depth) {
    const size_t kind = Pick(depth > 3 ? 4 : 7);
    switch (kind) {
      case 0:
        return Number();
      case 1:
        return PathText();
      case 2: {
        static const std::vector<std::string> literals{"true", "false", "null", "tru", "nul", "True"};
        return OneOf(literals);
      }
      case 3:
        return "\"" + Piece() + Piece() + "\"";
      case 4:
      case 5: {
        std::string text = "[" + Space();
        for (size_t i = Pick(4); i > 0; --i)
          text += Value(depth + 1) + Space() + (i > 1 ? "," + Space() : "");
        return text + "]";
      }
      default: {
        std::string text = "{" + Space();
        for (size_t i = Pick(4); i > 0; --i) {
          text += Key() + Space() + ":" + Space() + Value(depth + 1) + (i > 1 ? "," + Space() : "");
        }
        return text + "}";
      }
    }
  }

  std::string Key() {
    static const std::vector<std::string> keys{
        "\"event\"",       "\"event\"",      "\"event\"", "\"path\"",        "\"path\"", "\"path\"",
        "\"path_old\"",    "\"path_old\"",   "\"data\"",  "\"x\"",           "\"\"",     "\"Event\"",
        "\"\\u0065vent\"", "\"pa\\u0074h\"", "\"path \"", "\"event\\u0000\""};
    return OneOf(keys);
  }

  std::string MemberValue(const std::string& key) {
    if (key == "\"event\"" || key == "\"\\u0065vent\"") return Chance(90) ? Event() : Value(1);
    if (key.compare(0, 5, "\"path") == 0 || key == "\"pa\\u0074h\"")
      return Chance(85) ? PathText() : Value(1);
    return Value(1);
  }

  std::string Object() {
    std::vector<std::string> members;
    // Most objects carry an event and a path, in either order.
    if (Chance(85)) {
      members.push_back("\"event\"" + Space() + ":" + Space() + Event());
      members.push_back("\"path\"" + Space() + ":" + Space() + PathText());
      if (Chance(50)) std::swap(members[0], members[1]);
    }
    for (size_t i = Pick(4); i > 0; --i) {
      const std::string key = Key();
      members.insert(members.begin() + static_cast<long>(Pick(members.size() + 1)),
                     key + Space() + ":" + Space() + MemberValue(key));
    }
    std::string text = "{" + Space();
    for (size_t i = 0; i < members.size(); ++i) text += (i > 0 ? "," + Space() : "") + members[i] + Space();
    return text + "}";
  }

  std::string Mutate(std::string line) {
    static const std::string alphabet = "\"{}[],:\\ 0-e.+/utfn\t\r";
    for (size_t n = 1 + Pick(2); n > 0 && !line.empty(); --n) {
      const size_t at = Pick(line.size());
      switch (Pick(5)) {
        case 0:
          line.erase(at, 1);
          break;
        case 1:
          line.insert(at, 1, alphabet[Pick(alphabet.size())]);
          break;
        case 2:
          line[at] = alphabet[Pick(alphabet.size())];
          break;
        case 3:
          line.resize(at);
          break;
        default:
          line += Chance(50) ? " x" : ",";
      }
    }
    return line;
  }

  std::mt19937_64 rng_;
  std::string folder_;
};

// The rule, straight from the strict parse: an object whose "event" converts to an
// unsigned integer and whose "path" is a string; "path_old" when it is a string.
struct Naive {
  bool valid = false;
  unsigned event = 0;
  std::string path;
  bool hasPathOld = false;
  std::string pathOld;
};

Naive NaiveRead(const std::string& line) {
  Naive out;
  Json::Value doc;
  if (!internal::JsonFromString(doc, line) || !doc.isObject()) return out;
  if (!doc.isMember("event") || !doc.isMember("path")) return out;
  const Json::Value& event = doc["event"];
  const Json::Value& path = doc["path"];
  if (!event.isConvertibleTo(Json::uintValue) || !path.isString()) return out;
  out.valid = true;
  out.event = event.asUInt();
  out.path = path.asString();
  out.hasPathOld = doc.isMember("path_old") && doc["path_old"].isString();
  if (out.hasPathOld) out.pathOld = doc["path_old"].asString();
  return out;
}

std::vector<std::string> NaiveSplit(const std::string& text) {
  std::vector<std::string> lines;
  for (size_t start = 0; start < text.size();) {
    size_t nl = text.find('\n', start);
    if (nl == std::string::npos) nl = text.size();
    lines.push_back(text.substr(start, nl - start));
    start = nl + 1;
  }
  return lines;
}

std::string Printable(const std::string& line) {
  std::string out;
  for (unsigned char c : line) {
    if (c < 0x20 || c >= 0x7f) {
      char hex[8];
      std::snprintf(hex, sizeof(hex), "\\x%02x", c);
      out += hex;
    } else {
      out += static_cast<char>(c);
    }
  }
  return out;
}

void ExpectSameValues(const internal::QueueEventView& view, const Naive& naive, const std::string& line) {
  EXPECT_EQ(view.event, naive.event) << Printable(line);
  EXPECT_EQ(std::string(view.path, view.pathSize), naive.path) << Printable(line);
  EXPECT_EQ(view.pathOld != nullptr, naive.hasPathOld) << Printable(line);
  if (view.pathOld != nullptr && naive.hasPathOld) {
    EXPECT_EQ(std::string(view.pathOld, view.pathOldSize), naive.pathOld) << Printable(line);
  }
}

// Wherever the fast reader decides, alone or at the head of a run of lines, it must
// agree with ParseQueueLine and with the rule. Returns its verdict.
internal::QueueLineKind ExpectSameReading(const std::string& line) {
  const Naive naive = NaiveRead(line);
  internal::QueueEvent event;
  const bool parsed = internal::ParseQueueLine(line.data(), line.size(), event);
  EXPECT_EQ(parsed, naive.valid) << Printable(line);

  internal::QueueEventView view;
  const char* lineEnd = nullptr;
  const internal::QueueLineKind kind =
      internal::ClassifyQueueLine(line.data(), line.data() + line.size(), view, lineEnd);
  const std::string run = line + "\n{\"event\":1,\"path\":\"/next\"}\n";
  internal::QueueEventView inRun;
  const char* runLineEnd = nullptr;
  EXPECT_EQ(internal::ClassifyQueueLine(run.data(), run.data() + run.size(), inRun, runLineEnd), kind)
      << Printable(line);
  internal::QueueEventView alone;
  EXPECT_EQ(internal::ViewQueueLine(line.data(), line.size(), alone), kind == internal::QueueLineKind::kEvent)
      << Printable(line);

  if (kind == internal::QueueLineKind::kNotEvent) {
    EXPECT_FALSE(naive.valid) << "refused an event: " << Printable(line);
  } else if (kind == internal::QueueLineKind::kEvent) {
    EXPECT_TRUE(naive.valid) << "decided a line that is not an event: " << Printable(line);
    EXPECT_EQ(lineEnd, line.data() + line.size()) << Printable(line);
    EXPECT_EQ(runLineEnd, run.data() + line.size()) << Printable(line);
    ExpectSameValues(view, naive, line);
    ExpectSameValues(inRun, naive, line);
    ExpectSameValues(alone, naive, line);
  }
  return kind;
}

TEST(QueueLineDifferential, HandPickedLinesReadAsTheParserReadsThem) {
  // The common shapes must be decided by the fast reader, or every such line would pay
  // for a document; and they must be read exactly as the parser reads them.
  const std::vector<std::string> common{
      R"({"event":2,"path":"/v/p/a.jpg"})",
      R"({"event":8,"path":"/v/p/a","data":{"inode":12,"size":-3,"tags":["a",1,true,null,{}]}})",
      R"({"event":256,"path":"/v/q","path_old":"/v/p/a"})",
      R"({"event":256,"path":"/v/q","path_old":7})",
      R"({"event":256,"path":"/v/q","path_old":"/v/p","path_old":null})",
      R"({"event":131072,"path":"/v/p","data":{"path":"/p","name":"p","document":true}})",
      R"({"event":0,"path":""})",
      R"({"event":4294967295,"path":"/a"})",
      R"({"event":null,"path":"/a"})",
      R"({"event":true,"path":"/a"})",
      R"({"event":false,"path":"/a"})",
      R"({"event":"x","event":3,"path":5,"path":"/b"})",
      R"({"path":"/x","event":1,"data":{"path":"/y","event":"no"},"path":"/b","event":3})",
      R"( { "event" : 2 , "path" : "/a" } )",
      "{\"event\":2,\"path\":\"/a\"}\r",
      "{\"event\":2,\"path\":\"/a\tb\x01\x7f\"}",
      "{\"event\":2,\"path\":\"/\xc3\xa9t\xc3\xa9/\xe5\x86\x99\xff\"}",
      R"({"event":2,"path":"\/v\/p\/a"})",
      R"({"event":2,"path":"/v/\"q\"/\\/\b\f\n\r\t"})",
      R"({"event":2,"path":"/v/\u00e9\u5199\uFFFF\u0041"})",
      R"({"event":2,"path":"/v/\ud83d\ude00"})",
      R"({"event":2,"path":"/v/\ud800\u0041"})",
      R"({"event":2,"path":"/v/\udc00"})",
      R"({"event":2,"path":"/v/\u0000/x"})",
      R"({"event":256,"path":"/a","path_old":"/v/p/\u0041"})",
      R"({"event":2,"path":"/a","data":"\ud800\udc00\\\"\/"})",
      R"({"event":2,"path":"/a","data":[[[[[[[[[[1]]]]]]]]]]})",
      R"({"event":2,"path":"/a","data":123456789012345678})",
      R"({"event":2,"path":"/a","data":-0})",
      R"({"event":2,"path":"/a","":1})",
      std::string("{\"event\":2,\"path\":\"/a\0b\"}", 25),
      "{\"event\":2,\"path\":\"" + std::string(70000, 'l') + "\"}",
  };
  for (const std::string& line : common) {
    EXPECT_EQ(ExpectSameReading(line), internal::QueueLineKind::kEvent) << Printable(line);
  }

  // The ways a queue line commonly breaks must be refused without the parser too.
  const std::vector<std::string> broken{
      "",
      "   ",
      "\r",
      "{",
      "{}",
      "[1]",
      "\"x\"",
      "5",
      "null",
      "-",
      "tru",
      R"({"event":2,"path":"/v/p)",
      R"({"event":2,"path":"/v/p\)",
      R"({"event":2,"path":"/v/p\u00)",
      R"({"event":2,"path":"/v/p\ud83d)",
      R"({"event":2,"path":"/v/p")",
      R"({"event":2,"path":"/v/p",)",
      R"({"event":2,"path":)",
      R"({"event":2,"path")",
      R"({"event":2,"data":{"a":[1,-)",
      R"({"event":nul)",
      R"({"event":-)",
      R"({"event":2,"path":"/a"} x)",
      R"({"event":2,"path":"/a"}/**/)",
      R"({"event":2,"path":"/a"}})",
      R"({"event":2,"path":"/a"}{})",
      R"({"event":"8","path":"/a"})",
      R"({"event":-1,"path":"/a"})",
      R"({"event":4294967296,"path":"/a"})",
      R"({"event":[2],"path":"/a"})",
      R"({"event":2,"path":5})",
      R"({"event":2,"path":"/a","path":null})",
      R"({"event":2})",
      R"({"path":"/a"})",
  };
  for (const std::string& line : broken) {
    EXPECT_EQ(ExpectSameReading(line), internal::QueueLineKind::kNotEvent) << Printable(line);
  }

  // Lines the fast reader leaves to the parser, whatever the parser then says: loose
  // numbers that the JSON library still reads, its other quirks, and malformed lines
  // whose refusal would take more than the strict grammar to be sure of.
  const std::vector<std::string> others{
      R"({"event":1.5,"path":"/a"})",
      R"({"event":4294967295.0,"path":"/a"})",
      R"({"event":6.5536e4,"path":"/a"})",
      R"({"event":-0.0,"path":"/a"})",
      R"({"event":-0,"path":"/a"})",
      R"({"event":02,"path":"/a"})",
      R"({"event":+2,"path":"/a"})",
      R"({"event":2.,"path":"/a"})",
      R"({"event":-,"path":"/a"})",
      R"({"event":18446744073709551616,"path":"/a"})",
      R"({"event":2,"path":"/a","data":1e400})",
      R"({"event":2,"path":"/a","data":99999999999999999999999})",
      R"({"event":2,"path":"/a","data":01})",
      R"({"event":2,"path":"/a","":1,})",
      R"({"":1,})",
      R"({"event":2,"path":"/a",})",
      R"({"event":2,"path":"/a","data":[1,]})",
      R"({"\u0065vent":2,"path":"/a"})",
      R"({"event":2,"pa\u0074h":"/a"})",
      R"({"event":2,"path":"/a\x"})",
      R"({"event":2,"path":"/a\u12"})",
      R"({"event":2,"path":"/a\ud800"})",
      R"({"event":2,"path":"/a\ud800\x"})",
      R"({"event":2,/**/"path":"/a"})",
      R"({'event':2,'path':'/a'})",
      R"({"event":2,"path":"/a","data":tru})",
      R"({"event":2,"path":"/a","data":NaN})",
      "\xef\xbb\xbf{\"event\":2,\"path\":\"/a\"}",
      std::string("{\"event\":2,\"path\":\"/a\"}\0/x", 26),
      std::string("{\"event\":2,\"path\":\"/a\"}\0", 24),
      "{\"event\":2,\"path\":\"/a\",\"d\":" + std::string(70, '[') + std::string(70, ']') + "}",
      "{\"event\":2,\"path\":\"/a\",\"d\":" + std::string(5000, '[') + std::string(5000, ']') + "}",
  };
  for (const std::string& line : others) {
    EXPECT_EQ(ExpectSameReading(line), internal::QueueLineKind::kUndecided) << Printable(line);
  }
}

TEST(QueueLineDifferential, GeneratedLinesReadAsTheParserReadsThem) {
  size_t lines = 0, valid = 0, events = 0, escapedEvents = 0, refused = 0;
  for (uint64_t seed = 1; seed <= 8; ++seed) {
    LineGen gen(seed, "/volume1/photo/2019");
    for (int i = 0; i < 25000; ++i) {
      const std::string line = gen.Line();
      ++lines;
      if (NaiveRead(line).valid) ++valid;
      switch (ExpectSameReading(line)) {
        case internal::QueueLineKind::kEvent:
          ++events;
          if (line.find('\\') != std::string::npos) ++escapedEvents;
          break;
        case internal::QueueLineKind::kNotEvent:
          ++refused;
          break;
        default:
          break;
      }
      if (::testing::Test::HasFailure()) return;
    }
  }
  // The generator must reach both sides, and the fast reader must decide a good share
  // of them even in this mix of quirks, or the comparison would prove little.
  EXPECT_EQ(lines, 200000u);
  EXPECT_GT(valid, lines / 5);
  EXPECT_LT(valid, lines * 4 / 5);
  EXPECT_GT(events, valid / 5);
  EXPECT_GT(escapedEvents, 1000u);
  EXPECT_GT(refused, (lines - valid) / 5);
}

class QueueLineReaderTest : public SysrootTest {};

TEST_F(QueueLineReaderTest, SplitsTheFileLikeItsNewlines) {
  const std::string path = Rooted("/queue");
  std::mt19937_64 rng(3);
  // Lines longer than any block the reader starts with, lines across block edges, empty
  // lines and files, and files with and without a last newline.
  const std::vector<size_t> lengths{0, 1, 100, 4095, 65535, 65536, 262143, 262144, 262145, 600000, 1100000};
  for (int round = 0; round < 24; ++round) {
    std::string text;
    for (int n = static_cast<int>(rng() % 40); n > 0; --n) {
      text += std::string(rng() % 3 == 0 ? lengths[rng() % lengths.size()] : rng() % 300, 'a' + rng() % 26);
      text += rng() % 10 == 0 ? "\r\n" : "\n";
    }
    if (round % 2 == 1) text += "tail";
    WriteFile(path, text);
    const std::vector<std::string> expected = NaiveSplit(text);

    internal::QueueLineReader byLine;
    ASSERT_TRUE(byLine.Open(path));
    std::vector<std::string> lines;
    const char* data;
    size_t size;
    while (byLine.NextLine(data, size)) lines.emplace_back(data, size);
    EXPECT_EQ(lines, expected) << "round " << round;

    // Runs of whole lines put back together are the file.
    internal::QueueLineReader byRun;
    ASSERT_TRUE(byRun.Open(path));
    std::string joined;
    while (byRun.NextLines(data, size)) {
      ASSERT_GT(size, 0u);
      joined.append(data, size);
      if (joined.size() < text.size()) {
        EXPECT_EQ(joined.back(), '\n') << "round " << round;
      }
    }
    EXPECT_EQ(joined, text) << "round " << round;
  }
  ::unlink(path.c_str());
  internal::QueueLineReader missing;
  errno = 0;
  EXPECT_FALSE(missing.Open(path));
  EXPECT_EQ(errno, ENOENT);
}

class QueueScanDifferential : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("photo");
    ASSERT_EQ(::mkdir(Rooted("/volume1/photo/2019").c_str(), 0755), 0);
    ASSERT_EQ(::mkdir(Rooted("/volume1/photo/@eaDir").c_str(), 0755), 0);
    full_ = Rooted("/volume1/photo/2019");
    queue_ = Rooted("/volume1/photo/@eaDir/TAVO@file_index_queue");
  }

  // The scan as written plainly: every line through the strict parser, each malformed
  // one logged as the status report logs it.
  bool NaiveInFolder(const std::string& text, std::vector<std::string>& log) const {
    bool found = false;
    const std::string folder = full_ + "/";
    for (const std::string& line : NaiveSplit(text)) {
      const Naive event = NaiveRead(line);
      if (!event.valid) {
        // syslog's text stops at a NUL byte; the capture keeps 16383 bytes of it.
        log.push_back(("status_mgr:47 Malformed command: " + std::string(line.c_str())).substr(0, 16383));
        continue;
      }
      const std::string path = event.path + "/";
      const std::string old = event.pathOld + "/";
      if (path.compare(0, folder.size(), folder) == 0 ||
          (event.event == 256 && old.compare(0, folder.size(), folder) == 0)) {
        found = true;
      }
    }
    return found;
  }

  bool NaiveReindexPending(const std::string& text) const {
    for (const std::string& line : NaiveSplit(text)) {
      const Naive event = NaiveRead(line);
      if (event.valid && event.event == 65536 && event.path == full_) return true;
    }
    return false;
  }

  // The folder's status and log, and whether a settings event is absorbed, against the
  // plain scan. Returns {in folder, reindex pending}.
  std::pair<bool, bool> ExpectSameAnswers(const std::string& text, const std::string& what) {
    WriteFile(queue_, text);
    std::vector<std::string> expectedLog;
    const bool inFolder = NaiveInFolder(text, expectedLog);
    logcap::Clear();
    EXPECT_EQ(StatusMgr::GetFolderStatus("/photo/2019"), inFolder ? "processing" : "finished") << what;
    EXPECT_EQ(logcap::Texts(), expectedLog) << what;

    const bool pending = NaiveReindexPending(text);
    EXPECT_TRUE(AddCustomEvent(131072, full_, Json::Value(Json::objectValue))) << what;
    const size_t grown = ReadFile(queue_).size() - text.size();
    if (pending) {
      EXPECT_EQ(grown, 0u) << what;
    } else {
      EXPECT_GT(grown, 0u) << what;
    }
    return {inFolder, pending};
  }

  std::string full_;
  std::string queue_;
};

TEST_F(QueueScanDifferential, GeneratedQueuesAnswerAndLogAsThePlainScan) {
  LineGen gen(11, full_);
  std::mt19937_64 rng(12);
  int inFolder = 0, pending = 0;
  const int kFiles = 300;
  for (int file = 0; file < kFiles; ++file) {
    std::string text;
    for (int n = static_cast<int>(rng() % 30); n > 0; --n) {
      // Few lines about the folder, so that both answers occur.
      std::string line = gen.Line();
      if (line.find(full_) != std::string::npos && rng() % 4 != 0) line = "{\"event\":2,\"path\":\"/x\"}";
      text += line + (rng() % 8 == 0 ? "\r\n" : "\n");
    }
    if (rng() % 2 == 0) text += gen.Line();
    // Reindex events of the folder, and lines that only look like one.
    if (rng() % 6 == 0) {
      const std::vector<std::string> reindex{
          "{\"event\":65536,\"path\":\"" + full_ + "\"}",
          "{\"path\" : \"" + full_ + "\", \"event\" : 65536}",
          "{\"event\":65536,\"path\":\"" + full_.substr(0, full_.size() - 1) + "\\u0039\",\"data\":null}",
          "{\"event\":65536.0,\"path\":\"" + full_ + "\"}",
          "{\"event\":\"65536\",\"path\":\"" + full_ + "\"}",
          "{\"event\":65536,\"path\":\"" + full_ + "/\"}",
          "{\"event\":65537,\"path\":\"" + full_ + "\"}"};
      text = reindex[rng() % reindex.size()] + "\n" + text;
    }
    const std::pair<bool, bool> answers = ExpectSameAnswers(text, "file " + std::to_string(file));
    inFolder += answers.first;
    pending += answers.second;
    if (HasFailure()) return;
  }
  EXPECT_GT(inFolder, kFiles / 5);
  EXPECT_LT(inFolder, kFiles * 4 / 5);
  EXPECT_GT(pending, 3);
}

TEST_F(QueueScanDifferential, LinesAcrossBlockEdgesAreReadWhole) {
  const std::string reindex = "{\"event\":65536,\"path\":\"" + full_ + "\",\"data\":null}";
  const std::string escapedReindex =
      "{\"event\":65536,\"path\":\"" + full_.substr(0, full_.size() - 4) + "\\u0032019\"}";
  const std::string inside = "{\"event\":2,\"path\":\"" + full_ + "/a\"}";
  const std::string malformed = "{\"event\":2,\"path\":\"" + full_ + "/b\"";
  const std::string outside = "{\"event\":2,\"path\":\"" + full_ + "x/c\",\"data\":{\"k\":[1,2,3]}}\n";
  // One line of interest in a queue of ordinary lines about a sibling folder, across a
  // power-of-two offset from 16 KiB to 1 MiB: one of the files has it across the edge
  // of the reader's first block, whatever that block's size.
  const std::string head = "{\"event\":2,\"path\":\"/o\",\"x\":\"";
  const std::string tail = "\"}\n";
  for (const std::string& special : {reindex, escapedReindex, inside, malformed}) {
    for (size_t edge = 16u << 10; edge <= (1u << 20); edge *= 2) {
      const size_t start = edge - special.size() / 2;
      std::string text;
      while (text.size() + outside.size() + 64 < start) text += outside;
      // A filler line whose length puts the line of interest across the edge.
      text += head + std::string(start - text.size() - head.size() - tail.size(), 'w') + tail;
      text += special + "\n" + outside + outside;
      const std::string what = Printable(special) + " across " + std::to_string(edge);
      const std::pair<bool, bool> answers = ExpectSameAnswers(text, what);
      EXPECT_EQ(answers.first, special != malformed) << what;
      EXPECT_EQ(answers.second, special == reindex || special == escapedReindex) << what;
    }
  }
  // Without the line of interest nothing matches.
  std::string plain;
  while (plain.size() < (1u << 20)) plain += outside;
  EXPECT_EQ(ExpectSameAnswers(plain, "plain"), std::make_pair(false, false));
}

}  // namespace
