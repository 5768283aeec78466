// Sockets and listeners through their public interface: construction and its
// failures, connect and disconnect events, UDP, sockets destroyed while the
// network thread works for them, the connect queue, the wait set at its
// default size of 64 events and beyond; and the packaged TCP stream, a 4-byte
// little-endian length and the payload, which raw Linux peers read and write
// byte by byte (where the exact cut of a read matters, the read is fed to the
// receive path directly).
#include <algorithm>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <memory>
#include <random>
#include <thread>
#include <utility>

#include "endpoint_test.h"
#include "Q_System.h"
#include "guards.h"

namespace {

using SocketTest = EndpointTest;
using StreamTest = EndpointTest;

int registeredSockets() {
  int n = 0;
  for (N_Socket** s = N_Socket::getFirstSocket(); s != nullptr; s = N_Socket::getNextSocket(s)) ++n;
  return n;
}

// Writes one piece and gives the network thread time to read it alone.
void write(int fd, const Bytes& piece) {
  ASSERT_TRUE(rawSend(fd, piece));
  platform::Sleep(30);
}
Bytes readWire(int fd, std::size_t size) {
  Bytes wire(size);
  return raw::receiveExactly(fd, wire.data(), size, 10000) ? wire : Bytes{};
}

class FlagSocket : public N_Socket {
 public:
  ~FlagSocket() { destruct(); }
  bool receiveConnect() override { return ++connects, keep; }
  bool receiveDisconnect() override { return ++disconnects, keep; }
  std::atomic<int> connects{0}, disconnects{0};
  bool keep = true;
};

// A failed construction leaves the object as it was, ready for another. A
// UDP socket whose peer is its own address talks to itself; only the package
// mechanism lifts the datagram limit.
TEST_F(SocketTest, FailedConstructionLeavesTheObjectUsable) {
  N_Socket socket;  // inert until constructed
  socket.destruct();
  EXPECT_EQ(0, registeredSockets());
  N_Address unresolved("0.0.0.0");
  for (auto [call, type] : {std::pair{Call::bind, N_Socket::SOCKET_TCP}, {Call::bind, N_Socket::SOCKET_UDP}, {Call::WSAConnect, N_Socket::SOCKET_TCP}}) {
    EXPECT_THROW(socket.construct(&unresolved, port(), type), N_NetException_IPNotResolved*);
    platform::fault::arm(call, {1, false, platform::WSAEADDRINUSE});
    EXPECT_THROW(socket.construct(loopback(), port(), type), N_NetException_LocalAddressAlreadyInUse*);
    EXPECT_FALSE(socket.isConnected());
    EXPECT_EQ(0, registeredSockets());
  }
  socket.construct(loopback(), port(), N_Socket::SOCKET_UDP);
  EXPECT_TRUE(socket.isConnected());
  EXPECT_THROW(send(socket, pattern(65508, 1)), N_NetException_PacketTooBig*);
  for (bool package : {false, true}) {
    if (package) socket.enablePackage();
    for (unsigned size : {0u, 100u, 65507u, package ? 70000u : 1u}) {
      send(socket, pattern(size, size));
      ASSERT_TRUE(nextMessage(socket, pattern(size, size))) << size;
    }
  }
  socket.disablePackage();
  N_Listener listener(port());
  N_Socket in;
  for (unsigned i = 0; i < 2; ++i) {  // constructing a live socket again drops the old connection and its unread message
    ASSERT_TRUE(connectPair(listener, port(), in, socket));
    EXPECT_EQ(2, registeredSockets());
    send(socket, pattern(10, i));
    ASSERT_TRUE(waitFor([&] { return in.getQueuedReceiveMessages() == 1; }));
  }
  ASSERT_TRUE(nextMessage(in, pattern(10, 1)));
}

// Whichever of disconnect() and the peer's close comes first reports; the
// other finds nothing to do. Connect events are for outgoing sockets only.
TEST_F(SocketTest, ConnectAndDisconnectEvents) {
  N_Listener listener(port());
  FlagSocket in, out;
  ASSERT_TRUE(connectPair(listener, port(), in, out));
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollConnect(reported); }));
  EXPECT_EQ(&out, reported);
  EXPECT_FALSE(N_Socket::pollConnect(reported));
  EXPECT_EQ(0, in.connects.load());
  send(out, pattern(6, 1));
  ASSERT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
  out.disconnect();
  out.disconnect();
  EXPECT_FALSE(out.isConnected());
  ASSERT_TRUE(waitFor([&] { return !in.isConnected(); }));
  ASSERT_TRUE(nextMessage(in, pattern(6, 1)));  // the data in front of the close is still there
  in.disconnect();
  pumpFor(100, {});
  EXPECT_EQ(1, out.disconnects.load());
  EXPECT_EQ(1, in.disconnects.load());
  EXPECT_EQ(&out, nextDisconnect(0));  // oldest socket first
  EXPECT_EQ(&in, nextDisconnect(0));
  EXPECT_EQ(nullptr, nextDisconnect(0));

  // A handler answering false raises no event; a connect not yet polled when
  // the disconnect comes shows only as the disconnect; a refused connect is silent.
  for (bool keep : {true, false}) {
    FlagSocket toRaw;
    toRaw.keep = keep;
    int fd = -1;
    ASSERT_TRUE(connectRaw(toRaw, fd));
    raw::closeFd(fd);
    ASSERT_TRUE(waitFor([&] { return toRaw.disconnects == 1; }));
    EXPECT_EQ(1, toRaw.connects.load());
    EXPECT_FALSE(N_Socket::pollConnect(reported));
    EXPECT_EQ(keep ? &toRaw : nullptr, nextDisconnect(keep ? 5000 : 100)) << keep;
  }
  FlagSocket refused;
  refused.construct(loopback(), freePort(), N_Socket::SOCKET_TCP);
  EXPECT_TRUE(staysFalse([&] { return refused.isConnected() || N_Socket::pollConnect(reported) ||
                                      N_Socket::pollDisconnect(reported) || refused.disconnects > 0; }, 200));
}

