// The Winsock-shaped platform layer on Linux: network events, overlapped
// sends and reads, waits, mutexes, rand, names, and every call's fault plan.
#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <functional>
#include <memory>
#include <numeric>
#include <thread>
#include <vector>

#include "fault.h"
#include "guards.h"
#include "raw_socket.h"
#include "runtime_test.h"
#include "win32.h"
#include "winsock.h"

using namespace platform;
using platform::fault::Call;

namespace {

constexpr long kAll = FD_READ | FD_WRITE | FD_CONNECT | FD_CLOSE;

sockaddr_in loopback(std::uint16_t port) { return {AF_INET, htons(port), {inet_addr("127.0.0.1")}, {}}; }
const sockaddr* asAddr(const sockaddr_in& a) { return reinterpret_cast<const sockaddr*>(&a); }
SOCKET tcpSocket() { return WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED); }
SOCKET udpSocket() { return WSASocketA(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0, WSA_FLAG_OVERLAPPED); }
int connectTo(SOCKET s, std::uint16_t port) {
  sockaddr_in a = loopback(port);
  return WSAConnect(s, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr);
}
// A listener on a port of 127.0.0.1 that the system chose.
SOCKET makeListener(std::uint16_t& port) {
  SOCKET s = tcpSocket();
  sockaddr_in a = loopback(0);
  int length = sizeof a;
  EXPECT_EQ(0, bind(s, asAddr(a), sizeof a));
  EXPECT_EQ(0, listen(s, SOMAXCONN));
  EXPECT_EQ(0, getsockname(s, reinterpret_cast<sockaddr*>(&a), &length));
  port = ntohs(a.sin_port);
  return s;
}

struct Winsock {
  WSADATA data;
  Winsock() { EXPECT_EQ(0, WSAStartup(0x0002, &data)); }
  ~Winsock() { WSACleanup(); }
};

// The network events selected for one socket, as enumerated so far.
struct EventLog {
  SOCKET socket;
  WSAEVENT event = WSACreateEvent();
  long seen = 0;
  int errors[FD_MAX_EVENTS] = {};
  int counts[FD_MAX_EVENTS] = {};

  EventLog(SOCKET s, long bits) : socket(s) { EXPECT_EQ(0, WSAEventSelect(s, event, bits)); }
  ~EventLog() { WSACloseEvent(event); }
  long take() {
    WSANETWORKEVENTS ne{};
    EXPECT_EQ(0, WSAEnumNetworkEvents(socket, event, &ne));
    seen |= ne.lNetworkEvents;
    for (int bit = 0; bit < FD_MAX_EVENTS; ++bit)
      if (ne.lNetworkEvents & (1L << bit)) errors[bit] = ne.iErrorCode[bit], ++counts[bit];
    return ne.lNetworkEvents;
  }
  bool await(long bits) {  // alertably, until all of `bits` were seen since `seen` was cleared
    return waitFor([&] { return (take(), seen & bits) == bits; }, 5000,
                   [&] { WSAWaitForMultipleEvents(1, &event, FALSE, 50, TRUE); });
  }
  bool quiet() { return WSAWaitForMultipleEvents(1, &event, FALSE, 100, TRUE) == WSA_WAIT_TIMEOUT; }
};

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
bool settles(const Record& r) { return waitFor([&] { return r.order >= 0; }, 5000, [] { SleepEx(20, TRUE); }); }
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

// A condition function decides over each connection: a refused one is
// closed and answers WSAECONNREFUSED (an accepted one comes as without one).
TEST(Accept, AConditionFunctionRefuses) {
  Winsock ws;
  std::uint16_t port = 0;
  SOCKET listener = makeListener(port);
  EventLog accepting(listener, FD_ACCEPT);
  EventLog client(tcpSocket(), kAll);
  connectTo(client.socket, port);
  ASSERT_TRUE(accepting.await(FD_ACCEPT));
  const auto refuse = [](WSABUF* caller, WSABUF*, QOS*, QOS*, WSABUF*, WSABUF*, UINT*, std::uintptr_t) {
    return caller != nullptr && caller->len == sizeof(sockaddr_in) ? CF_REJECT : CF_ACCEPT;
  };
  EXPECT_EQ(INVALID_SOCKET, WSAAccept(listener, nullptr, nullptr, refuse, 0));
  EXPECT_EQ(WSAECONNREFUSED, WSAGetLastError());
  EXPECT_TRUE(client.await(FD_CLOSE));
  closesocket(client.socket);
  closesocket(listener);
}

