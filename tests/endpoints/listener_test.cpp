// The listener: the connect queue as pollConnect shows it, its port, and the
// accept step of the network thread with its failures.
#include "raw_peer.h"
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class ListenerTest : public TransportTest {};

class CountingListener : public N_Listener {
 public:
  explicit CountingListener(int port) : N_Listener(port) {}
  ~CountingListener() { destruct(); }
  void receiveConnect(N_Socket::ConnectData* data) override {
    // The entry is queued by now: pollConnect finds it from here.
    N_Socket::ConnectData* polled = nullptr;
    if (pollConnect(polled) && polled != nullptr) queuedBeforeCall = true;
    last = data;
    ++calls;
  }
  std::atomic<int> calls{0};
  std::atomic<N_Socket::ConnectData*> last{nullptr};
  std::atomic<bool> queuedBeforeCall{false};
};

TEST_F(ListenerTest, PollConnectGivesTheSameEntryUntilItIsConsumed) {
  int port = freePort();
  N_Listener listener(port);
  auto* untouched = reinterpret_cast<N_Socket::ConnectData*>(0x1234);
  N_Socket::ConnectData* out = untouched;
  EXPECT_FALSE(listener.pollConnect(out));
  EXPECT_EQ(untouched, out);

  int first = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  int second = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(out) && out != untouched; }));
  N_Socket::ConnectData* again = nullptr;
  ASSERT_TRUE(listener.pollConnect(again));
  EXPECT_EQ(out, again);
  EXPECT_EQ(&listener, out->pListener);
  EXPECT_EQ(raw_peer::localPort(first), platform::ntohs(out->address.sin_port));

  N_Socket a(out);
  // First come, first served: the second connection is next.
  N_Socket::ConnectData* next = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(next); }));
  EXPECT_EQ(raw_peer::localPort(second), platform::ntohs(next->address.sin_port));
  N_Socket b(next);
  EXPECT_FALSE(listener.pollConnect(next));
  EXPECT_EQ(raw_peer::localPort(first), a.getPort());
  EXPECT_EQ(raw_peer::localPort(second), b.getPort());
  raw::closeFd(first);
  raw::closeFd(second);
}

TEST_F(ListenerTest, TwoListenersEachGetTheirOwnInOrderOfArrival) {
  int portA = freePort(), portB = freePort();
  N_Listener a(portA), b(portB);
  int toB1 = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(portB));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return b.pollConnect(entry); }));
  int toA = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(portA));
  int toB2 = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(portB));
  ASSERT_TRUE(waitFor([&] { return a.pollConnect(entry); }));
  EXPECT_EQ(raw_peer::localPort(toA), platform::ntohs(entry->address.sin_port));
  N_Socket sa(entry);
  ASSERT_TRUE(b.pollConnect(entry));
  EXPECT_EQ(raw_peer::localPort(toB1), platform::ntohs(entry->address.sin_port));
  N_Socket sb1(entry);
  ASSERT_TRUE(waitFor([&] { return b.pollConnect(entry); }));
  EXPECT_EQ(raw_peer::localPort(toB2), platform::ntohs(entry->address.sin_port));
  N_Socket sb2(entry);
  EXPECT_FALSE(a.pollConnect(entry));
  EXPECT_FALSE(b.pollConnect(entry));
  for (int fd : {toA, toB1, toB2}) raw::closeFd(fd);
}

TEST_F(ListenerTest, PortIsWhatTheCallerGave) {
  N_Listener any(0);
  EXPECT_EQ(0, any.getPort());
  int port = freePort();
  N_Listener fixed(port);
  EXPECT_EQ(port, fixed.getPort());
}

// A second listener on a port in use throws nothing and never gets a
// connection; the first one goes on getting them.
TEST_F(ListenerTest, SecondListenerOnABusyPortIsSilent) {
  std::uint16_t port = 0;
  int busy = raw::listenOn("127.0.0.1", port);
  ASSERT_GE(busy, 0);
  N_Listener second(port);
  int fd = raw::connectTo("127.0.0.1", port);
  ASSERT_GE(fd, 0);
  N_Socket::ConnectData* entry = nullptr;
  EXPECT_TRUE(staysFalse([&] { return second.pollConnect(entry); }, 200));
  int accepted = raw::acceptOne(busy, 1000);
  EXPECT_GE(accepted, 0);
  for (int f : {fd, accepted, busy}) raw::closeFd(f);
}

TEST_F(ListenerTest, ConstructAgainMovesToTheNewPort) {
  int oldPort = freePort(), newPort = freePort();
  N_Listener listener(oldPort);
  listener.construct(newPort);
  EXPECT_EQ(newPort, listener.getPort());
  EXPECT_TRUE(raw_peer::refusedOrClosed("127.0.0.1", static_cast<std::uint16_t>(oldPort), 200));
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(newPort));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(entry); }));
  N_Socket in(entry);
  raw::closeFd(fd);

  listener.destruct();
  EXPECT_TRUE(raw_peer::refusedOrClosed("127.0.0.1", static_cast<std::uint16_t>(newPort), 200));
}

