// Helpers for platform tests: Winsock-style sockets over 127.0.0.1.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>

#include "winsock.h"
#include "win32.h"

namespace platform_test {

using namespace platform;

inline sockaddr_in loopback(std::uint16_t port) {
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port);
  a.sin_addr.s_addr = inet_addr("127.0.0.1");
  return a;
}

inline const sockaddr* asAddr(const sockaddr_in& a) { return reinterpret_cast<const sockaddr*>(&a); }

struct Winsock {
  Winsock() {
    WSADATA data;
    EXPECT_EQ(0, WSAStartup(0x0002, &data));
  }
  ~Winsock() { WSACleanup(); }
};

// A listening TCP socket on an ephemeral port of 127.0.0.1.
inline SOCKET makeListener(std::uint16_t& port) {
  SOCKET s = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  EXPECT_NE(INVALID_SOCKET, s);
  sockaddr_in a = loopback(0);
  EXPECT_EQ(0, bind(s, asAddr(a), sizeof a));
  EXPECT_EQ(0, listen(s, SOMAXCONN));
  int len = sizeof a;
  EXPECT_EQ(0, getsockname(s, reinterpret_cast<sockaddr*>(&a), &len));
  port = ntohs(a.sin_port);
  return s;
}

// Waits (alertably) on one event until `done` holds or the time runs out.
inline bool waitUntil(WSAEVENT event, const std::function<bool()>& done, int milliseconds = 3000) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(milliseconds);
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    WSAWaitForMultipleEvents(1, &event, FALSE, 50, TRUE);
  }
  return true;
}

// Enumerates and accumulates the network events of `s` on `event`.
struct EventLog {
  long seen = 0;
  int errors[FD_MAX_EVENTS] = {};
  int counts[FD_MAX_EVENTS] = {};
  void take(SOCKET s, WSAEVENT event) {
    WSANETWORKEVENTS ne{};
    ASSERT_EQ(0, WSAEnumNetworkEvents(s, event, &ne));
    seen |= ne.lNetworkEvents;
    for (int bit = 0; bit < FD_MAX_EVENTS; ++bit) {
      if (ne.lNetworkEvents & (1L << bit)) {
        ++counts[bit];
        errors[bit] = ne.iErrorCode[bit];
      }
    }
  }
};

}  // namespace platform_test
