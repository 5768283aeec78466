// The client end against a server end played by plain sockets, so that every
// control message the client sends is seen as bytes, and every message the
// client gets is one the test chose. Reliable and control channels only.
#include <cmath>
#include <limits>

#include "cs_fixture.h"
#include "fault_guard.h"

using namespace cs_test;

namespace {

using Access = N_ClientTestAccess;
using CM = ControlMessage;

class ClientScriptedTest : public ClientServerTest {
 protected:
  // Updates until the client reports the channel up; the first-update work
  // runs inside.
  static bool connect(N_Client& client, int milliseconds = 5000) {
    return waitFor([&] { return client.isConnected(); }, milliseconds, [&] { client.update(); });
  }
  static std::size_t countOf(const std::vector<Received>& messages, std::uint32_t type) {
    std::size_t n = 0;
    for (const Received& r : messages) n += r.type == type ? 1 : 0;
    return n;
  }
};

TEST_F(ClientScriptedTest, OpeningSendsRequestWorldTimeAndHeartbeatInOrder) {
  ScriptedServer script(port());
  script.worldTimeValue = 100.0f;
  N_Client client(loopback(), port());
  // Set before any channel is up: it rules at once and goes out with the
  // first-update work.
  client.setBandwidth(4321);
  EXPECT_EQ(4321u, client.getBandwidth());
  EXPECT_FALSE(client.isConnected());

  Clock::time_point start = Clock::now();
  ASSERT_TRUE(connect(client));
  const double elapsed = secondsSince(start);

  // Three world-time exchanges were answered, so the timer follows the
  // server's 100 s plus half the mean round trip, which is below the time
  // the connection took.
  const float age = client.getWorldTimer().getAge();
  EXPECT_GE(age, 100.0f);
  EXPECT_LE(age, 100.0 + elapsed + 0.05);

  ASSERT_TRUE(script.waitControl(5, 3000, [&] { client.update(); }));
  std::vector<Received> got = script.control();
  EXPECT_EQ(CM::CONTROL_BANDWIDTH_REQUEST, got[0].type);
  EXPECT_EQ(8u, got[0].size);
  EXPECT_EQ(4321u, got[0].value);
  EXPECT_EQ(CM::CONTROL_WORLD_TIME_REQUEST, got[1].type);
  EXPECT_EQ(4u, got[1].size);
  // The heartbeat leaves from the first update nested in the wait, before
  // the second exchange.
  EXPECT_EQ(CM::CONTROL_HEARTBEAT, got[2].type);
  EXPECT_EQ(4u, got[2].size);
  EXPECT_EQ(3u, countOf(got, CM::CONTROL_WORLD_TIME_REQUEST));

  // The scripted end answered that heartbeat: the round trip is measured.
  ASSERT_TRUE(waitFor([&] { return client.getLatency() > 0.0f; }, 2000, [&] { client.update(); }));
  EXPECT_LT(client.getLatency(), 2.0f);
}

TEST_F(ClientScriptedTest, ReceivedControlMessagesActByTypeAndSkipTheRest) {
  // No heartbeats of the client's own, so that every message it sends is an
  // answer to one of ours.
  N_Client::setHeartbeatFrequency(0.0f);
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  ASSERT_TRUE(script.waitControl(4, 2000, [&] { client.update(); }));  // request + three world times
  const std::size_t opening = script.control().size();
  EXPECT_EQ(0u, countOf(script.control(), CM::CONTROL_HEARTBEAT));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client.getBandwidth());
  const float reply = Access::worldTimeReply(client);