// receive() destroys its own socket, takes long while another thread
// destroys it, polls and declines, or throws, at the first of three messages
// of one read. Nothing touches a dead socket and the rest is dropped;
// destruct() waits for the call; a polled message is freed once (the balance
// tells); an exception is dropped with a diagnostic line naming it, and its
// message stays for poll() on a connection that goes on.
class BusySocket : public N_Socket {
 public:
  enum Mode { DESTRUCT, DELETE, SLOW, POLL, THROW } mode;
  explicit BusySocket(Mode m) : mode(m) {}
  ~BusySocket() { destruct(); }
  bool receive(void* data, unsigned size) override {
    ++calls;
    const Mode m = mode;  // `this` may be gone below
    void* polled = nullptr;
    unsigned polledSize = 0;
    if (m == DESTRUCT) destruct();
    if (m == DELETE) delete this;
    if (m == SLOW) platform::Sleep(200);
    while (m == POLL && poll(polled, polledSize)) own += polled == data && polledSize == size;
    ++finished;
    if (m == THROW) throw 7;
    return m != POLL;
  }
  static inline std::atomic<int> calls{0}, finished{0}, own{0}, traces{0};
};

TEST_F(SocketTest, ReceiveMayDestroyItsSocketPollOrThrow) {
  using enum BusySocket::Mode;
  Sys->setVerboseSink([](const char* line) { BusySocket::traces += std::strstr(line, "receive: ") != nullptr; });
  N_Listener listener(port());
  for (BusySocket::Mode mode : {DESTRUCT, DELETE, SLOW, POLL, THROW}) {
    SCOPED_TRACE(mode);
    BusySocket::calls = BusySocket::finished = BusySocket::own = BusySocket::traces = 0;
    auto* in = new BusySocket(mode);
    int fd = -1;
    ASSERT_TRUE(acceptRaw(listener, port(), *in, fd));
    ASSERT_TRUE(rawSend(fd, concat({framed(pattern(5, 1)), framed(pattern(6, 2)), framed(pattern(7, 3))})));
    const int all = mode == POLL || mode == THROW ? 3 : 1;
    ASSERT_TRUE(waitFor([&] { return BusySocket::calls == all; }));
    if (mode == SLOW) in->destruct();  // waits for the calls under way
    const int calls = BusySocket::calls;
    EXPECT_TRUE(mode != SLOW || BusySocket::finished == calls);
    pumpFor(50, {});
    EXPECT_EQ(mode == SLOW ? calls : all, BusySocket::calls.load());
    EXPECT_EQ(calls, BusySocket::finished.load());
    EXPECT_EQ(mode == POLL ? 3 : 0, BusySocket::own.load());
    EXPECT_EQ(mode == POLL || mode == THROW ? 1 : 0, registeredSockets());
    EXPECT_EQ(mode == THROW ? 3 : 0, BusySocket::traces.load());
    if (mode == THROW) {
      for (unsigned i = 1; i <= 3; ++i) EXPECT_TRUE(nextMessage(*in, pattern(4 + i, i)));
      EXPECT_TRUE(in->isConnected());
    }
    if (mode != DELETE) delete in;
    raw::closeFd(fd);
  }
  Sys->setVerboseSink(nullptr);
}

