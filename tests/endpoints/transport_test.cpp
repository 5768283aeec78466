// The transport under faults, limits and load: platform calls, the system's
// own calls (short writes, interrupted or refused reads and waits, used-up
// descriptors) and allocations failing under real loopback traffic, and the
// limits that bound what a peer can make the library hold (nothing may be
// lost, doubled or reordered, memory that runs out ends only the connection
// it hit, and every allocation is given back); two hosts in two processes,
// and several threads sending on one socket while sockets come and go.
// The Winsock-shaped headers first: Linux's socket macros would clash with them.
#include "endpoint_test.h"
#include "syscalls.h"

#include <malloc.h>
#include <netinet/in.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <cerrno>
#include <cstdlib>
#include <functional>
#include <new>
#include <thread>

#include "child_process.h"
#include "fault_sweep.h"
#include "guards.h"

// Heap bytes held in arrays (the library's buffers are arrays), process-wide.
static std::atomic<long long> g_arrayBytes{0};
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept {
  void* p = std::malloc(size == 0 ? 1 : size);
  g_arrayBytes += static_cast<long long>(malloc_usable_size(p));
  return p;
}
void* operator new[](std::size_t size) {
  void* p = operator new[](size, std::nothrow);
  return p != nullptr ? p : throw std::bad_alloc();
}
void operator delete[](void* p) noexcept {
  g_arrayBytes -= static_cast<long long>(malloc_usable_size(p));
  std::free(p);
}
void operator delete[](void* p, std::size_t) noexcept { operator delete[](p); }
void operator delete[](void* p, const std::nothrow_t&) noexcept { operator delete[](p); }

namespace {

// Calls of each kind so far: each fake goes through its own cycle.
std::atomic<int> g_sends{0}, g_receives{0}, g_polls{0}, g_registrations{0};

// The first call of every `cycle` is interrupted, the second refused for
// now (errno set, true); the others go on.
bool interrupted(std::atomic<int>& calls, int cycle) {
  const int turn = calls++ % cycle;
  if (turn > 1) return false;
  errno = turn == 0 ? EINTR : EAGAIN;
  return true;
}

// A stream's message cut to at most `limit` bytes of its buffers (a datagram goes whole).
template <class Call>
long cut(int fd, msghdr* message, std::size_t limit, Call call) {
  int type = 0;
  socklen_t length = sizeof type;
  if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0 || type != SOCK_STREAM) return call(message);
  iovec iov[1024];
  msghdr shorter = *message;
  shorter.msg_iov = iov, shorter.msg_iovlen = 0;
  for (std::size_t i = 0; i < message->msg_iovlen && limit > 0; ++i, ++shorter.msg_iovlen) {
    iov[i] = message->msg_iov[i];
    limit -= iov[i].iov_len = std::min(iov[i].iov_len, limit);
  }
  const long got = call(&shorter);
  message->msg_flags = shorter.msg_flags;
  return got;
}
long choppySendmsg(int fd, const msghdr* message, int flags) {
  if (interrupted(g_sends, 4)) return -1;
  return cut(fd, const_cast<msghdr*>(message), 3, [&](msghdr* m) { return ::sendmsg(fd, m, flags); });
}
long choppyRecvmsg(int fd, msghdr* message, int flags) {
  if (interrupted(g_receives, 3)) return -1;
  return cut(fd, message, 5, [&](msghdr* m) { return ::recvmsg(fd, m, flags); });
}
// A wait that wakes with nothing every other time (a look without waiting
// still sees what is ready).
int restlessWait(int epfd, epoll_event* events, int count, int timeout) {
  return timeout != 0 && g_polls++ % 2 == 0 ? 0 : ::epoll_wait(epfd, events, count, timeout);
}
// One change of a registration in five is refused for want of memory.
int forgetfulRegistration(int epfd, int op, int fd, epoll_event* event) {
  if (g_registrations++ % 5 == 4) return errno = ENOMEM, -1;
  return ::epoll_ctl(epfd, op, fd, event);
}
int noDescriptor(int, int, int) { return errno = EMFILE, -1; }
int noEventfd(unsigned int, int) { return errno = EMFILE, -1; }
int noEpoll(int) { return errno = EMFILE, -1; }