  // Messages too short for their type are dropped, not read past their end.
  script.sendControl(controlBytes(CM::CONTROL_BANDWIDTH_GRANT, 55, 4));
  script.sendControl(controlBytes(CM::CONTROL_WORLD_TIME, CM::floatBits(9.0f), 6));
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT, 0, 2));
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  ASSERT_TRUE(script.waitControl(opening + 1, 2000, [&] { client.update(); }));
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, script.control().back().type);
  EXPECT_EQ(4u, script.control().back().size);
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client.getBandwidth());
  EXPECT_EQ(reply, Access::worldTimeReply(client));
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));

  // Types that aren't this end's, or no type at all, change nothing; the
  // messages behind them are still handled, in order.
  script.sendControl(controlBytes(0, 1));
  script.sendControl(controlBytes(9, 2, 8));
  script.sendControl(controlBytes(0xFFFFFFFFu, 3, 8));
  script.sendControl(controlBytes(CM::CONTROL_BANDWIDTH_REQUEST, 77));
  script.sendControl(controlBytes(CM::CONTROL_WORLD_TIME_REQUEST));
  script.sendControl(controlBytes(CM::CONTROL_ECHO));
  script.sendControl(controlBytes(CM::CONTROL_ECHO_REPLY));
  script.sendControl(controlBytes(CM::CONTROL_ECHO_REPLY));
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  script.sendControl(controlBytes(CM::CONTROL_BANDWIDTH_GRANT, 777));
  // Unasked-for world time still lands.
  script.sendControl(controlBytes(CM::CONTROL_WORLD_TIME, CM::floatBits(55.5f)));
  ASSERT_TRUE(waitFor([&] { return Access::worldTimeReply(client) == 55.5f; }, 2000, [&] { client.update(); }));
  EXPECT_TRUE(Access::worldTimeReceived(client));
  EXPECT_EQ(777u, client.getBandwidth());
  EXPECT_EQ(55.5f, Access::worldTimeReply(client));
  EXPECT_EQ(2u, Access::echoReplies(client));

  // Exactly one more message came back: the reply to the second heartbeat.
  pumpFor(150, [&] { client.update(); });
  std::vector<Received> got = script.control();
  ASSERT_EQ(opening + 2, got.size());
  EXPECT_EQ(CM::CONTROL_HEARTBEAT_REPLY, got.back().type);
  EXPECT_TRUE(client.isConnected());
}

TEST_F(ClientScriptedTest, HeartbeatReplyIsTakenInAnyState) {
  N_Client::setHeartbeatFrequency(0.0f);
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  // With the machine off the client never left its opening state.
  EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));
  EXPECT_EQ(0.0f, client.getLatency());
  Access::setHeartbeatAge(client, 0.3f);
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT_REPLY));
  ASSERT_TRUE(waitFor([&] { return client.getLatency() > 0.0f; }, 2000, [&] { client.update(); }));
  EXPECT_GE(client.getLatency(), 0.3f);
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(client));
}

TEST_F(ClientScriptedTest, WorldTimerStopsAtTheFirstMissingReply) {
  // Slow heartbeats: they must not end the connection during the waits.
  N_Client::setHeartbeatFrequency(5.0f);
  N_Client::setHeartbeatLatency(5.0f);
  ScriptedServer script(port());
  script.worldTimeValue = 100.0f;
  script.worldTimeAnswers = 1;
  N_Client client(loopback(), port());
  Clock::time_point start = Clock::now();
  // The opening synchronisation fails at its second exchange; the
  // connection stays up and the first estimate stays set.
  ASSERT_TRUE(connect(client, 8000));
  const double elapsed = secondsSince(start);
  EXPECT_GE(elapsed, 1.0);
  float age = client.getWorldTimer().getAge();
  EXPECT_GE(age, 101.0f);
  EXPECT_LE(age, 100.0 + elapsed + 0.05);

  // No answer at all: false after the one-second wait, timer untouched
  // (it runs on from where it was).
  script.worldTimeAnswers = 0;
  const float before = client.getWorldTimer().getAge();
  start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  double took = secondsSince(start);
  EXPECT_GE(took, 1.0);
  age = client.getWorldTimer().getAge();
  EXPECT_GE(age, before + 1.0f);
  EXPECT_LE(age, before + took + 0.05);

  // Two answers: the second estimate holds, and the third wait passes on it.
  script.worldTimeValue = 500.0f;
  script.worldTimeAnswers = 2;
  start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  took = secondsSince(start);
  age = client.getWorldTimer().getAge();
  EXPECT_GE(age, 501.0f);
  EXPECT_LE(age, 500.0 + took + 0.05);

  // All three: true, and the timer follows the server's 20 s.
  script.worldTimeValue = 20.0f;
  script.worldTimeAnswers = -1;
  start = Clock::now();
  EXPECT_TRUE(client.updateWorldTimer());
  took = secondsSince(start);
  age = client.getWorldTimer().getAge();
  EXPECT_GE(age, 20.0f);
  EXPECT_LE(age, 20.0 + took + 0.05);
}

