// The client end against a server end played by plain sockets, so that every
// control message the client sends is seen as bytes, and every message the
// client gets is one the test chose. Reliable and control channels only.
#include <cmath>
#include <limits>

#include "cs_fixture.h"

using namespace cs_test;

namespace {

// The server end is a raw peer on 127.0.0.2.
class ClientScriptedTest : public ClientServerTest {
 protected:
  void SetUp() override {
    ClientServerTest::SetUp();
    m_server = std::make_unique<N_Address>("127.0.0.2");
  }
  void TearDown() override {
    m_server.reset();
    ClientServerTest::TearDown();
  }
  const N_Address* server() const { return m_server.get(); }
  RawPeer scripted() const { return RawPeer("127.0.0.2", "127.0.0.1", static_cast<std::uint16_t>(port())); }
  // Updates until the channel is up; the first-update work runs inside.
  static bool connect(N_Client& client, int milliseconds = 5000) {
    return waitFor([&] { return client.isConnected(); }, milliseconds, [&] { client.update(); });
  }
  static Pump updating(N_Client& client) {
    return [&client] { client.update(); };
  }
  static bool waitControl(RawPeer& script, std::size_t count, int milliseconds, const Pump& pump) {
    return waitFor([&] { return script.control().size() >= count; }, milliseconds, pump);
  }
  static bool closedBoth(RawPeer& script) {
    return waitFor([&] { return !script.open(true) && !script.open(false); }, 3000);
  }

 private:
  std::unique_ptr<N_Address> m_server;
};

TEST_F(ClientScriptedTest, OpeningSendsRequestWorldTimeAndHeartbeatInOrder) {
  RawPeer script = scripted();
  N_Client client(server(), port());
  // Set before any channel is up: it rules at once and goes out first.
  client.setBandwidth(4321);
  EXPECT_EQ(4321u, client.getBandwidth());
  // The world timer's exchanges are the next test's.
  ASSERT_TRUE(connect(client));
  ASSERT_TRUE(waitControl(script, 5, 3000, updating(client)));
  const std::vector<Received> got = script.control();
  // The heartbeat leaves from the first update nested in the wait.
  EXPECT_TRUE(got[0].type == CM::CONTROL_BANDWIDTH_REQUEST && got[0].size == 8 && got[0].value == 4321u);
  EXPECT_TRUE(got[1].type == CM::CONTROL_WORLD_TIME_REQUEST && got[1].size == 4);
  EXPECT_TRUE(got[2].type == CM::CONTROL_HEARTBEAT && got[2].size == 4);
  EXPECT_EQ(3u, script.count(CM::CONTROL_WORLD_TIME_REQUEST));

  // Requests follow the channel; a dead one stores the value and sends nothing.
  client.setBandwidth(999);
  ASSERT_TRUE(waitFor([&] { return script.count(CM::CONTROL_BANDWIDTH_REQUEST) == 2; }, 2000));
  EXPECT_EQ(999u, script.control().back().value);
  client.disconnect();
  client.disconnect();
  EXPECT_FALSE(client.isConnected());
  EXPECT_TRUE(closedBoth(script));
  client.setBandwidth(55);
  EXPECT_EQ(55u, client.getBandwidth());
  pumpFor(100, updating(client));
  EXPECT_FALSE(client.isConnected());  // nothing reconnects
  EXPECT_EQ(2u, script.count(CM::CONTROL_BANDWIDTH_REQUEST));
  // construct starts over from the default; destruct leaves 0.
  client.construct(loopback(), port());
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client.getBandwidth());
  client.destruct();
  EXPECT_EQ(0u, client.getBandwidth());
}

