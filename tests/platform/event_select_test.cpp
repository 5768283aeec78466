// Network events follow Winsock's recording rules.
#include <cstring>

#include "raw_socket.h"
#include "socket_pair.h"

using namespace platform_test;

namespace {

constexpr long kAll = FD_READ | FD_WRITE | FD_CONNECT | FD_CLOSE;

struct Connected {
  SOCKET listener = INVALID_SOCKET, client = INVALID_SOCKET, server = INVALID_SOCKET;
  WSAEVENT clientEvent = WSACreateEvent(), serverEvent = WSACreateEvent(), listenEvent = WSACreateEvent();
  EventLog clientLog, serverLog;
  std::uint16_t port = 0;

  Connected() {
    listener = makeListener(port);
    EXPECT_EQ(0, WSAEventSelect(listener, listenEvent, FD_ACCEPT));
    client = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
    EXPECT_EQ(0, WSAEventSelect(client, clientEvent, kAll));
    sockaddr_in a = loopback(port);
    EXPECT_EQ(SOCKET_ERROR, WSAConnect(client, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr));
    EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
    EventLog listenLog;
    EXPECT_TRUE(waitUntil(listenEvent, [&] {
      listenLog.take(listener, listenEvent);
      return (listenLog.seen & FD_ACCEPT) != 0;
    }));
    server = WSAAccept(listener, nullptr, nullptr, nullptr, 0);
    EXPECT_NE(INVALID_SOCKET, server);
    EXPECT_EQ(0, WSAEventSelect(server, serverEvent, kAll));
    EXPECT_TRUE(waitUntil(clientEvent, [&] {
      clientLog.take(client, clientEvent);
      return (clientLog.seen & FD_CONNECT) && (clientLog.seen & FD_WRITE);
    }));
  }
  ~Connected() {
    for (SOCKET s : {listener, client, server})
      if (s != INVALID_SOCKET) closesocket(s);
    WSACloseEvent(clientEvent);
    WSACloseEvent(serverEvent);
    WSACloseEvent(listenEvent);
  }
};

void noteSent(DWORD, DWORD, WSAOVERLAPPED*, DWORD) {}

// Sends `text` on `s` and waits alertably until it has gone to the kernel.
void sendText(SOCKET s, const char* text) {
  WSABUF buf{static_cast<std::uint32_t>(std::strlen(text)), const_cast<char*>(text)};
  WSAOVERLAPPED ov{};
  int rc = WSASend(s, &buf, 1, nullptr, 0, &ov, noteSent);
  ASSERT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING);
  ASSERT_EQ(WSA_WAIT_IO_COMPLETION, SleepEx(2000, TRUE));
}

}  // namespace

TEST(EventSelect, ConnectIsReportedOnceWithWriteAndAcceptedSocketIsWritable) {
  Winsock ws;
  Connected c;
  EXPECT_EQ(1, c.clientLog.counts[FD_CONNECT_BIT]);
  EXPECT_EQ(0, c.clientLog.errors[FD_CONNECT_BIT]);
  EventLog again;
  again.take(c.client, c.clientEvent);
  EXPECT_EQ(0, again.seen & (FD_CONNECT | FD_WRITE)) << "connect and write are recorded once";
  EXPECT_TRUE(waitUntil(c.serverEvent, [&] {
    c.serverLog.take(c.server, c.serverEvent);
    return (c.serverLog.seen & FD_WRITE) != 0;
  }));
}

TEST(EventSelect, RefusedConnectIsRecordedWithItsError) {
  Winsock ws;
  std::uint16_t port;
  SOCKET probe = makeListener(port);
  closesocket(probe);  // the port is now closed
  SOCKET s = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  WSAEVENT ev = WSACreateEvent();
  ASSERT_EQ(0, WSAEventSelect(s, ev, kAll));
  sockaddr_in a = loopback(port);
  EXPECT_EQ(SOCKET_ERROR, WSAConnect(s, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr));
  EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
  EventLog log;
  ASSERT_TRUE(waitUntil(ev, [&] {
    log.take(s, ev);
    return (log.seen & FD_CONNECT) != 0;
  }));
  EXPECT_EQ(WSAECONNREFUSED, log.errors[FD_CONNECT_BIT]);
  EXPECT_EQ(0, log.seen & FD_WRITE);
  EXPECT_EQ(WSA_WAIT_TIMEOUT, WSAWaitForMultipleEvents(1, &ev, FALSE, 100, TRUE)) << "nothing more to report";
  closesocket(s);
  WSACloseEvent(ev);
}

