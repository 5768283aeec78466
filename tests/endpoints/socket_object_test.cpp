// The socket object: construction and its failures, connect and disconnect
// events, poll's ownership rule, UDP datagrams, and sockets destroyed while
// the network thread still works for them.
#include <thread>

#include "raw_peer.h"
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class SocketObjectTest : public TransportTest {};

int registeredSockets() {
  int n = 0;
  for (N_Socket** s = N_Socket::getFirstSocket(); s != nullptr; s = N_Socket::getNextSocket(s)) ++n;
  return n;
}

bool registered(const N_Socket* socket) {
  for (N_Socket** s = N_Socket::getFirstSocket(); s != nullptr; s = N_Socket::getNextSocket(s))
    if (*s == socket) return true;
  return false;
}

// ---- Construction ----------------------------------------------------------

TEST_F(SocketObjectTest, DefaultSocketIsInertAndUnregistered) {
  EXPECT_TRUE(N_Socket::networkPresent());
  N_Socket idle;
  EXPECT_EQ(0, registeredSockets());
  idle.destruct();
  idle.destruct();
  EXPECT_FALSE(idle.isConnected());
  EXPECT_EQ(65536, idle.getMaximumSendPacketSize());
  EXPECT_EQ(3.4028235e38f, N_Socket::ping(nullptr));
}

TEST_F(SocketObjectTest, UnresolvedAddressThrowsAndTheObjectStaysUsable) {
  N_Address unresolved("0.0.0.0");  // identifier 0, and no lookup
  ASSERT_EQ(0u, unresolved.getIdentifier());
  int port = freePort();
  N_Socket socket;
  for (N_Socket::SocketType type : {N_Socket::SOCKET_TCP, N_Socket::SOCKET_UDP}) {
    try {
      socket.construct(&unresolved, port, type);
      FAIL() << "no exception";
    } catch (N_NetException_IPNotResolved* e) {
      EXPECT_STREQ("IP address is not resolved yet", e->getErrorMessage());
    }
    EXPECT_FALSE(socket.isConnected());
    EXPECT_EQ(0, registeredSockets());
  }
  N_Listener listener(port);
  N_Socket in;
  ASSERT_TRUE(connectPair(listener, port, in, socket));
  send(socket, pattern(3, 1));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(3, 1), got);
}

TEST_F(SocketObjectTest, LocalAddressInUseThrowsAndTheObjectStaysUsable) {
  int port = freePort();
  N_Socket socket;
  for (N_Socket::SocketType type : {N_Socket::SOCKET_TCP, N_Socket::SOCKET_UDP}) {
    platform::fault::arm(platform::fault::Call::bind, {1, false, platform::WSAEADDRINUSE});
    try {
      socket.construct(loopback(), port, type);
      FAIL() << "no exception";
    } catch (N_NetException_LocalAddressAlreadyInUse* e) {
      EXPECT_STREQ("Local address is already bound to other socket", e->getErrorMessage());
    }
    EXPECT_EQ(0, registeredSockets());
  }
  // The same through the connect.
  platform::fault::arm(platform::fault::Call::WSAConnect, {1, false, platform::WSAEADDRINUSE});
  EXPECT_THROW(socket.construct(loopback(), port, N_Socket::SOCKET_TCP), N_NetException_LocalAddressAlreadyInUse*);
  EXPECT_EQ(0, registeredSockets());

  socket.construct(loopback(), port, N_Socket::SOCKET_UDP);
  EXPECT_TRUE(registered(&socket));
}

TEST_F(SocketObjectTest, ConstructOnALiveSocketStartsAfresh) {
  int port = freePort();
  N_Listener listener(port);
  N_Socket in, out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  send(out, pattern(10, 1));
  ASSERT_TRUE(waitFor([&] { return in.getBytesWaitingForSend() == 0; }));
  platform::Sleep(50);
  // The unread message goes with the old connection.
  out.construct(loopback(), port, N_Socket::SOCKET_TCP);
  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(data); }));
  in.construct(data);
  Bytes got;
  EXPECT_FALSE(pollMessage(in, got, 100));
  EXPECT_EQ(2, registeredSockets());
  send(out, pattern(4, 2));
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(4, 2), got);
}