TEST_F(ClientScriptedTest, HeartbeatRunsDuringTheWorldTimeWait) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  script.worldTimeAnswers = 0;
  // The script answers the client's heartbeats but sends none of its own,
  // so only the client's own turns show up, every 0.2 s or so.
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  const std::size_t before = countOf(script.control(), CM::CONTROL_HEARTBEAT);
  EXPECT_FALSE(client.updateWorldTimer());
  EXPECT_GT(countOf(script.control(), CM::CONTROL_HEARTBEAT), before);
}

TEST_F(ClientScriptedTest, DisconnectDuringTheWaitFailsAfterTheTimeOut) {
  N_Client::setHeartbeatFrequency(5.0f);
  N_Client::setHeartbeatLatency(5.0f);
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  client.disconnect();
  Clock::time_point start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  EXPECT_GE(secondsSince(start), 1.0);
}

// The limits of the heartbeat, one connection each, with the timers set just
// below and just above them. Frequency and latency are 1 s here, so the
// margins dwarf the time a step takes.
class ClientHeartbeatLimitTest : public ClientScriptedTest {
 protected:
  void SetUp() override {
    ClientScriptedTest::SetUp();
    N_Client::setHeartbeatFrequency(1.0f);
    N_Client::setHeartbeatLatency(1.0f);
  }
  // Connected, with the opening heartbeat answered: the client awaits the
  // peer's heartbeat.
  bool open(ScriptedServer& script, N_Client& client) {
    if (!connect(client)) return false;
    script.answerHeartbeats = false;
    return waitFor([&] { return Access::state(client) == N_Client::HEARTBEAT_AWAIT_PEER; }, 2000,
                   [&] { client.update(); });
  }
};

TEST_F(ClientHeartbeatLimitTest, AwaitPeerAllowsFrequencyPlusLatency) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(open(script, client));
  Access::setHeartbeatAge(client, 1.9f);
  client.update();
  EXPECT_TRUE(client.isConnected());
  Access::setHeartbeatAge(client, 2.05f);
  client.update();
  EXPECT_FALSE(client.isConnected());
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_PEER, Access::state(client));
  // The peer sees all channels go.
  EXPECT_TRUE(waitFor([&] { return !script.controlConnected() && !script.dataConnected(); }, 3000));
}

TEST_F(ClientHeartbeatLimitTest, IdleTurnsToSendAndTheHeartbeatLeavesAtTheNextStep) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(open(script, client));
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  ASSERT_TRUE(waitFor([&] { return Access::state(client) == N_Client::HEARTBEAT_IDLE; }, 2000,
                      [&] { client.update(); }));
  const std::size_t heartbeats = countOf(script.control(), CM::CONTROL_HEARTBEAT);

  Access::setIdleAge(client, 0.9f);
  client.update();
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));
  Access::setIdleAge(client, 1.05f);
  client.update();
  EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));
  sleepMs(100);
  EXPECT_EQ(heartbeats, countOf(script.control(), CM::CONTROL_HEARTBEAT));
  client.update();
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_REPLY, Access::state(client));
  ASSERT_TRUE(waitFor([&] { return countOf(script.control(), CM::CONTROL_HEARTBEAT) == heartbeats + 1; }, 2000));

  // Its reply may take the latency, and not longer.
  Access::setHeartbeatAge(client, 0.9f);
  client.update();
  EXPECT_TRUE(client.isConnected());
  Access::setHeartbeatAge(client, 1.05f);
  client.update();
  EXPECT_FALSE(client.isConnected());
  EXPECT_EQ(N_Client::HEARTBEAT_AWAIT_REPLY, Access::state(client));
  // Nothing more is sent once the limit has fired.
  pumpFor(100, [&] { client.update(); });
  EXPECT_EQ(heartbeats + 1, countOf(script.control(), CM::CONTROL_HEARTBEAT));
}

