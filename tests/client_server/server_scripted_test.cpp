// The server end against client ends played by plain sockets in this process
// (all on 127.0.0.1, paired one after the other), so that each control
// message the server sends is seen as bytes.
#include <algorithm>

#include "cs_fixture.h"
#include "fault_guard.h"
#include "free_port.h"
#include "limits_guard.h"
#include "winsock.h"
#include "raw_socket.h"

using namespace cs_test;

namespace {

using Access = N_ClientTestAccess;
using CM = ControlMessage;

class ServerScriptedTest : public ClientServerTest {
 protected:
  // A scripted client that the server has paired and handed out.
  static bool pairUp(ServerPump& pump, ScriptedClient& sc, N_Client*& out) {
    const std::size_t before = pump.announced().size();
    if (!waitFor([&] { return pump.announced().size() > before && sc.connected(); }, 5000, pump)) {
      ADD_FAILURE() << "announced " << pump.announced().size() << " (before " << before << "), data "
                    << (sc.data() != nullptr && sc.data()->isConnected()) << ", control "
                    << (sc.control() != nullptr && sc.control()->isConnected());
      return false;
    }
    out = pump.announced().back();
    return true;
  }
  // The value of the last grant among what arrives within the time.
  static std::optional<std::uint32_t> lastGrant(ScriptedClient& sc, const Pump& pump, int milliseconds = 300) {
    std::optional<std::uint32_t> grant;
    for (const Received& r : sc.drain(milliseconds, pump))
      if (r.type == CM::CONTROL_BANDWIDTH_GRANT && r.size == 8) grant = r.value;
    return grant;
  }
};

TEST_F(ServerScriptedTest, AClientIsHandedOutOnceAndOnlyAfterPairing) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port(), true, false);
  ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 1; }, 5000, pump));
  pumpFor(200, pump);
  EXPECT_TRUE(pump.announced().empty());
  EXPECT_FALSE(N_ServerTestAccess::clients(server)[0]->isConnected());

  a.openControl();
  ASSERT_TRUE(waitFor([&] { return pump.announced().size() == 1; }, 5000, pump));
  pumpFor(200, pump);
  ASSERT_EQ(1u, pump.announced().size());
  N_Client* client = pump.announced()[0];
  EXPECT_TRUE(client->isConnected());
  EXPECT_EQ(loopback()->getIdentifier(), client->getAddress()->getIdentifier());
  EXPECT_EQ(0, N_ServerTestAccess::pendingControlCount(server));
}

TEST_F(ServerScriptedTest, AControlConnectionWaitsForItsClient) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port(), false, true);
  ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::pendingControlCount(server) == 1; }, 5000, pump));
  pumpFor(200, pump);
  EXPECT_TRUE(pump.announced().empty());
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
  a.openData();
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  EXPECT_EQ(0, N_ServerTestAccess::pendingControlCount(server));
}

TEST_F(ServerScriptedTest, OpeningMessagesAreAnsweredInOrder) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client->getBandwidth());

  const float before = server.getWorldTimer().getAge();
  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 5000);
  a.send(CM::CONTROL_WORLD_TIME_REQUEST);
  a.send(CM::CONTROL_HEARTBEAT);
  auto grant = a.next(2000, pump);
  auto time = a.next(2000, pump);
  auto reply = a.next(2000, pump);
  const float after = server.getWorldTimer().getAge();
  ASSERT_TRUE(grant && time && reply);
  EXPECT_EQ(CM::CONTROL_BANDWIDTH_GRANT, grant->type);
  EXPECT_EQ(8u, grant->size);
  EXPECT_EQ(5000u, grant->value);
  EXPECT_EQ(CM::CONTROL_WORLD_TIME, time->type);
  EXPECT_EQ(8u, time->size);
  const float world = ControlMessage{time->type, time->value}.floatValue();
  EXPECT_GE(world, before);
  EXPECT_LE(world, after);
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, reply->type);
  EXPECT_EQ(4u, reply->size);
  EXPECT_EQ(5000u, client->getBandwidth());
  EXPECT_EQ(5000u, Access::requestedBandwidth(*client));
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(*client));
  EXPECT_TRUE(a.drain(200, pump).empty());
}

