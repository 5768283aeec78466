// The server end against client ends played by plain sockets in this process
// (all on 127.0.0.1, paired one after the other), so that each control
// message the server sends is seen as bytes.
#include <algorithm>

#include "cs_fixture.h"
#include "raw_socket.h"
#include "win32.h"
#include "winsock.h"

using namespace cs_test;

namespace {

class ServerScriptedTest : public ClientServerTest {
 protected:
  static bool closed(ScriptedClient& c, const Pump& pump = {}) {
    return waitFor([&] { return c.closed(); }, 3000, pump);
  }
};

// The heartbeat machine and its limits are the client end's, which
// update() steps from the pairing on; here: the control messages are answered
// in order and the rest dropped, the server sends its own heartbeat, and
// latency is measured.
TEST_F(ServerScriptedTest, ControlMessagesAndHeartbeatsFromPairingOn) {
  heartbeat(1.0f, 1.0f);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient b(loopback(), port());
  N_Client* cb = pairUp(pump, b);
  ASSERT_NE(nullptr, cb);
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(*cb));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, cb->getBandwidth());
  // Not the server's, or too short: nothing comes back for these.
  for (const Bytes& bytes : {controlBytes(0, 1), controlBytes(9, 2, 8), controlBytes(CM::CONTROL_BANDWIDTH_GRANT, 99),
                             controlBytes(CM::CONTROL_ECHO_REPLY), controlBytes(CM::CONTROL_WORLD_TIME, CM::floatBits(3)),
                             controlBytes(CM::CONTROL_BANDWIDTH_REQUEST, 77, 4),
                             controlBytes(CM::CONTROL_BANDWIDTH_REQUEST, 78, 7), controlBytes(CM::CONTROL_ECHO, 0, 3)})
    b.sendRaw(bytes);
  // Our heartbeat among them; the server answers, rests for its frequency,
  // then sends its own, which we answer late.
  const float before = server.getWorldTimer().getAge();
  const Clock::time_point sent = Clock::now();  // before the server's rest starts
  for (auto [type, value] : {std::pair{CM::CONTROL_BANDWIDTH_REQUEST, 5000u}, {CM::CONTROL_WORLD_TIME_REQUEST, 0u},
                             {CM::CONTROL_HEARTBEAT, 0u}, {CM::CONTROL_ECHO, 0u}})
    b.send(type, value);
  std::vector<Received> got;
  for (auto [type, size] : {std::pair{CM::CONTROL_BANDWIDTH_GRANT, 8u}, {CM::CONTROL_WORLD_TIME, 8u},
                            {CM::CONTROL_HEARTBEAT_REPLY, 4u}, {CM::CONTROL_ECHO_REPLY, 4u}}) {
    auto r = b.next(2000, pump);
    ASSERT_TRUE(r);
    EXPECT_EQ(type, r->type);
    EXPECT_EQ(size, r->size);
    got.push_back(*r);
  }
  EXPECT_EQ(5000u, got[0].value);
  const float world = ControlMessage{got[1].type, got[1].value}.floatValue();
  EXPECT_GE(world, before);
  EXPECT_LE(world, server.getWorldTimer().getAge());
  EXPECT_EQ(5000u, cb->getBandwidth());
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(*cb));
  auto beat = b.next(3000, pump);
  ASSERT_TRUE(beat);
  EXPECT_EQ(CM::CONTROL_HEARTBEAT, beat->type) << "nothing but the server's heartbeat after the answers";
  EXPECT_GE(secondsSince(sent), 0.95) << "the server rests for its frequency after answering";
  EXPECT_EQ(0.0f, cb->getLatency());
  pumpFor(60, pump);
  b.send(CM::CONTROL_HEARTBEAT_REPLY);
  ASSERT_TRUE(waitFor([&] { return cb->getLatency() > 0.0f; }, 2000, pump));
  EXPECT_GE(cb->getLatency(), 0.06f);
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(*cb));
  // A disconnected client reads nothing more, and stays listed until freed.
  cb->disconnect();
  EXPECT_TRUE(closed(b));
  b.send(CM::CONTROL_ECHO);
  EXPECT_TRUE(b.drain(200, pump).empty());
  EXPECT_EQ(1, ServerAccess::clientCount(server));
  server.disconnectClient(cb);
  EXPECT_EQ(0, ServerAccess::clientCount(server));
}

