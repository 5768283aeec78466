// Payload queues, batches and pacing of N_Client, and the reading side with
// its simulated delay, over a real reliable channel: the client's TCP socket
// is accepted by a listener in this process, whose socket receives the
// batches and sends the messages that the client polls. No control channel
// is opened (update() is never called), so the client's bandwidth is what
// the test sets.
#include <algorithm>
#include <string>

#include "cs_fixture.h"
#include "fault_guard.h"
#include "win32.h"

using namespace cs_test;

namespace {

using Access = N_ClientTestAccess;

class ClientQueueTest : public ClientServerTest {
 protected:
  void SetUp() override {
    ClientServerTest::SetUp();
    m_listener = std::make_unique<N_Listener>(port());
    m_client = std::make_unique<N_Client>(loopback(), port());
    N_Socket::ConnectData* data = nullptr;
    ASSERT_TRUE(waitFor([&] { return m_listener->pollConnect(data); }, 5000));
    m_peer = std::make_unique<N_Socket>(data);
    ASSERT_TRUE(waitFor([&] { return Access::tcpSocket(*m_client)->isConnected(); }, 5000));
  }
  void TearDown() override {
    m_peer.reset();
    m_client.reset();
    m_listener.reset();
    ClientServerTest::TearDown();
  }

  N_Client& client() { return *m_client; }

  void queue(unsigned priority, const std::string& payload, unsigned key = 0) {
    client().queueReliable(const_cast<char*>(payload.data()), static_cast<unsigned>(payload.size()), key, priority);
  }
  // The next batch at the peer.
  std::optional<std::string> batch(int milliseconds = 3000) {
    void* data = nullptr;
    unsigned size = 0;
    if (!waitFor([&] { return m_peer->poll(data, size); }, milliseconds)) return std::nullopt;
    return std::string(static_cast<const char*>(data), size);
  }
  void peerSends(const std::string& message) {
    m_peer->send(const_cast<char*>(message.data()), static_cast<unsigned>(message.size()));
  }
  std::vector<std::string> payloads(const std::vector<Access::Entry>& entries) {
    std::vector<std::string> out;
    for (const auto& e : entries) out.push_back(e.payload);
    return out;
  }
  // Flushes the reliable queue; `before` and `after` bracket the age that
  // the pacing took.
  void flushTimed(float& before, float& after) {
    before = Access::sendAge(client());
    client().flushReliable();
    after = Access::sendAge(client());
  }
  static float paced(float age, double seconds) { return static_cast<float>(static_cast<double>(age) + seconds); }

