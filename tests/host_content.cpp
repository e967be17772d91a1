// What is inside the files, end to end: fileindexd and its extraction worker on files of each
// kind made by the formats' own libraries, searched by their fields through fileindexctl;
// and hostile files, each recorded as failed within its time limit while the service goes on.
#include <zlib.h>

#include <map>
#include <set>

#include "content_samples.h"
#include "host_support.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace host_test;
namespace cs = content_samples;

namespace {

constexpr std::chrono::milliseconds kDeadline = 60s;  // for the sanitizer build; usually a second or two
const std::string kAt = "/photo/mixed/";              // the folder, as searches name its files

class ContentTest : public SandboxTest {
 protected:
  void SetUp() override {
    InitSandbox("host_content", {});
    top_ = root_ + "/volume1/photo/mixed";
    fs::create_directories(top_);
  }
  void CheckLogs() override {
    std::string text = Log();
    // In the sanitizer build the worker's memory limit is the sanitizer's, which says so,
    // either as the limit or as the allocation it refused.
    for (const char* limit :
         {"AddressSanitizer: soft rss limit exhausted", "AddressSanitizer: allocator is out of memory",
          "SUMMARY: AddressSanitizer: out-of-memory"}) {
      for (std::size_t at; (at = text.find(limit)) != std::string::npos;)
        text.erase(at, text.find('\n', at) - at);
    }
    EXPECT_EQ(text.find("Sanitizer"), std::string::npos) << text;
    EXPECT_EQ(text.find("runtime error"), std::string::npos) << text;
  }
  std::string Log() { return ReadFile(root_ + "/var/log/fileindexd.log"); }
  // The daemon is started by the first folder added, with these variables.
  void AddFolder(const std::string& environment = "") {
    Result added = Run({"folders", "add", "/photo/mixed"}, true, environment);
    ASSERT_EQ(added.status, 0) << added.err;
  }
  // share path -> member of the hits of a search ("content" or "kind")
  std::map<std::string, Json::Value> Search(std::vector<std::string> args, const char* member = "content") {
    args.insert(args.begin(), {"search", "--limit", "1000"});
    std::map<std::string, Json::Value> hits;
    const Json::Value result = RunJson(args);
    for (const Json::Value& hit : result["hits"]) hits[hit["path"].asString()] = hit[member];
    return hits;
  }
  std::string Kind(const std::string& words, const std::string& path) {
    return Search({words}, "kind")[path].asString();
  }
  std::set<std::string> Paths(const std::vector<std::string>& args) {
    std::set<std::string> paths;
    for (const auto& hit : Search(args)) paths.insert(hit.first);
    return paths;
  }
  // What `why` says of a file of the folder, or of a share path.
  Json::Value Why(const std::string& name) {
    return ParseJson(Run({"--json", "why", name[0] == '/' ? name : kAt + name}).out);
  }
  // Waits until none of these files of the folder has its contents pending.
  bool WaitExtracted(const std::vector<std::string>& names) {
    auto done = [&] {
      for (const std::string& name : names) {
        const Json::Value why = Why(name);
        if (why.isNull() || why["state"] == "pending" || why["state"] == "content-pending") return false;
      }
      return true;
    };
    return WaitUntil(done, kDeadline);
  }
  std::string top_;
};

TEST_F(ContentTest, FilesOfEachKindAreFoundByTheirFieldsAndText) {
  ASSERT_TRUE(cs::WritePhoto(top_ + "/harbour.jpg", cs::Exif()));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/song.mp3", cs::Tags()));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/reed.flac", {"Reedbed", "Marsh Wren", "Reeds"}, 2));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/tide.opus", {"Slack Water", "Turnstone", "Ebb"}, 7.5));
  ASSERT_TRUE(cs::WriteVideo(top_ + "/clip.mkv", "Lighthouse at dusk", 50));
  cs::Write(top_ + "/report.pdf",
            cs::Pdf({"quarterly figures for the albatross project", "the second page mentions a cormorant"}));
  ASSERT_TRUE(cs::WriteDocx(top_ + "/letter.docx", {"Dear committee,", "the puffin survey is done."}));
  ASSERT_TRUE(cs::WriteOdt(top_ + "/minutes.odt", {"Minutes of the guillemot meeting"}));
  WriteFile(top_ + "/notes.txt", "remember the kittiwake\n");
  // The content decides the kind; the name is a hint only.
  ASSERT_TRUE(cs::WritePhoto(top_ + "/scan", {"2012:03:04 05:06:07", "Heron", "H1"}));
  cs::Write(top_ + "/invoice.jpg", cs::Pdf({"the invoice for the shearwater"}));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/take1.mp3", {"Harbour Lights", "Night Heron"}));
  fs::rename(top_ + "/take1.mp3", top_ + "/take1");
  cs::Write(top_ + "/empty", "");
  cs::Write(top_ + "/blob.bin", std::string(5000, '\x01') + "random");
  const std::vector<std::string> all{"harbour.jpg", "song.mp3",   "reed.flac",   "tide.opus",
                                     "clip.mkv",    "report.pdf", "letter.docx", "minutes.odt",
                                     "notes.txt",   "scan",       "invoice.jpg", "take1"};
  ASSERT_NO_FATAL_FAILURE(AddFolder());
  ASSERT_TRUE(WaitExtracted(all));
  ASSERT_TRUE(WaitExtracted({"blob.bin", "empty"}));
  for (const std::string& name : all) EXPECT_EQ(Why(name)["content"]["state"], "extracted") << name << Log();
  for (const auto& [name, kind] : std::map<std::string, std::string>{
           {"scan", "photo"}, {"invoice.jpg", "document"}, {"take1", "audio"}, {"blob.bin", "other"}})
    EXPECT_EQ(Kind(name.substr(0, name.find('.')), kAt + name), kind) << name;
  EXPECT_EQ(Why("blob.bin")["state"], "indexed") << Why("blob.bin");
  EXPECT_EQ(Why("empty")["reason"], "indexed by its name (inode/x-empty)");

  // Why other files are not indexed.
  WriteFile(top_ + "/@eaDir/thumb.txt", "thumbnail\n");
  EXPECT_EQ(Why("@eaDir/thumb.txt")["state"], "skipped");
  EXPECT_EQ(Run({"why", kAt + "@eaDir/thumb.txt"}).status, 3);
  EXPECT_EQ(Why("/photo/2019/beach.jpg")["state"], "outside");
  EXPECT_EQ(Why("nothing.txt")["state"], "missing");

  // A search -> the files it finds.
  const std::vector<std::pair<std::vector<std::string>, std::set<std::string>>> finds{
      {{"--camera", "heron"}, {"scan"}},
      {{"--kind", "document", "invoice"}, {"invoice.jpg"}},
      {{"--kind", "photo", "invoice"}, {}},
      {{"--album", "REEDS"}, {"reed.flac"}},
      {{"--artist", "turnstone"}, {"tide.opus"}},
      {{"--year", "2011", "song"}, {"song.mp3"}},
      {{"--taken-after", "2015-01-01"}, {"harbour.jpg"}},
      {{"--text", "CORMORANT"}, {"report.pdf"}},
      {{"--text", "puffin survey"}, {"letter.docx"}},
      {{"--text", "guillemot"}, {"minutes.odt"}},
      {{"--text", "kitti"}, {"notes.txt"}},
      {{"--text", "puffin albatross"}, {}}};
  for (const auto& find : finds) {
    SCOPED_TRACE(::testing::PrintToString(find.first));
    std::set<std::string> expected;
    for (const std::string& name : find.second) expected.insert(kAt + name);
    EXPECT_EQ(Paths(find.first), expected);
  }
  // A search -> the fields of its one hit, named by "name"; durations within 200 ms, as formats round.
  const std::vector<std::pair<std::vector<std::string>, std::string>> hits{
      {{"--artist", "gulls"},
       R"({"name": "song.mp3", "title": "Harbour Lights", "album": "Low Tide", "genre": "Folk",
           "year": 2011, "duration_ms": 3000, "mime": "audio/mpeg"})"},
      {{"--camera", "kestrel k-100"},
       R"({"name": "harbour.jpg", "taken": "2019-07-14 10:11:12", "width": 32, "height": 24,
           "latitude": 48.8583, "longitude": -2.2945})"},
      {{"--title", "lighthouse"},
       R"({"name": "clip.mkv", "width": 64, "codecs": "mjpeg", "duration_ms": 2000})"}};
  for (const auto& [args, fields] : hits) {
    Json::Value expected = ParseJson(fields);
    const std::string name = expected["name"].asString();
    expected.removeMember("name");
    SCOPED_TRACE(name);
    auto found = Search(args);
    ASSERT_EQ(found.size(), 1u);
    for (const std::string& field : expected.getMemberNames()) {
      const Json::Value& value = found[kAt + name][field];
      if (field == "duration_ms")
        EXPECT_NEAR(value.asDouble(), expected[field].asDouble(), 200);
      else if (expected[field].type() == Json::realValue)
        EXPECT_NEAR(value.asDouble(), expected[field].asDouble(), 0.001) << field;
      else
        EXPECT_EQ(value, expected[field]) << field;
    }
  }
  // Hits show the words around the match, marked.
  const Json::Value snippet = RunJson({"search", "--text", "cormo"});
  ASSERT_EQ(snippet["hits"].size(), 1u);
  EXPECT_EQ(snippet["hits"][0]["snippet"],
            "…for the albatross project the second page mentions a «cormorant»");

  // Audio switched off: its files go, but a song whose name says nothing stays, by its name
  // only; on again, they come back.
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--no-audio"}).status, 0);
  ASSERT_TRUE(WaitUntil([&] { return Why("song.mp3")["state"] == "kind-off"; }, kDeadline)) << Log();
  ASSERT_TRUE(WaitExtracted({"take1"}));
  EXPECT_EQ(Kind("take1", kAt + "take1"), "other");
  EXPECT_EQ(Why("take1")["content"]["state"], "skipped");
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--audio"}).status, 0);
  for (const char* artist : {"gulls", "night heron"}) {
    auto back = [&] { return Search({"--artist", artist}).size() == 1; };
    EXPECT_TRUE(WaitUntil(back, kDeadline)) << artist << Log();
  }

  // A changed file is extracted again.
  WriteFile(top_ + "/notes.txt", "now the fulmar\n");
  EXPECT_TRUE(WaitUntil([&] { return Paths({"--text", "fulmar"}).size() == 1; }, kDeadline)) << Log();
  EXPECT_TRUE(Paths({"--text", "kittiwake"}).empty());
}