TEST(EventSelect, AcceptIsRecordedOncePerWaitingConnection) {
  Winsock ws;
  std::uint16_t port;
  SOCKET listener = makeListener(port);
  WSAEVENT ev = WSACreateEvent();
  ASSERT_EQ(0, WSAEventSelect(listener, ev, FD_ACCEPT));
  SOCKET clients[2];
  for (SOCKET& c : clients) {
    c = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
    sockaddr_in a = loopback(port);
    WSAConnect(c, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr);
  }
  EventLog log;
  ASSERT_TRUE(waitUntil(ev, [&] {
    log.take(listener, ev);
    return (log.seen & FD_ACCEPT) != 0;
  }));
  EventLog quiet;
  quiet.take(listener, ev);
  EXPECT_EQ(0, quiet.seen) << "not again before an accept";
  sockaddr_in peer{};
  int len = sizeof peer;
  SOCKET first = WSAAccept(listener, reinterpret_cast<sockaddr*>(&peer), &len, nullptr, 0);
  ASSERT_NE(INVALID_SOCKET, first);
  EXPECT_EQ(inet_addr("127.0.0.1"), peer.sin_addr.s_addr);
  EventLog second;
  ASSERT_TRUE(waitUntil(ev, [&] {
    second.take(listener, ev);
    return (second.seen & FD_ACCEPT) != 0;
  })) << "the second waiting connection is reported after the first accept";
  SOCKET other = WSAAccept(listener, nullptr, nullptr, nullptr, 0);
  ASSERT_NE(INVALID_SOCKET, other);
  EXPECT_EQ(INVALID_SOCKET, WSAAccept(listener, nullptr, nullptr, nullptr, 0));
  EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
  for (SOCKET s : {first, other, clients[0], clients[1], listener}) closesocket(s);
  WSACloseEvent(ev);
}

TEST(EventSelect, ReadIsRecordedAgainOnlyAfterAReadWasPosted) {
  Winsock ws;
  Connected c;
  sendText(c.client, "first");
  EventLog log;
  ASSERT_TRUE(waitUntil(c.serverEvent, [&] {
    log.take(c.server, c.serverEvent);
    return (log.seen & FD_READ) != 0;
  }));
  sendText(c.client, "second");
  EXPECT_EQ(WSA_WAIT_TIMEOUT, WSAWaitForMultipleEvents(1, &c.serverEvent, FALSE, 100, FALSE));
  EventLog quiet;
  quiet.take(c.server, c.serverEvent);
  EXPECT_EQ(0, quiet.seen & FD_READ);

  char bytes[4];  // smaller than what waits, so data remains
  WSABUF buf{sizeof bytes, bytes};
  WSAOVERLAPPED ov{};
  DWORD got = 0, flags = 0;
  ASSERT_EQ(0, WSARecv(c.server, &buf, 1, &got, &flags, &ov, noteSent));
  EXPECT_EQ(4u, got);
  EventLog again;
  ASSERT_TRUE(waitUntil(c.serverEvent, [&] {
    again.take(c.server, c.serverEvent);
    return (again.seen & FD_READ) != 0;
  }));
  SleepEx(0, TRUE);
}