TEST_F(ClientHeartbeatLimitTest, AStalledApplicationIsDroppedEvenWithTheReplyWaiting) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(open(script, client));
  Access::setHeartbeatAge(client, 1.5f);
  // The peer's heartbeat arrives, but the step runs before the reading.
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  sleepMs(100);
  Access::setHeartbeatAge(client, 2.05f);
  client.update();
  EXPECT_FALSE(client.isConnected());
}

TEST_F(ClientHeartbeatLimitTest, MachineOffAnswersButNeitherSendsNorTimesOut) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(open(script, client));
  const std::size_t heartbeats = countOf(script.control(), CM::CONTROL_HEARTBEAT);
  const float nan = std::numeric_limits<float>::quiet_NaN();
  const float settings[][2] = {{0.0f, 1.0f}, {1.0f, 0.0f}, {-1.0f, 1.0f}, {1.0f, -0.5f}, {nan, 1.0f}, {1.0f, nan}};
  for (const auto& s : settings) {
    SCOPED_TRACE(testing::Message() << "frequency " << s[0] << ", latency " << s[1]);
    N_Client::setHeartbeatFrequency(s[0]);
    N_Client::setHeartbeatLatency(s[1]);
    Access::setHeartbeatAge(client, 100.0f);
    Access::setIdleAge(client, 100.0f);
    client.update();
    EXPECT_TRUE(client.isConnected());
  }
  // Still answering: a heartbeat gets its reply, and the idle rest doesn't
  // end while the machine is off.
  const std::size_t replies = countOf(script.control(), CM::CONTROL_HEARTBEAT_REPLY);
  script.sendControl(controlBytes(CM::CONTROL_HEARTBEAT));
  ASSERT_TRUE(waitFor([&] { return countOf(script.control(), CM::CONTROL_HEARTBEAT_REPLY) == replies + 1; }, 2000,
                      [&] { client.update(); }));
  Access::setIdleAge(client, 100.0f);
  pumpFor(100, [&] { client.update(); });
  EXPECT_EQ(N_Client::HEARTBEAT_IDLE, Access::state(client));
  EXPECT_EQ(heartbeats, countOf(script.control(), CM::CONTROL_HEARTBEAT));

  // On again: the idle timer kept running, so the first step turns.
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  client.update();
  EXPECT_EQ(N_Client::HEARTBEAT_SEND, Access::state(client));
}

TEST_F(ClientScriptedTest, BandwidthRequestsFollowTheChannel) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  ASSERT_TRUE(script.waitControl(1, 2000, {}));
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, script.control()[0].value);

  client.setBandwidth(999);
  EXPECT_EQ(999u, client.getBandwidth());
  ASSERT_TRUE(waitFor([&] { return countOf(script.control(), CM::CONTROL_BANDWIDTH_REQUEST) == 2; }, 2000));
  std::vector<Received> got = script.control();
  for (auto it = got.rbegin(); it != got.rend(); ++it) {
    if (it->type == CM::CONTROL_BANDWIDTH_REQUEST) {
      EXPECT_EQ(999u, it->value);
      break;
    }
  }

  // A dead channel: the value is stored and nothing is sent.
  script.hangUp();
  ASSERT_TRUE(waitFor([&] { return !client.isConnected(); }, 3000, [&] { client.update(); }));
  client.setBandwidth(55);
  EXPECT_EQ(55u, client.getBandwidth());
  sleepMs(100);
  EXPECT_EQ(2u, countOf(script.control(), CM::CONTROL_BANDWIDTH_REQUEST));

  // construct starts over from the default; destruct leaves 0.
  client.construct(loopback(), port());
  EXPECT_EQ(N_Client::DEFAULT_BANDWIDTH, client.getBandwidth());
  client.destruct();
  EXPECT_EQ(0u, client.getBandwidth());
}

