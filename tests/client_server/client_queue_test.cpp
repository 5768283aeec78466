// Payload queues, batches and pacing of N_Client, and the reading side with
// its simulated delay, over a real reliable channel whose other end is a
// listener in this process. No control channel is opened (update() is never
// called), so the client's bandwidth is what the test sets.
#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

class ClientQueueTest : public ClientServerTest {
 protected:
  void SetUp() override {
    ClientServerTest::SetUp();
    m_listener = std::make_unique<N_Listener>(port());
    m_client = std::make_unique<N_Client>(loopback(), port());
    N_Socket::ConnectData* data = nullptr;
    ASSERT_TRUE(waitFor([&] { return m_listener->pollConnect(data); }));
    m_peer = std::make_unique<N_Socket>(data);
    // The accepted end looks its address up on a thread of its own, whose
    // allocations would take the refusals that a test means for the client.
    waitFor([&] { return m_peer->getAddress()->fullyResolved(); });
    ASSERT_TRUE(waitFor([&] { return Access::tcpSocket(*m_client)->isConnected(); }));
  }
  void TearDown() override {
    m_peer.reset();
    m_client.reset();
    m_listener.reset();
    ClientServerTest::TearDown();
  }

  N_Client& client() { return *m_client; }
  unsigned waiting() { return m_client->getReliableBytesWaiting(); }
  void queue(unsigned priority, const std::string& payload, unsigned key = 0) {
    client().queueReliable(const_cast<char*>(payload.data()), static_cast<unsigned>(payload.size()), key, priority);
  }
  // The next batch at the peer, "" if none comes.
  std::string batch(int milliseconds = 3000) {
    void* data = nullptr;
    unsigned size = 0;
    if (!waitFor([&] { return m_peer->poll(data, size); }, milliseconds)) return "";
    return std::string(static_cast<const char*>(data), size);
  }
  void peerSends(const std::string& m) { m_peer->send(const_cast<char*>(m.data()), static_cast<unsigned>(m.size())); }
  bool gateOpen() { return waitFor([&] { return Access::sendAge(client()) >= Access::nextFlushTime(client()); }); }
  // Flushes; the gate must shut for `seconds` from the age of the flush.
  void flushPaced(double seconds) {
    const float before = Access::sendAge(client());
    client().flushReliable();
    const float after = Access::sendAge(client());
    EXPECT_GE(Access::nextFlushTime(client()), static_cast<float>(before + seconds));
    EXPECT_LE(Access::nextFlushTime(client()), static_cast<float>(after + seconds));
  }

 private:
  std::unique_ptr<N_Listener> m_listener;
  std::unique_ptr<N_Client> m_client;
  std::unique_ptr<N_Socket> m_peer;
};

// At 10240 bytes/s a batch takes entries by priority while they stay below
// 2560 bytes, or the first entry alone however large; the gate then shuts
// for the batch's bytes over the bandwidth.
TEST_F(ClientQueueTest, BatchesTakeByPriorityBelowTheBudget) {
  struct Case {
    std::vector<std::pair<unsigned, std::string>> queued;
    std::string batch;
    unsigned left;
  };
  const std::string a(1000, 'a'), b(1000, 'b'), c(2000, 'c');
  const Case cases[] = {
      {{{1, a}, {5, b}, {3, c}}, b + a, 2000},                                            // 3000 would not fit
      {{{3, a}, {2, std::string(1560, 'b')}, {1, std::string(1559, 'c')}}, a + std::string(1559, 'c'), 1560},  // 2560 is over
      {{{1, "yyyyyyyyyy"}, {9, std::string(5000, 'x')}}, std::string(5000, 'x'), 10},     // alone
  };
  client().setBandwidth(10240);
  for (const Case& k : cases) {
    ASSERT_TRUE(gateOpen());
    for (const auto& [priority, payload] : k.queued) queue(priority, payload);
    flushPaced(k.batch.size() / 10240.0);
    EXPECT_EQ(k.batch, batch());
    EXPECT_EQ(k.left, waiting());
    client().clearReliable();
  }
  // One gate holds both queues.
  ASSERT_TRUE(gateOpen());
  queue(1, c);
  client().flushReliable();
  EXPECT_EQ(c, batch());
  const float next = Access::nextFlushTime(client());
  queue(1, "r");
  client().flushReliable();
  std::string u = "unreliable";
  client().queueUnreliable(u.data(), static_cast<unsigned>(u.size()), 0, 1);
  client().flushUnreliable();
  EXPECT_EQ(1u, waiting());
  EXPECT_EQ(10u, client().getUnreliableBytesWaiting());
  EXPECT_EQ(next, Access::nextFlushTime(client()));
  ASSERT_TRUE(gateOpen());
  client().flushReliable();
  EXPECT_EQ("r", batch());
}