// The budget divided among the requests (each capped at the maximum), in
// proportion to the share, rounding ties to even, never below zero.
TEST_F(ServerScriptedTest, GrantsOnTheWire) {
  heartbeat(0.0f, 1.0f);
  N_Server server(port());
  ServerPump pump{server};
  std::vector<std::unique_ptr<ScriptedClient>> scripted;
  std::vector<N_Client*> clients;
  for (int i = 0; i < 3; ++i) {
    scripted.push_back(std::make_unique<ScriptedClient>(loopback(), port()));
    clients.push_back(pairUp(pump, *scripted.back()));
    ASSERT_NE(nullptr, clients.back());
  }
  struct Case {
    unsigned budget, maximum;
    std::array<unsigned, 3> requests, grants;
  };
  const Case cases[] = {
      {100000, 60000, {50000, 70000, 30000}, {35714, 42857, 21429}},
      {10000, 10240, {1250000, 1250000, 1250000}, {3333, 3333, 3333}},  // no remainder handed on
      {10000000, 40000000, {30000003, 7000001, 0}, {8108109, 1891892, 0}},  // the cut narrows to float
      {5, 10240, {5, 5, 0}, {3, 3, 0}},  // cuts of 2.5 round to 2
      {3, 10240, {3, 3, 0}, {1, 1, 0}},  // cuts of 1.5 round to 2
      {100000, 60000, {40000, 60000, 0}, {40000, 60000, 0}},  // no excess
      {100, 0, {5000, 7000, 0}, {0, 0, 0}},
      {0, 10240, {10240, 5000, 1}, {0, 0, 0}},
      {0, 40000000, {16777219, 0, 0}, {0, 0, 0}},  // a cut rounded past the share
  };
  for (const Case& k : cases) {
    SCOPED_TRACE(testing::Message() << "budget " << k.budget << ", maximum " << k.maximum);
    server.setBandwidth(k.budget);
    server.setMaximumBandwidthUsage(k.maximum);
    EXPECT_EQ(k.budget, server.getBandwidth());
    EXPECT_EQ(k.maximum, server.getMaximumBandwidthUsage());
    for (int i = 0; i < 3; ++i) scripted[i]->send(CM::CONTROL_BANDWIDTH_REQUEST, k.requests[i]);
    pumpFor(300, pump);
    for (int i = 0; i < 3; ++i) {
      EXPECT_EQ(k.grants[i], scripted[i]->lastGrant(pump, 50)) << i;
      EXPECT_EQ(k.grants[i], clients[i]->getBandwidth()) << i;
    }
  }
  // Lowering the cap sends the new grants at once.
  server.setMaximumBandwidthUsage(2);
  for (auto& s : scripted) EXPECT_EQ(0u, s->lastGrant({}));

  // disconnectClient gives the share back and sends the new grants in the same call.
  server.setMaximumBandwidthUsage(60000);
  server.setBandwidth(120000);
  for (auto& s : scripted) s->send(CM::CONTROL_BANDWIDTH_REQUEST, 60000);
  EXPECT_EQ(40000u, scripted[2]->lastGrant(pump));
  server.disconnectClient(clients[0]);
  EXPECT_EQ(60000u, clients[1]->getBandwidth());
  EXPECT_EQ(60000u, scripted[1]->lastGrant({}));
  EXPECT_TRUE(closed(*scripted[0]));
  // A pointer the server doesn't hold: nothing freed, grants sent again.
  N_Client stranger;
  server.disconnectClient(&stranger);
  EXPECT_EQ(60000u, scripted[1]->lastGrant({}));
  EXPECT_EQ(2, ServerAccess::clientCount(server));
  // A refused allocation doesn't make it throw; the grant that couldn't go
  // goes with the next update.
  server.setBandwidth(100000);
  EXPECT_EQ(50000u, scripted[2]->lastGrant(pump));
  failAllocation(1, true);
  EXPECT_NO_THROW(server.disconnectClient(clients[1]));
  platform::fault::disarmAll();
  EXPECT_EQ(1, ServerAccess::clientCount(server));
  EXPECT_EQ(60000u, scripted[2]->lastGrant(pump));
}

