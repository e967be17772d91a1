// What is inside the files, end to end: fileindexd and its extraction worker on files of each
// kind made by the formats' own libraries, searched by their fields through fileindexctl;
// and hostile files, each recorded as failed within its time limit while the service goes on.
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <zlib.h>

#include <chrono>
#include <filesystem>
#include <set>
#include <string>

#include "content_samples.h"
#include "host_support.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace host_test;
namespace cs = content_samples;

namespace {

constexpr std::chrono::milliseconds kDeadline = 60s;  // for the sanitizer build; usually a second or two

class ContentTest : public SandboxTest {
 protected:
  void SetUp() override {
    InitSandbox("host_content", {});
    top_ = root_ + "/volume1/photo/mixed";
    fs::create_directories(top_);
  }
  void CheckLogs() override {
    std::string text = ReadFile(root_ + "/var/log/fileindexd.log");
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
  std::map<std::string, std::string> Kinds(const std::vector<std::string>& args) {
    std::map<std::string, std::string> kinds;
    for (const auto& hit : Search(args, "kind")) kinds[hit.first] = hit.second.asString();
    return kinds;
  }
  std::set<std::string> Paths(const std::vector<std::string>& args) {
    std::set<std::string> paths;
    for (const auto& hit : Search(args)) paths.insert(hit.first);
    return paths;
  }
  Json::Value Why(const std::string& path) {
    Run({"--json", "why", path});
    return ParseJson(ReadFile(work_ + "/stdout"));
  }
  // Waits until no file of the folder has its contents pending.
  ::testing::AssertionResult WaitExtracted(const std::vector<std::string>& names) {
    std::string last;
    bool done = WaitUntil(
        [&] {
          for (const std::string& name : names) {
            Json::Value why = Why("/photo/mixed/" + name);
            if (why["state"] == "pending" || why["state"] == "content-pending" || why.isNull()) {
              last = name + ": " + why.toStyledString();
              return false;
            }
          }
          return true;
        },
        kDeadline);
    if (done) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "still pending: " << last << "\ndaemon log:\n" << Log();
  }
  // Files of a kind whose contents are extracted.
  int ContentRows(int kind) {
    sqlite3* db = nullptr;
    int count = -1;
    if (sqlite3_open_v2((root_ + "/volume1/photo/@eaDir/TAVO@.fileindexdb/index.sqlite3").c_str(), &db,
                        SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
      sqlite3_stmt* statement = nullptr;
      sqlite3_prepare_v2(db, "SELECT count(*) FROM contents WHERE kind = ? AND state = 1", -1, &statement,
                         nullptr);
      sqlite3_bind_int(statement, 1, kind);
      if (sqlite3_step(statement) == SQLITE_ROW) count = sqlite3_column_int(statement, 0);
      sqlite3_finalize(statement);
    }
    sqlite3_close(db);
    return count;
  }

  std::string top_;
};

TEST_F(ContentTest, FilesOfEachKindAreFoundByTheirFieldsAndText) {
  fs::create_directories(top_ + "/photos");
  fs::create_directories(top_ + "/music");
  fs::create_directories(top_ + "/papers");
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/harbour.jpg", cs::Exif()));
  cs::Exif old;
  old.taken = "2009:01:02 08:00:00";
  old.make = "Osprey";
  old.model = "O2";
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/old.jpg", old));
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/song.mp3", cs::Tags()));
  cs::Tags wren;
  wren.artist = "Marsh Wren";
  wren.album = "Reeds";
  wren.title = "Reedbed";
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/reed.flac", wren, 2));
  ASSERT_TRUE(cs::WriteVideo(top_ + "/clip.mkv", "Lighthouse at dusk", 50));
  cs::Write(top_ + "/papers/report.pdf",
            cs::Pdf({"quarterly figures for the albatross project", "the second page mentions a cormorant"},
                    "Seabird report"));
  ASSERT_TRUE(cs::WriteDocx(top_ + "/papers/letter.docx", {"Dear committee,", "the puffin survey is done."}));
  ASSERT_TRUE(cs::WriteOdt(top_ + "/papers/minutes.odt", {"Minutes of the guillemot meeting"}));
  WriteFile(top_ + "/papers/notes.txt", "remember the kittiwake\n");
  cs::Tags tide;
  tide.title = "Slack Water";
  tide.artist = "Turnstone";
  tide.album = "Ebb";
  tide.genre = "Ambient";
  tide.year = 1999;
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/tide.opus", tide, 7.5));
  // The content decides the kind; the name is a hint only.
  cs::Exif heron;
  heron.make = "Heron";
  heron.model = "H1";
  heron.taken = "2012:03:04 05:06:07";
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/scan", heron));
  ASSERT_TRUE(cs::WritePhoto(top_ + "/photos/scan2.dat", heron));
  cs::Write(top_ + "/papers/invoice.jpg", cs::Pdf({"the invoice for the shearwater"}));
  cs::Tags untitled;
  untitled.artist = "Night Heron";
  ASSERT_TRUE(cs::WriteAudio(top_ + "/music/take1.mp3", untitled));
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
  for (const std::string& name : all)
    EXPECT_EQ(Why("/photo/mixed/" + name)["content"]["state"], "extracted") << name << Log();
  const std::map<std::string, std::string> decided{{"/photo/mixed/photos/scan", "photo"},
                                                   {"/photo/mixed/photos/scan2.dat", "photo"},
                                                   {"/photo/mixed/papers/invoice.jpg", "document"},
                                                   {"/photo/mixed/music/take1", "audio"},
                                                   {"/photo/mixed/blob.bin", "other"}};
  for (const auto& file : decided) {
    std::string name = file.first.substr(file.first.rfind('/') + 1);
    EXPECT_EQ(Kinds({name.substr(0, name.find('.'))})[file.first], file.second) << file.first;
  }
  EXPECT_EQ(Kinds({"--camera", "heron"}),
            (std::map<std::string, std::string>{{"/photo/mixed/photos/scan", "photo"},
                                                {"/photo/mixed/photos/scan2.dat", "photo"}}));
  EXPECT_EQ(Kinds({"--kind", "document", "invoice"}).size(), 1u);
  EXPECT_TRUE(Kinds({"--kind", "photo", "invoice"}).empty());
  EXPECT_EQ(Paths({"--text", "shearwater"}), std::set<std::string>{"/photo/mixed/papers/invoice.jpg"});
  EXPECT_EQ(Why("/photo/mixed/blob.bin")["state"], "indexed") << Why("/photo/mixed/blob.bin");
  EXPECT_EQ(Why("/photo/mixed/empty")["reason"], "indexed by its name (inode/x-empty)");

  // Why other files are not indexed.
  WriteFile(top_ + "/@eaDir/thumb.txt", "thumbnail\n");
  Json::Value skipped = Why("/photo/mixed/@eaDir/thumb.txt");
  EXPECT_EQ(skipped["state"], "skipped") << skipped;
  EXPECT_EQ(skipped["indexed"], false);
  EXPECT_EQ(Run({"why", "/photo/mixed/@eaDir/thumb.txt"}).status, 3);
  EXPECT_EQ(Why("/photo/2019/beach.jpg")["state"], "outside");
  EXPECT_EQ(Why("/photo/mixed/nothing.txt")["state"], "missing");

  auto gulls = Search({"--artist", "gulls"});
  ASSERT_EQ(gulls.size(), 1u) << ReadFile(work_ + "/stdout") << ReadFile(work_ + "/stderr");
  const Json::Value& song = gulls["/photo/mixed/music/song.mp3"];
  EXPECT_EQ(song["title"], "Harbour Lights");
  EXPECT_EQ(song["album"], "Low Tide");
  EXPECT_EQ(song["genre"], "Folk");
  EXPECT_EQ(song["year"], 2011);
  EXPECT_NEAR(song["duration_ms"].asDouble(), 3000, 200);
  EXPECT_EQ(song["mime"], "audio/mpeg");
  EXPECT_EQ(Paths({"--album", "REEDS"}), std::set<std::string>{"/photo/mixed/music/reed.flac"});
  auto ogg = Search({"--artist", "turnstone"});
  ASSERT_EQ(ogg.size(), 1u);
  const Json::Value& opus = ogg["/photo/mixed/music/tide.opus"];
  EXPECT_EQ(opus["title"], "Slack Water");
  EXPECT_EQ(opus["album"], "Ebb");
  EXPECT_EQ(opus["genre"], "Ambient");
  EXPECT_EQ(opus["year"], 1999);
  EXPECT_EQ(opus["duration_ms"], 7500);
  EXPECT_EQ(opus["mime"], "audio/ogg");
  EXPECT_EQ(Paths({"--year", "2011", "song"}), std::set<std::string>{"/photo/mixed/music/song.mp3"});

  auto kestrel = Search({"--camera", "kestrel k-100"});
  ASSERT_EQ(kestrel.size(), 1u);
  const Json::Value& photo = kestrel["/photo/mixed/photos/harbour.jpg"];
  EXPECT_EQ(photo["taken"], "2019-07-14 10:11:12");
  EXPECT_EQ(photo["width"], 32);
  EXPECT_EQ(photo["height"], 24);
  EXPECT_NEAR(photo["latitude"].asDouble(), 48.8583, 0.001);
  EXPECT_NEAR(photo["longitude"].asDouble(), -2.2945, 0.001);
  EXPECT_EQ(Paths({"--taken-after", "2015-01-01"}), std::set<std::string>{"/photo/mixed/photos/harbour.jpg"});
  EXPECT_EQ(Paths({"--taken-before", "2009-01-02"}), std::set<std::string>{"/photo/mixed/photos/old.jpg"});

  auto video = Search({"--title", "lighthouse"});
  ASSERT_EQ(video.size(), 1u);
  const Json::Value& clip = video["/photo/mixed/clip.mkv"];
  EXPECT_EQ(clip["width"], 64);
  EXPECT_EQ(clip["codecs"], "mjpeg");
  EXPECT_NEAR(clip["duration_ms"].asDouble(), 2000, 100);

  EXPECT_EQ(Paths({"--text", "albatross"}), std::set<std::string>{"/photo/mixed/papers/report.pdf"});
  EXPECT_EQ(Paths({"--text", "CORMORANT"}), std::set<std::string>{"/photo/mixed/papers/report.pdf"});
  EXPECT_EQ(Paths({"--text", "puffin survey"}), std::set<std::string>{"/photo/mixed/papers/letter.docx"});
  EXPECT_EQ(Paths({"--text", "guillemot"}), std::set<std::string>{"/photo/mixed/papers/minutes.odt"});
  EXPECT_EQ(Paths({"--text", "kitti"}), std::set<std::string>{"/photo/mixed/papers/notes.txt"});
  EXPECT_TRUE(Paths({"--text", "puffin albatross"}).empty());
  // Hits show the words around the match, marked.
  const Json::Value snippet = RunJson({"search", "--text", "cormo"});
  ASSERT_EQ(snippet["hits"].size(), 1u);
  EXPECT_EQ(snippet["hits"][0]["snippet"],
            "…for the albatross project the second page mentions a «cormorant»");
  EXPECT_NE(Run({"search", "--text", "albatross"}).out.find("figures for the «albatross» project"),
            std::string::npos);
  EXPECT_EQ(Search({"--title", "seabird"})["/photo/mixed/papers/report.pdf"]["text_bytes"].asInt() > 40,
            true);
  // The table shows the main fields.
  Result table = Run({"search", "--artist", "gulls"});
  EXPECT_NE(table.out.find("The Gulls, \"Harbour Lights\", Low Tide, 2011"), std::string::npos) << table.out;

  // Audio switched off: its entries and contents go; on again, they come back.
  ASSERT_GT(ContentRows(2), 0);
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--no-audio"}).status, 0);
  ASSERT_TRUE(WaitUntil([&] { return ContentRows(2) == 0; }, kDeadline)) << Log();
  EXPECT_TRUE(Search({"--artist", "gulls"}).empty());
  EXPECT_EQ(Why("/photo/mixed/music/song.mp3")["state"], "kind-off");
  EXPECT_EQ(Paths({"--text", "albatross"}).size(), 1u);  // the other kinds stay
  // A song whose name says nothing stays, by its name only.
  ASSERT_TRUE(WaitExtracted({"music/take1"}));
  EXPECT_EQ(Kinds({"take1"})["/photo/mixed/music/take1"], "other");
  EXPECT_EQ(Why("/photo/mixed/music/take1")["content"]["state"], "skipped");
  ASSERT_EQ(Run({"folders", "set", "/photo/mixed", "--audio"}).status, 0);
  EXPECT_TRUE(WaitUntil([&] { return Search({"--artist", "gulls"}).size() == 1; }, kDeadline)) << Log();
  EXPECT_TRUE(WaitUntil([&] { return Search({"--artist", "night heron"}).size() == 1; }, kDeadline)) << Log();

  // A changed file is extracted again.
  WriteFile(top_ + "/papers/notes.txt", "now the fulmar\n");
  EXPECT_TRUE(WaitUntil([&] { return Paths({"--text", "fulmar"}).size() == 1; }, kDeadline)) << Log();
  EXPECT_TRUE(Paths({"--text", "kittiwake"}).empty());
}

std::string Deflate(const std::string& data) {
  uLongf size = compressBound(data.size());
  std::string out(size, '\0');
  compress2(reinterpret_cast<Bytef*>(&out[0]), &size, reinterpret_cast<const Bytef*>(data.data()),
            data.size(), 9);
  out.resize(size);
  return out;
}

// A PDF of one page whose packed content unpacks to 200 MB of text operators. Words kept
// on the page pile up in the text extractor's memory; words moved off it cost time only.
bool WritePdfBomb(const std::string& path, bool onPage) {
  std::string chunk;
  for (int i = 0; i < 1000; ++i) chunk += onPage ? "(bomb) Tj 0.0001 0 Td " : "(bomb) Tj 1 0 Td ";
  std::string unpacked = "BT /F1 12 Tf 72 720 Td ";
  unpacked.reserve(200u << 20);
  while (unpacked.size() < (200u << 20)) unpacked += chunk;
  unpacked += " ET";
  const std::string packed = Deflate(unpacked);
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
  // huge-tag.mp3: a 32 MiB ID3v2 tag before its frames.
  {
    const std::uint32_t tagSize = 32u << 20;
    std::string tag = "ID3";
    tag += std::string("\x03\x00\x00", 3);
    for (int shift = 21; shift >= 0; shift -= 7) tag += static_cast<char>((tagSize >> shift) & 0x7F);
    const std::uint32_t frameSize = tagSize - 10;
    tag += "TXXX";
    for (int shift = 24; shift >= 0; shift -= 8) tag += static_cast<char>((frameSize >> shift) & 0xFF);
    tag += std::string("\x00\x00\x00", 3);
    tag += std::string(frameSize - 1, 'x');
    cs::Write(top_ + "/huge-tag.mp3", tag + cs::Mp3Frames(1));
  }
  // bomb.docx: a zip whose document unpacks to 256 MiB of spaces.
  {
    std::string body = "<?xml version=\"1.0\"?><w:document xmlns:w=\"w\"><w:body><w:p><w:t>";
    body += std::string(256u << 20, ' ');
    body += "</w:t></w:p></w:body></w:document>";
    ASSERT_TRUE(cs::WriteZip(top_ + "/bomb.docx", {{"word/document.xml", body}}, 9));
  }
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
    Json::Value why = Why("/photo/mixed/" + name);
    EXPECT_EQ(why["state"], "failed") << name << ": " << why.toStyledString();
    reasons[name] = why["content"]["reason"].asString();
  }
  EXPECT_NE(reasons["truncated.jpg"].find("Exiv2"), std::string::npos) << reasons["truncated.jpg"];
  EXPECT_NE(reasons["huge-tag.mp3"].find("ID3v2 tag of 32 MiB"), std::string::npos)
      << reasons["huge-tag.mp3"];
  EXPECT_NE(reasons["bomb.docx"].find("word/document.xml"), std::string::npos) << reasons["bomb.docx"];
  // The bombs take the worker down: one by its memory limit (poppler aborts when an
  // allocation fails; the sanitizer build's limit is slower and may lose to the time
  // limit), the other by its time limit.
  const std::string& bomb = reasons["bomb.pdf"];
  EXPECT_TRUE(bomb.find("killed by signal 6") != std::string::npos ||
              bomb.find("out of memory") != std::string::npos ||
              bomb.find("longer than the limit of 3000 ms") != std::string::npos)
      << bomb;
  EXPECT_NE(reasons["slow.pdf"].find("longer than the limit of 3000 ms"), std::string::npos)
      << reasons["slow.pdf"];
  // ... and another worker took over: the file after it was extracted.
  EXPECT_EQ(Paths({"--text", "sandpiper"}), std::set<std::string>{"/photo/mixed/after.txt"});
  std::string log = Log();
  std::size_t workers = 0;
  for (std::size_t at = log.find("extraction worker "); at != std::string::npos;
       at = log.find("extraction worker ", at + 1))
    workers += log.compare(log.find(' ', at + 18), 8, " started") == 0;
  EXPECT_GE(workers, 2u) << log;
  // The daemon itself never stopped.
  EXPECT_EQ(RunJson({"status"})["status"], "finished");
}

// A worker that dies on a file (here by SIGABRT, as a library that aborts would) takes only
// that file down: it is recorded as failed with the signal, and the next worker goes on.
TEST_F(ContentTest, AWorkerThatCrashesFailsOnlyItsFile) {
  ASSERT_TRUE(WritePdfBomb(top_ + "/bomb.pdf", false));
  ASSERT_NO_FATAL_FAILURE(AddFolder("FILEINDEXD_EXTRACT_TIME_LIMIT=60 "));
  // The worker: the daemon's child, busy once it has used some CPU time on the bomb.
  pid_t worker = 0;
  auto cpuTicks = [](pid_t pid) {
    std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
    std::istringstream fields(stat.substr(stat.rfind(')') + 2));
    std::string field;
    long ticks = 0;
    for (int i = 3; i <= 15 && fields >> field; ++i)
      if (i == 14 || i == 15) ticks += std::atol(field.c_str());
    return ticks;
  };
  ASSERT_TRUE(WaitUntil(
      [&] {
        pid_t daemon = DaemonPid("fileindexd");
        std::istringstream children(
            ReadFile("/proc/" + std::to_string(daemon) + "/task/" + std::to_string(daemon) + "/children"));
        long child = 0;
        worker = children >> child ? static_cast<pid_t>(child) : 0;
        return worker > 0 && cpuTicks(worker) > 20;
      },
      kDeadline))
      << Log();
  ASSERT_EQ(::kill(worker, SIGABRT), 0);
  ASSERT_TRUE(WaitExtracted({"bomb.pdf"}));
  Json::Value why = Why("/photo/mixed/bomb.pdf");
  EXPECT_EQ(why["state"], "failed");
  EXPECT_NE(why["content"]["reason"].asString().find("killed by signal 6"), std::string::npos) << why;
  WriteFile(top_ + "/after.txt", "the turnstone\n");
  EXPECT_TRUE(WaitUntil(
      [&] {
        return Paths({"--text", "turnstone"}).size() == 1;
      },
      kDeadline))
      << Why("/photo/mixed/after.txt") << Log();
}

}  // namespace