// A PDF of one page whose packed content unpacks to 200 MB of text operators. Words kept
// on the page pile up in the text extractor's memory; words moved off it cost time only.
void WritePdfBomb(const std::string& path, bool onPage) {
  std::string chunk, unpacked = "BT /F1 12 Tf 72 720 Td ";
  for (int i = 0; i < 1000; ++i) chunk += onPage ? "(bomb) Tj 0.0001 0 Td " : "(bomb) Tj 1 0 Td ";
  unpacked.reserve(200u << 20);
  while (unpacked.size() < (200u << 20)) unpacked += chunk;
  unpacked += " ET";
  uLongf size = compressBound(unpacked.size());
  std::string packed(size, '\0');
  compress2(reinterpret_cast<Bytef*>(&packed[0]), &size, reinterpret_cast<const Bytef*>(unpacked.data()),
            unpacked.size(), 9);
  packed.resize(size);
  std::string pdf = cs::Pdf({"placeholder"});
  const std::string shown = "BT /F1 12 Tf 72 720 Td (placeholder) Tj ET";
  const std::string plain =
      "<< /Length " + std::to_string(shown.size()) + " >>\nstream\n" + shown + "\nendstream";
  pdf.replace(pdf.find(plain), plain.size(),
              "<< /Length " + std::to_string(packed.size()) + " /Filter /FlateDecode >>\nstream\n" + packed +
                  "\nendstream");
  cs::Write(path, pdf);  // (the offsets are off now: poppler reconstructs them)
}

