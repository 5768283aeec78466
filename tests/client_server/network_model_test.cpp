// The network model (N_Client::simulateNetwork) measured over real loopback
// channels: a client host process sends numbered payloads stamped with the
// steady clock (the same clock in every process), and the server's end in
// this process reads them through the model. What it loses, copies and
// reorders is compared with the draws of the seed, each message's delay
// with its own draw, and the cap's rate and queue limit with the settings.
#include <algorithm>
#include <map>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

// One payload as read: its number, when it was queued by the sender and how
// long it took until this process read it.
struct Delivery {
  int index;
  long long stampNs;
  long long readNs;
  unsigned size;
  double latencyMs() const { return static_cast<double>(readNs - stampNs) / 1e6; }
};

long long nowNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now().time_since_epoch()).count();
}

// What the documented draws of a seed do to each unreliable message, in
// order of arrival (delays in milliseconds, the reorder window included).
struct Fate {
  bool lost = false;
  bool copied = false;
  bool reordered = false;
  double delay = 0.0;
  double copyDelay = 0.0;
};

double drawnDelay(const N_NetworkModel& m, double u) {
  const double ms = static_cast<double>(m.fDelay) + static_cast<double>(m.fJitter) * (2.0 * u - 1.0);
  return ms > 0.0 ? ms : 0.0;
}

std::vector<Fate> unreliableFates(const N_NetworkModel& m, int count) {
  unsigned state = m.uSeed + 0x9E3779B9u;
  auto u = [&] { return platform::rand(state) / 32768.0; };
  std::vector<Fate> out(count);
  for (Fate& f : out) {
    const double loss = u(), copy = u(), reorder = u();
    f.delay = drawnDelay(m, u());
    f.copyDelay = drawnDelay(m, u());
    f.lost = loss < m.fLoss;
    f.copied = !f.lost && copy < m.fDuplicate;
    f.reordered = !f.lost && m.fReorderWindow > 0 && reorder < m.fReorder;
    if (f.reordered) f.delay += m.fReorderWindow;
  }
  return out;
}

std::vector<double> reliableDelays(const N_NetworkModel& m, int count) {
  unsigned state = m.uSeed;
  std::vector<double> out(count);
  for (double& d : out) d = drawnDelay(m, platform::rand(state) / 32768.0);
  return out;
}

N_NetworkModel modelOf(float delay, float jitter, float loss, float duplicate, float reorder, float window,
                       unsigned seed) {
  N_NetworkModel m;
  m.fDelay = delay;
  m.fJitter = jitter;
  m.fLoss = loss;
  m.fDuplicate = duplicate;
  m.fReorder = reorder;
  m.fReorderWindow = window;
  m.uSeed = seed;
  return m;
}

class NetworkModelTest : public ClientServerTest {
 protected:
  void SetUp() override {
    ClientServerTest::SetUp();
    heartbeat(1.0f, 1.0f);
  }
  static std::vector<std::string> peerOptions() { return {"--hb-frequency", "1", "--hb-latency", "1"}; }

  // Reads everything the client hands out now; payloads "<prefix><i>@<ns>;".
  static void readAll(N_Client& client, const std::string& prefix, std::vector<Delivery>& out) {
    void* m = nullptr;
    unsigned n = 0;
    while (client.poll(m, n)) {
      const long long read = nowNs();
      const std::string text(static_cast<const char*>(m), n);
      std::size_t start = 0;
      for (std::size_t end; (end = text.find(';', start)) != std::string::npos; start = end + 1) {
        const std::string payload = text.substr(start, end - start);
        ASSERT_EQ(0u, payload.find(prefix)) << payload;
        const std::size_t at = payload.find('@');
        ASSERT_NE(std::string::npos, at) << payload;
        out.push_back({std::atoi(payload.c_str() + prefix.size()), std::atoll(payload.c_str() + at + 1), read,
                       static_cast<unsigned>(payload.size() + 1)});
      }
    }
  }
};