TEST_F(ClientQueueTest, QueueLimitIsFourSecondsOfData) {
  client().setBandwidth(10240);  // 40960 bytes per queue
  queue(1, std::string(40000, 'a'));
  queue(1, std::string(950, 'b'), 7);
  queue(1, std::string(10, 'c'));
  EXPECT_EQ(40960u, waiting());
  try {
    queue(1, "d");
    ADD_FAILURE() << "one byte above the limit was queued";
  } catch (N_NetException_PacketsStackingUp* e) {
    EXPECT_STREQ("Packets are stacking up. Already 4.00 seconds of data waiting in queue", e->getErrorMessage());
  }
  // A replacement counts the bytes it would replace: smaller still throws.
  EXPECT_THROW(queue(2, "e", 7), N_NetException_PacketsStackingUp*);
  EXPECT_EQ(40960u, waiting());
  // The other queue has a limit of its own.
  std::string u(40960, 'u');
  client().queueUnreliable(u.data(), static_cast<unsigned>(u.size()), 0, 1);
  EXPECT_THROW(client().queueUnreliable(u.data(), 1, 0, 1), N_NetException_PacketsStackingUp*);

  // Clearing empties the queue but leaves the gate shut.
  client().flushReliable();
  EXPECT_EQ(40000u, batch().size());
  const float next = Access::nextFlushTime(client());
  client().clearReliable();
  client().clearUnreliable();
  EXPECT_EQ(0u, waiting());
  EXPECT_EQ(0u, client().getUnreliableBytesWaiting());
  EXPECT_EQ(next, Access::nextFlushTime(client()));
  queue(1, std::string(40960, 'f'));
  client().flushReliable();
  EXPECT_EQ(40960u, waiting());

  // A lower bandwidth can put the queue above its limit; the one entry
  // still leaves, however large.
  client().clearReliable();
  ASSERT_TRUE(gateOpen());
  queue(1, std::string(8000, 'a'));
  client().setBandwidth(1000);
  EXPECT_THROW(queue(1, ""), N_NetException_PacketsStackingUp*);
  client().flushReliable();
  EXPECT_EQ(8000u, batch().size());
  queue(1, std::string(4000, 'b'));
  EXPECT_EQ(4000u, waiting());
}

TEST_F(ClientQueueTest, ReplacementKeepsThePlaceAndTakesTheNewPriority) {
  queue(5, "one;", 1);
  queue(4, "two;", 2);
  queue(1, "x;");
  queue(3, "three;", 3);
  queue(1, "y;");  // key 0 never replaces
  queue(0, "TWO!!;", 2);
  EXPECT_EQ(20u, waiting());
  client().flushReliable();
  const std::string got = batch();
  ASSERT_EQ(20u, got.size()) << got;
  EXPECT_EQ("one;three;", got.substr(0, 10));
  EXPECT_TRUE(got.substr(10, 4) == "x;y;" || got.substr(10, 4) == "y;x;") << got;
  EXPECT_EQ("TWO!!;", got.substr(14));
}

TEST_F(ClientQueueTest, EmptyQueuesZeroLengthsAndZeroBandwidth) {
  // An empty queue: nothing happens, not even to the gate.
  client().flushReliable();
  client().flushUnreliable();
  EXPECT_EQ(0.0f, Access::nextFlushTime(client()));
  // A zero-length entry is taken and nothing is sent; the gate moves to now.
  queue(1, "");
  sleepMs(20);
  flushPaced(0.0);
  EXPECT_EQ(0u, waiting());
  EXPECT_EQ("", batch(100));

  // A zero bandwidth holds everything, and its limit is zero.
  ASSERT_TRUE(gateOpen());
  client().setBandwidth(0);
  queue(1, "");
  EXPECT_THROW(queue(1, "f"), N_NetException_PacketsStackingUp*);
  client().clearReliable();
  client().setBandwidth(10240);
  queue(2, "abc");
  queue(1, "de");
  client().setBandwidth(0);
  const float gate = Access::nextFlushTime(client());
  client().flushReliable();
  EXPECT_EQ(5u, waiting());
  EXPECT_EQ(gate, Access::nextFlushTime(client()));
  EXPECT_EQ("", batch(100));
  client().setBandwidth(10240);
  client().flushReliable();
  EXPECT_EQ("abcde", batch());
}