TEST_F(ServerScriptedTest, EchoIsAnsweredAndOtherTypesAreDropped) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));

  a.sendRaw(controlBytes(0, 1));
  a.sendRaw(controlBytes(9, 2, 8));
  a.send(CM::CONTROL_BANDWIDTH_GRANT, 99);
  a.send(CM::CONTROL_ECHO_REPLY);
  a.send(CM::CONTROL_WORLD_TIME, CM::floatBits(3.0f));
  a.sendRaw(controlBytes(CM::CONTROL_BANDWIDTH_REQUEST, 77, 4));  // too short
  a.sendRaw(controlBytes(CM::CONTROL_BANDWIDTH_REQUEST, 78, 7));  // too short
  a.sendRaw(controlBytes(CM::CONTROL_ECHO, 0, 3));                // too short
  a.send(CM::CONTROL_ECHO);
  auto echo = a.next(2000, pump);
  ASSERT_TRUE(echo);
  EXPECT_EQ(CM::CONTROL_ECHO_REPLY, echo->type);
  EXPECT_EQ(4u, echo->size);
  EXPECT_TRUE(a.drain(200, pump).empty());
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, Access::requestedBandwidth(*client));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client->getBandwidth());

  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 7);
  EXPECT_EQ(7u, lastGrant(a, pump));
}

TEST_F(ServerScriptedTest, LatencyIsMeasuredOnTheServerEnd) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  EXPECT_EQ(0.0f, client->getLatency());

  // Our heartbeat first; the server answers and rests for its frequency.
  a.send(CM::CONTROL_HEARTBEAT);
  auto reply = a.next(2000, pump);
  ASSERT_TRUE(reply);
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, reply->type);
  // Then its own heartbeat, which we answer late.
  auto heartbeat = a.next(2000, pump);
  ASSERT_TRUE(heartbeat);
  EXPECT_EQ(CM::CONTROL_HEARTBEAT, heartbeat->type);
  EXPECT_GE(heartbeat->at - reply->at, 0.2);
  EXPECT_EQ(0.0f, client->getLatency());
  pumpFor(60, pump);
  a.send(CM::CONTROL_HEARTBEAT_REPLY);
  ASSERT_TRUE(waitFor([&] { return client->getLatency() > 0.0f; }, 2000, pump));
  EXPECT_GE(client->getLatency(), 0.06f);
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(*client));
  EXPECT_TRUE(client->isConnected());
}

TEST_F(ServerScriptedTest, ASilentClientIsDroppedAndStaysListed) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  // Waiting for the peer: latency + frequency = 0.4 s.
  Clock::time_point start = Clock::now();
  ASSERT_TRUE(waitFor([&] { return !client->isConnected(); }, 3000, pump));
  EXPECT_GE(secondsSince(start), 0.4);
  EXPECT_TRUE(waitFor([&] { return !a.data()->isConnected() && !a.control()->isConnected(); }, 3000));
  pumpFor(100, pump);
  EXPECT_EQ(1, N_ServerTestAccess::clientCount(server));
  server.disconnectClient(client);
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
}

class ServerHeartbeatLimitTest : public ServerScriptedTest {
 protected:
  void SetUp() override {
    ServerScriptedTest::SetUp();
    N_Client::setHeartbeatFrequency(1.0f);
    N_Client::setHeartbeatLatency(1.0f);
  }
};

TEST_F(ServerHeartbeatLimitTest, AwaitPeerFromPairing) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(*client));
  Access::setHeartbeatAge(*client, 1.9f);
  server.update();
  EXPECT_TRUE(client->isConnected());
  Access::setHeartbeatAge(*client, 2.05f);
  server.update();
  EXPECT_FALSE(client->isConnected());
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(*client));
}

