#include "raw_socket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <random>
#include <string>

namespace raw {
namespace {

using Clock = std::chrono::steady_clock;

sockaddr_in address(const char* ip, std::uint16_t port) {
  sockaddr_in a{AF_INET, htons(port), {}, {}};
  inet_pton(AF_INET, ip, &a.sin_addr);
  return a;
}
int bound(int type, const char* ip, std::uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0), one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  sockaddr_in a = address(ip, port);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 && (type != SOCK_STREAM || ::listen(fd, 64) == 0))
    return fd;
  ::close(fd);
  return -1;
}
bool readable(int fd, Clock::time_point deadline) {
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  pollfd p{fd, POLLIN, 0};
  return left >= 0 && ::poll(&p, 1, static_cast<int>(left)) > 0;
}
Clock::time_point in(int ms) { return Clock::now() + std::chrono::milliseconds(ms); }
// Address reuse lets a stream bind pass over connections in TIME_WAIT, but
// not over a listener; a datagram bind without it fails beside any other.
bool bindable(int type, std::uint16_t port) {
  const int fd = type == SOCK_STREAM ? bound(type, "127.0.0.1", port) : ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  sockaddr_in a = address("127.0.0.1", port);
  const bool ok = fd >= 0 && (type == SOCK_STREAM || ::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0);
  closeFd(fd);
  return ok;
}
// Claims `port` against every other test process of the machine until this
// one ends (the descriptor stays open on purpose).
bool claim(std::uint16_t port) {
  ::mkdir("/tmp/vardel-ports", 01777);
  const int fd = ::open(("/tmp/vardel-ports/" + std::to_string(port)).c_str(), O_RDONLY | O_CREAT | O_CLOEXEC, 0666);
  if (fd >= 0 && ::flock(fd, LOCK_EX | LOCK_NB) == 0) return true;
  closeFd(fd);
  return false;
}

}  // namespace

int listenOn(const char* ip, std::uint16_t& port) {
  const int fd = bound(SOCK_STREAM, ip, port);
  sockaddr_in a{};
  socklen_t length = sizeof a;
  ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &length);
  port = ntohs(a.sin_port);
  return fd;
}

int acceptOne(int listener, int timeoutMs) {
  return readable(listener, in(timeoutMs)) ? ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC) : -1;
}

int connectTo(const char* ip, std::uint16_t port, const char* from) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in local = address(from != nullptr ? from : "0.0.0.0", 0), a = address(ip, port);
  if ((from == nullptr || ::bind(fd, reinterpret_cast<sockaddr*>(&local), sizeof local) == 0) &&
      ::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0)
    return fd;
  ::close(fd);
  return -1;
}

bool sendAll(int fd, const void* data, std::size_t size) {
  for (const char* p = static_cast<const char*>(data); size > 0;) {
    const ssize_t n = ::send(fd, p, size, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n, size -= static_cast<std::size_t>(n);
  }
  return true;
}

bool receiveExactly(int fd, void* data, std::size_t size, int timeoutMs) {
  const auto deadline = in(timeoutMs);
  for (char* p = static_cast<char*>(data); size > 0;) {
    const ssize_t n = readable(fd, deadline) ? ::recv(fd, p, size, 0) : -1;
    if (n <= 0) return false;
    p += n, size -= static_cast<std::size_t>(n);
  }
  return true;
}

std::vector<std::uint8_t> receiveFor(int fd, int timeoutMs) {
  std::vector<std::uint8_t> out;
  std::uint8_t buffer[65536];
  for (const auto deadline = in(timeoutMs); readable(fd, deadline);) {
    const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n <= 0) break;
    out.insert(out.end(), buffer, buffer + n);
  }
  return out;
}

bool closedByPeer(int fd, int timeoutMs) {
  char buffer[4096];
  for (const auto deadline = in(timeoutMs); readable(fd, deadline);) {
    const ssize_t got = ::recv(fd, buffer, sizeof buffer, 0);
    if (got == 0 || (got < 0 && errno != EINTR && errno != EAGAIN)) return true;
  }
  return false;
}

void reset(int fd) {
  linger hard{1, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
  ::close(fd);
}

void closeFd(int fd) {
  if (fd >= 0) ::close(fd);
}

int udpBound(const char* ip, std::uint16_t port) { return bound(SOCK_DGRAM, ip, port); }

std::uint16_t localPort(int fd) {
  sockaddr_in a{};
  socklen_t length = sizeof a;
  return ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &length) == 0 ? ntohs(a.sin_port) : 0;
}

void noDelay(int fd) {
  int one = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
}

std::uint16_t freePort(bool pairWithNext) {
  std::mt19937 pick(static_cast<unsigned>(Clock::now().time_since_epoch().count() ^ ::getpid()));
  for (int attempt = 0; attempt < 1000; ++attempt) {
    // Below the system's ephemeral range (32768 up), so that no outgoing
    // connection of another test takes it meanwhile.
    const auto port = static_cast<std::uint16_t>(20000 + pick() % 12700);
    if (claim(port) && portIsFree(port) && (!pairWithNext || (claim(port + 1) && portIsFree(port + 1)))) return port;
  }
  return 0;
}

bool portIsFree(std::uint16_t port) { return bindable(SOCK_STREAM, port) && bindable(SOCK_DGRAM, port); }

}  // namespace raw