// Two connections, each with its own generators: the same stream gets the
// same fate on both, whatever the other one does meanwhile.
TEST_F(NetworkModelTest, UnreliableStreamIsLostCopiedReorderedAndDelayedAsTheSeedDraws) {
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess a(2, port(), peerOptions()), b(3, port(), peerOptions());
  N_Client* clients[2] = {a.admit(pump), b.admit(pump)};
  ASSERT_NE(nullptr, clients[0]);
  ASSERT_NE(nullptr, clients[1]);
  EXPECT_EQ(0u, clients[0]->getSimulationStats().uReceived) << "off until set";

  const N_NetworkModel model = modelOf(40, 20, 0.25f, 0.1f, 0.1f, 50, 20240);
  N_Client::simulateNetwork(model);
  EXPECT_EQ(20240u, N_Client::getNetworkModel().uSeed);

  constexpr int kCount = 300;
  std::vector<Delivery> got[2];
  const Pump readBoth = [&] {
    pump();
    for (int i = 0; i < 2; ++i) readAll(*clients[i], "u", got[i]);
  };
  a.command("send-u " + std::to_string(kCount) + " u 5 stamp");
  b.command("send-u " + std::to_string(kCount) + " u 5 stamp");
  ASSERT_TRUE(a.waitLine("sent " + std::to_string(kCount), 60000, readBoth));
  ASSERT_TRUE(b.waitLine("sent " + std::to_string(kCount), 60000, readBoth));
  // The longest delay is 60 + 50 ms; wait until nothing is held any more.
  ASSERT_TRUE(waitFor(
      [&] {
        for (N_Client* c : clients) {
          const N_SimulationStats s = c->getSimulationStats();
          if (s.uReceived < kCount || s.uQueuedBytes > 0) return false;
        }
        return true;
      },
      20000, readBoth));
  pumpFor(100, readBoth);

  const std::vector<Fate> fates = unreliableFates(model, kCount);
  std::vector<int> expected;
  std::map<int, std::vector<double>> expectedDelays;  // by index, ascending
  unsigned lost = 0, copied = 0, reordered = 0;
  double delaySum = 0;
  for (int i = 0; i < kCount; ++i) {
    const Fate& f = fates[i];
    lost += f.lost;
    copied += f.copied;
    reordered += f.reordered;
    if (f.lost) continue;
    expected.push_back(i);
    expectedDelays[i].push_back(f.delay);
    delaySum += f.delay;
    if (f.copied) {
      expected.push_back(i);
      expectedDelays[i].push_back(f.copyDelay);
      delaySum += f.copyDelay;
    }
    std::sort(expectedDelays[i].begin(), expectedDelays[i].end());
  }
  // The seed's shares are near the settings, so the sample tests what they say.
  EXPECT_NEAR(0.25, lost / double(kCount), 0.08);
  EXPECT_NEAR(0.1, copied / double(kCount - lost), 0.06);
  EXPECT_NEAR(0.1, reordered / double(kCount - lost), 0.06);

  for (int c = 0; c < 2; ++c) {
    SCOPED_TRACE("connection " + std::to_string(c));
    const std::vector<Delivery>& d = got[c];
    // Exactly the messages the draws keep, the copies twice.
    std::vector<int> indices;
    for (const Delivery& x : d) indices.push_back(x.index);
    std::vector<int> sorted = indices;
    std::sort(sorted.begin(), sorted.end());
    EXPECT_EQ(expected, sorted);

    const N_SimulationStats s = clients[c]->getSimulationStats();
    EXPECT_EQ(unsigned(kCount), s.uReceived);
    EXPECT_EQ(lost, s.uLost);
    EXPECT_EQ(copied, s.uDuplicated);
    EXPECT_EQ(reordered, s.uReordered);
    EXPECT_EQ(0u, s.uDropped);
    EXPECT_EQ(unsigned(expected.size()), s.uDelivered);
    EXPECT_EQ(unsigned(expected.size()), s.uDelayed);
    EXPECT_NEAR(delaySum / expected.size(), s.dMeanDelay, 1e-6);
    EXPECT_GT(s.uPeakQueuedBytes, 0u);

    // No message is read before its own drawn delay has passed since it was
    // sent; a copied one has two delays, matched smallest to smallest.
    std::map<int, std::vector<double>> measured;
    for (const Delivery& x : d) measured[x.index].push_back(x.latencyMs());
    std::vector<double> excess;
    for (auto& [index, list] : measured) {
      std::sort(list.begin(), list.end());
      const std::vector<double>& want = expectedDelays[index];
      if (list.size() != want.size()) continue;  // reported by the comparison above
      for (std::size_t k = 0; k < list.size(); ++k) {
        EXPECT_GE(list[k], want[k] - 0.5) << "message " << index;
        excess.push_back(list[k] - want[k]);
      }
    }
    ASSERT_FALSE(excess.empty());
    std::sort(excess.begin(), excess.end());
    EXPECT_LT(excess[excess.size() / 2], 50.0) << "median time beyond the drawn delay, ms";

    // Messages leave in order of the time they became readable: an earlier
    // arrival read after a later one needs at least the later one's delay.
    // (Arrivals on loopback keep the sending order.)
    unsigned inversions = 0;
    for (std::size_t i = 0; i < d.size(); ++i)
      for (std::size_t j = i + 1; j < d.size(); ++j) {
        if (d[j].index >= d[i].index) continue;
        ++inversions;
        const double latest = expectedDelays[d[j].index].back();
        const double earliest = expectedDelays[d[i].index].front();
        EXPECT_GE(latest, earliest) << "message " << d[j].index << " read after " << d[i].index;
      }
    EXPECT_GT(inversions, 0u) << "jitter and the reorder window reorder some";
  }
  EXPECT_TRUE(a.quit(10000, pump));
  EXPECT_TRUE(b.quit(10000, pump));
}

