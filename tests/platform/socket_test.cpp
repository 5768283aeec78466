// Sockets on 127.0.0.1: network events follow Winsock's recording rules, and
// overlapped sends and reads complete once each, in order, on the issuing
// thread and only inside its alertable waits.
#include <atomic>
#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "fault.h"
#include "platform_test.h"

using namespace platform_test;

namespace {

constexpr long kAll = FD_READ | FD_WRITE | FD_CONNECT | FD_CLOSE;

struct Record {
  WSAOVERLAPPED ov{};  // first: the routine finds its record by it
  DWORD error = 0xFFFFFFFF;
  DWORD bytes = 0;
  int order = -1;
  std::thread::id thread;
};
std::atomic<int> g_finished{0};

void complete(DWORD error, DWORD bytes, WSAOVERLAPPED* ov, DWORD) {
  auto* r = reinterpret_cast<Record*>(ov);
  *r = {*ov, error, bytes, g_finished++, std::this_thread::get_id()};
}

int post(bool send, SOCKET s, const char* data, std::size_t size, Record& r) {
  WSABUF b{static_cast<std::uint32_t>(size), const_cast<char*>(data)};
  return send ? WSASend(s, &b, 1, nullptr, 0, &r.ov, complete) : WSARecv(s, &b, 1, nullptr, nullptr, &r.ov, complete);
}

bool settles(const Record& r) {
  for (int i = 0; i < 250 && r.order < 0; ++i) SleepEx(20, TRUE);
  return r.order >= 0;
}

Record transfer(bool send, SOCKET s, const char* data, std::size_t size) {
  Record r;
  const int rc = post(send, s, data, size, r);
  EXPECT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING) << WSAGetLastError();
  EXPECT_TRUE(settles(r));
  return r;
}

// A connection with every event selected on both ends.
struct Connected {
  Winsock ws;
  std::uint16_t port = 0;
  SOCKET listener = makeListener(port);
  EventLog client{tcpSocket(), kAll};
  std::unique_ptr<EventLog> server;

  Connected() {
    EventLog accepting(listener, FD_ACCEPT);
    EXPECT_EQ(SOCKET_ERROR, connectTo(client.socket, port));
    EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError()) << "a connect is always reported through FD_CONNECT";
    EXPECT_TRUE(accepting.await(FD_ACCEPT));
    server = std::make_unique<EventLog>(WSAAccept(listener, nullptr, nullptr, nullptr, 0), kAll);
    EXPECT_TRUE(client.await(FD_CONNECT | FD_WRITE));
  }
  ~Connected() {
    for (SOCKET s : {listener, client.socket, server->socket}) closesocket(s);
  }
};

}  // namespace

TEST(EventSelect, ConnectWriteAndReadAreRecordedOnceUntilReEnabled) {
  Connected c;
  EXPECT_EQ(0, c.client.errors[FD_CONNECT_BIT]);
  EXPECT_EQ(0, c.client.take() & (FD_CONNECT | FD_WRITE)) << "connect and write come once";
  EXPECT_TRUE(c.server->await(FD_WRITE)) << "an accepted socket is writable";
  transfer(true, c.client.socket, "first", 5);
  ASSERT_TRUE(c.server->await(FD_READ));
  transfer(true, c.client.socket, "second", 6);
  EXPECT_TRUE(c.server->quiet());
  EXPECT_EQ(0, c.server->take() & FD_READ) << "not again before a read was posted";
  char bytes[4];  // less than waits, so data remains
  EXPECT_EQ(4u, transfer(false, c.server->socket, bytes, sizeof bytes).bytes);
  c.server->seen = 0;
  EXPECT_TRUE(c.server->await(FD_READ));
}

TEST(EventSelect, ARefusedConnectIsRecordedWithItsErrorAndNothingElse) {
  Winsock ws;
  std::uint16_t port;
  closesocket(makeListener(port));
  EventLog log(tcpSocket(), kAll);
  EXPECT_EQ(SOCKET_ERROR, connectTo(log.socket, port));
  EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
  ASSERT_TRUE(log.await(FD_CONNECT));
  EXPECT_EQ(WSAECONNREFUSED, log.errors[FD_CONNECT_BIT]);
  EXPECT_TRUE(log.quiet());
  EXPECT_EQ(FD_CONNECT, log.seen | log.take());
  closesocket(log.socket);
}

TEST(EventSelect, AnOrderlyCloseComesOnceAfterTheDataInFrontOfIt) {
  Connected c;
  transfer(true, c.client.socket, "bye", 3);
  ASSERT_EQ(0, closesocket(c.client.socket));
  ASSERT_TRUE(c.server->await(FD_READ));
  EXPECT_EQ(0, c.server->seen & FD_CLOSE) << "close waits until the data is read";
  char bytes[16];
  EXPECT_EQ(3u, transfer(false, c.server->socket, bytes, sizeof bytes).bytes);
  ASSERT_TRUE(c.server->await(FD_CLOSE));
  EXPECT_EQ(0, c.server->errors[FD_CLOSE_BIT]);
  EXPECT_TRUE(c.server->quiet());
  EXPECT_EQ(1, c.server->counts[FD_CLOSE_BIT]);
}