// Sends still queued and reads still under way when their socket goes: the
// network side frees them once, and nothing reaches the wire.
TEST_F(SocketTest, DestroyedSocketLeavesOrphansThatTheNetworkSideFrees) {
  N_Socket probe;
  {
    N_Socket never(loopback(), freePort(), N_Socket::SOCKET_TCP);
    for (unsigned i = 0; i < 10; ++i) send(never, pattern(1000, i));
    EXPECT_EQ(10 * 1004, probe.getBytesWaitingForSend());
  }
  EXPECT_TRUE(waitFor([&] { return probe.getBytesWaitingForSend() == 0; }));
  N_Listener listener(port());
  for (unsigned round = 0; round < 10; ++round) {
    N_Socket in;
    int fd = -1;
    ASSERT_TRUE(acceptRaw(listener, port(), in, fd));
    const Bytes chunk = framed(pattern(50000, round));
    std::atomic<bool> stop{false};
    std::thread writer([&] { while (!stop && rawSend(fd, chunk)) {} });
    platform::Sleep(5 + round * 3);
    in.destruct();  // resets the connection: the writer's next send fails
    stop = true;
    writer.join();
    raw::reset(fd);
  }
  // WSASends still out (the peer doesn't read) are aborted by the close.
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));
  for (int i = 0; i < 600; ++i) send(out, pattern(60000, 1));  // more than loopback buffers hold
  int last = -1;  // until the kernel takes no more
  ASSERT_TRUE(waitFor([&] { const int now = probe.getBytesWaitingForSend(); return std::exchange(last, now) == now; }, 20000,
                      [] { platform::Sleep(100); }));
  ASSERT_GT(last, 0);
  const unsigned queued = out.getQueuedSendMessages();  // each counted with its prefix
  EXPECT_EQ(60004u * queued, out.getQueuedSendBytes());
  raw::receiveFor(fd, 200);  // what the peer reads leaves the count
  EXPECT_TRUE(waitFor([&] { return out.getQueuedSendMessages() < queued; }));
  out.destruct();
  EXPECT_TRUE(waitFor([&] { return probe.getBytesWaitingForSend() == 0; }, 10000));
  raw::closeFd(fd);
}

// Each listener queues its own connections in order of arrival; pollConnect
// gives the oldest entry until it is consumed, after receiveConnect heard of
// it. Constructed again a listener moves, destructed it closes; entries
// nobody took stay with the runtime, unseen by a later listener on the port.
TEST_F(SocketTest, ListenersQueueTheirConnectionsInOrder) {
  const int portB = freePort(), newPort = freePort();
  CountingListener a(port()), b(portB);
  N_Socket::ConnectData* entry = nullptr;
  const int toB1 = raw::connectTo("127.0.0.1", portB, "127.0.0.2");
  ASSERT_TRUE(waitFor([&] { return b.calls == 1; }));
  const int toA = raw::connectTo("127.0.0.1", port(), "127.0.0.3");
  const int toB2 = raw::connectTo("127.0.0.1", portB, "127.0.0.4");
  ASSERT_TRUE(waitFor([&] { return a.calls == 1 && b.calls == 2; }));
  EXPECT_EQ(1, a.queuedFirst.load());
  EXPECT_EQ(1, b.queuedFirst.load());  // b's second entry waits behind its first
  std::vector<std::unique_ptr<N_Socket>> accepted;
  struct Expected { CountingListener* listener; int fd; const char* from; };
  for (auto [listener, fd, from] : {Expected{&b, toB1, "127.0.0.2"}, Expected{&a, toA, "127.0.0.3"}, Expected{&b, toB2, "127.0.0.4"}}) {
    N_Socket::ConnectData* again = nullptr;
    ASSERT_TRUE(listener->pollConnect(entry) && listener->pollConnect(again));
    EXPECT_EQ(entry, again);
    EXPECT_EQ(listener, entry->pListener);
    N_Socket& in = *accepted.emplace_back(std::make_unique<N_Socket>(entry));
    EXPECT_TRUE(in.isConnected() && in.getSocketType() == N_Socket::SOCKET_TCP);
    EXPECT_EQ(raw::localPort(fd), in.getPort());
    EXPECT_STREQ(from, const_cast<const char*>(in.getAddress()->getStringNumber()));
    raw::closeFd(fd);
  }
  EXPECT_FALSE(a.pollConnect(entry) || b.pollConnect(entry));
  b.construct(newPort);
  EXPECT_EQ(newPort, b.getPort());
  EXPECT_TRUE(portClosed(portB));
  b.destruct();
  EXPECT_TRUE(portClosed(newPort));
  const int waiting = raw::connectTo("127.0.0.1", port());
  ASSERT_TRUE(waitFor([&] { return a.pollConnect(entry); }));
  a.destruct();
  N_Listener later(port());
  EXPECT_TRUE(staysFalse([&] { return later.pollConnect(entry); }, 100));
  raw::closeFd(waiting);
}

