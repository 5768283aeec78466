// Overlapped sends and reads: completions run exactly once, on the issuing
// thread, inside its alertable waits, in order; data arrives intact.
#include <atomic>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "fault.h"
#include "socket_pair.h"

using namespace platform_test;

namespace {

struct Record {
  WSAOVERLAPPED ov{};
  DWORD error = 0xFFFFFFFF;
  DWORD bytes = 0;
  int order = -1;
  std::thread::id thread;
};

std::atomic<int> g_finished{0};

void complete(DWORD error, DWORD bytes, WSAOVERLAPPED* ov, DWORD) {
  auto* r = reinterpret_cast<Record*>(ov);  // ov is the first member
  r->error = error;
  r->bytes = bytes;
  r->order = g_finished++;
  r->thread = std::this_thread::get_id();
}

struct Pair {
  SOCKET listener, client, server;
  std::uint16_t port;
  Pair() {
    listener = makeListener(port);
    client = WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
    WSAEVENT ev = WSACreateEvent();
    WSAEventSelect(client, ev, FD_CONNECT | FD_WRITE);
    sockaddr_in a = loopback(port);
    WSAConnect(client, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr);
    server = INVALID_SOCKET;
    for (int i = 0; i < 300 && server == INVALID_SOCKET; ++i) {
      server = WSAAccept(listener, nullptr, nullptr, nullptr, 0);
      if (server == INVALID_SOCKET) Sleep(5);
    }
    EventLog log;
    EXPECT_TRUE(waitUntil(ev, [&] {
      log.take(client, ev);
      return (log.seen & FD_CONNECT) != 0;
    }));
    WSAEventSelect(client, ev, 0);
    WSACloseEvent(ev);
  }
  ~Pair() {
    for (SOCKET s : {listener, client, server})
      if (s != INVALID_SOCKET) closesocket(s);
    SleepEx(0, TRUE);
  }
};

}  // namespace

TEST(Overlapped, CompletionRunsOnlyInAnAlertableWaitOfTheIssuingThread) {
  Winsock ws;
  Pair p;
  g_finished = 0;
  char out[] = "ping";
  Record sent;
  WSABUF sbuf{4, out};
  ASSERT_EQ(0, WSASend(p.client, &sbuf, 1, nullptr, 0, &sent.ov, complete));
  char in[16];
  Record got;
  WSABUF rbuf{sizeof in, in};
  int rc = WSARecv(p.server, &rbuf, 1, nullptr, nullptr, &got.ov, complete);
  ASSERT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING);

  std::thread other([] { SleepEx(100, TRUE); });
  other.join();
  Sleep(50);
  EXPECT_EQ(0, g_finished.load()) << "no routine outside an alertable wait of this thread";

  for (int i = 0; i < 100 && g_finished < 2; ++i) EXPECT_NE(WSA_WAIT_FAILED, SleepEx(20, TRUE));
  ASSERT_EQ(2, g_finished.load());
  EXPECT_EQ(0u, sent.error);
  EXPECT_EQ(4u, sent.bytes);
  EXPECT_EQ(0u, got.error);
  EXPECT_EQ(4u, got.bytes);
  EXPECT_EQ(0, std::memcmp(in, "ping", 4));
  EXPECT_EQ(std::this_thread::get_id(), sent.thread);
  EXPECT_EQ(std::this_thread::get_id(), got.thread);
  EXPECT_EQ(0u, SleepEx(30, TRUE)) << "each routine ran once";
  EXPECT_EQ(2, g_finished.load());
}

TEST(Overlapped, ManySendsArriveIntactAndCompleteInOrder) {
  Winsock ws;
  Pair p;
  g_finished = 0;
  // Sizes from 0 bytes to far beyond the socket buffers, so sends are taken
  // whole and split across writes.
  std::vector<std::size_t> sizes;
  for (int i = 0; i < 300; ++i) sizes.push_back(static_cast<std::size_t>((i * 7919) % 40000));
  sizes.push_back(3u << 20);
  std::size_t total = 0;
  for (std::size_t s : sizes) total += s;
  std::vector<char> payload(total);
  for (std::size_t i = 0; i < total; ++i) payload[i] = static_cast<char>(i * 131 + (i >> 9));

  std::vector<Record> sends(sizes.size());
  std::size_t offset = 0;
  for (std::size_t i = 0; i < sizes.size(); ++i) {
    WSABUF b{static_cast<std::uint32_t>(sizes[i]), payload.data() + offset};
    offset += sizes[i];
    // Every 50th send is made to go pending, as a full buffer would.
    if (i % 50 == 49) platform::fault::arm(platform::fault::Call::WSASend, {1, false, WSA_IO_PENDING});
    int rc = WSASend(p.client, &b, 1, nullptr, 0, &sends[i].ov, complete);
    ASSERT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING) << WSAGetLastError();
    EXPECT_EQ(i % 50 == 49, rc != 0);
  }

  std::vector<char> received;
  std::vector<char> chunk(65536);
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (received.size() < total && std::chrono::steady_clock::now() < deadline) {
    Record r;
    WSABUF b{static_cast<std::uint32_t>(chunk.size()), chunk.data()};
    int rc = WSARecv(p.server, &b, 1, nullptr, nullptr, &r.ov, complete);
    ASSERT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING);
    while (r.order < 0) SleepEx(50, TRUE);
    ASSERT_EQ(0u, r.error);
    received.insert(received.end(), chunk.begin(), chunk.begin() + r.bytes);
  }
  ASSERT_EQ(total, received.size());
  EXPECT_TRUE(received == payload);
  SleepEx(0, TRUE);
  for (std::size_t i = 1; i < sends.size(); ++i) {
    ASSERT_EQ(0u, sends[i].error);
    ASSERT_EQ(sizes[i], sends[i].bytes);
    ASSERT_LT(sends[i - 1].order, sends[i].order) << "sends of one socket complete in order";
  }
}