TEST(EventSelect, OrderlyCloseComesOnceAfterTheDataInFrontOfIt) {
  Winsock ws;
  Connected c;
  sendText(c.client, "bye");
  ASSERT_EQ(0, closesocket(c.client));
  c.client = INVALID_SOCKET;
  EventLog log;
  ASSERT_TRUE(waitUntil(c.serverEvent, [&] {
    log.take(c.server, c.serverEvent);
    return (log.seen & FD_READ) != 0;
  }));
  EXPECT_EQ(0, log.seen & FD_CLOSE) << "close waits until the data is read";
  char bytes[16];
  WSABUF buf{sizeof bytes, bytes};
  WSAOVERLAPPED ov{};
  DWORD got = 0, flags = 0;
  ASSERT_EQ(0, WSARecv(c.server, &buf, 1, &got, &flags, &ov, noteSent));
  EXPECT_EQ(3u, got);
  ASSERT_TRUE(waitUntil(c.serverEvent, [&] {
    log.take(c.server, c.serverEvent);
    return (log.seen & FD_CLOSE) != 0;
  }));
  EXPECT_EQ(0, log.errors[FD_CLOSE_BIT]);
  EXPECT_EQ(1, log.counts[FD_CLOSE_BIT]);
  SleepEx(0, TRUE);
  EXPECT_EQ(WSA_WAIT_TIMEOUT, WSAWaitForMultipleEvents(1, &c.serverEvent, FALSE, 100, TRUE))
      << "a closed socket does not wake the wait again";
}

TEST(EventSelect, ResetIsReportedAsCloseWithConnReset) {
  Winsock ws;
  std::uint16_t port;
  SOCKET listener = makeListener(port);
  int peer = raw::connectTo("127.0.0.1", port);
  ASSERT_GE(peer, 0);
  SOCKET server = INVALID_SOCKET;
  for (int i = 0; i < 100 && server == INVALID_SOCKET; ++i) {
    server = WSAAccept(listener, nullptr, nullptr, nullptr, 0);
    if (server == INVALID_SOCKET) Sleep(10);
  }
  ASSERT_NE(INVALID_SOCKET, server);
  WSAEVENT ev = WSACreateEvent();
  ASSERT_EQ(0, WSAEventSelect(server, ev, kAll));
  raw::reset(peer);
  EventLog log;
  ASSERT_TRUE(waitUntil(ev, [&] {
    log.take(server, ev);
    return (log.seen & FD_CLOSE) != 0;
  }));
  EXPECT_EQ(WSAECONNRESET, log.errors[FD_CLOSE_BIT]);
  closesocket(server);
  closesocket(listener);
  WSACloseEvent(ev);
}

TEST(EventSelect, OptionsReadBackWhatWasSetAndBindConflictsAreReported) {
  Winsock ws;
  SOCKET tcp = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  SOCKET udp = WSASocketA(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  int value = 65536, out = 0, len = sizeof out;
  ASSERT_EQ(0, setsockopt(tcp, SOL_SOCKET, SO_SNDBUF, reinterpret_cast<char*>(&value), sizeof value));
  ASSERT_EQ(0, getsockopt(tcp, SOL_SOCKET, SO_SNDBUF, reinterpret_cast<char*>(&out), &len));
  EXPECT_EQ(65536, out);
  len = sizeof out;
  ASSERT_EQ(0, getsockopt(udp, SOL_SOCKET, SO_MAX_MSG_SIZE, reinterpret_cast<char*>(&out), &len));
  EXPECT_EQ(65507, out);
  len = sizeof out;
  EXPECT_EQ(SOCKET_ERROR, getsockopt(tcp, SOL_SOCKET, SO_MAX_MSG_SIZE, reinterpret_cast<char*>(&out), &len));
  EXPECT_EQ(WSAENOPROTOOPT, WSAGetLastError());

  std::uint16_t port;
  SOCKET listener = makeListener(port);
  sockaddr_in a = loopback(port);
  EXPECT_EQ(SOCKET_ERROR, bind(tcp, asAddr(a), sizeof a));
  EXPECT_EQ(WSAEADDRINUSE, WSAGetLastError());
  for (SOCKET s : {tcp, udp, listener}) EXPECT_EQ(0, closesocket(s));
  EXPECT_EQ(SOCKET_ERROR, closesocket(tcp));
  EXPECT_EQ(WSAENOTSOCK, WSAGetLastError()) << "a closed handle stays dead";
}
