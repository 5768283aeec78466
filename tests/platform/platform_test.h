// Winsock-style sockets over 127.0.0.1 for the platform tests.
#pragma once

#include <gtest/gtest.h>

#include <chrono>

#include "win32.h"
#include "winsock.h"

namespace platform_test {

using namespace platform;

inline sockaddr_in loopback(std::uint16_t port) { return {AF_INET, htons(port), {inet_addr("127.0.0.1")}, {}}; }
inline const sockaddr* asAddr(const sockaddr_in& a) { return reinterpret_cast<const sockaddr*>(&a); }
inline SOCKET tcpSocket() { return WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED); }
inline SOCKET udpSocket() { return WSASocketA(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0, WSA_FLAG_OVERLAPPED); }
inline int connectTo(SOCKET s, std::uint16_t port) {
  sockaddr_in a = loopback(port);
  return WSAConnect(s, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr);
}
// The port `s` is bound to.
inline std::uint16_t portOf(SOCKET s) {
  sockaddr_in a{};
  int len = sizeof a;
  EXPECT_EQ(0, getsockname(s, reinterpret_cast<sockaddr*>(&a), &len));
  return ntohs(a.sin_port);
}
// A socket bound to a port of 127.0.0.1 that the system chose.
inline SOCKET bound(SOCKET s) {
  sockaddr_in a = loopback(0);
  EXPECT_EQ(0, bind(s, asAddr(a), sizeof a));
  return s;
}
inline SOCKET makeListener(std::uint16_t& port) {
  SOCKET s = bound(tcpSocket());
  EXPECT_EQ(0, listen(s, SOMAXCONN));
  port = portOf(s);
  return s;
}

struct Winsock {
  Winsock() {
    WSADATA data;
    EXPECT_EQ(0, WSAStartup(0x0002, &data));
  }
  ~Winsock() { WSACleanup(); }
};

// The network events selected for one socket, as enumerated so far.
struct EventLog {
  SOCKET socket;
  long selected;
  WSAEVENT event = WSACreateEvent();
  long seen = 0;
  int errors[FD_MAX_EVENTS] = {};
  int counts[FD_MAX_EVENTS] = {};

  EventLog(SOCKET s, long bits) : socket(s), selected(bits) { EXPECT_EQ(0, WSAEventSelect(s, event, bits)); }
  ~EventLog() { WSACloseEvent(event); }
  long take() {
    WSANETWORKEVENTS ne{};
    EXPECT_EQ(0, WSAEnumNetworkEvents(socket, event, &ne));
    seen |= ne.lNetworkEvents;
    for (int bit = 0; bit < FD_MAX_EVENTS; ++bit) {
      if (ne.lNetworkEvents & (1L << bit)) errors[bit] = ne.iErrorCode[bit], ++counts[bit];
    }
    return ne.lNetworkEvents;
  }
  // Waits alertably until every one of `bits` has been seen since `seen` was cleared.
  bool await(long bits, int milliseconds = 5000) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(milliseconds);
    while ((take(), seen & bits) != bits) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      WSAWaitForMultipleEvents(1, &event, FALSE, 50, TRUE);
    }
    return true;
  }
  bool quiet(int milliseconds = 100) { return WSAWaitForMultipleEvents(1, &event, FALSE, milliseconds, TRUE) == WSA_WAIT_TIMEOUT; }
};

}  // namespace platform_test
