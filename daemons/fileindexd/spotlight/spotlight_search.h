// Answers Samba's Spotlight searches from the shares' indexes: the Elasticsearch search
// request that Samba sends in, the Elasticsearch response it reads out. Samba reads only
// the total and each hit's "_source.path.real", an absolute path inside its share.
#ifndef FILEINDEXD_SPOTLIGHT_SPOTLIGHT_SEARCH_H
#define FILEINDEXD_SPOTLIGHT_SPOTLIGHT_SEARCH_H

#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace fileindexd {

// A share as searches see it.
struct SearchableShare {
  std::string name;
  std::string directory;  // the share's directory, as the share database gives it
  std::string dbDirectory;
  std::vector<std::string> folders;  // its indexed folders, relative to the directory
};

struct SearchAnswer {
  int status = 200;
  std::string body;  // JSON
};

class SpotlightSearch {
 public:
  // Replaces the shares searched (called from the indexing side, read by any thread).
  void SetShares(std::vector<SearchableShare> shares);

  // One search request: `index` is the index named in the request's path.
  SearchAnswer Search(const std::string& index, const std::string& body) const;

  // An Elasticsearch-style error.
  static SearchAnswer Error(int status, const std::string& type, const std::string& reason);

 private:
  struct Share {
    SearchableShare config;
    std::string canonicalDirectory;
  };
  std::shared_ptr<const std::vector<Share>> Shares() const;

  mutable std::mutex m_mutex;
  std::shared_ptr<const std::vector<Share>> m_shares = std::make_shared<std::vector<Share>>();
};

}  // namespace fileindexd

#endif