class TransportFaultsTest : public EndpointTest {
 protected:
  void TearDown() override {
    platform::sys::restore();
    EndpointTest::TearDown();
  }
  // `count` messages each way of assorted sizes, every fifth near `largest`,
  // the last after a pause and `beforeLast` (a send that failed waits for the
  // next pass, which a send brings): each whole, in order and once.
  static void exchange(N_Socket& a, N_Socket& b, unsigned count, unsigned largest = 700,
                       const std::function<void()>& beforeLast = [] {}) {
    const auto message = [&](unsigned i) { return pattern(i % 5 == 4 ? largest - i : i * 37 % 500, i); };
    for (unsigned i = 0; i < count; ++i) {
      if (i + 1 == count) {
        platform::Sleep(50);
        beforeLast();
      }
      send(a, message(i));
      send(b, message(i));
    }
    for (N_Socket* to : {&b, &a}) {
      for (unsigned i = 0; i < count; ++i) ASSERT_TRUE(nextMessage(*to, message(i), 20000)) << i;
      EXPECT_TRUE(noMessage(*to, 20));
    }
  }
};

// Each platform call of an exchange fails in turn (N = 1, 2, 3 ... until a
// run meets no fault), and some keep failing: nothing is lost, doubled or
// reordered. The last send goes without faults, so that its pass retries
// whatever failed.
TEST_F(TransportFaultsTest, PlatformCallsFailingLoseNothing) {
  struct Case { Call call; int error; bool persist = false; };
  const Case cases[] = {{Call::WSASend, platform::WSAEWOULDBLOCK}, {Call::WSASend, platform::WSAENOBUFS},
                        {Call::WSASend, platform::WSA_IO_PENDING, true}, {Call::WSARecv, platform::WSAENOBUFS},
                        {Call::WSARecv, platform::WSAEWOULDBLOCK}, {Call::WSARecv, platform::WSA_IO_PENDING, true},
                        {Call::WSAEnumNetworkEvents, platform::WSAENETDOWN}};
  N_Listener listener(port());
  for (const Case& c : cases) {
    for (int n = 1, fired = 1; fired > 0 && n < 1000; ++n) {
      SCOPED_TRACE(::testing::Message() << platform::fault::name(c.call) << " fails with " << c.error << " at call " << n);
      N_Socket in, out;
      ASSERT_TRUE(connectPair(listener, port(), in, out));
      platform::fault::arm(c.call, {n, c.persist, c.error});
      ASSERT_NO_FATAL_FAILURE(exchange(out, in, 11, 70100, [&] {
        fired = platform::fault::fired(c.call);
        platform::fault::disarmAll();
      }));
      EXPECT_TRUE(!c.persist || fired > 5) << fired;
      if (c.persist) break;
    }
  }
}

// An accept refused by Winsock leaves no entry; any other failure makes one
// with no socket, which can be refused. Either way the waiting connection is
// accepted next. Accepts failing for lack of descriptors rest a quarter
// second between tries instead of spinning.
TEST_F(TransportFaultsTest, FailedAcceptsLeaveTheConnectionForTheNext) {
  for (int error : {platform::WSAECONNREFUSED, platform::WSAENOBUFS, platform::WSAEMFILE}) {
    SCOPED_TRACE(error);
    CountingListener listener(freePort());
    platform::fault::arm(Call::WSAAccept, {1, error == platform::WSAEMFILE, error});
    const int fd = raw::connectTo("127.0.0.1", listener.getPort());
    if (error == platform::WSAEMFILE) {
      platform::Sleep(1000);
      platform::fault::disarm(Call::WSAAccept);
      EXPECT_GE(listener.calls.load(), 1);
      EXPECT_LE(listener.calls.load(), 7);  // load only makes fewer
    }
    N_Socket::ConnectData* entry = nullptr;
    ASSERT_TRUE(waitFor([&] {
      while (listener.pollConnect(entry)) {
        if (entry->socket != platform::INVALID_SOCKET) return true;
        EXPECT_TRUE(listener.rejectConnect(entry));
      }
      return false;
    }));
    // An entry is queued before its listener hears of it.
    const int calls = error == platform::WSAENOBUFS ? 2 : 1;
    EXPECT_TRUE(error == platform::WSAEMFILE || waitFor([&] { return listener.calls == calls; }));
    if (error == platform::WSAEMFILE) {  // a valid entry refused, by its own listener only, closes its connection
      N_Listener other(freePort());
      EXPECT_FALSE(other.rejectConnect(entry));
      EXPECT_TRUE(listener.rejectConnect(entry));
      EXPECT_TRUE(raw::closedByPeer(fd, 5000));
    } else {
      N_Socket in(entry);
      ASSERT_TRUE(rawSend(fd, framed(pattern(3, 1))));
      ASSERT_TRUE(nextMessage(in, pattern(3, 1)));
    }
    EXPECT_FALSE(listener.pollConnect(entry));
    raw::closeFd(fd);
  }
}