TEST_F(NetworkModelTest, ReliableMessagesAreOnlyDelayedAndNeverOvertakeEachOther) {
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess peer(2, port(), peerOptions());
  N_Client* client = peer.admit(pump);
  ASSERT_NE(nullptr, client);

  // Everything that could happen to an unreliable message is set to happen.
  const N_NetworkModel model = modelOf(30, 25, 1.0f, 1.0f, 1.0f, 100, 99);
  N_Client::simulateNetwork(model);

  constexpr int kCount = 100;
  std::vector<Delivery> got;
  const Pump read = [&] {
    pump();
    readAll(*client, "r", got);
  };
  peer.command("send-r " + std::to_string(kCount) + " r 3 stamp");
  ASSERT_TRUE(peer.waitLine("sent " + std::to_string(kCount), 60000, read));
  ASSERT_TRUE(waitFor([&] { return got.size() >= std::size_t(kCount); }, 20000, read));
  pumpFor(200, read);

  ASSERT_EQ(std::size_t(kCount), got.size());
  const std::vector<double> delays = reliableDelays(model, kCount);
  bool wouldOvertake = false;
  for (int i = 0; i < kCount; ++i) {
    EXPECT_EQ(i, got[i].index);
    EXPECT_GE(got[i].latencyMs(), delays[i] - 0.5) << "message " << i;
    if (i > 0 && got[i].stampNs / 1e6 + delays[i] + 5 < got[i - 1].stampNs / 1e6 + delays[i - 1]) wouldOvertake = true;
  }
  EXPECT_TRUE(wouldOvertake) << "the draws alone would have reordered some";
  const N_SimulationStats s = client->getSimulationStats();
  EXPECT_EQ(unsigned(kCount), s.uReceived);
  EXPECT_EQ(unsigned(kCount), s.uDelivered);
  EXPECT_EQ(0u, s.uLost);
  EXPECT_EQ(0u, s.uDuplicated);
  EXPECT_EQ(0u, s.uReordered);
  EXPECT_EQ(0u, s.uDropped);
  EXPECT_GE(s.dMeanDelay, 30.0 - 25.0);
  EXPECT_TRUE(peer.quit(10000, pump));
}