// Connect and write come once; read comes again only after a read was
// posted; an orderly close comes once, after the data in front of it was read.
TEST(EventSelect, EachEventIsRecordedOnceUntilReEnabled) {
  Connected c;
  EXPECT_EQ(0, c.client.errors[FD_CONNECT_BIT]);
  EXPECT_EQ(0, c.client.take() & (FD_CONNECT | FD_WRITE));
  EXPECT_TRUE(c.server->await(FD_WRITE)) << "an accepted socket is writable";
  transfer(true, c.client.socket, "first", 5);
  ASSERT_TRUE(c.server->await(FD_READ));
  transfer(true, c.client.socket, "second", 6);
  EXPECT_TRUE(c.server->quiet());
  EXPECT_EQ(0, c.server->take() & FD_READ) << "not again before a read was posted";
  char bytes[16];
  EXPECT_EQ(4u, transfer(false, c.server->socket, bytes, 4).bytes);  // data remains
  c.server->seen = 0;
  EXPECT_TRUE(c.server->await(FD_READ));
  ASSERT_EQ(0, closesocket(c.client.socket));
  EXPECT_TRUE(c.server->quiet());
  EXPECT_EQ(0, c.server->take() & FD_CLOSE) << "close waits until the data is read";
  EXPECT_EQ(7u, transfer(false, c.server->socket, bytes, sizeof bytes).bytes);
  ASSERT_TRUE(c.server->await(FD_CLOSE));
  EXPECT_TRUE(c.server->quiet());
  EXPECT_EQ(0, c.server->errors[FD_CLOSE_BIT]);
  EXPECT_EQ(1, c.server->counts[FD_CLOSE_BIT]);

  std::uint16_t port;
  closesocket(makeListener(port));
  EventLog refused(tcpSocket(), kAll);  // recorded with its error, and nothing else
  EXPECT_EQ(SOCKET_ERROR, connectTo(refused.socket, port));
  EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
  ASSERT_TRUE(refused.await(FD_CONNECT));
  EXPECT_EQ(WSAECONNREFUSED, refused.errors[FD_CONNECT_BIT]);
  EXPECT_TRUE(refused.quiet());
  EXPECT_EQ(FD_CONNECT, refused.seen | refused.take());
  Record never;
  EXPECT_EQ(SOCKET_ERROR, post(true, refused.socket, "x", 1, never));
  EXPECT_EQ(WSAENOTCONN, WSAGetLastError());
  closesocket(refused.socket);
}

// Completions run only in an alertable wait of the issuing thread, once; the
// peer's close completes a read with 0 bytes, its reset with an error, and
// closesocket aborts one.
TEST(Overlapped, CompletionsRunInAlertableWaitsOfTheIssuingThread) {
  Connected c;
  g_finished = 0;
  char in[16];
  Record sent, got, atClient;
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

  got = {};
  ASSERT_EQ(SOCKET_ERROR, post(false, c.server->socket, in, sizeof in, got));
  ASSERT_EQ(WSA_IO_PENDING, WSAGetLastError());
  ASSERT_EQ(SOCKET_ERROR, post(false, c.client.socket, in, sizeof in, atClient));
  ASSERT_EQ(0, WSASendDisconnect(c.client.socket, nullptr));
  ASSERT_TRUE(settles(got));
  EXPECT_EQ(0u, got.error);
  EXPECT_EQ(0u, got.bytes);
  ASSERT_EQ(0, closesocket(c.client.socket));
  ASSERT_TRUE(settles(atClient));
  EXPECT_EQ(static_cast<DWORD>(WSA_OPERATION_ABORTED), atClient.error);

  // A reset by the peer fails a read with WSAECONNRESET, whether the read
  // was under way or comes after: it is neither "try again" nor the orderly
  // end of the stream.
  std::uint16_t rawPort = 0;
  const int listening = raw::listenOn("127.0.0.1", rawPort);
  for (const bool readFirst : {true, false}) {
    EventLog reset(tcpSocket(), FD_CONNECT);
    connectTo(reset.socket, rawPort);
    const int peer = raw::acceptOne(listening, 5000);
    ASSERT_GE(peer, 0);
    ASSERT_TRUE(reset.await(FD_CONNECT));
    got = {};
    if (readFirst) {
      ASSERT_EQ(SOCKET_ERROR, post(false, reset.socket, in, sizeof in, got));
      SleepEx(20, TRUE);  // the read waits for data
      raw::reset(peer);
    } else {
      raw::reset(peer);
      Sleep(50);
      // Refused at once, or under way until the reset arrives.
      if (post(false, reset.socket, in, sizeof in, got) == SOCKET_ERROR && WSAGetLastError() != WSA_IO_PENDING) {
        got.error = static_cast<DWORD>(WSAGetLastError());
        got.order = 0;
      }
    }
    ASSERT_TRUE(settles(got)) << readFirst;
    EXPECT_EQ(static_cast<DWORD>(WSAECONNRESET), got.error) << readFirst;
    EXPECT_EQ(0u, got.bytes) << readFirst;
    closesocket(reset.socket);
  }
  raw::closeFd(listening);
}