// A full accept queue stops accepting, so the process holds no more
// connections than the bound; refusing entries lets the rest in.
TEST_F(SocketTest, AFullAcceptQueueWaitsForTheApplication) {
  N_Limits limits = N_Limits::defaults();
  limits.uMaximumAcceptQueue = 3;
  LimitsGuard guard(limits);
  N_Listener listener(port());
  const auto descriptors = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), std::filesystem::directory_iterator{});
  };
  const auto before = descriptors();
  std::vector<int> peers;
  for (int i = 0; i < 6; ++i) peers.push_back(raw::connectTo("127.0.0.1", port()));
  // Our 6 ends, and 3 accepted ones.
  EXPECT_TRUE(waitFor([&] { return descriptors() - before == 9; }));
  EXPECT_TRUE(staysFalse([&] { return descriptors() - before > 9; }, 300));
  int refused = 0;
  N_Socket::ConnectData* entry = nullptr;
  while (refused < 6 && waitFor([&] { return listener.pollConnect(entry); })) refused += listener.rejectConnect(entry);
  EXPECT_EQ(6, refused);
  for (int fd : peers) {
    EXPECT_TRUE(raw::closedByPeer(fd, 5000));
    raw::closeFd(fd);
  }
}

// The network thread waits on at most 64 events by default: its release
// event, then sockets oldest first, then listeners. What doesn't fit isn't
// served until others go, but its sends still leave. A larger wait set
// follows the same rule at its own size. With listeners first, none is left
// out.
class WaitSetTest : public EndpointTest, public ::testing::WithParamInterface<unsigned> {
 protected:
  void SetUp() override {
    N_Initializer::setMaximumWaitEvents(GetParam());
    EndpointTest::SetUp();
  }
  void TearDown() override {
    EndpointTest::TearDown();
    N_Initializer::setMaximumWaitEvents(64);
  }
};

TEST_P(WaitSetTest, SocketsFirstAndWhatDoesNotFitWaits) {
  const int size = static_cast<int>(GetParam());
  N_Initializer::setMaximumWaitEvents(size + 1);
  EXPECT_EQ(unsigned(size), N_Initializer::getMaximumWaitEvents()) << "the runtime keeps the size it started with";
  std::vector<std::unique_ptr<N_Socket>> sockets;
  auto addSockets = [&](int n) {
    while (n-- > 0) sockets.push_back(std::make_unique<N_Socket>(loopback(), freePort(), N_Socket::SOCKET_UDP));
  };
  std::vector<int> peers;
  auto knock = [&](int p) { peers.push_back(raw::connectTo("127.0.0.1", p)); };
  addSockets(size - 3);
  const int portB = freePort();
  CountingListener first(port()), second(portB);
  knock(port());  // 1 + (size - 3) + 2 = size: all served
  knock(portB);
  EXPECT_TRUE(waitFor([&] { return first.calls == 1 && second.calls == 1; }));
  addSockets(1);  // the younger listener is out
  knock(portB);
  knock(port());
  EXPECT_TRUE(waitFor([&] { return first.calls == 2; }));
  EXPECT_TRUE(staysFalse([&] { return second.calls > 1; }, 300));
  addSockets(2);  // both listeners and the youngest socket are out
  knock(port());
  N_Socket& last = *sockets.back();
  send(last, pattern(12, 1));
  EXPECT_TRUE(noMessage(last, 300));
  sockets.erase(sockets.begin());  // they move in, in order, as older sockets go
  ASSERT_TRUE(nextMessage(last, pattern(12, 1)));
  EXPECT_TRUE(staysFalse([&] { return first.calls > 2; }, 200));
  sockets.erase(sockets.begin(), sockets.begin() + 2);
  EXPECT_TRUE(waitFor([&] { return first.calls == 3 && second.calls == 2; }));
  {
    LimitsGuard open(N_Limits::openNetwork());  // listeners first
    CountingListener third(freePort());
    addSockets(10);
    knock(third.getPort());
    EXPECT_TRUE(waitFor([&] { return third.calls == 1; }));
  }
  sockets.clear();
  for (int fd : peers) raw::closeFd(fd);
}

