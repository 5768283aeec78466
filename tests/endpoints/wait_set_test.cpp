// The network thread waits on at most 64 events: its release event, then
// sockets oldest first, then listeners. What doesn't fit is not served until
// others go away; its sends still leave. Observed through behaviour: a
// listener outside the set accepts nothing, a socket outside it reads
// nothing.
#include <vector>

#include "limits_guard.h"
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class WaitSetTest : public TransportTest {};

class CountingListener : public N_Listener {
 public:
  explicit CountingListener(int port) : N_Listener(port) {}
  ~CountingListener() { destruct(); }
  void receiveConnect(N_Socket::ConnectData*) override { ++calls; }
  std::atomic<int> calls{0};
};

TEST_F(WaitSetTest, SocketsComeFirstAndWhatDoesNotFitWaits) {
  std::vector<std::unique_ptr<N_Socket>> sockets;
  auto addSocket = [&] {
    auto s = std::make_unique<N_Socket>();
    s->construct(loopback(), freePort(), N_Socket::SOCKET_UDP);
    sockets.push_back(std::move(s));
  };
  for (int i = 0; i < 61; ++i) addSocket();
  int portA = freePort(), portB = freePort();
  CountingListener first(portA), second(portB);
  std::vector<int> peers;
  auto knock = [&](int port) { peers.push_back(raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port))); };

  // 1 + 61 + 2 = 64: everything is served.
  knock(portA);
  knock(portB);
  EXPECT_TRUE(waitFor([&] { return first.calls.load() == 1 && second.calls.load() == 1; }));

  // A 62nd socket pushes the younger listener out.
  addSocket();
  knock(portB);
  knock(portA);
  EXPECT_TRUE(waitFor([&] { return first.calls.load() == 2; }));
  EXPECT_TRUE(staysFalse([&] { return second.calls.load() > 1; }, 300));

  // A 63rd pushes out the other one as well.
  addSocket();
  knock(portA);
  EXPECT_TRUE(staysFalse([&] { return first.calls.load() > 2; }, 300));

  // A 64th socket is out too: its datagram to itself leaves (the send pump
  // doesn't care about the wait set) but isn't read.
  addSocket();
  N_Socket& last = *sockets.back();
  send(last, pattern(12, 1));
  Bytes got;
  EXPECT_FALSE(pollMessage(last, got, 300));

  // As older sockets go, the others move in, in order.
  sockets.erase(sockets.begin());
  ASSERT_TRUE(pollMessage(last, got));
  EXPECT_EQ(pattern(12, 1), got);
  EXPECT_TRUE(staysFalse([&] { return first.calls.load() > 2; }, 200));
  sockets.erase(sockets.begin());
  EXPECT_TRUE(waitFor([&] { return first.calls.load() == 3; }));
  EXPECT_TRUE(staysFalse([&] { return second.calls.load() > 1; }, 200));
  sockets.erase(sockets.begin());
  EXPECT_TRUE(waitFor([&] { return second.calls.load() == 2; }));

  sockets.clear();
  for (int fd : peers) raw::closeFd(fd);
}

// With listeners first, no number of sockets keeps a connection out.
TEST_F(WaitSetTest, ListenersFirstAreAlwaysWaitedOn) {
  LimitsGuard open(N_Limits::openNetwork());
  std::vector<std::unique_ptr<N_Socket>> sockets;
  for (int i = 0; i < 70; ++i) {
    sockets.push_back(std::make_unique<N_Socket>());
    sockets.back()->construct(loopback(), freePort(), N_Socket::SOCKET_UDP);
  }
  int port = freePort();
  CountingListener listener(port);
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
  EXPECT_TRUE(waitFor([&] { return listener.calls.load() == 1; }));
  sockets.clear();
  raw::closeFd(fd);
}

}  // namespace