TEST_F(ServerScriptedTest, ClientsAreHandedOutOnceAfterPairingAndGoWithDestruct) {
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient first(loopback(), port());
  ASSERT_NE(nullptr, pairUp(pump, first));
  // Control first, then data (the first client, of the same address, has its
  // control channel already); data first is how every other test pairs.
  ScriptedClient controlFirst(loopback(), port(), false);
  ASSERT_TRUE(waitFor([&] { return ServerAccess::pendingControlCount(server) == 1; }, 5000, pump));
  pumpFor(200, pump);
  EXPECT_EQ(1u, pump.announced().size());
  controlFirst.openData();
  N_Client* client = pairUp(pump, controlFirst);
  ASSERT_NE(nullptr, client);
  pumpFor(200, pump);
  EXPECT_EQ(2u, pump.announced().size());
  EXPECT_TRUE(client->isConnected());
  EXPECT_EQ(loopback()->getIdentifier(), client->getAddress()->getIdentifier());
  EXPECT_EQ(0, ServerAccess::pendingControlCount(server));
  EXPECT_EQ(2, ServerAccess::clientCount(server));
  server.destruct();
  EXPECT_TRUE(closed(first));
  EXPECT_TRUE(closed(controlFirst));
  server.update();
  N_Client* out = nullptr;
  EXPECT_FALSE(server.pollConnect(out));
  EXPECT_EQ(nullptr, out);
  server.disconnectClient(client);  // already freed: must not be touched
  server.setBandwidth(5);
  EXPECT_EQ(-1, ServerAccess::clientCount(server));
  EXPECT_TRUE(waitFor([] { return raw::portIsFree(ControlMessage::CONTROL_PORT); }, 3000));
  // It comes back whole, on a port of its own (a listener constructed again
  // on the port it had accepted on may miss connections for a while).
  const int second = freePort(true);
  server.construct(second);
  ScriptedClient b(loopback(), second);
  ASSERT_NE(nullptr, pairUp(pump, b));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, server.getBandwidth());
  EXPECT_EQ(10240u, server.getMaximumBandwidthUsage());
  // The data port goes on accepting until the listener itself goes.
  server.destruct();
  const int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(second));
  EXPECT_GE(fd, 0);
  raw::closeFd(fd);
}

// A connection that can't be made into a client leaves no entry: by default
// the update throws and the connection waits for the next one; with failures
// contained it is refused and the update goes on. Each allocation refused in
// turn until one update makes the client (the balance at the end of the test
// counts what the runtime held meanwhile).
TEST_F(ServerScriptedTest, AFailedAcceptLeavesNoEntry) {
  for (bool contained : {false, true}) {
    SCOPED_TRACE(contained ? "contained" : "default");
    std::optional<LimitsGuard> limits;
    if (contained) limits.emplace(N_Limits::openNetwork());
    N_Server server(port());
    ServerPump pump{server};
    N_Listener& listener = server;
    N_Socket::ConnectData* waiting = nullptr;
    int refused = 0;
    std::vector<int> fds;
    for (int nth = 1; nth < 50 && ServerAccess::clientCount(server) == 0; ++nth) {
      // A thrown update may have closed the connection it was making.
      if (contained || !listener.pollConnect(waiting))
        fds.push_back(raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port())));
      ASSERT_TRUE(waitFor([&] { return listener.pollConnect(waiting); })) << nth;
      failAllocation(nth);
      bool threw = false;
      try {
        server.update();
      } catch (Q_MemoryException_Allocation*) {
        threw = true;
      }
      platform::fault::disarmAll();
      EXPECT_FALSE(contained && threw) << "a contained failure threw";
      const bool made = ServerAccess::clientCount(server) == 1;
      EXPECT_FALSE(threw && made);
      refused += !made;
      // Refused: closed at once when contained, else waiting for the next update.
      EXPECT_TRUE(made || !contained || raw::closedByPeer(fds.back(), 3000));
    }
    for (int fd : fds) raw::closeFd(fd);
    EXPECT_GE(refused, 3);  // the list entry, the client object, its socket
    EXPECT_EQ(1, ServerAccess::clientCount(server));
  }
}