TEST_F(ClientScriptedTest, ReceivedControlMessagesActByTypeAndSkipTheRest) {
  // No heartbeats of its own: every message it sends answers one of ours.
  heartbeat(0.0f, 0.2f);
  RawPeer script = scripted();
  N_Client client(server(), port());
  ASSERT_TRUE(connect(client));
  ASSERT_TRUE(waitControl(script, 4, 2000, updating(client)));  // request and three world times
  const std::size_t opening = script.control().size();
  const float reply = Access::worldTimeReply(client);
  EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));  // the machine is off

  // Too short for their type: dropped, not read past their end.
  for (const Bytes& b : {controlBytes(CM::CONTROL_BANDWIDTH_GRANT, 55, 4),
                         controlBytes(CM::CONTROL_WORLD_TIME, CM::floatBits(9.0f), 6),
                         controlBytes(CM::CONTROL_HEARTBEAT, 0, 2), controlBytes(CM::CONTROL_HEARTBEAT)})
    script.sendControlBytes(b);
  ASSERT_TRUE(waitControl(script, opening + 1, 2000, updating(client)));
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, script.control().back().type);
  EXPECT_EQ(4u, script.control().back().size);
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client.getBandwidth());
  EXPECT_EQ(reply, Access::worldTimeReply(client));
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));

  // Types that aren't this end's change nothing; what follows is handled.
  for (auto [type, value, size] : std::vector<std::tuple<std::uint32_t, std::uint32_t, int>>{
           {0, 1, -1}, {9, 2, 8}, {0xFFFFFFFFu, 3, 8}, {CM::CONTROL_BANDWIDTH_REQUEST, 77, -1},
           {CM::CONTROL_WORLD_TIME_REQUEST, 0, -1}, {CM::CONTROL_ECHO, 0, -1}, {CM::CONTROL_ECHO_REPLY, 0, -1},
           {CM::CONTROL_ECHO_REPLY, 0, -1}, {CM::CONTROL_HEARTBEAT, 0, -1}, {CM::CONTROL_BANDWIDTH_GRANT, 777, -1},
           {CM::CONTROL_WORLD_TIME, CM::floatBits(55.5f), -1}})  // unasked-for world time still lands
    script.sendControlBytes(controlBytes(type, value, size));
  ASSERT_TRUE(waitFor([&] { return Access::worldTimeReply(client) == 55.5f; }, 2000, updating(client)));
  EXPECT_EQ(777u, client.getBandwidth());
  EXPECT_EQ(2u, Access::echoReplies(client));
  // Exactly one more message came back: the reply to the second heartbeat.
  pumpFor(150, updating(client));
  ASSERT_EQ(opening + 2, script.control().size());
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, script.control().back().type);

  // A heartbeat reply is taken in any state, and measures from the last
  // heartbeat timer reset.
  Access::setHeartbeatAge(client, 0.3f);
  script.sendControlBytes(controlBytes(CM::CONTROL_HEARTBEAT_REPLY));
  ASSERT_TRUE(waitFor([&] { return client.getLatency() > 0.0f; }, 2000, updating(client)));
  EXPECT_GE(client.getLatency(), 0.3f);
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(client));
  EXPECT_TRUE(client.isConnected());
}

TEST_F(ClientScriptedTest, WorldTimerStopsAtTheFirstMissingReplyAndHeartbeatsGoOn) {
  heartbeat(0.2f, 30.0f);  // beats go on, but no limit during the waits
  RawPeer script = scripted();
  script.worldTimeAnswers = 1;
  N_Client client(server(), port());
  // The opening exchange fails at its second step; the connection stays up
  // and the first estimate holds.
  Clock::time_point start = Clock::now();
  ASSERT_TRUE(connect(client, 8000));
  EXPECT_GE(client.getWorldTimer().getAge(), 101.0f);
  EXPECT_LE(client.getWorldTimer().getAge(), 100.0 + secondsSince(start) + 0.05);

  // The script sends no heartbeat of its own after this one, so only the
  // client's own turn can add one during the next wait.
  script.sendControlBytes(controlBytes(CM::CONTROL_HEARTBEAT));
  const std::size_t heartbeats = script.count(CM::CONTROL_HEARTBEAT);
  // Answers given, the server's time, result: none leaves the timer running
  // on; otherwise the last answer holds, and only three make it true.
  struct Case { int answers; float value; bool result; };
  for (const Case& k : {Case{0, 300.0f, false}, Case{2, 500.0f, false}, Case{-1, 20.0f, true}}) {
    SCOPED_TRACE(k.answers);
    script.worldTime = k.value;
    script.worldTimeAnswers = k.answers;
    const float before = client.getWorldTimer().getAge();
    start = Clock::now();
    EXPECT_EQ(k.result, client.updateWorldTimer());
    const double took = secondsSince(start);
    const float base = k.answers == 0 ? before : k.value;
    EXPECT_GE(client.getWorldTimer().getAge(), base + (k.result ? 0.0f : 1.0f));
    EXPECT_LE(client.getWorldTimer().getAge(), base + took + 0.05);
    EXPECT_TRUE(k.answers != 0 || script.count(CM::CONTROL_HEARTBEAT) > heartbeats);
  }
  // A dead channel fails after the same wait.
  client.disconnect();
  start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  EXPECT_GE(secondsSince(start), 1.0);
}

