// The HTTP side of Spotlight searches: Samba's Elasticsearch backend connects here on the
// loopback interface. Samba sends no credentials, so a connection is served only when the
// socket at its other end is root's: made by root, or held only by processes that are
// root (Samba's search helper runs as root, acting as the user it serves); every other
// local user is refused, so that nobody lists other people's file names through it.
#ifndef FILEINDEXD_SPOTLIGHT_SPOTLIGHT_ENDPOINT_H
#define FILEINDEXD_SPOTLIGHT_SPOTLIGHT_ENDPOINT_H

#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "spotlight_search.h"

namespace fileindexd {

class SpotlightEndpoint {
 public:
  explicit SpotlightEndpoint(const SpotlightSearch& search);
  ~SpotlightEndpoint();
  SpotlightEndpoint(const SpotlightEndpoint&) = delete;
  SpotlightEndpoint& operator=(const SpotlightEndpoint&) = delete;

  // Binds address:port (port 0: any free port, told in boundPort) and serves on threads
  // of its own. False, with error, when the port cannot be bound.
  bool Start(const std::string& address, int port, std::string& error, int* boundPort = nullptr);
  void Stop();

 private:
  struct Server;
  bool MayAsk(const std::string& clientAddress, int clientPort, const std::string& serverAddress,
              int serverPort, std::string& why);

  const SpotlightSearch& m_search;
  std::mutex m_trustedMutex;
  std::set<unsigned long> m_trustedSockets;  // inodes of connections found to be root's
  std::unique_ptr<Server> m_server;
  std::thread m_thread;
};

}  // namespace fileindexd

#endif