// Every allocation from listening to sending and reassembly, failed in turn
// on either thread: a listener that can't be made leaves its port closed; a
// connection that can't be queued is closed; an accepted one whose socket
// can't be made stays queued; a send that can't be queued leaves nothing to
// go out; a read that runs out of memory ends its connection, and the
// messages in front of it are intact. Nothing is left behind.
TEST_F(TransportFaultsTest, RunningOutOfMemoryAnywhere) {
  const Bytes a = pattern(20, 1), big = pattern(100000, 2), bigStream = framed(big);
  const std::vector<Bytes> writes = {Bytes{20, 0}, concat({slice(framed(a), 2, 24), slice(bigStream, 0, 5000)}),
                                     concat({slice(bigStream, 5000, bigStream.size()), framed(a), framed(a)})};
  const std::vector<Bytes> expected = {a, big, a, a};
  pumpFor(50, {});
  EXPECT_TRUE(sweepAllocations([&] {
    const int p = freePort();
    std::unique_ptr<N_Listener> listener;
    try {
      listener = std::make_unique<N_Listener>(p);
    } catch (Q_Exception*) {
      EXPECT_TRUE(portClosed(p));
      throw;
    }
    int fd = raw::connectTo("127.0.0.1", p);
    N_Socket::ConnectData* entry = nullptr;
    N_Socket::ConnectData* again = nullptr;
    waitFor([&] { return listener->pollConnect(entry) || raw::closedByPeer(fd, 0); });
    const bool queued = listener->pollConnect(entry);
    EXPECT_TRUE(queued || platform::fault::allocationsFailed() > 0);
    try {
      if (queued) N_Socket accepted(entry);  // gone at once: closes the connection
    } catch (Q_MemoryException_Allocation*) {  // the entry stays queued for another try
      EXPECT_TRUE(listener->pollConnect(again) && again == entry);
      N_Socket retry(entry);
    }
    EXPECT_TRUE(raw::closedByPeer(fd, 5000));
    raw::closeFd(fd);
    std::uint16_t rawPort = 0;
    const int listening = raw::listenOn("127.0.0.1", rawPort);
    RecordingSocket in;
    bool made = false;
    try {
      in.construct(loopback(), rawPort, N_Socket::SOCKET_TCP);
      made = true;
      send(in, big);
    } catch (Q_MemoryException_Allocation* e) {
      EXPECT_STREQ("Out of system memory resources", e->getErrorMessage());
      fd = made ? raw::acceptOne(listening, 5000) : -1;
      if (made) {  // the send failed: nothing of it goes out, before the next or at all
        EXPECT_EQ(0, in.getBytesWaitingForSend());
        send(in, a);
        Bytes wire(24);
        EXPECT_TRUE(raw::receiveExactly(fd, wire.data(), 24, 5000) && wire == framed(a));
      }
      raw::closeFd(fd);
      raw::closeFd(listening);
      throw;
    }
    fd = raw::acceptOne(listening, 5000);
    raw::closeFd(listening);
    raw::noDelay(fd);
    waitFor([&] { return in.isConnected(); });
    for (const Bytes& w : writes) {
      rawSend(fd, w);
      platform::Sleep(20);
    }
    waitFor([&] { return in.messages().size() == expected.size() || !in.isConnected(); });
    pumpFor(20, {});
    const std::vector<Bytes> got = in.messages();
    EXPECT_TRUE(got.size() <= expected.size() && std::equal(got.begin(), got.end(), expected.begin()));
    EXPECT_TRUE(got.size() == expected.size() || (platform::fault::allocationsFailed() > 0 && !in.isConnected()));
    raw::closeFd(fd);
  }));
}

