// What is inside the files, end to end: fileindexd and its extraction worker on files of each
// kind made by the formats' own libraries, searched by their fields through fileindexctl;
// and hostile files, each recorded as failed within its time limit while the service goes on.
#include <sqlite3.h>
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
  ::testing::AssertionResult WaitExtracted(const std::vector<std::string>& names) {
    std::string last;
    auto done = [&] {
      for (const std::string& name : names) {
        Json::Value why = Why(name);
        if (why["state"] == "pending" || why["state"] == "content-pending" || why.isNull()) {
          last = name + ": " + why.toStyledString();
          return false;
        }
      }
      return true;
    };
    if (WaitUntil(done, kDeadline)) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "still pending: " << last << "\ndaemon log:\n" << Log();
  }
  // Files of a kind whose contents are extracted.
  int ContentRows(int kind) {
    sqlite3* db = nullptr;
    sqlite3_stmt* statement = nullptr;
    sqlite3_open_v2((root_ + "/volume1/photo/@eaDir/TAVO@.fileindexdb/index.sqlite3").c_str(), &db,
                    SQLITE_OPEN_READONLY, nullptr);
    sqlite3_prepare_v2(db, "SELECT count(*) FROM contents WHERE kind = ? AND state = 1", -1, &statement,
                       nullptr);
    sqlite3_bind_int(statement, 1, kind);
    int count = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int(statement, 0) : -1;
    sqlite3_finalize(statement);
    sqlite3_close(db);
    return count;
  }

  std::string top_;
};