// Sizes from 0 bytes to far beyond the socket buffers; some sends are made to
// go pending and one to be refused, as a full buffer would.
TEST(Overlapped, ManySendsArriveIntactAndCompleteInOrder) {
  Connected c;
  std::vector<std::size_t> sizes;
  for (int i = 0; i < 300; ++i) sizes.push_back(static_cast<std::size_t>((i * 7919) % 40000));
  sizes.push_back(3u << 20);
  std::vector<char> payload(std::accumulate(sizes.begin(), sizes.end(), std::size_t{0}));
  for (std::size_t i = 0; i < payload.size(); ++i) payload[i] = static_cast<char>(i * 131 + (i >> 9));
  std::vector<Record> sends(sizes.size());
  Record refused;
  for (std::size_t i = 0, offset = 0; i < sizes.size(); offset += sizes[i++]) {
    if (i == 150) {
      fault::arm(Call::WSASend, {1, false, WSAEWOULDBLOCK});
      EXPECT_EQ(SOCKET_ERROR, post(true, c.client.socket, payload.data() + offset, sizes[i], refused));
      EXPECT_EQ(WSAEWOULDBLOCK, WSAGetLastError());
    }
    if (i % 50 == 49) fault::arm(Call::WSASend, {1, false, WSA_IO_PENDING});
    const int rc = post(true, c.client.socket, payload.data() + offset, sizes[i], sends[i]);
    EXPECT_EQ(i % 50 == 49 ? SOCKET_ERROR : 0, rc) << i;
    ASSERT_TRUE(rc == 0 || WSAGetLastError() == WSA_IO_PENDING);
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
  // A send the peer resets (closing with data unread) fails. Four copies
  // are more than the system's buffers hold, so the last is still under way.
  Record cut[4];
  for (Record& r : cut) post(true, c.client.socket, payload.data(), payload.size(), r);
  SleepEx(100, TRUE);
  closesocket(c.server->socket);
  ASSERT_TRUE(settles(cut[3]));
  EXPECT_TRUE(cut[3].error != 0 && cut[3].bytes < payload.size()) << cut[3].error;
  Record late;
  EXPECT_TRUE(post(true, c.client.socket, "x", 1, late) == SOCKET_ERROR && WSAGetLastError() != WSA_IO_PENDING)
      << "a broken stream refuses further sends at once";
}

void refuseRegistrations(bool refuse);  // epoll_faults.cpp

// A registration the system refuses fails the wait until the system agrees,
// also when a socket comes back into the wait (FD_READ wanted again after a
// read) and is found missing from the epoll set.
TEST(Wait, RefusedRegistrationsFailTheWaitUntilTheSystemAgrees) {
  Winsock ws;
  WSAEVENT event = WSACreateEvent();
  SOCKET in = udpSocket(), out = udpSocket();
  sockaddr_in a = loopback(0);
  int length = sizeof a;
  ASSERT_EQ(0, bind(in, asAddr(a), sizeof a));
  ASSERT_EQ(0, getsockname(in, reinterpret_cast<sockaddr*>(&a), &length));
  ASSERT_EQ(0, WSAConnect(out, asAddr(a), sizeof a, nullptr, nullptr, nullptr, nullptr));
  ASSERT_EQ(0, WSAEventSelect(in, event, FD_READ));
  Record sent, taken;
  char byte = 0;
  std::thread([&] {  // a thread of its own: its wait set starts empty
    const auto wait = [&](DWORD ms) {
      DWORD r, index = 0;
      while ((r = waitForAnyEvent(1, &event, ms, TRUE, &index)) == WSA_WAIT_IO_COMPLETION) {
      }
      return r;
    };
    for (const bool readFirst : {false, true}) {
      refuseRegistrations(true);
      if (readFirst) post(false, in, &byte, 1, taken);  // takes the datagram: FD_READ wanted again
      EXPECT_EQ(0, post(true, out, "x", 1, sent));
      EXPECT_EQ(WSA_WAIT_FAILED, wait(100)) << readFirst;
      EXPECT_EQ(WSAENOBUFS, WSAGetLastError());
      refuseRegistrations(false);
      EXPECT_EQ(WSA_WAIT_EVENT_0, wait(5000)) << readFirst;
      WSANETWORKEVENTS ne{};
      EXPECT_EQ(0, WSAEnumNetworkEvents(in, event, &ne));
    }
  }).join();
  closesocket(in);
  closesocket(out);
  WSACloseEvent(event);
}

// Beyond Winsock's 64: a thousand events (and Winsock's own wait over the
// first 64). Indices of 192 and 258 are indices, not other results; the
// lowest signalled one wins however the array changes between waits; a
// handle closed between two waits over the same array fails the second.
// (Sockets' events at such indices: the runtime's larger wait set test.)
TEST(Wait, AnyOfThousandsGivesTheLowestSignalledIndex) {
  std::vector<WSAEVENT> e(1000);
  for (WSAEVENT& h : e) h = WSACreateEvent();
  DWORD result = 0;
  const auto wait = [&](const std::vector<WSAEVENT>& set, DWORD ms = 0) {
    DWORD index = ~0u;
    do result = waitForAnyEvent(static_cast<DWORD>(set.size()), set.data(), ms, TRUE, &index);
    while (result == WSA_WAIT_IO_COMPLETION);
    return result == WSA_WAIT_EVENT_0 ? index : ~0u;
  };
  for (DWORD i : {999u, 258u, 192u}) ASSERT_TRUE(WSASetEvent(e[i]));
  for (DWORD i : {192u, 258u, 999u}) {
    EXPECT_EQ(i, wait(e));
    EXPECT_EQ(i, wait(e)) << "manual reset";
    ASSERT_TRUE(WSAResetEvent(e[i]));
  }
  EXPECT_EQ(~0u, wait(e, 20));
  EXPECT_EQ(WSA_WAIT_TIMEOUT, result);
  ASSERT_TRUE(WSASetEvent(e[63]) && WSASetEvent(e[7]));  // Winsock's own wait, up to 64
  EXPECT_EQ(7u, WSAWaitForMultipleEvents(64, e.data(), FALSE, 0, TRUE));
  for (DWORD count : {0u, 65u}) {
    EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(count, e.data(), FALSE, 0, TRUE));
    EXPECT_EQ(WSA_INVALID_PARAMETER, WSAGetLastError());
  }
  ASSERT_TRUE(WSAResetEvent(e[7]));
  EXPECT_EQ(63u, WSAWaitForMultipleEvents(64, e.data(), FALSE, 0, TRUE));
  ASSERT_TRUE(WSAResetEvent(e[63]));

  ASSERT_TRUE(WSASetEvent(e[600]) && WSASetEvent(e[0]));
  EXPECT_EQ(100u, wait(std::vector<WSAEVENT>(e.begin() + 500, e.end())));
  EXPECT_EQ(1u, wait({e[5], e[0], e[600], e[0]})) << "a repeated handle counts where it comes first";
  for (DWORD i : {0u, 600u}) WSAResetEvent(e[i]);

  std::thread([&] { WSASetEvent(e[640]); }).join();
  ASSERT_TRUE(WSACloseEvent(e[3]));
  EXPECT_FALSE(WSASetEvent(e[3]));
  for (int again = 0; again < 2; ++again) {
    EXPECT_EQ(~0u, wait(e));
    EXPECT_EQ(WSA_INVALID_HANDLE, WSAGetLastError());
  }
  EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(4, e.data(), FALSE, 0, TRUE)) << "Winsock's wait too";
  EXPECT_EQ(WSA_INVALID_HANDLE, WSAGetLastError());
  e[3] = WSACreateEvent();
  EXPECT_EQ(640u, wait(e));
  for (WSAEVENT h : e) WSACloseEvent(h);
}

