// The network model (N_Client::simulateNetwork) over real loopback channels:
// client host processes send numbered payloads stamped with the steady clock
// (the same clock in every process) to a server in this process, which reads
// them through the model. What it loses, copies and reorders is compared with
// the seed's draws, each message's delay with its own draw, and the cap's
// rate and queue limit with the settings.
#include <algorithm>
#include <map>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

// One payload "<letter>...<index>@<stamp ns>;" as read: when the sender
// queued it and when this process read it.
struct Delivery {
  int index;
  long long stampNs, readNs;
  unsigned size;
  double latencyMs() const { return static_cast<double>(readNs - stampNs) / 1e6; }
};
using Deliveries = std::map<char, std::vector<Delivery>>;  // by the first letter

void readAll(N_Client& client, Deliveries& out) {
  void* m = nullptr;
  unsigned n = 0;
  while (client.poll(m, n)) {
    const long long read = std::chrono::nanoseconds(Clock::now().time_since_epoch()).count();
    const std::string text(static_cast<const char*>(m), n);
    for (std::size_t start = 0, end; (end = text.find(';', start)) != std::string::npos; start = end + 1) {
      const std::string p = text.substr(start, end - start);
      const std::size_t digits = p.find_first_of("0123456789"), at = p.find('@');
      ASSERT_TRUE(digits != std::string::npos && at != std::string::npos) << p;
      out[p[0]].push_back({std::atoi(&p[digits]), std::atoll(&p[at + 1]), read, static_cast<unsigned>(p.size() + 1)});
    }
  }
}

// The counts in order: received, delivered, delayed, lost, duplicated,
// reordered, dropped.
std::vector<unsigned> counts(const N_SimulationStats& s) {
  return {s.uReceived, s.uDelivered, s.uDelayed, s.uLost, s.uDuplicated, s.uReordered, s.uDropped};
}

// A delay drawn from u, in ms.
double drawnDelay(const N_NetworkModel& m, double u) {
  return std::max(0.0, static_cast<double>(m.fDelay) + static_cast<double>(m.fJitter) * (2.0 * u - 1.0));
}

using NetworkModelTest = ClientServerTest;