 private:
  std::unique_ptr<N_Listener> m_listener;
  std::unique_ptr<N_Client> m_client;
  std::unique_ptr<N_Socket> m_peer;
};

const std::string kStackingUp = "Packets are stacking up. Already 4.00 seconds of data waiting in queue";

TEST_F(ClientQueueTest, BatchByPriorityWithinTheBudgetThenTheGateShuts) {
  client().setBandwidth(10240);  // budget 2560, limit 40960
  queue(1, std::string(1000, 'a'));
  queue(5, std::string(1000, 'b'));
  queue(3, std::string(2000, 'c'));
  EXPECT_EQ(4000u, Access::reliableBytes(client()));

  float before = 0, after = 0;
  flushTimed(before, after);
  // 5 and 1 make 2000; 3 would have made 3000, not below 2560.
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ(std::string(1000, 'b') + std::string(1000, 'a'), *got);
  EXPECT_EQ(2000u, Access::reliableBytes(client()));
  EXPECT_EQ(std::vector<std::string>{std::string(2000, 'c')}, payloads(Access::reliableEntries(client())));
  // 2000 / 10240 = 0.1953125 s from the age of the flush.
  const float next = Access::nextFlushTime(client());
  EXPECT_GE(next, paced(before, 0.1953125));
  EXPECT_LE(next, paced(after, 0.1953125));

  // The one gate holds both queues.
  client().flushReliable();
  std::string u = "unreliable";
  client().queueUnreliable(u.data(), static_cast<unsigned>(u.size()), 0, 1);
  client().flushUnreliable();
  EXPECT_EQ(2000u, Access::reliableBytes(client()));
  EXPECT_EQ(10u, Access::unreliableBytes(client()));
  EXPECT_EQ(next, Access::nextFlushTime(client()));
  EXPECT_FALSE(batch(100));

  // Open again at that age: the 2000 bytes leave, alone.
  ASSERT_TRUE(waitFor([&] { return Access::sendAge(client()) >= next; }, 2000));
  flushTimed(before, after);
  got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ(std::string(2000, 'c'), *got);
  EXPECT_EQ(0u, Access::reliableBytes(client()));
  EXPECT_GE(Access::nextFlushTime(client()), paced(before, 0.1953125));
  EXPECT_LE(Access::nextFlushTime(client()), paced(after, 0.1953125));
}

TEST_F(ClientQueueTest, ABatchStaysBelowTheBudget) {
  client().setBandwidth(10240);
  queue(3, std::string(1000, 'a'));
  queue(2, std::string(1560, 'b'));  // 2560: exactly the budget, passed over
  queue(1, std::string(1559, 'c'));  // 2559 goes
  client().flushReliable();
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ(std::string(1000, 'a') + std::string(1559, 'c'), *got);
  EXPECT_EQ(std::vector<std::string>{std::string(1560, 'b')}, payloads(Access::reliableEntries(client())));
  EXPECT_EQ(1560u, Access::reliableBytes(client()));
}

TEST_F(ClientQueueTest, AFirstEntryAboveTheBudgetLeavesAlone) {
  client().setBandwidth(10240);
  queue(1, std::string(10, 'y'));
  queue(9, std::string(5000, 'x'));
  float before = 0, after = 0;
  flushTimed(before, after);
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ(std::string(5000, 'x'), *got);
  EXPECT_EQ(10u, Access::reliableBytes(client()));
  EXPECT_GE(Access::nextFlushTime(client()), paced(before, 5000.0 / 10240.0));
  EXPECT_LE(Access::nextFlushTime(client()), paced(after, 5000.0 / 10240.0));
}

TEST_F(ClientQueueTest, QueueLimitIsFourSecondsOfData) {
  client().setBandwidth(10240);  // 40960 bytes per queue
  queue(1, std::string(40000, 'a'));
  queue(1, std::string(950, 'b'), 7);
  queue(1, std::string(10, 'c'));
  EXPECT_EQ(40960u, Access::reliableBytes(client()));
  const auto full = Access::reliableEntries(client());

  try {
    queue(1, "d");
    ADD_FAILURE() << "one byte above the limit was queued";
  } catch (N_NetException_PacketsStackingUp* e) {
    EXPECT_EQ(kStackingUp, e->getErrorMessage());
  }
  // A replacement counts the bytes it would replace: smaller still throws.
  EXPECT_THROW(queue(2, "e", 7), N_NetException_PacketsStackingUp*);
  EXPECT_EQ(40960u, Access::reliableBytes(client()));
  auto now = Access::reliableEntries(client());
  ASSERT_EQ(full.size(), now.size());
  EXPECT_EQ(1u, now[1].priority);
  EXPECT_EQ(std::string(950, 'b'), now[1].payload);

  // The other queue has a limit of its own.
  std::string u(40960, 'u');
  client().queueUnreliable(u.data(), static_cast<unsigned>(u.size()), 0, 1);
  EXPECT_THROW(client().queueUnreliable(u.data(), 1, 0, 1), N_NetException_PacketsStackingUp*);

  // A flush shuts the gate for the 40000 bytes; clearing empties the queue
  // but leaves the gate shut.
  client().flushReliable();
  ASSERT_TRUE(batch());
  const float next = Access::nextFlushTime(client());
  client().clearReliable();
  EXPECT_EQ(0u, Access::reliableBytes(client()));
  EXPECT_TRUE(Access::reliableEntries(client()).empty());
  EXPECT_EQ(next, Access::nextFlushTime(client()));
  queue(1, std::string(40960, 'f'));
  client().flushReliable();
  EXPECT_EQ(40960u, Access::reliableBytes(client()));
  EXPECT_FALSE(batch(100));
  client().clearUnreliable();
  EXPECT_EQ(0u, Access::unreliableBytes(client()));
}

TEST_F(ClientQueueTest, ALowerBandwidthCanPutTheQueueAboveItsLimit) {
  queue(1, std::string(8000, 'a'));
  client().setBandwidth(1000);  // limit 4000 now
  EXPECT_THROW(queue(1, ""), N_NetException_PacketsStackingUp*);
  client().flushReliable();  // the one entry leaves, however large
  ASSERT_TRUE(batch());
  queue(1, std::string(4000, 'b'));
  EXPECT_EQ(4000u, Access::reliableBytes(client()));
}

TEST_F(ClientQueueTest, ReplacementKeepsThePlaceAndTakesTheNewPriority) {
  queue(5, "one;", 1);
  queue(4, "two;", 2);
  queue(1, "x;");
  queue(3, "three;", 3);
  queue(1, "y;");
  queue(0, "TWO!!;", 2);
  const auto entries = Access::reliableEntries(client());
  ASSERT_EQ(5u, entries.size());
  EXPECT_EQ((std::vector<std::string>{"one;", "TWO!!;", "x;", "three;", "y;"}), payloads(entries));
  EXPECT_EQ(2u, entries[1].key);
  EXPECT_EQ(0u, entries[1].priority);
  // Key 0 never replaces: both unkeyed payloads are there.
  EXPECT_EQ(0u, entries[2].key);
  EXPECT_EQ(0u, entries[4].key);
  EXPECT_EQ(4u + 6 + 2 + 6 + 2, Access::reliableBytes(client()));

  client().flushReliable();
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ(20u, got->size());
  EXPECT_EQ("one;three;", got->substr(0, 10));
  EXPECT_TRUE(got->substr(10, 4) == "x;y;" || got->substr(10, 4) == "y;x;") << *got;
  EXPECT_EQ("TWO!!;", got->substr(14));
}

TEST_F(ClientQueueTest, EmptyAndZeroLengthFlushes) {
  // An empty queue: nothing at all happens, not even to the gate.
  client().flushReliable();
  client().flushUnreliable();
  EXPECT_EQ(0.0f, Access::nextFlushTime(client()));

  queue(1, "");
  EXPECT_EQ(1u, Access::reliableEntries(client()).size());
  sleepMs(20);
  float before = 0, after = 0;
  flushTimed(before, after);
  // Taken and removed; nothing is sent, and the gate moves to "now".
  EXPECT_TRUE(Access::reliableEntries(client()).empty());
  EXPECT_GE(Access::nextFlushTime(client()), before);
  EXPECT_LE(Access::nextFlushTime(client()), after);
  EXPECT_FALSE(batch(100));
}

TEST_F(ClientQueueTest, ZeroBandwidthHoldsEverything) {
  client().setBandwidth(0);
  // A limit of 0: an empty payload on an empty queue is all that fits.
  queue(1, "");
  EXPECT_THROW(queue(1, "f"), N_NetException_PacketsStackingUp*);
  client().setBandwidth(10240);
  queue(2, "abc");
  queue(1, "de");
  client().setBandwidth(0);
  EXPECT_THROW(queue(1, ""), N_NetException_PacketsStackingUp*);
  client().flushReliable();
  EXPECT_EQ(3u, Access::reliableEntries(client()).size());
  EXPECT_EQ(5u, Access::reliableBytes(client()));
  EXPECT_EQ(0.0f, Access::nextFlushTime(client()));
  EXPECT_FALSE(batch(100));
  client().setBandwidth(10240);
  client().flushReliable();
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ("abcde", *got);
}

TEST_F(ClientQueueTest, FailedAllocationsLeaveTheQueueAsItWas) {
  queue(3, "aaa", 1);
  queue(2, "bb");
  const auto entries = Access::reliableEntries(client());
  int refused = 0;
  {
    // The copy of a replacement.
    FaultGuard faults;
    faults.failAllocation(1);
    EXPECT_THROW(queue(9, "zzzzz", 1), Q_MemoryException_Allocation*);
    refused += platform::fault::allocationsFailed();
  }
  {
    // The list node of a new entry, after its copy was made.
    FaultGuard faults;
    faults.failAllocation(2);
    EXPECT_THROW(queue(9, "zzzzz", 4), Q_MemoryException_Allocation*);
    refused += platform::fault::allocationsFailed();
  }
  EXPECT_EQ(payloads(entries), payloads(Access::reliableEntries(client())));
  EXPECT_EQ(3u, Access::reliableEntries(client())[0].priority);
  EXPECT_EQ(5u, Access::reliableBytes(client()));

  // A flush that can't get its pointer array or its batch buffer.
  for (int nth : {1, 2}) {
    FaultGuard faults;
    faults.failAllocation(nth);
    EXPECT_THROW(client().flushReliable(), Q_MemoryException_Allocation*);
    refused += platform::fault::allocationsFailed();
    EXPECT_EQ(payloads(entries), payloads(Access::reliableEntries(client())));
    EXPECT_EQ(5u, Access::reliableBytes(client()));
    EXPECT_EQ(0.0f, Access::nextFlushTime(client()));
  }
  countRefusedAllocations(refused);
  client().flushReliable();
  auto got = batch();
  ASSERT_TRUE(got);
  EXPECT_EQ("aaabb", *got);
}

TEST_F(ClientQueueTest, QueuesIgnoreTheStateOfTheChannel) {
  client().disconnect();
  queue(1, "lost");
  client().flushReliable();
  EXPECT_TRUE(Access::reliableEntries(client()).empty());
  EXPECT_EQ(0u, Access::reliableBytes(client()));
  // construct again drops whatever waits.
  queue(1, "waiting");
  std::string u = "u";
  client().queueUnreliable(u.data(), 1, 0, 0);
  client().construct(loopback(), port());
  EXPECT_TRUE(Access::reliableEntries(client()).empty());
  EXPECT_TRUE(Access::unreliableEntries(client()).empty());
  EXPECT_EQ(0u, Access::reliableBytes(client()));
}

// ---------------------------------------------------------------------------
// Reading, with the simulated delay. Loss is for the unreliable channel only
// and is checked with client processes; here it must leave reliable
// messages alone.

class ClientPollTest : public ClientQueueTest {
 protected:
  // The messages the peer sent, read with the gate open.
  std::vector<std::string> readAll() {
    std::vector<std::string> out;
    void* m = nullptr;
    unsigned n = 0;
    while (client().poll(m, n)) out.emplace_back(static_cast<const char*>(m), n);
    return out;
  }
  // Sends and waits until the bytes have surely arrived, without polling
  // (a poll would draw).
  void sendAndSettle(const std::vector<std::string>& messages) {
    for (const auto& m : messages) peerSends(m);
    sleepMs(150);
  }
  static std::vector<int> randSequence(unsigned seed, int count) {
    platform::srand(seed);
    std::vector<int> out;
    for (int i = 0; i < count; ++i) out.push_back(platform::rand());
    platform::srand(seed);
    return out;
  }
  // The pacing formula for a draw `r` and the age `age` it was taken at.
  static float drawn(int r, float age, unsigned minimum, unsigned maximum) {
    const double u = static_cast<double>(r) * static_cast<double>(3.0518509e-05f);
    const double lo = static_cast<double>(minimum) * static_cast<double>(0.001f);
    const double hi = static_cast<double>(maximum) * static_cast<double>(0.001f);
    return static_cast<float>(((hi - lo) * u + static_cast<double>(age)) + lo);
  }
};

TEST_F(ClientPollTest, WithoutSimulationNothingIsDrawn) {
  N_Client::simulatePacketLoss(1.0f);  // loss never touches reliable messages
  const auto sequence = randSequence(11, 1);
  sendAndSettle({"r1", "r2", "r3"});
  EXPECT_EQ((std::vector<std::string>{"r1", "r2", "r3"}), readAll());
  EXPECT_EQ(0.0f, Access::nextPollTime(client()));
  EXPECT_EQ(sequence[0], platform::rand());
}

TEST_F(ClientPollTest, EqualLimitsGiveAFixedGate) {
  N_Client::simulateLatency(100, 100);
  const auto sequence = randSequence(5, 3);
  sendAndSettle({"m1", "m2", "m3"});
  void* m = nullptr;
  unsigned n = 0;
  float before = Access::sendAge(client());
  ASSERT_TRUE(client().poll(m, n));
  float after = Access::sendAge(client());
  EXPECT_EQ("m1", std::string(static_cast<const char*>(m), n));
  float next = Access::nextPollTime(client());
  EXPECT_GE(next, drawn(sequence[0], before, 100, 100));
  EXPECT_LE(next, drawn(sequence[0], after, 100, 100));
  EXPECT_GE(next - after, 0.0999f);

  // Shut, with messages waiting, and a shut gate draws nothing.
  EXPECT_FALSE(client().poll(m, n));
  EXPECT_EQ(next, Access::nextPollTime(client()));
  ASSERT_TRUE(waitFor([&] { return Access::sendAge(client()) >= next; }, 2000));
  ASSERT_TRUE(client().poll(m, n));
  EXPECT_EQ("m2", std::string(static_cast<const char*>(m), n));
  next = Access::nextPollTime(client());

  // Switched off: no new draws, but the last gate holds its time.
  N_Client::simulateLatency(0, 0);
  EXPECT_FALSE(client().poll(m, n));
  ASSERT_TRUE(waitFor([&] { return Access::sendAge(client()) >= next; }, 2000));
  EXPECT_EQ((std::vector<std::string>{"m3"}), readAll());
  EXPECT_EQ(next, Access::nextPollTime(client()));
  EXPECT_EQ(sequence[2], platform::rand());
}

TEST_F(ClientPollTest, EveryReadDrawsEvenWithoutAMessage) {
  // One end of the range at 0 still switches the delay on; a maximum below
  // the minimum runs the draw from the minimum down.
  const std::pair<unsigned, unsigned> ranges[] = {{0, 40}, {40, 0}, {100, 50}};
  for (auto [minimum, maximum] : ranges) {
    SCOPED_TRACE(testing::Message() << minimum << ".." << maximum);
    N_Client::simulateLatency(minimum, maximum);
    const auto sequence = randSequence(77 + minimum, 1);
    ASSERT_TRUE(waitFor([&] { return Access::sendAge(client()) >= Access::nextPollTime(client()); }, 2000));
    void* m = nullptr;
    unsigned n = 0;
    float before = Access::sendAge(client());
    EXPECT_FALSE(client().poll(m, n));
    float after = Access::sendAge(client());
    const float next = Access::nextPollTime(client());
    EXPECT_GE(next, drawn(sequence[0], before, minimum, maximum));
    EXPECT_LE(next, drawn(sequence[0], after, minimum, maximum));
    const float low = static_cast<float>(std::min(minimum, maximum)) * 0.001f;
    const float high = static_cast<float>(std::max(minimum, maximum)) * 0.001f;
    EXPECT_GE(next - after, low - 0.001f);
    EXPECT_LE(next - before, high + 0.001f);
  }
}

}  // namespace