// One name is one recursive mutex, owned by a thread; rand follows the
// classic sequence per thread or on a state of its own; the local host can be
// chosen, and lookups give per-thread records.
TEST(System, MutexRandAndNames) {
  HANDLE a = CreateMutexA(nullptr, FALSE, "system test mutex");
  HANDLE b = CreateMutexA(nullptr, FALSE, "system test mutex");
  HANDLE owned = CreateMutexA(nullptr, TRUE, "another name");
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(a, INFINITE));
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, 50)) << "the owner may take it again";
  std::thread([&] {
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(b, 30)) << "both handles name one mutex";
    EXPECT_FALSE(ReleaseMutex(a)) << "a thread that doesn't own it can't release it";
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(owned, 0)) << "owned by its creator";
  }).join();
  EXPECT_TRUE(ReleaseMutex(a) && ReleaseMutex(b) && ReleaseMutex(owned));
  EXPECT_FALSE(ReleaseMutex(a)) << "released as often as taken";
  EXPECT_TRUE(CloseHandle(a));
  EXPECT_FALSE(CloseHandle(a));
  std::thread([&] {
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, 0)) << "the other handle still works";
    EXPECT_TRUE(ReleaseMutex(b));
  }).join();
  EXPECT_TRUE(CloseHandle(b) && CloseHandle(owned));

  platform::srand(1);
  for (int expected : {41, 18467, 6334, 26500, 19169}) EXPECT_EQ(expected, platform::rand());
  int fromThread = -1;
  std::thread([&] { fromThread = platform::rand(); }).join();
  EXPECT_EQ(41, fromThread) << "each thread starts at seed 1";
  platform::srand(0x9E3779B9u);
  for (unsigned i = 0, state = 0x9E3779B9u; i < 1000; ++i) ASSERT_EQ(platform::rand(), platform::rand(state));
  char name[1024];
  platform::setLocalHost("127.0.0.2");
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STREQ("127.0.0.2", name);
  EXPECT_EQ(SOCKET_ERROR, platform::gethostname(name, 9)) << "no room for the end of the name";
  platform::setLocalHost(nullptr);
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STRNE("127.0.0.2", name);
  hostent* mine = gethostbyname("localhost");
  ASSERT_NE(nullptr, mine);
  EXPECT_EQ(0x0100007Fu, *reinterpret_cast<std::uint32_t*>(mine->h_addr_list[0])) << "network order";
  hostent* theirs = nullptr;
  std::thread([&] { theirs = gethostbyname("127.0.0.3"); }).join();
  EXPECT_NE(mine, theirs);
  EXPECT_EQ(nullptr, gethostbyname("no-such-host.invalid"));
  const int error = WSAGetLastError();  // try again where no name server is reachable
  EXPECT_TRUE(error == WSAHOST_NOT_FOUND || error == WSATRY_AGAIN) << error;
}

