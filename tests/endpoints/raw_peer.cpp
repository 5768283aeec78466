#include "raw_peer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

namespace raw_peer {

std::uint16_t localPort(int fd) {
  sockaddr_in a{};
  socklen_t length = sizeof a;
  if (::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &length) != 0) return 0;
  return ntohs(a.sin_port);
}

void noDelay(int fd) {
  int one = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
}

bool closedByPeer(int fd, int timeoutMs) {
  pollfd p{fd, POLLIN, 0};
  if (::poll(&p, 1, timeoutMs) <= 0) return false;
  char byte;
  ssize_t n = ::recv(fd, &byte, 1, MSG_PEEK);
  return n == 0 || (n < 0 && errno != EAGAIN);
}

bool refusedOrClosed(const char* ip, std::uint16_t port, int timeoutMs) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port);
  ::inet_pton(AF_INET, ip, &a.sin_addr);
  bool result = true;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0) result = closedByPeer(fd, timeoutMs);
  ::close(fd);
  return result;
}

}  // namespace raw_peer