TEST_F(ServerHeartbeatLimitTest, IdleSendAndAwaitReply) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  a.send(CM::CONTROL_HEARTBEAT);
  ASSERT_TRUE(a.next(2000, pump));
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(*client));
  Access::setIdleAge(*client, 0.9f);
  server.update();
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(*client));
  Access::setIdleAge(*client, 1.05f);
  server.update();
  EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(*client));
  server.update();
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_REPLY, Access::state(*client));
  auto heartbeat = a.next(2000, {});
  ASSERT_TRUE(heartbeat);
  EXPECT_EQ(CM::CONTROL_HEARTBEAT, heartbeat->type);
  Access::setHeartbeatAge(*client, 0.9f);
  server.update();
  EXPECT_TRUE(client->isConnected());
  Access::setHeartbeatAge(*client, 1.05f);
  server.update();
  EXPECT_FALSE(client->isConnected());
  // A disconnected client reads nothing more.
  a.send(CM::CONTROL_ECHO);
  EXPECT_TRUE(a.drain(200, pump).empty());
}

TEST_F(ServerScriptedTest, GrantsOverTheWireTieToEven) {
  N_Client::setHeartbeatFrequency(0.0f);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* ca = nullptr;
  ASSERT_TRUE(pairUp(pump, a, ca));
  // One client asking for the default gets the cap.
  a.send(CM::CONTROL_BANDWIDTH_REQUEST, N_Client::DEFAULT_BANDWIDTH);
  EXPECT_EQ(10240u, lastGrant(a, pump));
  ScriptedClient b(loopback(), port());
  N_Client* cb = nullptr;
  ASSERT_TRUE(pairUp(pump, b, cb));

  server.setBandwidth(5);
  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 5);
  b.send(CM::CONTROL_BANDWIDTH_REQUEST, 5);
  pumpFor(200, pump);
  EXPECT_EQ(3u, lastGrant(a, pump));
  EXPECT_EQ(3u, lastGrant(b, pump));
  EXPECT_EQ(3u, ca->getBandwidth());
  EXPECT_EQ(3u, cb->getBandwidth());

  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 3);
  b.send(CM::CONTROL_BANDWIDTH_REQUEST, 3);
  pumpFor(200, pump);
  server.setBandwidth(3);
  EXPECT_EQ(1u, lastGrant(a, pump));
  EXPECT_EQ(1u, lastGrant(b, pump));

  // A request of 0 gets a grant of 0, and the message still goes.
  server.setBandwidth(1000);
  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 0);
  EXPECT_EQ(0u, lastGrant(a, pump));
  EXPECT_EQ(3u, lastGrant(b, pump));
  // A cap of 0 makes every grant 0; lowering it re-sends at once.
  server.setMaximumBandwidthUsage(0);
  EXPECT_EQ(0u, lastGrant(a, {}));
  EXPECT_EQ(0u, lastGrant(b, {}));
  EXPECT_EQ(0u, server.getMaximumBandwidthUsage());
  EXPECT_EQ(1000u, server.getBandwidth());
}

TEST_F(ServerScriptedTest, DisconnectClientGivesTheShareBackInTheSameCall) {
  N_Client::setHeartbeatFrequency(0.0f);
  N_Server server(port());
  server.setMaximumBandwidthUsage(60000);
  server.setBandwidth(100000);
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* ca = nullptr;
  ASSERT_TRUE(pairUp(pump, a, ca));
  ScriptedClient b(loopback(), port());
  N_Client* cb = nullptr;
  ASSERT_TRUE(pairUp(pump, b, cb));
  a.send(CM::CONTROL_BANDWIDTH_REQUEST, 60000);
  b.send(CM::CONTROL_BANDWIDTH_REQUEST, 60000);
  EXPECT_EQ(50000u, lastGrant(b, pump));
  EXPECT_EQ(50000u, ca->getBandwidth());

  server.disconnectClient(ca);
  EXPECT_EQ(60000u, cb->getBandwidth());
  EXPECT_EQ(60000u, lastGrant(b, {}));
  EXPECT_TRUE(waitFor([&] { return !a.data()->isConnected() && !a.control()->isConnected(); }, 3000));

  // A pointer the server doesn't hold: nothing freed, grants sent again.
  N_Client stranger;
  server.disconnectClient(&stranger);
  EXPECT_EQ(60000u, lastGrant(b, {}));
  EXPECT_EQ(1, N_ServerTestAccess::clientCount(server));
}