TEST_F(ContentTest, FilesOfEachKindAreFoundByTheirFieldsAndText) {
  for (const char* dir : {"/photos", "/music", "/papers"}) fs::create_directories(top_ + dir);
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/harbour.jpg", cs::Exif()));
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/old.jpg", {"2009:01:02 08:00:00", "Osprey", "O2"}));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/song.mp3", cs::Tags()));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/reed.flac", {"Reedbed", "Marsh Wren", "Reeds"}, 2));
  ASSERT_TRUE(
      cs::WriteAudio(top_ + "/music/tide.opus", {"Slack Water", "Turnstone", "Ebb", "Ambient", 1999}, 7.5));
  ASSERT_TRUE(cs::WriteVideo(top_ + "/clip.mkv", "Lighthouse at dusk", 50));
  cs::Write(top_ + "/papers/report.pdf",
            cs::Pdf({"quarterly figures for the albatross project", "the second page mentions a cormorant"},
                    "Seabird report"));
  ASSERT_TRUE(cs::WriteDocx(top_ + "/papers/letter.docx", {"Dear committee,", "the puffin survey is done."}));
  ASSERT_TRUE(cs::WriteOdt(top_ + "/papers/minutes.odt", {"Minutes of the guillemot meeting"}));
  WriteFile(top_ + "/papers/notes.txt", "remember the kittiwake\n");
  // The content decides the kind; the name is a hint only.
  const cs::Exif heron{"2012:03:04 05:06:07", "Heron", "H1"};
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/scan", heron));
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/scan2.dat", heron));
  cs::Write(top_ + "/papers/invoice.jpg", cs::Pdf({"the invoice for the shearwater"}));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/take1.mp3", {"Harbour Lights", "Night Heron"}));
  fs::rename(top_ + "/music/take1.mp3", top_ + "/music/take1");
  cs::Write(top_ + "/empty", "");
  cs::Write(top_ + "/blob.bin", std::string(5000, '\x01') + "random");
  const std::vector<std::string> all{
      "photos/harbour.jpg", "photos/old.jpg",     "music/song.mp3",     "music/reed.flac",  "clip.mkv",
      "papers/report.pdf",  "papers/letter.docx", "papers/minutes.odt", "papers/notes.txt", "music/tide.opus",
      "photos/scan",        "photos/scan2.dat",   "papers/invoice.jpg", "music/take1"};
  ASSERT_NO_FATAL_FAILURE(AddFolder());
  ASSERT_TRUE(WaitExtracted(all));
  ASSERT_TRUE(WaitExtracted({"blob.bin", "empty"}));
  for (const std::string& name : all) EXPECT_EQ(Why(name)["content"]["state"], "extracted") << name << Log();
  for (const auto& decided : std::map<std::string, std::string>{{"photos/scan", "photo"},
                                                                {"photos/scan2.dat", "photo"},
                                                                {"papers/invoice.jpg", "document"},
                                                                {"music/take1", "audio"},
                                                                {"blob.bin", "other"}}) {
    const std::string name = decided.first.substr(decided.first.rfind('/') + 1);
    EXPECT_EQ(Kind(name.substr(0, name.find('.')), kAt + decided.first), decided.second) << decided.first;
  }
  EXPECT_EQ(Why("blob.bin")["state"], "indexed") << Why("blob.bin");
  EXPECT_EQ(Why("empty")["reason"], "indexed by its name (inode/x-empty)");

  // Why other files are not indexed.
  WriteFile(top_ + "/@eaDir/thumb.txt", "thumbnail\n");
  Json::Value skipped = Why("@eaDir/thumb.txt");
  EXPECT_EQ(skipped["state"], "skipped") << skipped;
  EXPECT_EQ(skipped["indexed"], false);
  EXPECT_EQ(Run({"why", kAt + "@eaDir/thumb.txt"}).status, 3);
  EXPECT_EQ(Why("/photo/2019/beach.jpg")["state"], "outside");
  EXPECT_EQ(Why("nothing.txt")["state"], "missing");

  // A search -> the files it finds.
  const std::vector<std::pair<std::vector<std::string>, std::set<std::string>>> finds{
      {{"--camera", "heron"}, {"photos/scan", "photos/scan2.dat"}},
      {{"--kind", "document", "invoice"}, {"papers/invoice.jpg"}},
      {{"--kind", "photo", "invoice"}, {}},
      {{"--text", "shearwater"}, {"papers/invoice.jpg"}},
      {{"--album", "REEDS"}, {"music/reed.flac"}},
      {{"--year", "2011", "song"}, {"music/song.mp3"}},
      {{"--taken-after", "2015-01-01"}, {"photos/harbour.jpg"}},
      {{"--taken-before", "2009-01-02"}, {"photos/old.jpg"}},
      {{"--text", "albatross"}, {"papers/report.pdf"}},
      {{"--text", "CORMORANT"}, {"papers/report.pdf"}},
      {{"--text", "puffin survey"}, {"papers/letter.docx"}},
      {{"--text", "guillemot"}, {"papers/minutes.odt"}},
      {{"--text", "kitti"}, {"papers/notes.txt"}},
      {{"--text", "puffin albatross"}, {}}};
  for (const auto& find : finds) {
    SCOPED_TRACE(::testing::PrintToString(find.first));
    std::set<std::string> expected;
    for (const std::string& name : find.second) expected.insert(kAt + name);
    EXPECT_EQ(Paths(find.first), expected);
  }
  // A search -> its one hit's fields; durations within `slack` ms where the format rounds.
  const struct {
    std::vector<std::string> args;
    const char *name, *fields;
    double slack;
  } hits[] = {
      {{"--artist", "gulls"},
       "music/song.mp3",
       R"({"title": "Harbour Lights", "album": "Low Tide", "genre": "Folk", "year": 2011,
           "duration_ms": 3000, "mime": "audio/mpeg"})",
       200},
      {{"--artist", "turnstone"},
       "music/tide.opus",
       R"({"title": "Slack Water", "album": "Ebb", "genre": "Ambient", "year": 1999, "duration_ms": 7500,
           "mime": "audio/ogg"})",
       0},
      {{"--camera", "kestrel k-100"},
       "photos/harbour.jpg",
       R"({"taken": "2019-07-14 10:11:12", "width": 32, "height": 24, "latitude": 48.8583,
           "longitude": -2.2945})",
       0},
      {{"--title", "lighthouse"},
       "clip.mkv",
       R"({"width": 64, "codecs": "mjpeg", "duration_ms": 2000})",
       100}};
  for (const auto& hit : hits) {
    SCOPED_TRACE(hit.name);
    auto found = Search(hit.args);
    ASSERT_EQ(found.size(), 1u);
    const Json::Value& content = found[kAt + hit.name];
    const Json::Value expected = ParseJson(hit.fields);
    ASSERT_TRUE(expected.isObject());
    for (const std::string& field : expected.getMemberNames()) {
      if (field == "duration_ms" || expected[field].type() == Json::realValue)
        EXPECT_NEAR(content[field].asDouble(), expected[field].asDouble(),
                    field == "duration_ms" ? hit.slack : 0.001)
            << field;
      else
        EXPECT_EQ(content[field], expected[field]) << field;
    }
  }
  // Hits show the words around the match, marked.
  const Json::Value snippet = RunJson({"search", "--text", "cormo"});
  ASSERT_EQ(snippet["hits"].size(), 1u);
  EXPECT_EQ(snippet["hits"][0]["snippet"],
            "…for the albatross project the second page mentions a «cormorant»");
  EXPECT_NE(Run({"search", "--text", "albatross"}).out.find("figures for the «albatross» project"),
            std::string::npos);
  EXPECT_GT(Search({"--title", "seabird"})[kAt + "papers/report.pdf"]["text_bytes"].asInt(), 40);
  // The table shows the main fields.
  Result table = Run({"search", "--artist", "gulls"});
  EXPECT_NE(table.out.find("The Gulls, \"Harbour Lights\", Low Tide, 2011"), std::string::npos) << table.out;

  // Audio switched off: its entries and contents go; on again, they come back.
  ASSERT_GT(ContentRows(2), 0);
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--no-audio"}).status, 0);
  ASSERT_TRUE(WaitUntil([&] { return ContentRows(2) == 0; }, kDeadline)) << Log();
  EXPECT_TRUE(Search({"--artist", "gulls"}).empty());
  EXPECT_EQ(Why("music/song.mp3")["state"], "kind-off");
  EXPECT_EQ(Paths({"--text", "albatross"}).size(), 1u);  // the other kinds stay
  // A song whose name says nothing stays, by its name only.
  ASSERT_TRUE(WaitExtracted({"music/take1"}));
  EXPECT_EQ(Kind("take1", kAt + "music/take1"), "other");
  EXPECT_EQ(Why("music/take1")["content"]["state"], "skipped");
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--audio"}).status, 0);
  for (const char* artist : {"gulls", "night heron"})
    EXPECT_TRUE(WaitUntil(
        [&] {
          return Search({"--artist", artist}).size() == 1;
        },
        kDeadline))
        << artist << Log();

  // A changed file is extracted again.
  WriteFile(top_ + "/papers/notes.txt", "now the fulmar\n");
  EXPECT_TRUE(WaitUntil([&] { return Paths({"--text", "fulmar"}).size() == 1; }, kDeadline)) << Log();
  EXPECT_TRUE(Paths({"--text", "kittiwake"}).empty());
}