// Two connections, each with generators of its own per channel: the same
// unreliable stream gets the same fate on both, whatever else either carries
// meanwhile (b a reliable stream too). Then a cap on both.
TEST_F(NetworkModelTest, TwoConnectionsFollowTheDrawsAndTheCap) {
  heartbeat(1.0f, 5.0f);  // a loaded machine may hold a peer for a second
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess a(2, port()), b(3, port());
  PeerProcess* peers[2] = {&a, &b};
  N_Client* clients[2] = {a.admit(pump), b.admit(pump)};
  ASSERT_TRUE(clients[0] != nullptr && clients[1] != nullptr);
  EXPECT_EQ(0u, clients[0]->getSimulationStats().uReceived) << "off until set";
  Deliveries got[2];
  const Pump read = [&] {
    pump();
    for (int i = 0; i < 2; ++i) readAll(*clients[i], got[i]);
  };
  // Sets the model, gives each peer its "send-x COUNT ..." commands and reads
  // until the model has taken every message and holds none.
  auto exchange = [&](const N_NetworkModel& model, std::vector<std::string> commands[2]) {
    N_Client::simulateNetwork(model);
    unsigned want[2] = {0, 0};
    for (int i = 0; i < 2; ++i) {
      got[i].clear();
      for (const std::string& c : commands[i]) peers[i]->command(c), want[i] += std::atoi(&c[7]);
    }
    auto taken = [&](int i) {
      const N_SimulationStats s = clients[i]->getSimulationStats();
      return s.uReceived >= want[i] && s.uQueuedBytes == 0;
    };
    const bool done = waitFor([&] { return taken(0) && taken(1); }, 60000, read);
    for (int i = 0; i < 2 && !done; ++i) {
      const N_SimulationStats s = clients[i]->getSimulationStats();
      ADD_FAILURE() << peers[i]->host() << ": " << s.uReceived << " of " << want[i] << " taken, " << s.uQueuedBytes
                    << " bytes held, " << (clients[i]->isConnected() ? "connected" : "disconnected");
    }
    pumpFor(100, read);
    return done;
  };

  constexpr unsigned kCount = 300, kReliable = 100;
  const N_NetworkModel model{.fDelay = 40, .fJitter = 20, .fLoss = 0.25f, .fDuplicate = 0.1f, .fReorder = 0.1f,
                             .fReorderWindow = 50, .uSeed = 20240};
  std::vector<std::string> streams[2] = {{"send-u 300 u 5 stamp"}, {"send-u 300 u 5 stamp", "send-r 100 r 10 stamp"}};
  ASSERT_TRUE(exchange(model, streams));
  EXPECT_EQ(20240u, N_Client::getNetworkModel().uSeed);

  // What the documented draws do to each unreliable message, in order of
  // arrival: five each (loss, copy, reorder, delay, the copy's delay).
  unsigned state = model.uSeed + 0x9E3779B9u;
  auto draw = [&] { return platform::rand(state) / 32768.0; };
  std::vector<int> expected;
  std::map<int, std::vector<double>> expectedDelays;  // by index, ascending
  unsigned lost = 0, copied = 0, reordered = 0;
  double delaySum = 0;
  for (unsigned i = 0; i < kCount; ++i) {
    const double loss = draw(), copy = draw(), reorder = draw(), delay = drawnDelay(model, draw());
    const double copyDelay = drawnDelay(model, draw());
    lost += loss < model.fLoss;
    if (loss < model.fLoss) continue;
    const bool late = reorder < model.fReorder;
    reordered += late;
    expectedDelays[i] = {delay + (late ? model.fReorderWindow : 0)};
    if (copy < model.fDuplicate) ++copied, expectedDelays[i].push_back(copyDelay);
    std::sort(expectedDelays[i].begin(), expectedDelays[i].end());
    for (double d : expectedDelays[i]) expected.push_back(i), delaySum += d;
  }
  for (int c = 0; c < 2; ++c) {
    SCOPED_TRACE(c == 0 ? "a" : "b");
    const std::vector<Delivery>& d = got[c]['u'];
    // Exactly the messages the draws keep, the copies twice.
    std::vector<int> indices;
    for (const Delivery& x : d) indices.push_back(x.index);
    std::sort(indices.begin(), indices.end());
    EXPECT_EQ(expected, indices);
    const N_SimulationStats s = clients[c]->getSimulationStats();
    const unsigned r = c == 0 ? 0 : kReliable, n = static_cast<unsigned>(expected.size()) + r;
    EXPECT_EQ((std::vector<unsigned>{kCount + r, n, n, lost, copied, reordered, 0}), counts(s));
    if (c == 0) {  // b's reliable delays depend on when they arrived
      EXPECT_NEAR(delaySum / expected.size(), s.dMeanDelay, 1e-6);
    }

    // No message is read before its own drawn delay has passed since it was
    // sent; a copied one has two delays, matched smallest to smallest.
    std::map<int, std::vector<double>> measured;
    for (const Delivery& x : d) measured[x.index].push_back(x.latencyMs());
    std::vector<double> excess;
    for (auto& [index, list] : measured) {
      std::sort(list.begin(), list.end());
      const std::vector<double>& want = expectedDelays[index];
      for (std::size_t k = 0; k < list.size() && list.size() == want.size(); ++k) {
        EXPECT_GE(list[k], want[k] - 0.5) << "message " << index;
        excess.push_back(list[k] - want[k]);
      }
    }
    ASSERT_FALSE(excess.empty());
    std::nth_element(excess.begin(), excess.begin() + excess.size() / 2, excess.end());
    EXPECT_LT(excess[excess.size() / 2], 50.0) << "median time beyond the drawn delay, ms";

    // Messages leave in order of the time they became readable: an earlier
    // arrival read after a later one needs at least the later one's delay.
    // (Arrivals on loopback keep the sending order.)
    unsigned inversions = 0;
    for (std::size_t i = 0; i < d.size(); ++i)
      for (std::size_t j = i + 1; j < d.size(); ++j)
        if (d[j].index < d[i].index) {
          ++inversions;
          EXPECT_GE(expectedDelays[d[j].index].back(), expectedDelays[d[i].index].front())
              << "message " << d[j].index << " read after " << d[i].index;
        }
    EXPECT_GT(inversions, 0u) << "jitter and the reorder window reorder some";
  }
  // Reliable messages are only delayed, by their own draws (one each from
  // uSeed), and never overtake each other though the draws alone would.
  const std::vector<Delivery>& rd = got[1]['r'];
  ASSERT_EQ(std::size_t{kReliable}, rd.size());
  state = model.uSeed;
  bool wouldOvertake = false;
  double due = 0;  // when the message before would be readable by its draw alone
  for (int i = 0; i < static_cast<int>(kReliable); ++i) {
    const double delay = drawnDelay(model, draw()), before = due;
    EXPECT_EQ(i, rd[i].index);
    EXPECT_GE(rd[i].latencyMs(), delay - 0.5) << "message " << i;
    due = rd[i].stampNs / 1e6 + delay;
    wouldOvertake |= i > 0 && due + 5 < before;
  }
  EXPECT_TRUE(wouldOvertake) << "the draws alone would have reordered some";

  // Above the cap the link passes its rate and the queue holds its limit:
  // unreliable messages beyond it (a) are dropped, reliable ones (b) wait.
  // About 113-byte payloads, offered at the sender's grant (10240 B/s).
  constexpr unsigned kCap = 2000, kLimit = 1200;
  const std::string fill(90, 'x');
  std::vector<std::string> flood[2] = {{"send-u 150 u" + fill + " 0 stamp"}, {"send-r 40 r" + fill + " 0 stamp"}};
  ASSERT_TRUE(exchange({.uBandwidth = kCap, .uQueueLimit = kLimit}, flood));
  for (int c = 0; c < 2; ++c) {
    const bool reliable = c == 1;
    SCOPED_TRACE(reliable ? "reliable" : "unreliable");
    const std::vector<Delivery>& d = got[c][reliable ? 'r' : 'u'];
    ASSERT_FALSE(d.empty());
    const N_SimulationStats s = clients[c]->getSimulationStats();
    const unsigned sent = reliable ? 40 : 150, n = static_cast<unsigned>(d.size());
    EXPECT_EQ((std::vector<unsigned>{sent, n, n, 0, 0, 0, sent - n}), counts(s));
    EXPECT_EQ(reliable, n == sent) << "reliable messages wait for room; unreliable ones, offered at several times the "
                                      "cap, are dropped";
    unsigned largest = 0, bytes = 0;
    for (std::size_t i = 0; i < d.size(); ++i) {
      largest = std::max(largest, d[i].size), bytes += d[i].size;
      EXPECT_TRUE(i == 0 || d[i].index > d[i - 1].index) << "the link keeps the order";
    }
    EXPECT_LE(s.uPeakQueuedBytes, kLimit + (reliable ? largest : 0));
    EXPECT_GE(s.uPeakQueuedBytes, kLimit - largest) << "the queue filled up";
    // Nothing passes faster than the cap: the last message can't be through
    // before the bytes up to it had the link's time, counted from the first
    // one's sending. Nor slower: none waits longer than a full queue takes.
    EXPECT_GE((d.back().readNs - d.front().stampNs) / 1e9, bytes / double(kCap) - 0.001);
    EXPECT_LE(s.dMeanDelay, 1000.0 * (kLimit + largest) / kCap);
  }

  EXPECT_TRUE(a.quit(10000, pump));
  EXPECT_TRUE(b.quit(10000, pump));
}

}  // namespace