TEST_F(ServerScriptedTest, AfterDestructOnlyTheDataPortStays) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));

  server.destruct();
  EXPECT_TRUE(waitFor([&] { return !a.data()->isConnected() && !a.control()->isConnected(); }, 3000));
  server.update();
  N_Client* out = nullptr;
  EXPECT_FALSE(server.pollConnect(out));
  EXPECT_EQ(nullptr, out);
  server.disconnectClient(client);  // already freed: must not be touched
  server.setBandwidth(5);
  EXPECT_EQ(-1, N_ServerTestAccess::clientCount(server));
  EXPECT_TRUE(waitFor([] { return portIsFree(ControlMessage::CONTROL_PORT); }, 3000));

  // It comes back whole. (On a port of its own: a listener constructed again
  // on the port it had accepted on may miss connections for a while.)
  const int second = pickFreePort(true);
  server.construct(second);
  ScriptedClient b(loopback(), second);
  ASSERT_TRUE(pairUp(pump, b, client));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, server.getBandwidth());
  EXPECT_EQ(10240u, server.getMaximumBandwidthUsage());

  // The data port goes on accepting until the listener itself goes.
  server.destruct();
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(second));
  EXPECT_GE(fd, 0);
  raw::closeFd(fd);
}

TEST_F(ServerScriptedTest, AFailedAcceptLeavesNoEntryAndIsRetried) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port(), true, false);
  N_Listener& listener = server;
  N_Socket::ConnectData* waiting = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(waiting); }, 5000));
  int refused = 0;
  // The list entry, the client object, its reliable socket: each refused
  // in turn, and the connection stays queued for the next update.
  for (int nth = 1; nth <= 3; ++nth) {
    FaultGuard faults;
    faults.failAllocation(nth);
    EXPECT_THROW(server.update(), Q_MemoryException_Allocation*) << nth;
    refused += platform::fault::allocationsFailed();
    EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
  }
  countRefusedAllocations(refused);
  a.openControl();
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  EXPECT_EQ(1, N_ServerTestAccess::clientCount(server));
}

// The server under N_Limits. Heartbeats are off: the scripted ends don't
// answer them.
class ServerLimitsTest : public ServerScriptedTest {
 protected:
  void SetUp() override {
    ServerScriptedTest::SetUp();
    N_Client::setHeartbeatFrequency(0.0f);
  }
  static N_Limits limits() { return N_Limits::openNetwork(); }
  static unsigned count(const std::vector<Received>& got, std::uint32_t type) {
    return static_cast<unsigned>(std::count_if(got.begin(), got.end(), [&](const Received& r) { return r.type == type; }));
  }
};

TEST_F(ServerLimitsTest, UnpairedConnectionsAreBoundedAndReleased) {
  for (bool perAddress : {true, false}) {
    SCOPED_TRACE(perAddress ? "per address" : "in all");
    N_Limits l = limits();
    l.fPairingTimeout = 600.0f;
    l.uMaximumUnpaired = perAddress ? 10 : 2;
    l.uMaximumUnpairedPerAddress = perAddress ? 2 : 0;
    auto bounded = std::make_unique<LimitsGuard>(l);
    N_Server server(port());
    ServerPump pump{server};
    // Pairing goes by address, so all three here are data connections.
    ScriptedClient a(loopback(), port(), true, false);
    ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 1; }, 5000, pump));
    ScriptedClient b(loopback(), port(), true, false);
    ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 2; }, 5000, pump));
    // The third is closed on arrival (its connect and the close may come in
    // one pass of its end, so the close is what is waited for).
    ScriptedClient c(loopback(), port(), true, false);
    EXPECT_TRUE(waitFor(
        [&] {
          const N_Socket* closed = nullptr;
          bool found = false;
          while (N_Socket::pollDisconnect(closed)) found |= closed == c.data();
          return found;
        },
        5000, pump));
    EXPECT_EQ(2, N_ServerTestAccess::clientCount(server));
    // With a short time limit the two others go, and so does a control
    // connection without a client.
    bounded.reset();
    l.fPairingTimeout = 0.2f;
    LimitsGuard brief(l);
    EXPECT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 0; }, 5000, pump));
    EXPECT_TRUE(waitFor([&] { return !a.data()->isConnected() && !b.data()->isConnected(); }, 5000, pump));
    ScriptedClient e(loopback(), port(), false, true);
    ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::pendingControlCount(server) == 1; }, 5000, pump));
    EXPECT_TRUE(waitFor([&] { return N_ServerTestAccess::pendingControlCount(server) == 0; }, 5000, pump));
    EXPECT_TRUE(waitFor([&] { return !e.control()->isConnected(); }, 5000, pump));
  }
  // One whose peer closed goes at once, long before its time limit.
  N_Limits l = limits();
  l.fPairingTimeout = 600.0f;
  LimitsGuard guard(l);
  N_Server server(port());
  ServerPump pump{server};
  auto f = std::make_unique<ScriptedClient>(loopback(), port(), true, false);
  ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 1; }, 5000, pump));
  f.reset();
  EXPECT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 0; }, 5000, pump));
}