// A refused allocation leaves the queue as it was: the copy of a
// replacement, the list node of a new entry (after its copy was made), a
// flush's pointer array and its batch buffer. (Numbered by hand, not swept:
// the network thread allocates too, and a refusal there holds what it had
// until the runtime stops.)
TEST_F(ClientQueueTest, AFailedAllocationLeavesTheQueueAsItWas) {
  queue(3, "aaa", 1);
  queue(2, "bb");
  const std::pair<int, std::function<void()>> steps[] = {
      {1, [&] { queue(9, "zzzzz", 1); }}, {2, [&] { queue(9, "zzzzz", 4); }},
      {1, [&] { client().flushReliable(); }}, {2, [&] { client().flushReliable(); }}};
  for (const auto& [nth, step] : steps) {
    failAllocation(nth);
    EXPECT_THROW(step(), Q_MemoryException_Allocation*);
    platform::fault::disarmAll();
    EXPECT_EQ(5u, waiting());
    EXPECT_EQ(0.0f, Access::nextFlushTime(client()));
  }
  client().flushReliable();
  EXPECT_EQ("aaabb", batch());  // the first entry kept its payload and priority
}

TEST_F(ClientQueueTest, QueuesIgnoreTheStateOfTheChannel) {
  client().disconnect();
  queue(1, "lost");
  client().flushReliable();
  EXPECT_EQ(0u, waiting());
  // construct again drops whatever waits.
  queue(1, "waiting");
  std::string u = "u";
  client().queueUnreliable(u.data(), 1, 0, 0);
  client().construct(loopback(), port());
  EXPECT_EQ(0u, waiting());
  EXPECT_EQ(0u, client().getUnreliableBytesWaiting());
}

// Reading with the simulated delay: each read with the delay on, a message or
// not, draws the next gate from the thread's generator; a shut gate holds
// messages and draws nothing. Loss is for the unreliable channel only (the
// statistics test checks it): it leaves reliable messages alone.
TEST_F(ClientQueueTest, ReadingWithTheSimulatedDelay) {
  void* m = nullptr;
  unsigned n = 0;
  auto read = [&] { return client().poll(m, n) ? std::string(static_cast<const char*>(m), n) : "<none>"; };
  // The generator's first draws for `seed`, which is then set again.
  auto draws = [](unsigned seed) {
    platform::srand(seed);
    std::vector<int> out = {platform::rand(), platform::rand(), platform::rand()};
    platform::srand(seed);
    return out;
  };
  // A read between the ages `before` and now sets the gate to its age plus the delay drawn from `r`.
  auto expectGate = [&](int r, float before, unsigned minimum, unsigned maximum) {
    const float after = Access::sendAge(client());
    auto drawn = [&](float age) {
      const double u = static_cast<double>(r) * static_cast<double>(3.0518509e-05f);
      const double lo = minimum * static_cast<double>(0.001f), hi = maximum * static_cast<double>(0.001f);
      return static_cast<float>(((hi - lo) * u + static_cast<double>(age)) + lo);
    };
    EXPECT_GE(Access::nextPollTime(client()), drawn(before));
    EXPECT_LE(Access::nextPollTime(client()), drawn(after));
  };
  auto gateOpens = [&] { return waitFor([&] { return Access::sendAge(client()) >= Access::nextPollTime(client()); }); };
  N_Client::simulatePacketLoss(1.0f);
  std::vector<int> sequence = draws(11);
  for (const char* r : {"r1", "r2", "r3"}) peerSends(r);
  sleepMs(150);  // arrived, surely
  for (const char* r : {"r1", "r2", "r3"}) EXPECT_EQ(r, read());
  EXPECT_EQ(0.0f, Access::nextPollTime(client()));
  EXPECT_EQ(sequence[0], platform::rand()) << "without the delay nothing is drawn";

  N_Client::simulateLatency(100, 100);
  sequence = draws(5);
  for (const char* r : {"m1", "m2", "m3"}) peerSends(r);
  sleepMs(150);
  float before = Access::sendAge(client());
  EXPECT_EQ("m1", read());
  expectGate(sequence[0], before, 100, 100);
  float next = Access::nextPollTime(client());
  EXPECT_EQ("<none>", read());
  EXPECT_EQ(next, Access::nextPollTime(client()));
  ASSERT_TRUE(gateOpens());
  EXPECT_EQ("m2", read());
  next = Access::nextPollTime(client());
  // Switched off: no new draws, but the last gate holds its time.
  N_Client::simulateLatency(0, 0);
  EXPECT_EQ("<none>", read());
  ASSERT_TRUE(gateOpens());
  EXPECT_EQ("m3", read());
  EXPECT_EQ("<none>", read());
  EXPECT_EQ(next, Access::nextPollTime(client()));
  EXPECT_EQ(sequence[2], platform::rand()) << "two reads drew";

  // One end at 0 still switches the delay on; a maximum below the minimum
  // runs the draw from the minimum down.
  for (auto [minimum, maximum] : {std::pair{0u, 40u}, {40u, 0u}, {100u, 50u}}) {
    SCOPED_TRACE(testing::Message() << minimum << ".." << maximum);
    N_Client::simulateLatency(minimum, maximum);
    const int first = draws(77 + minimum)[0];
    ASSERT_TRUE(gateOpens());
    before = Access::sendAge(client());
    EXPECT_EQ("<none>", read());
    expectGate(first, before, minimum, maximum);
  }
}