// The limits of the heartbeat at 1 s / 1 s, with the timers set just below
// and just above them; each scenario on a connection of its own, its opening
// heartbeat answered, awaiting the peer's.
TEST_F(ClientScriptedTest, HeartbeatLimits) {
  heartbeat(1.0f, 1.0f);
  auto scenario = [&](const char* name, const std::function<void(RawPeer&, N_Client&)>& body) {
    SCOPED_TRACE(name);
    RawPeer script = scripted();
    N_Client client(server(), port());
    ASSERT_TRUE(connect(client));
    script.answerHeartbeats = false;
    ASSERT_TRUE(waitFor([&] { return Access::state(client) == N_Client::HEARTBEAT_AWAIT_PEER; }, 2000,
                        updating(client)));
    body(script, client);
  };
  // The limit fires between `below` and `above` of the heartbeat timer.
  auto expectLimit = [](N_Client& client, float below, float above) {
    const int state = Access::state(client);
    Access::setHeartbeatAge(client, below);
    client.update();
    EXPECT_TRUE(client.isConnected());
    Access::setHeartbeatAge(client, above);
    client.update();
    EXPECT_FALSE(client.isConnected());
    EXPECT_EQ(state, Access::state(client));
  };
  scenario("awaiting the peer: frequency plus latency", [&](RawPeer& script, N_Client& client) {
    expectLimit(client, 1.9f, 2.05f);
    EXPECT_TRUE(closedBoth(script));
  });
  scenario("idle turns to send, the reply may take the latency", [&](RawPeer& script, N_Client& client) {
    script.sendControlBytes(controlBytes(CM::CONTROL_HEARTBEAT));
    ASSERT_TRUE(
        waitFor([&] { return Access::state(client) == N_Client::HEARTBEAT_IDLE; }, 2000, updating(client)));
    const std::size_t heartbeats = script.count(CM::CONTROL_HEARTBEAT);
    Access::setIdleAge(client, 0.9f);
    client.update();
    EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));
    Access::setIdleAge(client, 1.05f);
    client.update();
    EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));
    sleepMs(100);
    EXPECT_EQ(heartbeats, script.count(CM::CONTROL_HEARTBEAT));  // it leaves at the next step
    client.update();
    EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_REPLY, Access::state(client));
    ASSERT_TRUE(waitFor([&] { return script.count(CM::CONTROL_HEARTBEAT) == heartbeats + 1; }, 2000));
    expectLimit(client, 0.9f, 1.05f);
    pumpFor(100, updating(client));
    EXPECT_EQ(heartbeats + 1, script.count(CM::CONTROL_HEARTBEAT));
  });
  scenario("a stalled application, the peer's heartbeat unread", [&](RawPeer& script, N_Client& client) {
    // The step runs before the reading.
    script.sendControlBytes(controlBytes(CM::CONTROL_HEARTBEAT));
    sleepMs(100);
    Access::setHeartbeatAge(client, 2.05f);
    client.update();
    EXPECT_FALSE(client.isConnected());
  });
  scenario("switched off: answers but neither sends nor times out", [&](RawPeer& script, N_Client& client) {
    const std::size_t heartbeats = script.count(CM::CONTROL_HEARTBEAT);
    const float nan = std::numeric_limits<float>::quiet_NaN();
    for (auto [f, l] : {std::pair{0.0f, 1.0f}, {1.0f, 0.0f}, {-1.0f, 1.0f}, {1.0f, -0.5f}, {nan, 1.0f}, {1.0f, nan}}) {
      SCOPED_TRACE(testing::Message() << "frequency " << f << ", latency " << l);
      heartbeat(f, l);
      Access::setHeartbeatAge(client, 100.0f);
      Access::setIdleAge(client, 100.0f);
      client.update();
      EXPECT_TRUE(client.isConnected());
    }
    const std::size_t replies = script.count(CM::CONTROL_HEARTBEAT_REPLY);
    script.sendControlBytes(controlBytes(CM::CONTROL_HEARTBEAT));
    ASSERT_TRUE(waitFor([&] { return script.count(CM::CONTROL_HEARTBEAT_REPLY) == replies + 1; }, 2000,
                        updating(client)));
    Access::setIdleAge(client, 100.0f);
    pumpFor(100, updating(client));
    EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));
    EXPECT_EQ(heartbeats, script.count(CM::CONTROL_HEARTBEAT));
    // On again: the idle timer kept running, so the first step turns.
    heartbeat(1.0f, 1.0f);
    client.update();
    EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));
  });
}