// All places taken by other addresses: a newcomer takes the oldest one's
// place, and its control connection, which pairs at once, takes none.
TEST_F(ServerLimitsTest, ANewcomerTakesTheOldestWaitingPlace) {
  N_Limits l = limits();
  l.fPairingTimeout = 600.0f;
  l.uMaximumUnpaired = 2;
  l.uMaximumUnpairedPerAddress = 0;
  LimitsGuard guard(l);
  N_Server server(port());
  ServerPump pump{server};
  const int oldest = raw::connectFrom("127.0.0.5", "127.0.0.1", static_cast<std::uint16_t>(port()));
  ASSERT_GE(oldest, 0);
  ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 1; }, 5000, pump));
  const int younger = raw::connectFrom("127.0.0.6", "127.0.0.1", static_cast<std::uint16_t>(port()));
  ASSERT_GE(younger, 0);
  ASSERT_TRUE(waitFor([&] { return N_ServerTestAccess::clientCount(server) == 2; }, 5000, pump));
  ScriptedClient newcomer(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, newcomer, client));
  EXPECT_TRUE(raw::closedByPeer(oldest, 5000));
  EXPECT_FALSE(raw::closedByPeer(younger, 200));
  EXPECT_EQ(2, N_ServerTestAccess::clientCount(server));
  raw::closeFd(oldest);
  raw::closeFd(younger);
}

// A budget of control messages per client and update, and the requests of
// one update divided once, with grants only where they changed or were
// asked for.
TEST_F(ServerLimitsTest, ControlWorkIsBudgetedAndRequestsCollected) {
  LimitsGuard guard(limits());
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port()), b(loopback(), port(), false, false);
  N_Client* ca = nullptr;
  N_Client* cb = nullptr;
  ASSERT_TRUE(pairUp(pump, a, ca));
  b.openData();
  b.openControl();
  ASSERT_TRUE(pairUp(pump, b, cb));
  // Both grants settle first.
  b.send(CM::CONTROL_BANDWIDTH_REQUEST, 10240);
  EXPECT_EQ(10240u, lastGrant(b, pump));
  a.drain(200, pump);
  const Pump none;
  for (int i = 0; i < 100; ++i) a.send(CM::CONTROL_ECHO);
  for (std::uint32_t rate = 5000; rate < 5005; ++rate) a.send(CM::CONTROL_BANDWIDTH_REQUEST, rate);
  N_Socket* control = Access::controlSocket(*ca);
  ASSERT_TRUE(waitFor([&] { return control->getQueuedReceiveBytes() == 100 * 4 + 5 * 8; }, 5000));
  server.update();
  // The budget left the rest, the requests included, for the next update.
  EXPECT_EQ(36u * 4 + 5 * 8, control->getQueuedReceiveBytes());
  ASSERT_TRUE(waitFor([&] { return a.control()->getQueuedReceiveBytes() == 64 * 4; }, 5000));
  std::vector<Received> got = a.drain(100, none);
  EXPECT_EQ(64u, count(got, CM::CONTROL_ECHO_REPLY));
  server.update();
  EXPECT_EQ(0u, control->getQueuedReceiveBytes());
  ASSERT_TRUE(waitFor([&] { return a.control()->getQueuedReceiveBytes() == 36 * 4 + 8; }, 5000));
  got = a.drain(100, none);
  EXPECT_EQ(36u, count(got, CM::CONTROL_ECHO_REPLY));
  ASSERT_EQ(1u, count(got, CM::CONTROL_BANDWIDTH_GRANT));
  EXPECT_EQ(5004u, got.back().value);
  EXPECT_EQ(5004u, ca->getBandwidth());
  EXPECT_TRUE(b.drain(200, pump).empty()) << "b's grant didn't change";
}