// Under the network model a reliable message is timed from the read that
// took it from the socket, however long it waited there before.
TEST_F(ClientQueueTest, TheNetworkModelTimesAMessageFromTheReadThatTookItIn) {
  N_Client::simulateNetwork({.fDelay = 1000});
  void* m = nullptr;
  unsigned n = 0;
  EXPECT_FALSE(client().poll(m, n));
  peerSends("late");
  ASSERT_TRUE(waitFor([&] { return client().getStatistics().reliable.uMessagesReceived == 1; }));
  sleepMs(1500);  // longer than the delay since the read before
  EXPECT_FALSE(client().poll(m, n)) << "read at once";
  EXPECT_EQ(1u, client().getSimulationStats().uReceived);
  ASSERT_TRUE(waitFor([&] { return client().poll(m, n); }, 5000));
  EXPECT_EQ("late", std::string(static_cast<const char*>(m), n));
}

// Another model leaves what the last one holds held and starts the
// statistics again; switched off, the model hands it out at once, in its
// order and ahead of what comes later.
TEST_F(ClientQueueTest, ASwitchedOffModelHandsOutWhatItHolds) {
  N_Client::simulateNetwork({.fDelay = 5000});
  void* m = nullptr;
  unsigned n = 0;
  auto read = [&] { return client().poll(m, n) ? std::string(static_cast<const char*>(m), n) : "<none>"; };
  for (const char* h : {"h0", "h1", "h2"}) peerSends(h);
  ASSERT_TRUE(waitFor([&] { return read() == "<none>" && client().getSimulationStats().uReceived == 3; }));
  const unsigned held = client().getSimulationStats().uQueuedBytes;
  EXPECT_GT(held, 0u);
  N_Client::simulateNetwork({.fDelay = 1000});
  EXPECT_EQ("<none>", read()) << "still held";
  N_SimulationStats s = client().getSimulationStats();
  EXPECT_EQ(0u, s.uReceived);
  EXPECT_EQ(held, s.uQueuedBytes);
  EXPECT_EQ(held, s.uPeakQueuedBytes);
  N_Client::simulateNetwork(N_NetworkModel{});
  peerSends("k");
  ASSERT_TRUE(waitFor([&] { return client().getStatistics().reliable.uMessagesReceived == 4; }));
  for (const char* expected : {"h0", "h1", "h2", "k"}) EXPECT_EQ(expected, read());
  s = client().getSimulationStats();
  EXPECT_EQ(0u, s.uReceived);
  EXPECT_EQ(3u, s.uDelivered);
  EXPECT_EQ(0u, s.uQueuedBytes);
}

}  // namespace