TEST_F(ClientScriptedTest, WithoutAServerOrAnAddress) {
  // Nobody listens: no control channel is opened and nothing waits.
  N_Client client(loopback(), port());
  for (int i = 0; i < 20; ++i) client.update();
  EXPECT_EQ(2u, N_Initializer::getStatistics().uOpenSockets);  // its data channels, no control channel
  EXPECT_FALSE(client.isConnected());
  const Clock::time_point start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  EXPECT_LT(secondsSince(start), 0.5);
  EXPECT_EQ(port(), client.getPort());
  EXPECT_EQ(loopback()->getIdentifier(), client.getAddress()->getIdentifier());

  // An empty object answers empty, before and after a life.
  N_Client empty;
  for (int round = 0; round < 2; ++round) {
    EXPECT_TRUE(!empty.isConstructed() && !empty.isConnected() && empty.getAddress() == nullptr);
    EXPECT_TRUE(empty.getPort() == 0 && empty.getLargestUnreliablePacketSize() == 0 && empty.getBandwidth() == 0);
    empty.disconnect();
    empty.update();
    EXPECT_FALSE(empty.updateWorldTimer());
    void* message = nullptr;
    unsigned size = 0;
    EXPECT_FALSE(empty.poll(message, size));
    empty.flushReliable();
    empty.flushUnreliable();
    char byte = 'x';
    EXPECT_THROW(empty.queueReliable(&byte, 1, 0, 0), N_NetException_PacketsStackingUp*);  // its limit is 0
    EXPECT_EQ(0u, empty.getStatistics().reliableQueue.uPayloadsRefused);  // nothing counted unconstructed
    empty.destruct();
    empty.construct(loopback(), port());
    EXPECT_TRUE(empty.isConstructed());
    empty.destruct();
  }
  // An unresolved address: the sockets refuse it.
  N_Address unresolved;
  EXPECT_THROW(empty.construct(&unresolved, port()), N_NetException_IPNotResolved*);
  EXPECT_FALSE(empty.isConstructed());
  EXPECT_EQ(0u, empty.getBandwidth());

  // Each allocation of construct refused in turn until one constructs. (Not
  // a sweep: a socket whose construction failed is held by the runtime until
  // it stops; the balance at the end of the test counts it then.)
  int failures = 0;
  for (int nth = 1; nth < 200; ++nth) {
    failAllocation(nth);
    try {
      empty.construct(loopback(), port());
    } catch (Q_MemoryException_Allocation*) {
      ++failures;
      EXPECT_FALSE(empty.isConstructed());
      EXPECT_EQ(nullptr, empty.getAddress());
      continue;
    }
    const bool fired = platform::fault::allocationsFailed() > 0;  // maybe on the network thread
    platform::fault::disarmAll();
    if (!fired) break;
    empty.destruct();
  }
  platform::fault::disarmAll();
  EXPECT_TRUE(empty.isConstructed());
  EXPECT_GE(failures, 4);  // two sockets and two queues at least
}

}  // namespace