// ---- Events ----------------------------------------------------------------

class FlagSocket : public N_Socket {
 public:
  ~FlagSocket() { destruct(); }
  bool receiveConnect() override {
    ++connects;
    return keepConnect;
  }
  bool receiveDisconnect() override {
    ++disconnects;
    return keepDisconnect;
  }
  std::atomic<int> connects{0};
  std::atomic<int> disconnects{0};
  bool keepConnect = true;
  bool keepDisconnect = true;
};

TEST_F(SocketObjectTest, ConnectIsReportedOnceForTheOutgoingSocketOnly) {
  int port = freePort();
  N_Listener listener(port);
  FlagSocket out;
  N_Socket in;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollConnect(reported); }));
  EXPECT_EQ(&out, reported);
  EXPECT_EQ(1, out.connects.load());
  EXPECT_TRUE(in.isConnected());
  reported = nullptr;
  EXPECT_FALSE(N_Socket::pollConnect(reported));
  EXPECT_EQ(nullptr, reported);
  EXPECT_FALSE(N_Socket::pollDisconnect(reported));
}

TEST_F(SocketObjectTest, ReceiveConnectReturningFalseRaisesNoEvent) {
  int port = freePort();
  N_Listener listener(port);
  FlagSocket out;
  out.keepConnect = false;
  N_Socket in;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  EXPECT_EQ(1, out.connects.load());
  const N_Socket* reported = nullptr;
  EXPECT_TRUE(staysFalse([&] { return N_Socket::pollConnect(reported); }, 100));
}

TEST_F(SocketObjectTest, AcceptedSocketKnowsThePeersPortAndAddress) {
  int port = freePort();
  N_Listener listener(port);
  N_Socket in;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, in, fd));
  EXPECT_EQ(raw_peer::localPort(fd), in.getPort());
  EXPECT_NE(port, in.getPort());
  EXPECT_EQ(N_Socket::SOCKET_TCP, in.getSocketType());
  ASSERT_NE(nullptr, in.getAddress());
  EXPECT_STREQ("127.0.0.1", const_cast<const char*>(in.getAddress()->getStringNumber()));
  EXPECT_TRUE(in.isConnected());
  raw::closeFd(fd);
}

// Whichever of disconnect() and the peer's close comes first reports, and
// the other one finds nothing to do.
TEST_F(SocketObjectTest, DisconnectAndALaterCloseGiveOneEvent) {
  int port = freePort();
  N_Listener listener(port);
  FlagSocket in, out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollConnect(reported); }));

  send(out, pattern(6, 1));
  ASSERT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
  out.disconnect();
  EXPECT_FALSE(out.isConnected());
  out.disconnect();
  EXPECT_EQ(1, out.disconnects.load());
  // The peer sees the close after the data in front of it.
  ASSERT_TRUE(waitFor([&] { return !in.isConnected(); }));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(6, 1), got);
  // in's own close reaches out as FD_CLOSE: no second event there.
  in.disconnect();
  platform::Sleep(100);
  EXPECT_EQ(1, out.disconnects.load());
  EXPECT_EQ(1, in.disconnects.load());

  // One event each, oldest socket first.
  std::vector<const N_Socket*> events;
  while (N_Socket::pollDisconnect(reported)) events.push_back(reported);
  EXPECT_EQ(std::vector<const N_Socket*>({&out, &in}), events);
}

TEST_F(SocketObjectTest, ReceiveDisconnectReturningFalseRaisesNoEvent) {
  int port = freePort();
  N_Listener listener(port);
  FlagSocket in;
  in.keepDisconnect = false;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, in, fd));
  raw::closeFd(fd);
  ASSERT_TRUE(waitFor([&] { return in.disconnects.load() == 1; }));
  EXPECT_FALSE(in.isConnected());
  const N_Socket* reported = nullptr;
  EXPECT_TRUE(staysFalse([&] { return N_Socket::pollDisconnect(reported); }, 100));
}