TEST_F(ServerLimitsTest, AClientThatDoesNotReadIsDisconnected) {
  N_Limits l = limits();
  l.uReceiveBacklog = 64 << 10;  // the scripted end in this process stops reading
  l.fSendBacklogSeconds = 0.5f;
  LimitsGuard guard(l);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
  std::vector<unsigned char> block(64 << 10, 7);
  N_Socket* out = Access::tcpSocket(*client);
  // Far more than half a second of 1250000 bytes per second plus what the
  // system buffers hold.
  for (int i = 0; i < 64; ++i) out->send(block.data(), static_cast<unsigned>(block.size()));
  EXPECT_TRUE(waitFor([&] { return !client->isConnected(); }, 5000, pump));
  const N_Socket* reported = nullptr;
  bool tcpReported = false;
  while (N_Socket::pollDisconnect(reported)) tcpReported |= reported == out;
  EXPECT_TRUE(tcpReported);
}

// An accept that failed for lack of descriptors never becomes a client and
// costs no update an exception, by default too; the connection is taken
// once accepts work again.
TEST_F(ServerLimitsTest, AFailedAcceptNeverBecomesAClient) {
  N_Server server(port());
  ServerPump pump{server};
  FaultGuard faults(platform::fault::Call::WSAAccept, {1, true, platform::WSAEMFILE});
  ScriptedClient a(loopback(), port(), true, false);
  EXPECT_NO_THROW(pumpFor(600, pump));
  EXPECT_GE(platform::fault::fired(platform::fault::Call::WSAAccept), 1);
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
  platform::fault::disarm(platform::fault::Call::WSAAccept);
  a.openControl();
  N_Client* client = nullptr;
  ASSERT_TRUE(pairUp(pump, a, client));
}

// With failures contained a connection that can't be made into a client is
// refused, and the update goes on.
TEST_F(ServerLimitsTest, AClientThatCantBeMadeIsRefused) {
  LimitsGuard guard(limits());
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port(), true, false);
  N_Listener& listener = server;
  N_Socket::ConnectData* waiting = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(waiting); }, 5000));
  int refused = 0;
  for (int nth = 1; nth <= 3; ++nth) {
    ScriptedClient b(loopback(), port(), true, false);
    ASSERT_TRUE(waitFor([&] { return b.data()->isConnected(); }, 5000));
    FaultGuard faults;
    faults.failAllocation(nth);
    EXPECT_NO_THROW(server.update()) << nth;
    refused += platform::fault::allocationsFailed();
  }
  countRefusedAllocations(refused);
  EXPECT_TRUE(waitFor([&] { return !a.data()->isConnected(); }, 5000, pump));
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
}

TEST_F(ServerLimitsTest, DisconnectClientNeverThrows) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port()), b(loopback(), port(), false, false);
  N_Client* ca = nullptr;
  N_Client* cb = nullptr;
  ASSERT_TRUE(pairUp(pump, a, ca));
  b.openData();
  b.openControl();
  ASSERT_TRUE(pairUp(pump, b, cb));
  a.drain(200, pump);
  b.drain(200, pump);
  {
    FaultGuard faults;
    faults.failAllocation(1, true);
    EXPECT_NO_THROW(server.disconnectClient(ca));
    countRefusedAllocations(platform::fault::allocationsFailed());
  }
  pump.forget(ca);
  EXPECT_EQ(1, N_ServerTestAccess::clientCount(server));
  // The grant that couldn't go then goes with the next update.
  EXPECT_EQ(10240u, lastGrant(b, pump));
}

}  // namespace