INSTANTIATE_TEST_SUITE_P(Size, WaitSetTest, ::testing::Values(64u, 300u));

// Messages are exact on the wire, with the package and without; reads
// without it are messages as they came, prefix-like bytes and all, an empty
// read too. Neither plain reads nor a read that completes with an error
// touch the message in collection.
TEST_F(StreamTest, WithAndWithoutThePackage) {
  std::uint16_t p = 0;
  const int listening = raw::listenOn("127.0.0.1", p);
  N_Socket out(loopback(), p, N_Socket::SOCKET_TCP);
  send(out, Bytes{'h', 'e', 'l', 'l', 'o'});  // before the connect completes
  send(out, Bytes{'h', 'i'});
  send(out, Bytes{});
  const int fd = raw::acceptOne(listening, 5000);
  raw::closeFd(listening);
  EXPECT_EQ(Bytes({5, 0, 0, 0, 'h', 'e', 'l', 'l', 'o', 2, 0, 0, 0, 'h', 'i', 0, 0, 0, 0}), readWire(fd, 19));
  // A big message leaves in chunks (of S - 16 bytes) that add no bytes of
  // their own; the caller's buffer is free as soon as send returns.
  for (std::size_t size : {65519u, 65520u, 65521u, 65536u, 3 * 65520u + 1, 200000u}) {
    Bytes big = pattern(size, 1), sent = big;
    send(out, big);
    std::fill(big.begin(), big.end(), 0xEE);
    EXPECT_TRUE(framed(sent) == readWire(fd, size + 4)) << size;
  }
  EXPECT_TRUE(raw::receiveFor(fd, 200).empty());

  out.disablePackage();  // bare bytes, up to the limit
  const unsigned s = static_cast<unsigned>(out.getMaximumSendPacketSize());
  EXPECT_EQ(65536u, s);
  send(out, Bytes{1, 2, 3});
  send(out, Bytes{});
  const int waiting = out.getBytesWaitingForSend();
  EXPECT_THROW(send(out, pattern(s + 1, 2)), N_NetException_PacketTooBig*);
  EXPECT_LE(out.getBytesWaitingForSend(), waiting);
  send(out, pattern(s, 3));
  EXPECT_EQ(concat({Bytes{1, 2, 3}, pattern(s, 3)}), readWire(fd, s + 3));
  out.enablePackage();
  send(out, Bytes{9});
  EXPECT_EQ(Bytes({1, 0, 0, 0, 9}), readWire(fd, 5));

  const Bytes stream = framed(pattern(100, 1));
  inject(out, slice(stream, 0, 50));
  N_SocketTestAccess::read(out, nullptr, 0, 10054);
  EXPECT_TRUE(out.isConnected());
  out.disablePackage();
  write(fd, Bytes{5, 0, 0, 0, 'a'});
  ASSERT_TRUE(nextMessage(out, Bytes({5, 0, 0, 0, 'a'})));
  inject(out, Bytes{});
  ASSERT_TRUE(nextMessage(out, Bytes{}, 0));
  EXPECT_EQ(104, out.getReceivePacketSize());
  out.enablePackage();
  inject(out, slice(stream, 50, 104));
  ASSERT_TRUE(nextMessage(out, pattern(100, 1), 0));
  raw::closeFd(fd);
}