TEST_F(ClientScriptedTest, DisconnectClosesEveryChannelOnce) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(connect(client));
  client.disconnect();
  EXPECT_FALSE(client.isConnected());
  client.disconnect();
  EXPECT_TRUE(waitFor([&] { return !script.controlConnected() && !script.dataConnected(); }, 3000));
  // Nothing reconnects.
  pumpFor(100, [&] { client.update(); });
  EXPECT_FALSE(client.isConnected());
}

TEST_F(ClientScriptedTest, WithoutAControlChannel) {
  // Nobody listens: the reliable channel never comes up, so no control
  // channel is opened and nothing waits.
  N_Client client(loopback(), port());
  for (int i = 0; i < 20; ++i) client.update();
  EXPECT_EQ(nullptr, Access::controlSocket(client));
  EXPECT_FALSE(client.isConnected());
  Clock::time_point start = Clock::now();
  EXPECT_FALSE(client.updateWorldTimer());
  EXPECT_LT(secondsSince(start), 0.5);
  client.disconnect();
  EXPECT_FALSE(client.isConnected());
  EXPECT_EQ(port(), client.getPort());
  ASSERT_NE(nullptr, client.getAddress());
  EXPECT_EQ(loopback()->getIdentifier(), client.getAddress()->getIdentifier());
  EXPECT_GT(client.getLargestUnreliablePacketSize(), 0u);
}

TEST_F(ClientScriptedTest, AnEmptyObjectAnswersEmpty) {
  N_Client client;
  for (int round = 0; round < 2; ++round) {
    EXPECT_FALSE(client.isConstructed());
    EXPECT_FALSE(client.isConnected());
    EXPECT_EQ(nullptr, client.getAddress());
    EXPECT_EQ(0, client.getPort());
    EXPECT_EQ(0u, client.getLargestUnreliablePacketSize());
    EXPECT_EQ(0u, client.getBandwidth());
    client.disconnect();
    client.update();
    EXPECT_FALSE(client.updateWorldTimer());
    void* message = nullptr;
    unsigned size = 0;
    EXPECT_FALSE(client.poll(message, size));
    client.flushReliable();
    client.flushUnreliable();
    client.clearReliable();
    char byte = 'x';
    // The queue limit of a zero bandwidth is zero.
    EXPECT_THROW(client.queueReliable(&byte, 1, 0, 0), N_NetException_PacketsStackingUp*);
    client.queueUnreliable(&byte, 0, 0, 0);
    client.destruct();
    // Once more after a real life.
    client.construct(loopback(), port());
    EXPECT_TRUE(client.isConstructed());
    client.destruct();
  }
}

TEST_F(ClientScriptedTest, FailedConstructionLeavesNothing) {
  // Unresolved address: the sockets refuse it.
  N_Address unresolved;
  N_Client client;
  EXPECT_THROW(client.construct(&unresolved, port()), N_NetException_IPNotResolved*);
  EXPECT_FALSE(client.isConstructed());
  EXPECT_EQ(0u, client.getBandwidth());

  // Each allocation of construct failing in turn; the allocation balance
  // at the end of the test shows that nothing of the attempts stays. The
  // network thread allocates too: a refusal that lands there is counted and
  // the attempt repeated with the next allocation.
  int failures = 0;
  int refused = 0;
  bool constructed = false;
  for (int nth = 1; nth < 200 && !constructed; ++nth) {
    FaultGuard faults;
    faults.failAllocation(nth);
    bool threw = false;
    try {
      client.construct(loopback(), port());
    } catch (Q_MemoryException_Allocation*) {
      threw = true;
    }
    const int fired = platform::fault::allocationsFailed();
    refused += fired;
    if (threw) {
      ++failures;
      EXPECT_FALSE(client.isConstructed());
      EXPECT_EQ(nullptr, client.getAddress());
    } else if (fired == 0) {
      EXPECT_TRUE(client.isConstructed());
      constructed = true;
    } else {
      client.destruct();
    }
  }
  countRefusedAllocations(refused);
  EXPECT_TRUE(constructed);
  EXPECT_GE(failures, 4);  // two sockets and two queues at least
  client.destruct();
}

}  // namespace