// With compact messages a prefix that claims 16 MiB holds about what came,
// and short messages don't keep the 64 KiB read buffer. By default the block
// is the claimed size at once.
TEST_F(TransportFaultsTest, CompactMessagesHoldWhatArrived) {
  for (bool compact : {false, true}) {
    SCOPED_TRACE(compact ? "compact" : "default");
    N_Limits limits = N_Limits::defaults();
    limits.uMaximumMessageSize = 32u << 20;
    limits.bCompactMessages = compact;
    LimitsGuard guard(limits);
    N_Socket in(loopback(), freePort(), N_Socket::SOCKET_TCP);
    const Bytes big = pattern(16u << 20, 3), stream = framed(big);
    long long before = g_arrayBytes.load();
    N_SocketTestAccess::read(in, stream.data(), 1000);
    if (compact) EXPECT_LT(g_arrayBytes.load() - before, 64 << 10); else EXPECT_GT(g_arrayBytes.load() - before, 16 << 20);
    for (std::size_t at = 1000; at < stream.size(); at += 60000)
      N_SocketTestAccess::read(in, stream.data() + at, static_cast<unsigned>(std::min<std::size_t>(60000, stream.size() - at)));
    ASSERT_TRUE(nextMessage(in, big, 0));
    before = g_arrayBytes.load();
    for (unsigned i = 0; i < 200; ++i) inject(in, framed(pattern(8, i)));
    if (compact) EXPECT_LT(g_arrayBytes.load() - before, 200 * 1024); else EXPECT_GE(g_arrayBytes.load() - before, 200LL * 65536);
    for (unsigned i = 0; i < 200; ++i) ASSERT_TRUE(nextMessage(in, pattern(8, i), 0));
  }
}

// A peer that writes more than the receive backlog is held back by TCP
// until the application polls; then everything arrives, in order.
TEST_F(TransportFaultsTest, ReceiveBacklogPushesBackOnThePeer) {
  N_Limits limits = N_Limits::openNetwork();
  limits.uReceiveBacklog = 256 << 10;
  LimitsGuard guard(limits);
  N_Listener listener(port());
  N_Socket in;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port(), in, fd));
  constexpr unsigned kMessages = 12000;  // beyond what the system buffers of both ends hold
  std::atomic<bool> written{false};
  std::thread writer([&] {
    for (unsigned i = 0; i < kMessages && rawSend(fd, framed(pattern(1024, i))); ++i) {}
    written = true;
  });
  // Each message is charged for its record; one read may land beyond the bound.
  const auto cost = [&] { return in.getQueuedReceiveBytes() + N_Limits::kMessageCharge * in.getQueuedReceiveMessages(); };
  EXPECT_TRUE(waitFor([&] { return cost() >= limits.uReceiveBacklog; }));
  EXPECT_TRUE(staysFalse([&] { return written.load(); }, 300));
  EXPECT_EQ(in.getQueuedReceiveBytes(), 1024 * in.getQueuedReceiveMessages());
  EXPECT_LE(cost(), limits.uReceiveBacklog + (65536 + 4096) / 1024 * (1024 + N_Limits::kMessageCharge));
  for (unsigned i = 0; i < kMessages; ++i) ASSERT_TRUE(nextMessage(in, pattern(1024, i))) << i;
  writer.join();
  EXPECT_EQ(0u, in.getQueuedReceiveBytes() + in.getQueuedReceiveMessages());
  raw::closeFd(fd);
}