TEST_F(ContentTest, HostileFilesAreRecordedAsFailedAndTheServiceGoesOn) {
  // truncated.jpg: cut inside its EXIF block.
  ASSERT_TRUE(cs::WritePhoto(top_ + "/truncated.jpg", cs::Exif()));
  const std::string jpeg = ReadFile(top_ + "/truncated.jpg");
  cs::Write(top_ + "/truncated.jpg", jpeg.substr(0, jpeg.find(std::string("Exif\0\0", 6)) + 60));
  WritePdfBomb(top_ + "/bomb.pdf", true);
  WritePdfBomb(top_ + "/slow.pdf", false);
  // huge-tag.mp3: a 32 MiB ID3v2.3 tag (its size in 7-bit bytes: 10 00 00 00) of one TXXX frame
  // (32 MiB - 10: 01 FF FF F6), before the audio.
  const std::string tag(
      "ID3\x03\x00\x00\x10\x00\x00\x00"
      "TXXX\x01\xFF\xFF\xF6"
      "\x00\x00\x00",
      21);
  cs::Write(top_ + "/huge-tag.mp3", tag + std::string((32u << 20) - 11, 'x') + cs::Mp3Frames(1));
  // bomb.docx: a zip whose document unpacks to 256 MiB of spaces.
  ASSERT_TRUE(cs::WriteZip(
      top_ + "/bomb.docx",
      {{"word/document.xml", "<?xml version=\"1.0\"?><w:document xmlns:w=\"w\"><w:body><w:p><w:t>" +
                                 std::string(256u << 20, ' ') + "</w:t></w:p></w:body></w:document>"}},
      9));
  WriteFile(top_ + "/after.txt", "the sandpiper comes last\n");

  // Each failed, and why.
  const std::map<std::string, std::string> reasons{{"truncated.jpg", "Exiv2"},
                                                   {"slow.pdf", "longer than the limit of 3000 ms"},
                                                   {"huge-tag.mp3", "ID3v2 tag of 32 MiB"},
                                                   {"bomb.docx", "word/document.xml"}};
  auto started = std::chrono::steady_clock::now();
  ASSERT_NO_FATAL_FAILURE(AddFolder("FILEINDEXD_EXTRACT_TIME_LIMIT=3 FILEINDEXD_EXTRACT_MEMORY_LIMIT=256 "));
  ASSERT_TRUE(
      WaitExtracted({"truncated.jpg", "bomb.pdf", "slow.pdf", "huge-tag.mp3", "bomb.docx", "after.txt"}))
      << Log();
  // One file at a time, each within its limit of 3 s: none took much longer.
  EXPECT_LT(std::chrono::steady_clock::now() - started, 30s);
  for (const auto& [name, reason] : reasons) {
    const Json::Value why = Why(name);
    EXPECT_EQ(why["state"], "failed") << name;
    EXPECT_NE(why["content"]["reason"].asString().find(reason), std::string::npos) << name << ": " << why;
  }
  // The bomb takes the worker down by its memory limit (poppler aborts when an allocation
  // fails; the sanitizer build's limit is slower and may lose to the time limit) ...
  const Json::Value bomb = Why("bomb.pdf");
  const std::string why = bomb["content"]["reason"].asString();
  EXPECT_EQ(bomb["state"], "failed");
  EXPECT_TRUE(why.find("killed by signal 6") != std::string::npos ||
              why.find("out of memory") != std::string::npos ||
              why.find("longer than the limit of 3000 ms") != std::string::npos)
      << why;
  // ... and another worker takes over: the file after it is extracted.
  EXPECT_EQ(Paths({"--text", "sandpiper"}), std::set<std::string>{kAt + "after.txt"});
  EXPECT_EQ(RunJson({"status"})["status"], "finished");  // the daemon itself never stopped
}

