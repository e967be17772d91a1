#include "spotlight_search.h"

#include <json/json.h>
#include <store.h>
#include <sys/stat.h>

#include <chrono>
#include <climits>
#include <cstdlib>
#include <set>

#include "query_string.h"

namespace fileindexd {

namespace {

using fileindex_store::Condition;

// Elasticsearch's own bound on from + size.
const Json::UInt64 kMaxResultWindow = 10000;

std::string Compact(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

std::string Canonical(const std::string& path) {
  char resolved[PATH_MAX];
  return ::realpath(path.c_str(), resolved) != nullptr ? std::string(resolved) : path;
}

// Path scopes as the file system names them, so that a share reached through a link
// still matches its directory.
void CanonicalScopes(Condition& condition) {
  for (Condition& child : condition.children) CanonicalScopes(child);
  if (condition.type == Condition::Type::kUnder) condition.text = Canonical(condition.text);
}

bool Integer(const Json::Value& request, const char* key, Json::UInt64 fallback, Json::UInt64& out) {
  const Json::Value& value = request[key];
  if (value.isNull()) {
    out = fallback;
    return true;
  }
  if (!value.isIntegral() || value.asLargestInt() < 0) return false;
  out = value.asLargestUInt();
  return true;
}

SearchAnswer Hits(Json::UInt64 total, const Json::Value& hits,
                  std::chrono::steady_clock::time_point started) {
  Json::Value response;
  response["took"] = static_cast<Json::Int64>(
      std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - started)
          .count());
  response["timed_out"] = false;
  response["hits"]["total"]["value"] = total;
  response["hits"]["total"]["relation"] = "eq";
  response["hits"]["hits"] = hits;
  return SearchAnswer{200, Compact(response)};
}

}  // namespace

void SpotlightSearch::SetShares(std::vector<SearchableShare> shares) {
  auto prepared = std::make_shared<std::vector<Share>>();
  for (SearchableShare& share : shares) {
    std::string canonical = Canonical(share.directory);
    prepared->push_back(Share{std::move(share), std::move(canonical)});
  }
  std::lock_guard<std::mutex> lock(m_mutex);
  m_shares = std::move(prepared);
}

std::shared_ptr<const std::vector<SpotlightSearch::Share>> SpotlightSearch::Shares() const {
  std::lock_guard<std::mutex> lock(m_mutex);
  return m_shares;
}

SearchAnswer SpotlightSearch::Error(int status, const std::string& type, const std::string& reason) {
  Json::Value cause;
  cause["type"] = type;
  cause["reason"] = reason;
  Json::Value response;
  response["error"]["root_cause"].append(cause);
  response["error"]["type"] = type;
  response["error"]["reason"] = reason;
  response["status"] = status;
  return SearchAnswer{status, Compact(response)};
}

SearchAnswer SpotlightSearch::Search(const std::string& index, const std::string& body) const {
  const auto started = std::chrono::steady_clock::now();
  (void)index;  // Samba names "_all" unless told otherwise; the query's scope picks the share
  Json::Value request;
  std::string parseErrors;
  Json::CharReaderBuilder strict;
  strict["failIfExtra"] = true;
  strict["rejectDupKeys"] = true;
  std::unique_ptr<Json::CharReader> parser(strict.newCharReader());
  if (!parser->parse(body.data(), body.data() + body.size(), &request, &parseErrors) || !request.isObject())
    return Error(400, "parsing_exception", "the request body is not a JSON object");

  Json::UInt64 from = 0, size = 0;
  if (!Integer(request, "from", 0, from) || !Integer(request, "size", 10, size))
    return Error(400, "illegal_argument_exception", "from and size must be numbers of at least 0");
  if (from > kMaxResultWindow || size > kMaxResultWindow - from)
    return Error(400, "illegal_argument_exception",
                 "Result window is too large, from + size must be less than or equal to: [10000]");
  const Json::Value& queryString = request["query"]["query_string"]["query"];
  if (!request["query"].isObject() || !request["query"]["query_string"].isObject() || !queryString.isString())
    return Error(400, "parsing_exception", "only query_string queries are answered");

  Condition condition;
  std::string error;
  if (!ParseQueryString(queryString.asString(), condition, error))
    return Error(400, "query_shard_exception",
                 "Failed to parse query [" + queryString.asString() + "]: " + error);
  CanonicalScopes(condition);
  std::string scope;
  if (!QueryScope(condition, scope))
    return Error(400, "query_shard_exception",
                 "the query must be limited to a share with path.real.fulltext");

  const auto shares = Shares();
  const Share* share = nullptr;
  for (const Share& candidate : *shares) {
    const std::string& dir = candidate.canonicalDirectory;
    if (scope == dir ||
        (scope.compare(0, dir.size(), dir) == 0 && scope.size() > dir.size() && scope[dir.size()] == '/'))
      share = &candidate;
  }
  Json::Value hits(Json::arrayValue);
  if (share == nullptr) return Hits(0, hits, started);  // not a share this service indexes
  ScopeToShare(condition, share->canonicalDirectory);

  std::unique_ptr<fileindex_store::IndexReader> reader =
      fileindex_store::IndexReader::Open(share->config.dbDirectory, error);
  if (!reader) return Hits(0, hits, started);  // nothing indexed yet
  // Entries of folders that are no longer indexed wait for the indexer to remove them;
  // until it has, they are left out here.
  std::vector<std::string> applied;
  const std::set<std::string> configured(share->config.folders.begin(), share->config.folders.end());
  fileindex_store::IndexReader::SelectOptions options;
  options.from = from;
  options.size = static_cast<std::size_t>(size);
  if (!reader->AppliedFolders(applied)) return Error(500, "exception", reader->LastError());
  for (const std::string& folder : applied) {
    if (!configured.count(folder)) options.folders = &share->config.folders;
  }
  fileindex_store::IndexReader::Selection selection;
  if (!reader->Select(condition, options, selection)) return Error(500, "exception", reader->LastError());

  for (const fileindex_store::Hit& hit : selection.hits) {
    const std::string path = share->canonicalDirectory + "/" + hit.path;
    struct stat st;
    // Gone since it was indexed; or a name that JSON, which holds UTF-8 only, cannot carry.
    if (::lstat(path.c_str(), &st) != 0 || !IsUtf8(path)) continue;
    Json::Value entry;
    entry["_index"] = share->config.name;
    entry["_id"] = hit.path;
    entry["_score"] = 1.0;
    entry["_source"]["path"]["real"] = path;
    hits.append(entry);
  }
  // Samba takes a total above zero with no hits for a failure.
  Json::UInt64 total = selection.total;
  if (hits.empty() && total > 0) total = from;
  return Hits(total, hits, started);
}

}  // namespace fileindexd
