#include "peer_owner.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/sock_diag.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

namespace fileindexd {

namespace {

class Descriptor {
 public:
  explicit Descriptor(int fd) : m_fd(fd) {}
  ~Descriptor() {
    if (m_fd >= 0) ::close(m_fd);
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int get() const { return m_fd; }

 private:
  int m_fd;
};

}  // namespace

bool LoopbackPeerSocket(const std::string& clientAddress, int clientPort, const std::string& serverAddress,
                        int serverPort, PeerSocket& peer, std::string& error) {
  struct {
    nlmsghdr header;
    inet_diag_req_v2 request;
  } message = {};
  message.header.nlmsg_len = sizeof(message);
  message.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
  message.header.nlmsg_flags = NLM_F_REQUEST;
  message.request.sdiag_family = AF_INET;
  message.request.sdiag_protocol = IPPROTO_TCP;
  message.request.idiag_states = ~0U;
  // The client's socket: its own address and port are the "source" of the lookup.
  inet_diag_sockid& id = message.request.id;
  id.idiag_sport = htons(static_cast<uint16_t>(clientPort));
  id.idiag_dport = htons(static_cast<uint16_t>(serverPort));
  if (::inet_pton(AF_INET, clientAddress.c_str(), &id.idiag_src[0]) != 1 ||
      ::inet_pton(AF_INET, serverAddress.c_str(), &id.idiag_dst[0]) != 1) {
    error = "not an IPv4 peer: " + clientAddress;
    return false;
  }
  id.idiag_if = 0;
  id.idiag_cookie[0] = INET_DIAG_NOCOOKIE;
  id.idiag_cookie[1] = INET_DIAG_NOCOOKIE;

  Descriptor netlink(::socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
  if (netlink.get() < 0) {
    error = std::string("sock_diag: ") + std::strerror(errno);
    return false;
  }
  sockaddr_nl kernel = {};
  kernel.nl_family = AF_NETLINK;
  if (::sendto(netlink.get(), &message, sizeof(message), 0, reinterpret_cast<sockaddr*>(&kernel),
               sizeof(kernel)) < 0) {
    error = std::string("sock_diag: ") + std::strerror(errno);
    return false;
  }
  alignas(nlmsghdr) char buffer[8192];
  ssize_t length = ::recv(netlink.get(), buffer, sizeof(buffer), 0);
  if (length < 0) {
    error = std::string("sock_diag: ") + std::strerror(errno);
    return false;
  }
  for (auto* reply = reinterpret_cast<nlmsghdr*>(buffer); NLMSG_OK(reply, static_cast<unsigned>(length));
       reply = NLMSG_NEXT(reply, length)) {
    if (reply->nlmsg_type == NLMSG_ERROR) {
      const auto* failure = static_cast<const nlmsgerr*>(NLMSG_DATA(reply));
      error = failure->error == -ENOENT
                  ? "no local socket at " + clientAddress + ":" + std::to_string(clientPort)
                  : std::string("sock_diag: ") + std::strerror(-failure->error);
      return false;
    }
    if (reply->nlmsg_type == SOCK_DIAG_BY_FAMILY && reply->nlmsg_len >= NLMSG_LENGTH(sizeof(inet_diag_msg))) {
      const auto* found = static_cast<const inet_diag_msg*>(NLMSG_DATA(reply));
      peer.owner = found->idiag_uid;
      peer.inode = found->idiag_inode;
      return true;
    }
  }
  error = "no local socket at " + clientAddress + ":" + std::to_string(clientPort);
  return false;
}

bool SocketHeldByRootOnly(unsigned long inode, std::string& who) {
  who.clear();
  const std::string target = "socket:[" + std::to_string(inode) + "]";
  bool held = false;
  DIR* proc = ::opendir("/proc");
  if (proc == nullptr) return false;
  while (dirent* process = ::readdir(proc)) {
    if (!std::isdigit(static_cast<unsigned char>(process->d_name[0]))) continue;
    const std::string base = std::string("/proc/") + process->d_name;
    DIR* fds = ::opendir((base + "/fd").c_str());
    if (fds == nullptr) continue;  // gone meanwhile
    bool holds = false;
    char link[64];
    while (dirent* fd = ::readdir(fds)) {
      ssize_t length = ::readlinkat(::dirfd(fds), fd->d_name, link, sizeof(link) - 1);
      if (length > 0 && target.compare(0, std::string::npos, link, static_cast<std::size_t>(length)) == 0) {
        holds = true;
        break;
      }
    }
    ::closedir(fds);
    if (!holds) continue;
    std::ifstream status(base + "/status");
    std::string line;
    bool root = false;
    while (std::getline(status, line)) {
      if (line.compare(0, 4, "Uid:") != 0) continue;
      std::istringstream ids(line.substr(4));
      unsigned long real = 1, effective = 1, saved = 1;
      ids >> real >> effective >> saved;
      root = real == 0 || effective == 0 || saved == 0;
      if (!root) who = "user " + std::to_string(real);
      break;
    }
    if (!root) {
      if (who.empty()) who = "process " + std::string(process->d_name);
      ::closedir(proc);
      return false;
    }
    held = true;
  }
  ::closedir(proc);
  return held;
}

}  // namespace fileindexd
