// `fileindexctl search`: the files the indexing service has indexed, by words of their names.
#include <fileindex/index_mgr.h>
#include <unistd.h>

#include <ctime>
#include <memory>

#include "commands.h"
#include "content_view.h"
#include "index_view.h"
#include "output.h"

namespace fileindexctl {

namespace {

namespace FI = TAVO::FILEINDEX;

struct SearchArgs {
  std::vector<std::string> words;
  std::string share;
  std::string kind;
  std::size_t limit = 50;
  // Fields of the files' contents.
  std::string title, artist, album, genre, camera, takenAfter, takenBefore, text;
  std::int64_t year = 0;
};

// "YYYY-MM-DD" or "YYYY-MM-DD HH:MM[:SS]", as the index keeps the date a photo was taken.
bool ValidDate(const std::string& date) {
  static const char kPattern[] = "dddd-dd-dd dd:dd:dd";
  if (date.size() != 10 && date.size() != 16 && date.size() != 19) return false;
  for (std::size_t i = 0; i < date.size(); ++i) {
    bool digit = date[i] >= '0' && date[i] <= '9';
    if (kPattern[i] == 'd' ? !digit : date[i] != kPattern[i]) return false;
  }
  return true;
}

std::vector<std::string> Words(const std::string& text) {
  std::vector<std::string> words;
  std::string word;
  for (char c : text + " ") {
    if (c == ' ' || c == '\t') {
      if (!word.empty()) words.push_back(word);
      word.clear();
    } else {
      word += c;
    }
  }
  return words;
}

std::string HumanSize(std::int64_t bytes) {
  const char* units[] = {"B", "KiB", "MiB", "GiB", "TiB"};
  double value = static_cast<double>(bytes);
  int unit = 0;
  while (value >= 1024 && unit < 4) {
    value /= 1024;
    ++unit;
  }
  char text[32];
  std::snprintf(text, sizeof(text), unit == 0 ? "%.0f %s" : "%.1f %s", value, units[unit]);
  return text;
}

// A snippet on one line, runs of white space as one space, its matching words between open
// and close.
std::string ShowSnippet(const std::string& snippet, const char* open, const char* close) {
  std::string out;
  bool space = false;
  for (char c : snippet) {
    if (c == ' ' || c == '\n' || c == '\r' || c == '\t' || c == '\f') {
      space = true;
      continue;
    }
    if (space && !out.empty()) out += ' ';
    space = false;
    if (c == fileindex_store::kSnippetOpen) {
      out += open;
    } else if (c == fileindex_store::kSnippetClose) {
      out += close;
    } else {
      out += c;
    }
  }
  return out;
}

int Search(Session& s, const SearchArgs& args) {
  // File names are private to those who may read the files: only root searches here;
  // users search through Samba, which checks every hit against their own permissions.
  if (::geteuid() != 0) {
    s.Fail("search", "only root may search the index (users search their shares through Samba)");
    return s.Finish(Json::Value(), nullptr);
  }
  fileindex_store::ContentQuery query;
  query.names.words = args.words;
  query.names.limit = args.limit;
  if (!args.kind.empty()) {
    query.names.anyKind = false;
    if (!fileindex_store::KindFromName(args.kind, query.names.kind) ||
        query.names.kind == fileindex_store::Kind::kOther) {
      s.Usage("--kind must be document, audio, video or photo, not \"" + args.kind + "\"");
      return s.Finish(Json::Value(), nullptr);
    }
  }
  query.title = args.title;
  query.artist = args.artist;
  query.album = args.album;
  query.genre = args.genre;
  query.camera = args.camera;
  query.year = args.year;
  query.text = Words(args.text);
  for (const std::string* date : {&args.takenAfter, &args.takenBefore}) {
    if (!date->empty() && !ValidDate(*date)) {
      s.Usage("--taken-after and --taken-before take YYYY-MM-DD or YYYY-MM-DD HH:MM[:SS], not \"" + *date +
              "\"");
      return s.Finish(Json::Value(), nullptr);
    }
  }
  query.takenAfter = args.takenAfter;
  query.takenBefore = args.takenBefore;
  if (query.names.words.empty() && !query.Filters()) {
    s.Usage("search needs words of names or a field filter (--artist, --camera, --text ...)");
    return s.Finish(Json::Value(), nullptr);
  }
  std::vector<FI::Folder> folders;
  if (!s.Call("IndexMgr::List", [&]() { return FI::IndexMgr::List(folders); }))
    return s.Finish(Json::Value(), nullptr);
  std::map<std::string, IndexedShare> shares = IndexedShares(folders);
  if (!args.share.empty()) {
    auto it = shares.find(args.share);
    if (it == shares.end()) {
      s.Fail("search", "share \"" + args.share + "\" has no indexed folder");
      return s.Finish(Json::Value(), nullptr);
    }
    shares = {*it};
  }
  std::vector<SearchHit> hits;
  std::map<std::string, std::string> unavailable;
  SearchShares(shares, query, hits, unavailable);

  Json::Value result(Json::objectValue);
  result["hits"] = Json::Value(Json::arrayValue);
  for (const SearchHit& found : hits) {
    Json::Value item;
    item["path"] = found.path;
    item["share"] = found.share;
    item["type"] = found.hit.isDir ? "directory" : "file";
    item["kind"] = found.hit.isDir ? "" : fileindex_store::KindName(found.hit.kind);
    item["size"] = static_cast<Json::Int64>(found.hit.size);
    item["mtime"] = static_cast<Json::Int64>(found.hit.mtime);
    item["content"] = found.hasContent ? ContentJson(found.content) : Json::Value();
    if (!query.text.empty()) item["snippet"] = ShowSnippet(found.snippet, "«", "»");
    result["hits"].append(item);
  }
  result["count"] = static_cast<Json::UInt64>(hits.size());
  for (const auto& share : unavailable) result["unavailable"][share.first] = share.second;
  return s.Finish(result, [&]() {
    for (const auto& share : unavailable)
      std::fprintf(stderr, "fileindexctl: share %s not searched: no index yet (%s)\n", share.first.c_str(),
                   share.second.c_str());
    if (hits.empty()) {
      std::printf("no match\n");
      return;
    }
    std::vector<std::string> headers{"PATH", "KIND", "SIZE", "MODIFIED", "DETAILS"};
    // The matching words of the text: in bold on a terminal, else between guillemets.
    const bool bold = ::isatty(STDOUT_FILENO) == 1;
    if (!query.text.empty()) headers.push_back("TEXT");
    Table table(headers);
    for (const SearchHit& found : hits) {
      std::string details;
      if (found.hasContent) {
        details = ContentSummary(found.content);
      } else if (!found.hit.isDir && found.hit.kind != fileindex_store::Kind::kOther) {
        details = "(contents pending)";
      }
      std::vector<std::string> row{found.path + (found.hit.isDir ? "/" : ""),
                                   found.hit.isDir ? "directory" : fileindex_store::KindName(found.hit.kind),
                                   found.hit.isDir ? "" : HumanSize(found.hit.size),
                                   LocalTime(found.hit.mtime), details};
      if (!query.text.empty())
        row.push_back(bold ? ShowSnippet(found.snippet, "\033[1m", "\033[0m")
                           : ShowSnippet(found.snippet, "«", "»"));
      table.AddRow(row);
    }
    table.Print(stdout);
  });
}

}  // namespace

void AddSearchCommand(CLI::App& app, Action& action) {
  auto args = std::make_shared<SearchArgs>();
  CLI::App* cmd = app.add_subcommand(
      "search",
      "Indexed files and directories whose names hold every word (as the start of a word) and whose contents "
      "match every field filter, newest first");
  cmd->add_option("words", args->words, "Words of names to look for (case-insensitive, accents ignored)");
  cmd->add_option("--share", args->share, "Only this share");
  cmd->add_option("--kind", args->kind, "Only files of this kind: document, audio, video or photo");
  cmd->add_option("--title", args->title, "Title (of a song, video, document or photo) holding this text");
  cmd->add_option("--artist", args->artist, "Artist holding this text");
  cmd->add_option("--album", args->album, "Album holding this text");
  cmd->add_option("--genre", args->genre, "Genre holding this text");
  cmd->add_option("--year", args->year, "Year of a song")->check(CLI::Range(1, 9999));
  cmd->add_option("--camera", args->camera, "Camera make or model holding this text");
  cmd->add_option("--taken-after", args->takenAfter,
                  "Photos taken at or after DATE (YYYY-MM-DD[ HH:MM[:SS]])");
  cmd->add_option("--taken-before", args->takenBefore, "Photos taken on or before DATE");
  cmd->add_option("--text", args->text,
                  "Documents whose text holds every one of these WORDS (as word starts)");
  cmd->add_option("--limit", args->limit, "At most this many results")
      ->capture_default_str()
      ->check(CLI::Range(1, 100000));
  cmd->callback([&action, args]() { action = [args](Session& s) { return Search(s, *args); }; });
}

}  // namespace fileindexctl