TEST_F(SocketObjectTest, ConnectNotPolledBeforeTheDisconnectShowsOnlyAsDisconnect) {
  std::uint16_t port = 0;
  int listening = raw::listenOn("127.0.0.1", port);
  N_Socket out(loopback(), port, N_Socket::SOCKET_TCP);
  int fd = raw::acceptOne(listening, 5000);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(waitFor([&] { return out.isConnected(); }));
  raw::closeFd(fd);
  raw::closeFd(listening);
  ASSERT_TRUE(waitFor([&] { return !out.isConnected(); }));
  const N_Socket* reported = nullptr;
  EXPECT_FALSE(N_Socket::pollConnect(reported));
  ASSERT_TRUE(N_Socket::pollDisconnect(reported));
  EXPECT_EQ(&out, reported);
}

TEST_F(SocketObjectTest, FailedConnectStaysSilent) {
  int refused = freePort();
  FlagSocket out;
  out.construct(loopback(), refused, N_Socket::SOCKET_TCP);
  platform::Sleep(200);
  EXPECT_FALSE(out.isConnected());
  EXPECT_EQ(0, out.connects.load());
  EXPECT_EQ(0, out.disconnects.load());
  const N_Socket* reported = nullptr;
  EXPECT_FALSE(N_Socket::pollConnect(reported));
  EXPECT_FALSE(N_Socket::pollDisconnect(reported));
}

// ---- poll ------------------------------------------------------------------

TEST_F(SocketObjectTest, PollHandsOutInOrderAndFreesThePreviousMessage) {
  int port = freePort();
  N_Listener listener(port);
  N_Socket in, out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  for (unsigned i = 0; i < 3; ++i) send(out, pattern(100 + i, i));
  ASSERT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
  Bytes got;
  for (unsigned i = 0; i < 3; ++i) {
    ASSERT_TRUE(pollMessage(in, got));
    EXPECT_EQ(pattern(100 + i, i), got);
  }
  platform::Sleep(50);  // let the network thread fall quiet
  // The last message handed out goes with the next poll, even an empty one:
  // its buffer and its list node.
  int before = Q_Memory::sm_iDeleteCount.load();
  void* data;
  unsigned int size;
  EXPECT_FALSE(in.poll(data, size));
  EXPECT_EQ(2, Q_Memory::sm_iDeleteCount.load() - before);
  before = Q_Memory::sm_iDeleteCount.load();
  EXPECT_FALSE(in.poll(data, size));
  EXPECT_EQ(0, Q_Memory::sm_iDeleteCount.load() - before);
}

TEST_F(SocketObjectTest, MessagesStayPollableAfterTheDisconnect) {
  int port = freePort();
  N_Listener listener(port);
  N_Socket in;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, in, fd));
  Bytes stream = concat({framed(pattern(5, 1)), framed(pattern(6, 2))});
  ASSERT_TRUE(raw::sendAll(fd, stream.data(), stream.size()));
  raw::closeFd(fd);
  ASSERT_TRUE(waitFor([&] { return !in.isConnected(); }));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(5, 1), got);
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(6, 2), got);
}

// ---- UDP -------------------------------------------------------------------

// A UDP socket whose peer is its own address and port talks to itself.
TEST_F(SocketObjectTest, UdpSocketTalksToItself) {
  int port = freePort();
  N_Socket udp(loopback(), port, N_Socket::SOCKET_UDP);
  EXPECT_TRUE(udp.isConnected());
  EXPECT_EQ(N_Socket::SOCKET_UDP, udp.getSocketType());
  const N_Socket* reported = nullptr;
  const int s = udp.getMaximumSendPacketSize();
  EXPECT_EQ(65507, s);

  std::vector<Bytes> sent = {Bytes{}, pattern(100, 1), pattern(static_cast<std::size_t>(s), 2), pattern(1, 3)};
  for (const Bytes& d : sent) {
    send(udp, d);
    Bytes got{7};
    ASSERT_TRUE(pollMessage(udp, got)) << d.size();
    EXPECT_TRUE(d == got) << d.size();
  }

  Bytes tooBig = pattern(static_cast<std::size_t>(s) + 1, 4);
  try {
    send(udp, tooBig);
    FAIL() << "no exception";
  } catch (N_NetException_PacketTooBig* e) {
    EXPECT_STREQ("Packet 65508 bytes exceeds 65507 byte limit when not using distributed packet mechanism",
                 e->getErrorMessage());
  }
  send(udp, pattern(5, 5));
  Bytes got;
  ASSERT_TRUE(pollMessage(udp, got));
  EXPECT_EQ(pattern(5, 5), got);
  EXPECT_FALSE(N_Socket::pollConnect(reported));
}