// A worker that dies on a file (here by SIGABRT, as a library that aborts would) takes only
// that file down: it is recorded as failed with the signal, and the next worker goes on.
TEST_F(ContentTest, AWorkerThatCrashesFailsOnlyItsFile) {
  WritePdfBomb(top_ + "/bomb.pdf", false);
  ASSERT_NO_FATAL_FAILURE(AddFolder("FILEINDEXD_EXTRACT_TIME_LIMIT=60 "));
  // The worker: the daemon's child, busy once it has used some CPU time (user + system) on the bomb.
  pid_t worker = 0;
  auto busy = [&] {
    const std::string daemon = std::to_string(DaemonPid("fileindexd"));
    std::istringstream children(ReadFile("/proc/" + daemon + "/task/" + daemon + "/children"));
    std::string stat, field;
    if (!(children >> worker) || (stat = ReadFile("/proc/" + std::to_string(worker) + "/stat")).empty())
      return false;
    std::istringstream fields(stat.substr(stat.rfind(')') + 2));
    long ticks = 0;
    for (int i = 3; i <= 15 && fields >> field; ++i) ticks += i >= 14 ? std::atol(field.c_str()) : 0;
    return ticks > 20;
  };
  ASSERT_TRUE(WaitUntil(busy, kDeadline)) << Log();
  ASSERT_EQ(::kill(worker, SIGABRT), 0);
  ASSERT_TRUE(WaitExtracted({"bomb.pdf"}));
  Json::Value why = Why("bomb.pdf");
  EXPECT_EQ(why["state"], "failed");
  EXPECT_NE(why["content"]["reason"].asString().find("killed by signal 6"), std::string::npos) << why;
  WriteFile(top_ + "/after.txt", "the turnstone\n");
  auto found = [&] { return Paths({"--text", "turnstone"}).size() == 1; };
  EXPECT_TRUE(WaitUntil(found, kDeadline)) << Why("after.txt") << Log();
}

}  // namespace