// A PDF of one page whose packed content unpacks to 200 MB of text operators. Words kept
// on the page pile up in the text extractor's memory; words moved off it cost time only.
bool WritePdfBomb(const std::string& path, bool onPage) {
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
  if (pdf.find(plain) == std::string::npos) return false;
  pdf.replace(pdf.find(plain), plain.size(),
              "<< /Length " + std::to_string(packed.size()) + " /Filter /FlateDecode >>\nstream\n" + packed +
                  "\nendstream");
  cs::Write(path, pdf);  // (the offsets are off now: poppler reconstructs them)
  return true;
}

TEST_F(ContentTest, HostileFilesAreRecordedAsFailedAndTheServiceGoesOn) {
  // truncated.jpg: cut inside its EXIF block.
  ASSERT_TRUE(cs::WritePhoto(top_ + "/whole.jpg", cs::Exif()));
  std::string jpeg = ReadFile(top_ + "/whole.jpg");
  fs::remove(top_ + "/whole.jpg");
  std::size_t exif = jpeg.find(std::string("Exif\0\0", 6));
  ASSERT_NE(exif, std::string::npos);
  cs::Write(top_ + "/truncated.jpg", jpeg.substr(0, exif + 60));
  ASSERT_TRUE(WritePdfBomb(top_ + "/bomb.pdf", true));
  ASSERT_TRUE(WritePdfBomb(top_ + "/slow.pdf", false));
  // huge-tag.mp3: a 32 MiB ID3v2 tag (its size in 7-bit bytes) of one TXXX frame, before the audio.
  const std::uint32_t tagSize = 32u << 20, frameSize = tagSize - 10;
  std::string tag = std::string("ID3\x03\x00\x00", 6);
  for (int shift = 21; shift >= 0; shift -= 7) tag += static_cast<char>((tagSize >> shift) & 0x7F);
  tag += "TXXX";
  for (int shift = 24; shift >= 0; shift -= 8) tag += static_cast<char>((frameSize >> shift) & 0xFF);
  cs::Write(top_ + "/huge-tag.mp3",
            tag + std::string(3, '\0') + std::string(frameSize - 1, 'x') + cs::Mp3Frames(1));
  // bomb.docx: a zip whose document unpacks to 256 MiB of spaces.
  ASSERT_TRUE(cs::WriteZip(
      top_ + "/bomb.docx",
      {{"word/document.xml", "<?xml version=\"1.0\"?><w:document xmlns:w=\"w\"><w:body><w:p><w:t>" +
                                 std::string(256u << 20, ' ') + "</w:t></w:p></w:body></w:document>"}},
      9));
  WriteFile(top_ + "/after.txt", "the sandpiper comes last\n");

  const std::vector<std::string> hostile{"truncated.jpg", "bomb.pdf", "slow.pdf", "huge-tag.mp3",
                                         "bomb.docx"};
  auto started = std::chrono::steady_clock::now();
  ASSERT_NO_FATAL_FAILURE(AddFolder("FILEINDEXD_EXTRACT_TIME_LIMIT=3 FILEINDEXD_EXTRACT_MEMORY_LIMIT=256 "));
  std::vector<std::string> names = hostile;
  names.push_back("after.txt");
  ASSERT_TRUE(WaitExtracted(names));
  // One file at a time, each within its limit of 3 s: none took much longer.
  EXPECT_LT(std::chrono::steady_clock::now() - started, 30s);

  std::map<std::string, std::string> reasons;
  for (const std::string& name : hostile) {
    Json::Value why = Why(name);
    EXPECT_EQ(why["state"], "failed") << name << ": " << why.toStyledString();
    reasons[name] = why["content"]["reason"].asString();
  }
  for (const auto& reason :
       std::map<std::string, std::string>{{"truncated.jpg", "Exiv2"},
                                          {"huge-tag.mp3", "ID3v2 tag of 32 MiB"},
                                          {"bomb.docx", "word/document.xml"},
                                          {"slow.pdf", "longer than the limit of 3000 ms"}})
    EXPECT_NE(reasons[reason.first].find(reason.second), std::string::npos)
        << reason.first << ": " << reasons[reason.first];
  // The bombs take the worker down: one by its memory limit (poppler aborts when an
  // allocation fails; the sanitizer build's limit is slower and may lose to the time
  // limit), the other (above) by its time limit.
  const std::string& bomb = reasons["bomb.pdf"];
  EXPECT_TRUE(bomb.find("killed by signal 6") != std::string::npos ||
              bomb.find("out of memory") != std::string::npos ||
              bomb.find("longer than the limit of 3000 ms") != std::string::npos)
      << bomb;
  // ... and another worker took over: the file after it was extracted.
  EXPECT_EQ(Paths({"--text", "sandpiper"}), std::set<std::string>{kAt + "after.txt"});
  const std::string log = Log();
  std::size_t workers = 0;
  for (std::size_t at = log.find("extraction worker "); at != std::string::npos;
       at = log.find("extraction worker ", at + 1))
    workers += log.compare(log.find(' ', at + 18), 8, " started") == 0;
  EXPECT_GE(workers, 2u) << log;
  EXPECT_EQ(RunJson({"status"})["status"], "finished");  // the daemon itself never stopped
}

// A worker that dies on a file (here by SIGABRT, as a library that aborts would) takes only
// that file down: it is recorded as failed with the signal, and the next worker goes on.
TEST_F(ContentTest, AWorkerThatCrashesFailsOnlyItsFile) {
  ASSERT_TRUE(WritePdfBomb(top_ + "/bomb.pdf", false));
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
  EXPECT_TRUE(WaitUntil(
      [&] {
        return Paths({"--text", "turnstone"}).size() == 1;
      },
      kDeadline))
      << Why("after.txt") << Log();
}

}  // namespace
