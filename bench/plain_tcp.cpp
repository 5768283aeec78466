#include "plain_tcp.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <random>
#include <thread>

namespace bench {
namespace {

using Clock = std::chrono::steady_clock;

sockaddr_in loopback(std::uint16_t port) {
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port);
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return a;
}

// A connected pair with the same socket buffers the library asks for.
void connectedPair(int& a, int& b) {
  int listener = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr = loopback(0);
  ::bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  ::listen(listener, 1);
  socklen_t len = sizeof addr;
  ::getsockname(listener, reinterpret_cast<sockaddr*>(&addr), &len);
  a = ::socket(AF_INET, SOCK_STREAM, 0);
  int size = 65536;
  ::setsockopt(a, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
  ::setsockopt(a, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
  ::connect(a, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  b = ::accept(listener, nullptr, nullptr);
  ::setsockopt(b, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
  ::setsockopt(b, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
  ::close(listener);
}

bool sendAll(int fd, const void* data, std::size_t size) {
  const char* p = static_cast<const char*>(data);
  while (size > 0) {
    ssize_t n = ::send(fd, p, size, MSG_NOSIGNAL);
    if (n <= 0) return false;
    p += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

// Reads framed messages and calls `each` for every whole one.
template <class Each>
bool readMessages(int fd, std::size_t count, Each each) {
  std::vector<std::uint8_t> buffer(65536);
  std::vector<std::uint8_t> pending;
  std::size_t seen = 0;
  while (seen < count) {
    ssize_t n = ::recv(fd, buffer.data(), buffer.size(), 0);
    if (n <= 0) return false;
    pending.insert(pending.end(), buffer.begin(), buffer.begin() + n);
    std::size_t at = 0;
    while (pending.size() - at >= 4) {
      std::uint32_t length;
      std::memcpy(&length, pending.data() + at, 4);
      if (pending.size() - at - 4 < length) break;
      if (!each(pending.data() + at + 4, length)) return false;
      at += 4 + length;
      ++seen;
    }
    pending.erase(pending.begin(), pending.begin() + static_cast<std::ptrdiff_t>(at));
  }
  return true;
}

// Byte k of message i is (i * 31 + k) mod 256, its first 8 bytes hold i: a
// window into one repeating ramp, so that filling and checking are a memcpy
// and a memcmp and the figures measure the transports, not a byte loop.
constexpr std::size_t kRampMessage = 1u << 20;  // longer messages take the loop

const std::uint8_t* ramp() {
  static const std::vector<std::uint8_t> bytes = [] {
    std::vector<std::uint8_t> b(256 + kRampMessage);
    for (std::size_t j = 0; j < b.size(); ++j) b[j] = static_cast<std::uint8_t>(j);
    return b;
  }();
  return bytes.data();
}

}  // namespace

void fillMessage(std::vector<std::uint8_t>& out, std::size_t size, std::uint64_t index) {
  out.resize(size);
  if (size <= kRampMessage) {
    std::memcpy(out.data(), ramp() + ((index * 31) & 255), size);
  } else {
    for (std::size_t k = 0; k < size; ++k) out[k] = static_cast<std::uint8_t>(index * 31 + k);
  }
  if (size >= 8) std::memcpy(out.data(), &index, 8);
}

bool checkMessage(const std::uint8_t* data, std::size_t size, std::uint64_t index) {
  std::size_t k = 0;
  if (size >= 8) {
    std::uint64_t got;
    std::memcpy(&got, data, 8);
    if (got != index) return false;
    k = 8;
  }
  if (size <= kRampMessage) return std::memcmp(data + k, ramp() + ((index * 31 + k) & 255), size - k) == 0;
  for (; k < size; ++k) {
    if (data[k] != static_cast<std::uint8_t>(index * 31 + k)) return false;
  }
  return true;
}

Latency summarize(std::vector<double>& micros) {
  Latency l;
  l.samples = micros.size();
  if (micros.empty()) return l;
  std::sort(micros.begin(), micros.end());
  l.medianMicros = micros[micros.size() / 2];
  l.p99Micros = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
  return l;
}

Throughput plainThroughput(std::size_t size, std::size_t count) {
  int a, b;
  connectedPair(a, b);
  Throughput t;
  bool ok = true;
  std::thread reader([&] {
    std::uint64_t next = 0;
    // A bad message is noted and reading goes on: a reader that stopped would
    // leave the sender blocked on a full socket.
    bool intact = true;
    bool whole = readMessages(b, count, [&](const std::uint8_t* data, std::uint32_t length) {
      if (length != size || !checkMessage(data, length, next)) intact = false;
      ++next;
      return true;
    });
    ok = whole && intact;
  });
  auto start = Clock::now();
  std::vector<std::uint8_t> message;
  std::vector<std::uint8_t> frame;
  for (std::size_t i = 0; i < count; ++i) {
    fillMessage(message, size, i);
    frame.resize(4 + size);
    std::uint32_t length = static_cast<std::uint32_t>(size);
    std::memcpy(frame.data(), &length, 4);
    std::memcpy(frame.data() + 4, message.data(), size);
    if (!sendAll(a, frame.data(), frame.size())) break;
  }
  reader.join();
  double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  t.verified = ok;
  setRates(t, count, size, seconds);
  ::close(a);
  ::close(b);
  return t;
}

Latency plainRoundTrip(std::size_t size, int rounds) {
  int a, b;
  connectedPair(a, b);
  std::thread echo([&] {
    readMessages(b, static_cast<std::size_t>(rounds), [&](const std::uint8_t* data, std::uint32_t length) {
      std::vector<std::uint8_t> frame(data, data + length);
      frame.insert(frame.begin(), reinterpret_cast<const std::uint8_t*>(&length),
                   reinterpret_cast<const std::uint8_t*>(&length) + 4);
      return sendAll(b, frame.data(), frame.size());
    });
  });
  std::vector<double> micros;
  std::vector<std::uint8_t> message;
  std::vector<std::uint8_t> frame;
  for (int i = 0; i < rounds; ++i) {
    fillMessage(message, size, static_cast<std::uint64_t>(i));
    std::uint32_t length = static_cast<std::uint32_t>(size);
    frame.resize(4 + size);
    std::memcpy(frame.data(), &length, 4);
    std::memcpy(frame.data() + 4, message.data(), size);
    auto start = Clock::now();
    std::uint64_t expect = static_cast<std::uint64_t>(i);
    bool ok = sendAll(a, frame.data(), frame.size()) &&
              readMessages(a, 1, [&](const std::uint8_t* data, std::uint32_t len) {
                return len == size && checkMessage(data, len, expect);
              });
    if (!ok) {
      ::shutdown(a, SHUT_RDWR);  // wakes the echo thread
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  echo.join();
  ::close(a);
  ::close(b);
  return summarize(micros);
}

std::uint16_t freePort() {
  std::mt19937 pick(static_cast<unsigned>(::getpid() ^ Clock::now().time_since_epoch().count()));
  for (int attempt = 0; attempt < 1000; ++attempt) {
    auto port = static_cast<std::uint16_t>(20000 + pick() % 30000);
    if (port == 6000 || port == 5999) continue;
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in a = loopback(port);
    bool ok = ::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0;
    ::close(fd);
    if (ok) return port;
  }
  return 0;
}

int silentPeer(std::uint16_t port) {
  int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  int on = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
  sockaddr_in a = loopback(port);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 || ::listen(fd, 4) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

void closeSilentPeer(int fd) {
  if (fd >= 0) ::close(fd);
}

}  // namespace bench