// Reads cut at every kind of place: inside a prefix, between prefix and
// body, several messages (empty ones too) in one read, and a long run of
// mixed sizes cut at random. receive() and poll() see the same messages.
TEST_F(StreamTest, ReadsCutAnywhereGiveTheSameMessages) {
  const Bytes a = pattern(5, 1), b = pattern(10, 2), e;
  struct Case { Bytes stream; std::vector<std::size_t> cuts; std::vector<Bytes> messages; };
  std::vector<Case> cases = {{concat({framed(e), framed(a), framed(e), framed(e), framed(b), framed(e), framed(a), framed(e), framed(e)}),
                              {1, 4, 6, 8, 17, 19, 21, 26, 48, 48}, {e, a, e, e, b, e, a, e, e}}};
  std::mt19937 random(1234);
  Case& r = cases.emplace_back();
  for (unsigned i = 0; i < 300; ++i) {
    r.messages.push_back(pattern(random() % 10 == 0 ? 0 : random() % 8 == 0 ? 60000 + random() % 20000 : random() % 300, i));
    const Bytes f = framed(r.messages.back());
    r.stream.insert(r.stream.end(), f.begin(), f.end());
  }
  for (std::size_t at = 0; (at += 1 + random() % (random() % 3 == 0 ? 9 : 9000)) < r.stream.size();) r.cuts.push_back(at);
  for (const Case& c : cases) {
    RecordingSocket in;
    in.keep = true;
    in.construct(loopback(), freePort(), N_Socket::SOCKET_TCP);
    std::size_t at = 0;
    for (std::size_t cut : c.cuts) inject(in, slice(c.stream, std::exchange(at, cut), cut));
    inject(in, slice(c.stream, at, c.stream.size()));
    EXPECT_TRUE(c.messages == in.messages()) << in.messages().size() << " messages";
    for (const Bytes& m : c.messages) ASSERT_TRUE(nextMessage(in, m, 0));
    EXPECT_TRUE(noMessage(in, 0));
  }
}

// A stream that ends inside a message (closed in a prefix, reset in a body,
// closed in a message of the largest length) or breaks on a length above the
// cap (by one, or with the top bit set; whole or split) ends its own
// connection only: the messages in front stay pollable after the one
// disconnect, and nothing behind shows, not even a valid message.
TEST_F(StreamTest, AnEndOrBreakInsideAMessageEndsOnlyItsConnection) {
  LimitsGuard open(N_Limits::openNetwork());
  const std::uint32_t cap = N_Limits::openNetwork().uMaximumMessageSize;
  const int atCap = static_cast<int>(cap) + 4;
  N_Listener listener(port());
  const Bytes a = pattern(50, 1), body = pattern(1000, 4);
  struct Case { const char* name; std::vector<Bytes> pieces; int collecting; int missing; bool reset; };
  for (const Case& c : {Case{"closed in a prefix", {Bytes{3, 0}}, 0, 0, false},
                        Case{"reset in a body", {slice(framed(pattern(5000, 2)), 0, 1000)}, 5004, 4004, true},
                        Case{"at the cap", {concat({le32(cap), body})}, atCap, atCap - 1004, false},
                        Case{"at the cap, split", {slice(le32(cap), 0, 2), concat({slice(le32(cap), 2, 4), body})}, atCap, atCap - 1004, false},
                        Case{"over the cap", {concat({le32(cap + 1), pattern(100, 3)}), framed(a)}, -1, 0, false},
                        Case{"top bit", {concat({le32(0xFFFFFFFF), pattern(100, 3)}), framed(a)}, -1, 0, false},
                        Case{"top bit, split", {Bytes{0, 0}, concat({Bytes{0, 0x80}, pattern(100, 3)}), framed(a)}, -1, 0, false}}) {
    SCOPED_TRACE(c.name);
    N_Socket bad, good;
    int badFd = -1, goodFd = -1;
    ASSERT_TRUE(acceptRaw(listener, port(), bad, badFd));
    ASSERT_TRUE(acceptRaw(listener, port(), good, goodFd));
    raw::noDelay(badFd);
    write(badFd, concat({framed(a), framed(a), c.pieces[0]}));
    for (std::size_t i = 1; i < c.pieces.size(); ++i) write(badFd, c.pieces[i]);
    if (c.collecting >= 0) {
      ASSERT_TRUE(waitFor([&] { return bad.getReceivePacketSize() == c.collecting && bad.getQueuedReceiveMessages() == 2; }));
      EXPECT_EQ(c.missing, bad.getReceivePacketBytesMissing());
      c.reset ? raw::reset(badFd) : raw::closeFd(badFd);
      badFd = -1;
    }
    EXPECT_EQ(&bad, nextDisconnect());
    EXPECT_TRUE(c.collecting >= 0 || bad.getReceivePacketSize() == 0);
    for (int i = 0; i < 2; ++i) ASSERT_TRUE(nextMessage(bad, a));
    EXPECT_TRUE(noMessage(bad));
    write(goodFd, framed(a));
    ASSERT_TRUE(nextMessage(good, a));  // the other connection goes on
    raw::closeFd(badFd);
    raw::closeFd(goodFd);
    EXPECT_EQ(&good, nextDisconnect());
    EXPECT_EQ(nullptr, nextDisconnect(50)) << "the broken one's close reports nothing new";
  }
}

}  // namespace