TEST_F(TransportFaultsTest, StreamsComeThroughShortWritesInterruptionsAndRefusals) {
  N_Listener listener(port());
  N_Socket a, b, c, d;
  ASSERT_TRUE(connectPair(listener, port(), b, a) && connectPair(listener, port(), d, c));
  platform::sys::calls().sendmsg = choppySendmsg;
  platform::sys::calls().recvmsg = choppyRecvmsg;
  platform::sys::calls().epoll_wait = restlessWait;
  platform::sys::calls().epoll_ctl = forgetfulRegistration;
  exchange(a, b, 40);
  exchange(c, d, 10);
  EXPECT_GT(g_sends.load(), 1000);  // the calls did go through the table
  EXPECT_GT(g_receives.load(), 1000);
  EXPECT_GT(g_polls.load(), 10);
  EXPECT_GT(g_registrations.load(), 20);
  EXPECT_TRUE(a.isConnected() && b.isConnected() && c.isConnected() && d.isConnected());

  // Datagrams, to a plain socket on a host of its own and back.
  N_Address other("127.0.0.2");
  const auto udpPort = static_cast<std::uint16_t>(freePort());
  const int peer = raw::udpBound("127.0.0.2", udpPort);
  N_Socket u(&other, udpPort, N_Socket::SOCKET_UDP);
  const sockaddr_in back{AF_INET, htons(udpPort), {htonl(INADDR_LOOPBACK)}, {}};
  for (unsigned i = 0; i < 20; ++i) {
    const Bytes m = pattern(1 + i, i);
    Bytes got(m.size());
    send(u, m);
    ASSERT_TRUE(raw::receiveExactly(peer, got.data(), m.size(), 5000)) << i;
    EXPECT_EQ(m, got);
    ASSERT_EQ(long(m.size()), ::sendto(peer, m.data(), m.size(), 0, reinterpret_cast<const sockaddr*>(&back), sizeof back));
    ASSERT_TRUE(nextMessage(u, m)) << i;
  }
  raw::closeFd(peer);
}

// Descriptors used up: a socket that can't be made never connects (and
// leaves the listener as it was), and a thread that can't get its
// descriptors fails its waits until it can.
TEST_F(TransportFaultsTest, UsedUpDescriptorsFailAsWinsockWouldAndRecover) {
  N_Socket::ConnectData* data = nullptr;
  {
    N_Listener listener(port());
    platform::sys::calls().socket = noDescriptor;
    N_Socket never(loopback(), port(), N_Socket::SOCKET_TCP), neverUdp(loopback(), port() + 1, N_Socket::SOCKET_UDP);
    send(neverUdp, Bytes{'x'});  // goes nowhere, and costs nothing else
    EXPECT_TRUE(staysFalse([&] { return never.isConnected() || listener.pollConnect(data); }, 300));
    platform::sys::restore();
  }
  // A new runtime whose network thread can't make its wake-up or its epoll
  // descriptor: its waits fail until the system agrees.
  stopRuntime();
  for (bool wakeUp : {true, false}) {
    if (wakeUp)
      platform::sys::calls().eventfd = noEventfd;
    else
      platform::sys::calls().epoll_create1 = noEpoll;
    N_Initializer runtime;
    N_Address host("127.0.0.1");
    const int p = freePort();
    N_Listener second(p);
    N_Socket out(&host, p, N_Socket::SOCKET_TCP);
    EXPECT_TRUE(staysFalse([&] { return second.pollConnect(data); }, 300));
    platform::sys::restore();
    ASSERT_TRUE(waitFor([&] { return second.pollConnect(data); }, 10000));
    N_Socket accepted(data);
    ASSERT_TRUE(waitFor([&] { return out.isConnected() && accepted.isConnected(); }));
    exchange(out, accepted, 5);
  }
}

class TransportStressTest : public EndpointTest {};