TEST_F(SocketObjectTest, UdpWithThePackageMechanism) {
  int port = freePort();
  N_Socket udp(loopback(), port, N_Socket::SOCKET_UDP);
  udp.enablePackage();
  for (std::size_t size : {std::size_t(0), std::size_t(10), std::size_t(70000)}) {
    Bytes m = pattern(size, static_cast<unsigned>(size));
    send(udp, m);
    Bytes got{7};
    ASSERT_TRUE(pollMessage(udp, got)) << size;
    EXPECT_TRUE(m == got) << size;
  }
}

// ---- Destroyed while the network thread works for it -----------------------

// receive() destroys its own socket at the first of three messages of one
// read: the rest of the read is dropped and nothing touches the dead socket.
class SelfDestroyingSocket : public N_Socket {
 public:
  ~SelfDestroyingSocket() { destruct(); }
  bool receive(void*, unsigned int) override {
    ++calls;
    if (deleteSelf) {
      delete this;
    } else {
      destruct();
    }
    ++finished;  // static: `this` may be gone
    return true;
  }
  static std::atomic<int> calls;
  static std::atomic<int> finished;
  bool deleteSelf = false;
};
std::atomic<int> SelfDestroyingSocket::calls{0};
std::atomic<int> SelfDestroyingSocket::finished{0};

TEST_F(SocketObjectTest, ReceiveMayDestroyItsOwnSocket) {
  for (bool deleteSelf : {false, true}) {
    SelfDestroyingSocket::calls = 0;
    SelfDestroyingSocket::finished = 0;
    int port = freePort();
    N_Listener listener(port);
    auto* in = new SelfDestroyingSocket;
    in->deleteSelf = deleteSelf;
    int fd = -1;
    ASSERT_TRUE(acceptRaw(listener, port, *in, fd));
    Bytes stream = concat({framed(pattern(5, 1)), framed(pattern(6, 2)), framed(pattern(7, 3))});
    ASSERT_TRUE(raw::sendAll(fd, stream.data(), stream.size()));
    ASSERT_TRUE(waitFor([&] { return SelfDestroyingSocket::finished.load() >= 1; }));
    platform::Sleep(50);
    EXPECT_EQ(1, SelfDestroyingSocket::calls.load());
    EXPECT_EQ(0, registeredSockets());
    if (!deleteSelf) delete in;
    raw::closeFd(fd);
  }
}

// destruct() on another thread waits for a receive() call in progress.
class SlowSocket : public N_Socket {
 public:
  ~SlowSocket() { destruct(); }
  bool receive(void*, unsigned int) override {
    entered = true;
    platform::Sleep(200);
    left = true;
    return true;
  }
  std::atomic<bool> entered{false};
  std::atomic<bool> left{false};
};

TEST_F(SocketObjectTest, DestructWaitsForAReceiveInProgress) {
  int port = freePort();
  N_Listener listener(port);
  SlowSocket in;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, in, fd));
  Bytes stream = concat({framed(pattern(5, 1)), framed(pattern(6, 2))});
  ASSERT_TRUE(raw::sendAll(fd, stream.data(), stream.size()));
  ASSERT_TRUE(waitFor([&] { return in.entered.load(); }));
  in.destruct();
  EXPECT_TRUE(in.left.load());
  EXPECT_EQ(0, registeredSockets());
  raw::closeFd(fd);
}

// A receive() that reads through poll() and then declines the message: the
// message it was handed stays valid for its poll and is freed exactly once.
class PollingSocket : public N_Socket {
 public:
  ~PollingSocket() { destruct(); }
  bool receive(void* data, unsigned int size) override {
    void* polled;
    unsigned int polledSize;
    while (poll(polled, polledSize)) {
      if (polled == data && polledSize == size) sawOwn = true;
      ++polls;
    }
    return false;
  }
  std::atomic<bool> sawOwn{false};
  std::atomic<int> polls{0};
};