// Above the cap the link passes its rate and the queue holds its limit:
// unreliable messages beyond it are dropped, reliable ones wait.
TEST_F(NetworkModelTest, TheCapPassesItsRateAndTheQueueLimitHolds) {
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess peer(2, port(), peerOptions());
  N_Client* client = peer.admit(pump);
  ASSERT_NE(nullptr, client);

  constexpr unsigned kCap = 2000;
  // About 113-byte payloads; the sender offers them at its grant (10240 B/s).
  for (const bool reliable : {false, true}) {
    SCOPED_TRACE(reliable ? "reliable" : "unreliable");
    N_NetworkModel model;
    model.uBandwidth = kCap;
    model.uQueueLimit = reliable ? 600 : 1200;
    N_Client::simulateNetwork(model);
    const std::string prefix = (reliable ? "r" : "u") + std::string(90, 'x');
    const int count = reliable ? 30 : 150;
    std::vector<Delivery> got;
    const Pump read = [&] {
      pump();
      readAll(*client, prefix, got);
    };
    peer.command(std::string(reliable ? "send-r " : "send-u ") + std::to_string(count) + " " + prefix + " 0 stamp");
    ASSERT_TRUE(peer.waitLine("sent " + std::to_string(count), 60000, read));
    ASSERT_TRUE(waitFor(
        [&] {
          const N_SimulationStats s = client->getSimulationStats();
          return s.uReceived >= unsigned(count) && s.uQueuedBytes == 0;
        },
        30000, read));
    pumpFor(100, read);

    const N_SimulationStats s = client->getSimulationStats();
    EXPECT_EQ(unsigned(count), s.uReceived);
    EXPECT_EQ(unsigned(got.size()), s.uDelivered);
    EXPECT_EQ(unsigned(count), s.uDelivered + s.uDropped);
    EXPECT_EQ(0u, s.uLost);
    ASSERT_FALSE(got.empty());
    unsigned largest = 0, bytes = 0;
    for (std::size_t i = 0; i < got.size(); ++i) {
      largest = std::max(largest, got[i].size);
      bytes += got[i].size;
      if (i > 0) {
        EXPECT_GT(got[i].index, got[i - 1].index) << "the link keeps the order";
      }
    }
    if (reliable) {
      EXPECT_EQ(0u, s.uDropped) << "reliable messages wait for room";
      EXPECT_EQ(std::size_t(count), got.size());
      EXPECT_LE(s.uPeakQueuedBytes, model.uQueueLimit + largest);
    } else {
      EXPECT_GT(s.uDropped, 0u) << "offered at several times the cap";
      EXPECT_LE(s.uPeakQueuedBytes, model.uQueueLimit);
    }
    EXPECT_GE(s.uPeakQueuedBytes, model.uQueueLimit - largest) << "the queue filled up";
    // Nothing passes faster than the cap: the last message can't be through
    // before the bytes up to it had the link's time, counted from the first
    // one's sending. And the link was busy throughout, so not much slower.
    const double seconds = static_cast<double>(got.back().readNs - got.front().stampNs) / 1e9;
    EXPECT_GE(seconds, bytes / double(kCap) - 0.001);
    EXPECT_GE(bytes / seconds, 0.6 * kCap);
    EXPECT_GT(s.dMeanDelay, 0.0);
  }
  EXPECT_TRUE(peer.quit(10000, pump));
}

// The model acts on a client end just as on a server's; switched off, what it
// holds is readable at once and in order, ahead of what comes later.
TEST_F(NetworkModelTest, OnTheClientEndAndSwitchedOffWhileHolding) {
  ScriptedServer script(port());
  N_Client client(loopback(), port());
  ASSERT_TRUE(waitFor([&] { return client.isConnected(); }, 5000, [&] { client.update(); }));
  std::vector<Delivery> got;
  const Pump read = [&] {
    client.update();
    readAll(client, "m", got);
  };
  auto send = [&](int i) { ASSERT_TRUE(script.sendData("m" + std::to_string(i) + "@" + std::to_string(nowNs()) + ";")); };

  // Off: read as it comes, and nothing counted.
  send(0);
  ASSERT_TRUE(waitFor([&] { return got.size() == 1; }, 5000, read));
  EXPECT_EQ(0u, client.getSimulationStats().uReceived);

  N_NetworkModel model;
  model.fDelay = 60;
  N_Client::simulateNetwork(model);
  for (int i = 1; i <= 5; ++i) {
    send(i);
    pumpFor(10, read);
  }
  ASSERT_TRUE(waitFor([&] { return got.size() == 6; }, 5000, read));
  for (int i = 1; i <= 5; ++i) {
    EXPECT_EQ(i, got[i].index);
    EXPECT_GE(got[i].latencyMs(), 60.0 - 0.5);
  }
  N_SimulationStats s = client.getSimulationStats();
  EXPECT_EQ(5u, s.uReceived);
  EXPECT_EQ(5u, s.uDelayed);
  EXPECT_EQ(5u, s.uDelivered);
  EXPECT_NEAR(60.0, s.dMeanDelay, 1e-3);

  // Held for two seconds, then the model goes off: they come at once.
  model.fDelay = 2000;
  N_Client::simulateNetwork(model);
  for (int i = 6; i <= 8; ++i) send(i);
  ASSERT_TRUE(waitFor([&] { return client.getSimulationStats().uReceived == 3; }, 5000, read));
  pumpFor(100, read);
  EXPECT_EQ(6u, got.size()) << "still held";
  N_Client::simulateNetwork(N_NetworkModel{});
  const Clock::time_point off = Clock::now();
  send(9);
  ASSERT_TRUE(waitFor([&] { return got.size() == 10; }, 5000, read));
  EXPECT_LT(secondsSince(off), 1.0);
  for (int i = 6; i <= 9; ++i) EXPECT_EQ(i, got[i].index);
  s = client.getSimulationStats();
  EXPECT_EQ(3u, s.uReceived) << "the statistics stay readable once off";
  EXPECT_EQ(3u, s.uDelivered);
  EXPECT_EQ(0u, s.uQueuedBytes);
}

}  // namespace
