// Who is at the other end of a loopback TCP connection: the kernel's socket table knows
// the owner of the client's socket, since both ends live on this machine.
#ifndef FILEINDEXD_SPOTLIGHT_PEER_OWNER_H
#define FILEINDEXD_SPOTLIGHT_PEER_OWNER_H

#include <sys/types.h>

#include <string>

namespace fileindexd {

struct PeerSocket {
  uid_t owner = 0;          // the user the socket was made for
  unsigned long inode = 0;  // the socket's inode, as /proc/PID/fd shows it ("socket:[N]")
};

// The TCP socket at clientAddress:clientPort that is connected to serverAddress:serverPort
// (IPv4, numeric). False, with error, when no such socket is found (the peer is on another
// machine, or already gone).
bool LoopbackPeerSocket(const std::string& clientAddress, int clientPort, const std::string& serverAddress,
                        int serverPort, PeerSocket& peer, std::string& error);

// Whether every process holding the socket has root among its user ids (real, effective,
// saved): a process that may become root at will is root. Samba's helpers open their
// connections while acting as the user they serve, so the socket's owner alone does not
// say who asks. False, with `who` naming the first other user, when not; false with an
// empty `who` when no process holds it any more.
bool SocketHeldByRootOnly(unsigned long inode, std::string& who);

}  // namespace fileindexd

#endif