TEST(Overlapped, ClosesocketAbortsAnOutstandingRead) {
  Winsock ws;
  Pair p;
  char in[16];
  Record r;
  WSABUF b{sizeof in, in};
  ASSERT_EQ(SOCKET_ERROR, WSARecv(p.server, &b, 1, nullptr, nullptr, &r.ov, complete));
  ASSERT_EQ(WSA_IO_PENDING, WSAGetLastError());
  ASSERT_EQ(0, closesocket(p.server));
  p.server = INVALID_SOCKET;
  EXPECT_EQ(-1, r.order);
  EXPECT_EQ(WSA_WAIT_IO_COMPLETION, SleepEx(1000, TRUE));
  EXPECT_EQ(static_cast<DWORD>(WSA_OPERATION_ABORTED), r.error);
}

TEST(Overlapped, PeerCloseCompletesAReadWithZeroBytes) {
  Winsock ws;
  Pair p;
  char in[16];
  Record r;
  WSABUF b{sizeof in, in};
  WSARecv(p.server, &b, 1, nullptr, nullptr, &r.ov, complete);
  ASSERT_EQ(0, WSASendDisconnect(p.client, nullptr));
  for (int i = 0; i < 100 && r.order < 0; ++i) SleepEx(20, TRUE);
  EXPECT_EQ(0u, r.error);
  EXPECT_EQ(0u, r.bytes);
}

TEST(Overlapped, InjectedPendingAndRefusalsStillDeliverInOrder) {
  Winsock ws;
  Pair p;
  g_finished = 0;
  platform::fault::arm(platform::fault::Call::WSASend, {1, false, WSA_IO_PENDING});
  char a[] = "AAAA", c[] = "CCCC";
  Record ra, rc;
  WSABUF ba{4, a}, bc{4, c};
  EXPECT_EQ(SOCKET_ERROR, WSASend(p.client, &ba, 1, nullptr, 0, &ra.ov, complete));
  EXPECT_EQ(WSA_IO_PENDING, WSAGetLastError());
  platform::fault::arm(platform::fault::Call::WSASend, {1, false, WSAEWOULDBLOCK});
  Record refused;
  EXPECT_EQ(SOCKET_ERROR, WSASend(p.client, &bc, 1, nullptr, 0, &refused.ov, complete));
  EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
  EXPECT_EQ(0, WSASend(p.client, &bc, 1, nullptr, 0, &rc.ov, complete));
  for (int i = 0; i < 100 && g_finished < 2; ++i) SleepEx(20, TRUE);
  EXPECT_EQ(-1, refused.order) << "a refused send never completes";
  EXPECT_EQ(0, ra.order);
  EXPECT_EQ(1, rc.order);
  char in[16] = {};
  std::size_t have = 0;
  for (int i = 0; i < 100 && have < 8; ++i) {
    Record r;
    WSABUF b{static_cast<std::uint32_t>(sizeof in - have), in + have};
    WSARecv(p.server, &b, 1, nullptr, nullptr, &r.ov, complete);
    while (r.order < 0) SleepEx(20, TRUE);
    have += r.bytes;
  }
  EXPECT_EQ(std::string("AAAACCCC"), std::string(in, have));
  platform::fault::disarmAll();
}

TEST(Overlapped, DatagramsToSelfKeepTheirBoundariesIncludingEmptyOnes) {
  Winsock ws;
  SOCKET s = WSASocketA(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  sockaddr_in a = loopback(0);
  ASSERT_EQ(0, bind(s, asAddr(a), sizeof a));
  int len = sizeof a;
  ASSERT_EQ(0, getsockname(s, reinterpret_cast<sockaddr*>(&a), &len));
  ASSERT_EQ(0, WSAConnect(s, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr));
  std::vector<char> big(65507, 'x');
  char empty[1];
  Record s1, s2;
  WSABUF b1{0, empty}, b2{static_cast<std::uint32_t>(big.size()), big.data()};
  ASSERT_EQ(0, WSASend(s, &b1, 1, nullptr, 0, &s1.ov, complete));
  ASSERT_EQ(0, WSASend(s, &b2, 1, nullptr, 0, &s2.ov, complete));
  SleepEx(0, TRUE);
  std::vector<char> in(65536);
  std::vector<DWORD> sizes;
  for (int i = 0; i < 2; ++i) {
    Record r;
    WSABUF b{static_cast<std::uint32_t>(in.size()), in.data()};
    WSARecv(s, &b, 1, nullptr, nullptr, &r.ov, complete);
    for (int k = 0; k < 100 && r.order < 0; ++k) SleepEx(20, TRUE);
    ASSERT_EQ(0u, r.error);
    sizes.push_back(r.bytes);
  }
  EXPECT_EQ((std::vector<DWORD>{0u, 65507u}), sizes);
  closesocket(s);
}