// The server under N_Limits. Heartbeats are off: the scripted ends don't
// answer them.
class ServerLimitsTest : public ServerScriptedTest {
 protected:
  void SetUp() override {
    ServerScriptedTest::SetUp();
    heartbeat(0.0f, 1.0f);
  }
  static N_Limits limits(float pairingTimeout, unsigned unpaired = 32, unsigned perAddress = 0) {
    N_Limits l = N_Limits::openNetwork();
    l.fPairingTimeout = pairingTimeout;
    l.uMaximumUnpaired = unpaired;
    l.uMaximumUnpairedPerAddress = perAddress;
    return l;
  }
};

// Connections that wait for their partner (plain sockets from addresses of
// their own) take places, in all and per address; a newcomer takes the
// oldest place of another address, and its control connection, which pairs
// at once, takes none. A time limit, or the peer's close, frees them.
TEST_F(ServerLimitsTest, UnpairedConnectionsAreBoundedAndReleased) {
  LimitsGuard bounded(limits(600.0f, 2));
  N_Server server(port());
  ServerPump pump{server};
  auto dataFrom = [&](const char* host) { return raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port()), host); };
  auto closedByServer = [&](int fd) { return waitFor([&] { return raw::closedByPeer(fd, 0); }, 5000, pump); };
  int fds[3];
  for (int i = 0; i < 2; ++i) {
    fds[i] = dataFrom("127.0.0.5");
    ASSERT_GE(fds[i], 0);
    ASSERT_TRUE(waitFor([&] { return ServerAccess::clientCount(server) == i + 1; }, 5000, pump));
  }
  // All places taken by its own address: closed on arrival.
  fds[2] = dataFrom("127.0.0.5");
  EXPECT_TRUE(closedByServer(fds[2]));
  ScriptedClient newcomer(loopback(), port());
  ASSERT_NE(nullptr, pairUp(pump, newcomer));
  EXPECT_TRUE(raw::closedByPeer(fds[0], 5000));
  EXPECT_FALSE(raw::closedByPeer(fds[1], 200));
  EXPECT_EQ(2, ServerAccess::clientCount(server));
  EXPECT_EQ(1u, pump.announced().size()) << "a connection waiting for its partner was handed out";
  // Lone control connections are bounded per address too: the third is closed on arrival.
  LimitsGuard perAddress(limits(600.0f, 32, 2));
  int control[3];
  for (int& fd : control) fd = raw::connectTo("127.0.0.1", CM::CONTROL_PORT, "127.0.0.7");
  EXPECT_TRUE(closedByServer(control[2]));
  EXPECT_TRUE(
      staysFalse([&] { return raw::closedByPeer(control[0], 0) || raw::closedByPeer(control[1], 0); }, 300, pump));
  EXPECT_EQ(2, ServerAccess::pendingControlCount(server));
  // One whose peer closed goes at once, long before its time limit.
  const int gone = dataFrom("127.0.0.8");
  ASSERT_TRUE(waitFor([&] { return ServerAccess::clientCount(server) == 3; }, 5000, pump));
  raw::closeFd(gone);
  EXPECT_TRUE(waitFor([&] { return ServerAccess::clientCount(server) == 2; }, 5000, pump));
  // With a short time limit the waiting ones go, the paired one stays.
  LimitsGuard brief(limits(0.2f, 32, 2));
  EXPECT_TRUE(closedByServer(fds[1]));
  EXPECT_TRUE(closedByServer(control[0]));
  EXPECT_TRUE(closedByServer(control[1]));
  EXPECT_EQ(1, ServerAccess::clientCount(server));
  EXPECT_EQ(0, ServerAccess::pendingControlCount(server));
  for (int fd : fds) raw::closeFd(fd);
  for (int fd : control) raw::closeFd(fd);
}

