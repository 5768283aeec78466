#include "raw_socket.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <random>

namespace raw {
namespace {

sockaddr_in address(const char* ip, std::uint16_t port) {
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port);
  inet_pton(AF_INET, ip, &a.sin_addr);
  return a;
}

bool readable(int fd, int timeoutMs) {
  pollfd p{fd, POLLIN, 0};
  return ::poll(&p, 1, timeoutMs) > 0;
}

// Address reuse lets a stream bind pass over connections in TIME_WAIT, but
// not over a listener; without it a datagram bind fails beside any other.
bool bindable(int type, std::uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  int one = 1;
  if (type == SOCK_STREAM) ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  sockaddr_in a = address("127.0.0.1", port);
  bool ok = ::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 && (type != SOCK_STREAM || ::listen(fd, 1) == 0);
  ::close(fd);
  return ok;
}

// Claims `port` against every other test process of the machine until this
// one ends: two processes that both find a port free would otherwise both
// take it. The descriptor stays open on purpose.
bool claim(std::uint16_t port) {
  ::mkdir("/tmp/vardel-ports", 01777);
  const std::string path = "/tmp/vardel-ports/" + std::to_string(port);
  const int fd = ::open(path.c_str(), O_RDONLY | O_CREAT | O_CLOEXEC, 0666);
  if (fd < 0) return false;
  if (::flock(fd, LOCK_EX | LOCK_NB) == 0) return true;
  ::close(fd);
  return false;
}

}  // namespace

int listenOn(const char* ip, std::uint16_t& port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  int one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  sockaddr_in a = address(ip, port);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 || ::listen(fd, 64) != 0) {
    ::close(fd);
    return -1;
  }
  socklen_t len = sizeof a;
  ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
  port = ntohs(a.sin_port);
  return fd;
}

int acceptOne(int listener, int timeoutMs) {
  if (!readable(listener, timeoutMs)) return -1;
  return ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
}

int connectTo(const char* ip, std::uint16_t port) { return connectFrom(nullptr, ip, port); }

int connectFrom(const char* from, const char* ip, std::uint16_t port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in local = address(from != nullptr ? from : "0.0.0.0", 0);
  sockaddr_in a = address(ip, port);
  if ((from != nullptr && ::bind(fd, reinterpret_cast<sockaddr*>(&local), sizeof local) != 0) ||
      ::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

bool sendAll(int fd, const void* data, std::size_t size) {
  const char* p = static_cast<const char*>(data);
  while (size > 0) {
    ssize_t n = ::send(fd, p, size, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

bool receiveExactly(int fd, void* data, std::size_t size, int timeoutMs) {
  char* p = static_cast<char*>(data);
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  while (size > 0) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
    if (left <= 0 || !readable(fd, static_cast<int>(left))) return false;
    ssize_t n = ::recv(fd, p, size, 0);
    if (n <= 0) return false;
    p += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

std::vector<std::uint8_t> receiveFor(int fd, int timeoutMs) {
  std::vector<std::uint8_t> out;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  std::uint8_t buffer[65536];
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
    if (left <= 0 || !readable(fd, static_cast<int>(left))) break;
    ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n <= 0) break;
    out.insert(out.end(), buffer, buffer + n);
  }
  return out;
}

void reset(int fd) {
  linger hard{1, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
  ::close(fd);
}

void closeFd(int fd) {
  if (fd >= 0) ::close(fd);
}

int udpBound(const char* ip, std::uint16_t port) {
  int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  int one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  sockaddr_in a = address(ip, port);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

std::uint16_t freePort(bool pairWithNext) {
  std::mt19937 pick(static_cast<unsigned>(std::chrono::steady_clock::now().time_since_epoch().count() ^ ::getpid()));
  for (int attempt = 0; attempt < 1000; ++attempt) {
    // Below the system's ephemeral range (32768 up), so that no outgoing
    // connection of another test takes it meanwhile.
    auto port = static_cast<std::uint16_t>(20000 + pick() % 12700);
    if (!claim(port) || (pairWithNext && !claim(port + 1))) continue;
    bool ok = bindable(SOCK_STREAM, port) && bindable(SOCK_DGRAM, port);
    if (ok && pairWithNext) ok = bindable(SOCK_STREAM, port + 1) && bindable(SOCK_DGRAM, port + 1);
    if (ok) return port;
  }
  return 0;
}

bool portIsFree(std::uint16_t port) { return bindable(SOCK_STREAM, port) && bindable(SOCK_DGRAM, port); }

bool closedByPeer(int fd, int timeoutMs) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0 || !readable(fd, static_cast<int>(left.count()))) return false;
    char buffer[4096];
    ssize_t got = ::recv(fd, buffer, sizeof buffer, 0);
    if (got == 0) return true;
    if (got < 0 && errno != EINTR && errno != EAGAIN) return true;
  }
}

}  // namespace raw