// Each call answers its plan's result on the second call only: the first and
// the third behave as without a plan. Plans persist when asked, and disarming
// restores everything.
TEST(Faults, EveryCallFailsAsItsPlanSays) {
  constexpr int kCode = 10050;
  Winsock ws;
  std::uint16_t port;
  SOCKET listener = makeListener(port), tcp = tcpSocket(), udp = udpSocket();
  WSAEVENT event = WSACreateEvent();
  sockaddr_in any = loopback(0);
  int length = sizeof any, option = 1;
  char buffer[4];
  WSABUF buf{sizeof buffer, buffer};
  WSAOVERLAPPED ov{};
  WSANETWORKEVENTS ne{};
  std::uint32_t loop = inet_addr("127.0.0.1");
  DWORD size = 0;
  const auto errorIf = [](bool failed) { return failed ? WSAGetLastError() : 0; };
  const auto noRoutine = [](DWORD, DWORD, WSAOVERLAPPED*, DWORD) {};
  const std::vector<std::pair<Call, std::function<int()>>> calls = {
      {Call::WSAStartup, [] { WSADATA d; int rc = WSAStartup(2, &d); return rc != 0 ? rc : WSACleanup(); }},
      {Call::WSAEnumProtocolsA, [&] { return errorIf(WSAEnumProtocolsA(nullptr, nullptr, &size) < 0); }},
      {Call::WSASocketA, [] { SOCKET s = udpSocket(); return s == INVALID_SOCKET ? WSAGetLastError() : closesocket(s); }},
      {Call::bind, [&] { return errorIf(bind(udp, asAddr(any), sizeof any) != 0); }},
      {Call::listen, [&] { return errorIf(listen(listener, 5) != 0); }},
      {Call::getsockname, [&] { return errorIf(getsockname(udp, reinterpret_cast<sockaddr*>(&any), &length) != 0); }},
      {Call::setsockopt, [&] { return errorIf(setsockopt(tcp, SOL_SOCKET, SO_KEEPALIVE, reinterpret_cast<char*>(&option), 4) != 0); }},
      {Call::getsockopt, [&] { return errorIf(getsockopt(tcp, SOL_SOCKET, SO_KEEPALIVE, reinterpret_cast<char*>(&option), &length) != 0); }},
      {Call::WSAConnect, [&] { return errorIf(connectTo(udp, port) != 0); }},
      {Call::WSAAccept, [&] { return errorIf(WSAAccept(listener, nullptr, nullptr, nullptr, 0) == INVALID_SOCKET); }},
      {Call::WSASendDisconnect, [&] { return errorIf(WSASendDisconnect(tcp, nullptr) != 0); }},
      {Call::WSAEventSelect, [&] { return errorIf(WSAEventSelect(tcp, event, FD_READ) != 0); }},
      {Call::WSAEnumNetworkEvents, [&] { return errorIf(WSAEnumNetworkEvents(tcp, event, &ne) != 0); }},
      {Call::WSASend, [&] { return errorIf(WSASend(tcp, &buf, 1, nullptr, 0, &ov, noRoutine) != 0); }},
      {Call::WSARecv, [&] { return errorIf(WSARecv(tcp, &buf, 1, nullptr, nullptr, &ov, noRoutine) != 0); }},
      {Call::closesocket, [&] { return errorIf(closesocket(udpSocket()) != 0); }},
      {Call::WSACreateEvent, [] { WSAEVENT e = WSACreateEvent(); return e == nullptr ? WSAGetLastError() : !WSACloseEvent(e); }},
      {Call::WSAWaitForMultipleEvents, [&] { return errorIf(WSAWaitForMultipleEvents(1, &event, FALSE, 0, TRUE) == WSA_WAIT_FAILED); }},
      {Call::gethostbyname, [&] { return errorIf(gethostbyname("localhost") == nullptr); }},
      {Call::gethostbyaddr, [&] { return errorIf(gethostbyaddr(reinterpret_cast<char*>(&loop), 4, AF_INET) == nullptr); }},
      {Call::CreateMutexA, [] { HANDLE h = CreateMutexA(nullptr, FALSE, nullptr); return h == nullptr ? WSAGetLastError() : !CloseHandle(h); }},
      {Call::AfxBeginThread, [&] { return errorIf(AfxBeginThread([](void*) { return 0u; }, nullptr) == nullptr); }},
  };
  ASSERT_EQ(static_cast<std::size_t>(Call::Count), calls.size());
  EXPECT_EQ(nullptr, AfxBeginThread(nullptr, nullptr)) << "no procedure, no thread";
  for (const auto& [call, run] : calls) {
    SCOPED_TRACE(fault::name(call));
    FaultGuard faults(call, {.countdown = 2, .persist = false, .result = kCode});
    EXPECT_NE(kCode, run());
    WSASetLastError(0);  // the code must come from this failure, not an earlier one
    EXPECT_EQ(kCode, run());
    EXPECT_NE(kCode, run());
    EXPECT_EQ(1, fault::fired(call));
  }
  for (SOCKET s : {listener, tcp}) closesocket(s);
  WSACloseEvent(event);

  FaultGuard faults(Call::WSAStartup, {1, true, WSAEPROCLIM});
  WSADATA data{};
  for (int i = 0; i < 2; ++i) EXPECT_EQ(WSAEPROCLIM, WSAStartup(0x0002, &data));
  EXPECT_EQ(2, fault::fired(Call::WSAStartup)) << "a persistent plan";
  faults.setCatalogue({});
  fault::disarmAll();
  EXPECT_EQ(0, WSAStartup(0x0002, &data));
  // Any major version from 1 on is agreed; 0 is not a version.
  EXPECT_EQ(WSAVERNOTSUPPORTED, WSAStartup(0x0100, &data));
  EXPECT_EQ(0, WSAStartup(0x0101, &data));
  WSACleanup();
  EXPECT_EQ(SOCKET_ERROR, WSAEnumProtocolsA(nullptr, nullptr, &size));
  EXPECT_GT(size, 0u) << "the real catalogue is back";
  WSACleanup();
}