// A budget of control messages per client and update, and the requests of
// one update divided once, with grants only where they changed or were
// asked for.
TEST_F(ServerLimitsTest, ControlWorkIsBudgetedAndRequestsCollected) {
  LimitsGuard guard(N_Limits::openNetwork());
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* ca = pairUp(pump, a);
  ASSERT_NE(nullptr, ca);
  ScriptedClient b(loopback(), port());
  ASSERT_NE(nullptr, pairUp(pump, b));
  b.send(CM::CONTROL_BANDWIDTH_REQUEST, 10240);
  EXPECT_EQ(10240u, b.lastGrant(pump));
  a.drain(200, pump);
  for (int i = 0; i < 100; ++i) a.send(CM::CONTROL_ECHO);
  for (std::uint32_t rate = 5000; rate < 5005; ++rate) a.send(CM::CONTROL_BANDWIDTH_REQUEST, rate);
  auto unread = [&] { return ca->getStatistics().control.uBytesWaitingToPoll; };
  ASSERT_TRUE(waitFor([&] { return unread() == 100 * 4 + 5 * 8; }));
  server.update();
  // The budget left the rest, the requests included, for the next update.
  EXPECT_EQ(36u * 4 + 5 * 8, unread());
  ASSERT_TRUE(waitFor([&] { return a.control()->getQueuedReceiveBytes() == 64 * 4; }));
  EXPECT_EQ(64, std::ranges::count(a.drain(100, {}), CM::CONTROL_ECHO_REPLY, &Received::type));
  server.update();
  EXPECT_EQ(0u, unread());
  ASSERT_TRUE(waitFor([&] { return a.control()->getQueuedReceiveBytes() == 36 * 4 + 8; }));
  const std::vector<Received> got = a.drain(100, {});
  EXPECT_EQ(36, std::ranges::count(got, CM::CONTROL_ECHO_REPLY, &Received::type));
  ASSERT_EQ(1, std::ranges::count(got, CM::CONTROL_BANDWIDTH_GRANT, &Received::type));
  EXPECT_EQ(5004u, got.back().value);
  EXPECT_EQ(5004u, ca->getBandwidth());
  EXPECT_TRUE(b.drain(200, pump).empty()) << "b's grant didn't change";
}

// A client whose unsent bytes exceed the bound is disconnected; at exactly
// the bound it stays. The scripted end stops reading, so the bytes stay
// queued; the network thread is held while the bound is set at their cost.
TEST_F(ServerLimitsTest, AClientThatDoesNotReadIsDisconnectedAboveTheBound) {
  N_Limits l = N_Limits::openNetwork();
  l.uReceiveBacklog = 64 << 10;
  l.fSendBacklogSeconds = 1e-6f;  // the minimum rules
  l.uMinimumSendBacklog = 1u << 30;
  LimitsGuard guard(l);
  N_Server server(port());
  ServerPump pump{server};
  ScriptedClient a(loopback(), port());
  N_Client* client = pairUp(pump, a);
  ASSERT_NE(nullptr, client);
  std::vector<unsigned char> block(64 << 10, 7);
  N_Socket* out = Access::tcpSocket(*client);
  for (int i = 0; i < 256; ++i) out->send(block.data(), static_cast<unsigned>(block.size()));
  unsigned last = 0;  // steady once the system's buffers are full
  auto steady = [&] {
    const unsigned now = out->getQueuedSendBytes();
    return now > 0 && std::exchange(last, now) == now;
  };
  ASSERT_TRUE(waitFor(steady, 10000, [&] { pumpFor(100, pump); }));
  // Nothing moves now: the peer's backlog is full, so it reads no more, and
  // everything is queued already.
  const unsigned cost = out->getQueuedSendBytes() + N_Limits::kMessageCharge * out->getQueuedSendMessages();
  for (unsigned bound : {cost, cost - 1}) {
    l.uMinimumSendBacklog = bound;
    N_Initializer::setLimits(l);
    server.update();
    EXPECT_EQ(bound == cost, client->isConnected()) << bound << " of " << cost;
  }
  const N_Socket* reported = nullptr;
  bool tcpReported = false;
  while (N_Socket::pollDisconnect(reported)) tcpReported |= reported == out;
  EXPECT_TRUE(tcpReported);
}

}  // namespace