TEST_F(SocketObjectTest, ReceiveMayPollAndDecline) {
  int port = freePort();
  N_Listener listener(port);
  PollingSocket in;
  N_Socket out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  for (unsigned i = 0; i < 20; ++i) send(out, pattern(i * 10, i));
  ASSERT_TRUE(waitFor([&] { return in.polls.load() == 20; })) << in.polls.load();
  EXPECT_TRUE(in.sawOwn.load());
}

// Sends that are still queued, and reads still under way, when their socket
// goes: the network side frees them, once, and nothing reaches the wire.
TEST_F(SocketObjectTest, DestroyedSocketLeavesOrphansThatTheNetworkSideFrees) {
  int refused = freePort();
  N_Socket probe;
  {
    N_Socket never(loopback(), refused, N_Socket::SOCKET_TCP);
    for (int i = 0; i < 10; ++i) send(never, pattern(1000, static_cast<unsigned>(i)));
    EXPECT_EQ(10 * 1004, probe.getBytesWaitingForSend());
  }
  EXPECT_TRUE(waitFor([&] { return probe.getBytesWaitingForSend() == 0; }));

  // Reads under way: a writer keeps the socket busy while it goes.
  int port = freePort();
  N_Listener listener(port);
  for (int round = 0; round < 10; ++round) {
    N_Socket in;
    int fd = -1;
    ASSERT_TRUE(acceptRaw(listener, port, in, fd));
    Bytes chunk = framed(pattern(50000, static_cast<unsigned>(round)));
    std::atomic<bool> stop{false};
    std::thread writer([&] {
      while (!stop.load() && raw::sendAll(fd, chunk.data(), chunk.size())) {
      }
    });
    platform::Sleep(static_cast<platform::DWORD>(5 + round * 3));
    in.destruct();  // resets the connection: the writer's next send fails
    stop = true;
    writer.join();
    raw::reset(fd);
  }
}

// A send whose WSASend is still out when the socket goes: the peer doesn't
// read, the kernel's buffers fill up, and the closesocket aborts what is
// left. Each aborted entry is told by its completion and freed once.
TEST_F(SocketObjectTest, DestroyedSocketWithSendsInFlight) {
  VerboseCapture verbose;
  N_Socket probe;
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));
  Bytes chunk = pattern(60000, 1);
  for (int i = 0; i < 600; ++i) send(out, chunk);  // 36 MB, more than loopback buffers hold
  // Wait until the queue stops draining: the kernel took what it can.
  int last = -1;
  ASSERT_TRUE(waitFor(
      [&] {
        int now = probe.getBytesWaitingForSend();
        bool still = now == last;
        last = now;
        platform::Sleep(100);
        return still;
      },
      20000));
  ASSERT_GT(probe.getBytesWaitingForSend(), 0);
  out.destruct();
  EXPECT_TRUE(waitFor([&] { return probe.getBytesWaitingForSend() == 0; }, 10000))
      << probe.getBytesWaitingForSend();
  bool aborted = false;
  for (const std::string& line : VerboseCapture::lines())
    if (line.rfind("sendComplete: dwError = WSA_OPERATION_ABORTED (995),\n              lpOverlapped->hEvent = 0x", 0) == 0)
      aborted = true;
  EXPECT_TRUE(aborted) << "no aborted send was reported";
  raw::closeFd(fd);
}

TEST_F(SocketObjectTest, ErrorNames) {
  EXPECT_STREQ("WSAEWOULDBLOCK", N_SocketTestAccess::errorName(10035));
  EXPECT_STREQ("WSA_IO_PENDING", N_SocketTestAccess::errorName(997));
  EXPECT_STREQ("WSA_INVALID_HANDLE", N_SocketTestAccess::errorName(6));
  EXPECT_STREQ("WSANO_DATA", N_SocketTestAccess::errorName(11004));
  EXPECT_STREQ("WSAEDISCON", N_SocketTestAccess::errorName(10101));
  for (int unknown : {0, 1, 10009, 10059, 10068, 11005, -1})
    EXPECT_STREQ("Undetermined error", N_SocketTestAccess::errorName(unknown)) << unknown;
}

}  // namespace
