#include "spotlight_endpoint.h"

#include <daemon_support.h>
#include <httplib.h>
#include <syslog.h>
#include <unistd.h>

#include "peer_owner.h"

namespace fileindexd {

namespace {

// Samba's requests are a few hundred bytes.
const std::size_t kMaxRequestBytes = 64 * 1024;
// Each keep-alive connection holds a thread while it is open; Samba keeps one per client
// session, and reconnects when the connection was closed.
const int kThreads = 8;
const time_t kIdleSeconds = 5;
const std::size_t kMaxTrustedSockets = 1024;

void Send(httplib::Response& response, const SearchAnswer& answer) {
  response.status = answer.status;
  response.set_content(answer.body, "application/json; charset=UTF-8");
}

}  // namespace

struct SpotlightEndpoint::Server {
  httplib::Server http;
};

SpotlightEndpoint::SpotlightEndpoint(const SpotlightSearch& search) : m_search(search) {}

SpotlightEndpoint::~SpotlightEndpoint() { Stop(); }

bool SpotlightEndpoint::Start(const std::string& address, int port, std::string& error, int* boundPort) {
  m_server.reset(new Server);
  httplib::Server& http = m_server->http;
  http.new_task_queue = [] { return new httplib::ThreadPool(kThreads); };
  http.set_payload_max_length(kMaxRequestBytes);
  http.set_read_timeout(kIdleSeconds, 0);
  http.set_write_timeout(kIdleSeconds, 0);
  http.set_keep_alive_timeout(kIdleSeconds);
  // Samba keeps one connection per client session for all its pages and searches; the
  // server's default of closing after five requests would make it connect again and again.
  http.set_keep_alive_max_count(1000);
  // An answer goes out in more than one write: without this, the client's delayed
  // acknowledgement holds the last one back for tens of milliseconds.
  http.set_tcp_nodelay(true);

  http.set_pre_routing_handler([this](const httplib::Request& request, httplib::Response& response) {
    std::string why;
    if (MayAsk(request.remote_addr, request.remote_port, request.local_addr, request.local_port, why))
      return httplib::Server::HandlerResponse::Unhandled;
    fileindex_daemon::Log(LOG_WARNING, "spotlight: refused %s:%d: %s", request.remote_addr.c_str(),
                          request.remote_port, why.c_str());
    Send(response, SpotlightSearch::Error(403, "security_exception", "searches are served to Samba only"));
    return httplib::Server::HandlerResponse::Handled;
  });
  auto search = [this](const httplib::Request& request, httplib::Response& response) {
    Send(response,
         m_search.Search(request.matches.size() > 1 ? request.matches[1].str() : "_all", request.body));
  };
  http.Post(R"(/([^/]+)/_search)", search);
  http.Post("/_search", search);
  // Whatever else reaches the server (other paths and methods, oversized bodies) gets an
  // Elasticsearch-style error with the status the server chose.
  http.set_error_handler([](const httplib::Request& request, httplib::Response& response) {
    if (!response.body.empty()) return;
    const bool tooLarge = response.status == 413;
    Send(response,
         SpotlightSearch::Error(response.status, tooLarge ? "content_too_long_exception" : "no_handler_found",
                                tooLarge ? "the request body is too large"
                                         : "no handler for " + request.method + " " + request.path));
  });

  const int bound =
      port == 0 ? http.bind_to_any_port(address) : (http.bind_to_port(address, port) ? port : -1);
  if (bound <= 0) {
    error = "cannot listen on " + address + ":" + std::to_string(port);
    m_server.reset();
    return false;
  }
  if (boundPort != nullptr) *boundPort = bound;
  m_thread = std::thread([this] { m_server->http.listen_after_bind(); });
  return true;
}

bool SpotlightEndpoint::MayAsk(const std::string& clientAddress, int clientPort,
                               const std::string& serverAddress, int serverPort, std::string& why) {
  PeerSocket peer;
  if (!LoopbackPeerSocket(clientAddress, clientPort, serverAddress, serverPort, peer, why)) return false;
  if (peer.owner == 0) return true;
  // A keep-alive connection asks many times: its socket is looked up among the processes once.
  std::lock_guard<std::mutex> lock(m_trustedMutex);
  if (m_trustedSockets.count(peer.inode)) return true;
  if (!SocketHeldByRootOnly(peer.inode, why)) {
    if (why.empty()) why = "no process holds the connection";
    why = "a search by " + why;
    return false;
  }
  if (m_trustedSockets.size() >= kMaxTrustedSockets) m_trustedSockets.clear();
  m_trustedSockets.insert(peer.inode);
  return true;
}

void SpotlightEndpoint::Stop() {
  if (!m_server) return;
  m_server->http.stop();
  if (m_thread.joinable()) m_thread.join();
  m_server.reset();
}

}  // namespace fileindexd