TEST(Overlapped, CompletionRunsOnlyInAnAlertableWaitOfTheIssuingThread) {
  Connected c;
  g_finished = 0;
  char in[16];
  Record sent, got;
  ASSERT_EQ(0, post(true, c.client.socket, "ping", 4, sent));
  ASSERT_EQ(SOCKET_ERROR, post(false, c.server->socket, in, sizeof in, got));
  std::thread([] { SleepEx(100, TRUE); }).join();
  Sleep(50);
  EXPECT_EQ(0, g_finished.load()) << "a routine ran outside an alertable wait of this thread";
  ASSERT_TRUE(settles(sent) && settles(got));
  EXPECT_EQ(4u, sent.bytes);
  EXPECT_EQ(0u, got.error);
  EXPECT_EQ(4u, got.bytes);
  EXPECT_EQ(0, std::memcmp(in, "ping", 4));
  EXPECT_EQ(std::this_thread::get_id(), sent.thread);
  EXPECT_EQ(std::this_thread::get_id(), got.thread);
  EXPECT_EQ(0u, SleepEx(30, TRUE)) << "each routine runs once";
}

// Sizes from 0 bytes to far beyond the socket buffers; some sends are made to
// go pending and one to be refused, as a full buffer would.
TEST(Overlapped, ManySendsArriveIntactAndCompleteInOrder) {
  Connected c;
  g_finished = 0;
  std::vector<std::size_t> sizes;
  for (int i = 0; i < 300; ++i) sizes.push_back(static_cast<std::size_t>((i * 7919) % 40000));
  sizes.push_back(3u << 20);
  std::vector<char> payload;
  for (std::size_t s : sizes) payload.resize(payload.size() + s);
  for (std::size_t i = 0; i < payload.size(); ++i) payload[i] = static_cast<char>(i * 131 + (i >> 9));
  std::vector<Record> sends(sizes.size());
  Record refused;
  for (std::size_t i = 0, offset = 0; i < sizes.size(); offset += sizes[i++]) {
    if (i == 150) {
      platform::fault::arm(platform::fault::Call::WSASend, {1, false, WSAEWOULDBLOCK});
      EXPECT_EQ(SOCKET_ERROR, post(true, c.client.socket, payload.data() + offset, sizes[i], refused));
      EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
    }
    if (i % 50 == 49) platform::fault::arm(platform::fault::Call::WSASend, {1, false, WSA_IO_PENDING});
    const int rc = post(true, c.client.socket, payload.data() + offset, sizes[i], sends[i]);
    EXPECT_EQ(i % 50 == 49 ? SOCKET_ERROR : 0, rc) << i;
    if (rc != 0) {
      ASSERT_EQ(WSA_IO_PENDING, WSAGetLastError());
    }
  }
  std::vector<char> received, chunk(65536);
  while (received.size() < payload.size()) {
    Record r = transfer(false, c.server->socket, chunk.data(), chunk.size());
    ASSERT_TRUE(r.error == 0 && r.bytes > 0);
    received.insert(received.end(), chunk.begin(), chunk.begin() + r.bytes);
  }
  EXPECT_TRUE(received == payload);
  SleepEx(0, TRUE);
  for (std::size_t i = 1; i < sends.size(); ++i) {
    ASSERT_EQ(0u, sends[i].error);
    ASSERT_EQ(sizes[i], sends[i].bytes);
    ASSERT_LT(sends[i - 1].order, sends[i].order) << "sends of one socket complete in order";
  }
  EXPECT_EQ(-1, refused.order) << "a refused send never completes";
  c.client.seen = 0;
  EXPECT_TRUE(c.client.await(FD_WRITE)) << "a refused send arms FD_WRITE";
}

TEST(Overlapped, PeerCloseCompletesAReadWithZeroBytesAndClosesocketAbortsOne) {
  Connected c;
  char in[16];
  Record atServer, atClient;
  ASSERT_EQ(SOCKET_ERROR, post(false, c.server->socket, in, sizeof in, atServer));
  ASSERT_EQ(WSA_IO_PENDING, WSAGetLastError());
  ASSERT_EQ(SOCKET_ERROR, post(false, c.client.socket, in, sizeof in, atClient));
  ASSERT_EQ(0, WSASendDisconnect(c.client.socket, nullptr));
  ASSERT_TRUE(settles(atServer));
  EXPECT_EQ(0u, atServer.error);
  EXPECT_EQ(0u, atServer.bytes);
  ASSERT_EQ(0, closesocket(c.client.socket));
  ASSERT_TRUE(settles(atClient));
  EXPECT_EQ(static_cast<DWORD>(WSA_OPERATION_ABORTED), atClient.error);
}
