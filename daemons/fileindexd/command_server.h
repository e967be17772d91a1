// The daemon's command socket: one length-prefixed JSON command per connection, no reply.
// Connections are read without blocking; a frame that lies about its length, an
// oversized one, or a client that connects and sends nothing is logged and dropped.
#ifndef FILEINDEXD_COMMAND_SERVER_H
#define FILEINDEXD_COMMAND_SERVER_H

#include <daemon_support.h>
#include <json/json.h>
#include <sys/types.h>

#include <functional>
#include <map>
#include <string>

namespace fileindexd {

class CommandServer {
 public:
  using Handler = std::function<void(const Json::Value& command)>;

  CommandServer(fileindex_daemon::EventLoop& loop, Handler handler)
      : m_loop(loop), m_handler(std::move(handler)) {}
  ~CommandServer();

  // Listens on path; only root and, when group is not -1, that group may connect.
  bool Listen(const std::string& path, gid_t group, std::string& error);

 private:
  struct Connection {
    std::string received;
    std::uint64_t timer = 0;
  };
  void Accept();
  void Read(int fd);
  void Drop(int fd, const char* reason);

  fileindex_daemon::EventLoop& m_loop;
  Handler m_handler;
  std::string m_path;
  int m_listener = -1;
  bool m_acceptPaused = false;  // at the connection limit, the listener is not watched
  std::map<int, Connection> m_connections;
};

}  // namespace fileindexd

#endif