// This test on 127.0.0.1 and the transport peer on 127.0.0.2 exchange
// messages over TCP (port P) and UDP (P + 1 on each side's own address). The
// peer echoes everything: whole, in order and byte-identical.
TEST_F(TransportStressTest, TcpAndUdpExchangeWithAPeerProcess) {
  N_Listener listener(port());
  N_Address peerAddress("127.0.0.2");
  N_Socket udp(&peerAddress, port() + 1, N_Socket::SOCKET_UDP);
  ChildProcess peer(VARDEL_HOST_TRANSPORT_PEER, {"--port", std::to_string(port())});
  ASSERT_TRUE(peer.started());
  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(data); }, 20000));
  N_Socket tcp(data);
  EXPECT_STREQ("127.0.0.2", const_cast<const char*>(tcp.getAddress()->getStringNumber()));
  std::vector<Bytes> sent = {Bytes{}, pattern(1, 1), pattern(3 << 20, 2)};  // and a burst
  for (unsigned i = 0; i < 300; ++i) sent.push_back(pattern(i * 7 % 700, 1000 + i));
  for (const Bytes& m : sent) send(tcp, m);
  for (std::size_t i = 0; i < sent.size(); ++i) ASSERT_TRUE(nextMessage(tcp, sent[i], 20000)) << "echo " << i;
  for (unsigned size : {0, 1, 1400, 65507}) {  // one datagram at a time, up to the limit
    send(udp, pattern(size, size + 5));
    ASSERT_TRUE(nextMessage(udp, pattern(size, size + 5))) << "datagram of " << size;
  }
  send(tcp, Bytes{'q', 'u', 'i', 't'});
  EXPECT_EQ(std::optional<int>(0), peer.wait(20000)) << "the peer's exit";
  EXPECT_EQ(&tcp, nextDisconnect());
}

constexpr int kSenders = 4, kMessagesPerSender = 500;

// Sender (1 byte), sequence (4 bytes), then a pattern of both.
Bytes makeMessage(int sender, unsigned sequence) {
  const std::size_t size = sequence % 10 == 0 ? 70000 + sequence * 13 : sequence * 131 % 3000;
  return concat({Bytes{static_cast<unsigned char>(sender)}, le32(sequence), pattern(size, sender * 100000 + sequence)});
}

// Checks each message on the network thread as it comes.
class CheckingSocket : public N_Socket {
 public:
  ~CheckingSocket() { destruct(); }
  bool receive(void* data, unsigned size) override {
    const auto* p = static_cast<const unsigned char*>(data);
    if (size < 5 || p[0] >= kSenders) return ++bad, false;
    const int sender = p[0];
    const unsigned sequence = p[1] | p[2] << 8 | p[3] << 16 | static_cast<unsigned>(p[4]) << 24;
    bad += sequence != next[sender] || makeMessage(sender, sequence) != Bytes(p, p + size);
    next[sender] = sequence + 1;
    ++total;
    return false;
  }
  unsigned next[kSenders] = {};
  std::atomic<int> total{0}, bad{0};
};

// Every message arrives whole, and each thread's in the order it sent them:
// the chunks of one send never interleave with another's.
TEST_F(TransportStressTest, ConcurrentSendersWhileSocketsComeAndGo) {
  N_Listener listener(port());
  CheckingSocket in;
  N_Socket out;
  ASSERT_TRUE(connectPair(listener, port(), in, out));
  std::atomic<bool> stop{false};
  std::atomic<int> churned{0}, churnFailures{0};
  std::thread churn([&] {  // sockets made, used once and destroyed, the last send left in flight
    const int churnPort = freePort();
    N_Listener churnListener(churnPort);
    while (!stop) {
      N_Socket a, b, udp(loopback(), freePort(), N_Socket::SOCKET_UDP);
      send(udp, pattern(64, 1));
      const bool ok = connectPair(churnListener, churnPort, b, a);
      if (ok) send(a, pattern(1000, 2));
      churnFailures += !ok || !nextMessage(b, pattern(1000, 2), 2000) || !nextMessage(udp, pattern(64, 1), 2000);
      if (ok) send(b, pattern(10, 3));
      ++churned;
    }
  });
  std::vector<std::thread> senders;
  for (int s = 0; s < kSenders; ++s)
    senders.emplace_back([&, s] {
      for (unsigned i = 0; i < kMessagesPerSender; ++i) {
        send(out, makeMessage(s, i));
        while (i % 16 == 15 && out.getBytesWaitingForSend() > (4 << 20)) platform::Sleep(1);
      }
    });
  for (std::thread& t : senders) t.join();
  EXPECT_TRUE(waitFor([&] { return in.total == kSenders * kMessagesPerSender; }, 60000)) << in.total;
  stop = true;
  churn.join();
  EXPECT_EQ(0, in.bad.load());
  for (unsigned next : in.next) EXPECT_EQ(kMessagesPerSender, next);
  EXPECT_EQ(0, churnFailures.load());
  EXPECT_GT(churned.load(), 0);
}

}  // namespace