TEST_F(ListenerTest, ReceiveConnectHearsOfEachConnectionWithItsQueuedEntry) {
  int port = freePort();
  CountingListener listener(port);
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  ASSERT_TRUE(waitFor([&] { return listener.calls.load() == 1; }));
  EXPECT_TRUE(listener.queuedBeforeCall.load());
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(listener.pollConnect(entry));
  EXPECT_EQ(listener.last.load(), entry);
  N_Socket in(entry);
  raw::closeFd(fd);
}

// An accept refused by Winsock leaves no entry; the connection still waiting
// is accepted at the next FD_ACCEPT.
TEST_F(ListenerTest, RefusedAcceptLeavesNoEntry) {
  int port = freePort();
  CountingListener listener(port);
  platform::fault::arm(platform::fault::Call::WSAAccept, {1, false, platform::WSAECONNREFUSED});
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(entry); }));
  EXPECT_EQ(1, platform::fault::fired(platform::fault::Call::WSAAccept));
  EXPECT_EQ(1, listener.calls.load());
  EXPECT_NE(platform::INVALID_SOCKET, entry->socket);
  N_Socket in(entry);
  EXPECT_FALSE(listener.pollConnect(entry));
  raw::closeFd(fd);
}

// Any other failure of the accept still makes an entry, with the failed
// handle, and the listener hears of it.
TEST_F(ListenerTest, FailedAcceptStillMakesAnEntry) {
  int port = freePort();
  CountingListener listener(port);
  platform::fault::arm(platform::fault::Call::WSAAccept, {1, false, platform::WSAENOBUFS});
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  ASSERT_TRUE(waitFor([&] { return listener.calls.load() == 2; }));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(listener.pollConnect(entry));
  EXPECT_EQ(platform::INVALID_SOCKET, entry->socket);
  {
    N_Socket dead(entry);  // consumes it; the socket never moves data
  }
  ASSERT_TRUE(listener.pollConnect(entry));
  EXPECT_NE(platform::INVALID_SOCKET, entry->socket);
  N_Socket in(entry);
  Bytes got;
  raw::sendAll(fd, framed(pattern(3, 1)).data(), 7);
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(pattern(3, 1), got);
  raw::closeFd(fd);
}

// An accept that fails for lack of descriptors doesn't spin on the waiting
// connection: the listener rests between tries and takes the connection once
// accepts work again. An entry can be refused, which closes its connection.
TEST_F(ListenerTest, FailedAcceptsRestAndEntriesCanBeRefused) {
  int port = freePort();
  CountingListener listener(port);
  platform::fault::arm(platform::fault::Call::WSAAccept, {1, true, platform::WSAEMFILE});
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  platform::Sleep(1000);
  platform::fault::disarm(platform::fault::Call::WSAAccept);
  // One try per rest of a quarter second, however loaded the machine.
  int tries = listener.calls.load();
  EXPECT_GE(tries, 1);
  EXPECT_LE(tries, 7);
  N_Socket::ConnectData* entry = nullptr;
  auto nextValid = [&] {
    while (listener.pollConnect(entry)) {
      if (entry->socket != platform::INVALID_SOCKET) return true;
      EXPECT_TRUE(listener.rejectConnect(entry));
    }
    return false;
  };
  ASSERT_TRUE(waitFor(nextValid));
  N_Listener other(freePort());
  EXPECT_FALSE(other.rejectConnect(entry));
  EXPECT_TRUE(listener.rejectConnect(entry));
  EXPECT_FALSE(listener.pollConnect(entry));
  EXPECT_TRUE(raw::closedByPeer(fd, 5000));
  raw::closeFd(fd);
}

// Memory for the registry entry runs out: nothing of the attempt stays, the
// port isn't open, and the same port can be opened later.
TEST_F(ListenerTest, RegistryEntryThatCantBeMadeLeavesNothing) {
  int port = freePort();
  failAllocation(1);
  try {
    N_Listener listener(port);
    FAIL() << "no exception";
  } catch (Q_MemoryException_Allocation* e) {
    EXPECT_STREQ("Out of system memory resources", e->getErrorMessage());
  }
  EXPECT_TRUE(raw_peer::refusedOrClosed("127.0.0.1", static_cast<std::uint16_t>(port), 200));
  N_Listener listener(port);
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(entry); }));
  N_Socket in(entry);
  raw::closeFd(fd);
}

// A connection that can't be queued is refused: the peer sees it closed,
// and the next one is accepted as usual.
TEST_F(ListenerTest, ConnectionThatCantBeQueuedIsClosed) {
  int port = freePort();
  CountingListener listener(port);
  platform::Sleep(50);
  failAllocation(1);
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  ASSERT_GE(fd, 0);
  EXPECT_TRUE(raw_peer::closedByPeer(fd, 2000));
  EXPECT_EQ(1, platform::fault::allocationsFailed());
  EXPECT_EQ(0, listener.calls.load());
  raw::closeFd(fd);
  fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(entry); }));
  N_Socket in(entry);
  raw::closeFd(fd);
}

// A listener destroyed with connections nobody took: they stay queued (and
// go with the runtime), and no later listener on the same port sees them.
TEST_F(ListenerTest, DestroyedListenerLeavesItsEntriesBehind) {
  int port = freePort();
  auto listener = std::make_unique<N_Listener>(port);
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener->pollConnect(entry); }));
  listener.reset();
  N_Listener again(port);
  EXPECT_TRUE(staysFalse([&] { return again.pollConnect(entry); }, 100));
  raw::closeFd(fd);
}

}  // namespace
