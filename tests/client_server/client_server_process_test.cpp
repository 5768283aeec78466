// A server in this process (127.0.0.1) with client host processes, each on
// an address of its own (127.0.0.2 and up), so that every channel works as
// it would between machines, the unreliable one included.
#include <algorithm>
#include <map>
#include <set>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

const std::vector<std::string> kSlowHeartbeat = {"--hb-frequency", "1", "--hb-latency", "1"};

#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr int kPayloads = 60;  // twenty instrumented processes share the cores
#else
constexpr int kPayloads = 300;
#endif

// The payloads "<prefix><i>;" the server's end of a client can read now.
// With simulated loss a false read doesn't mean that nothing is left, so it
// reads a fixed number of times (a read that finds nothing draws nothing).
std::vector<std::string> readPayloads(N_Client& client, int reads = 500) {
  std::vector<std::string> out;
  void* m = nullptr;
  unsigned n = 0;
  for (int i = 0; i < reads; ++i) {
    const std::string batch = client.poll(m, n) ? std::string(static_cast<const char*>(m), n) : "";
    for (std::size_t at = 0, end; (end = batch.find(';', at)) != std::string::npos; at = end + 1)
      out.push_back(batch.substr(at, end - at));
  }
  return out;
}

std::vector<int> indicesOf(const std::vector<std::string>& payloads, char prefix) {
  std::vector<int> out;
  for (const std::string& p : payloads)
    if (!p.empty() && p[0] == prefix) out.push_back(std::atoi(p.c_str() + 1));
  return out;
}

class ClientServerProcessTest : public ClientServerTest {
 protected:
  void SetUp() override {
    ClientServerTest::SetUp();
    heartbeat(1.0f, 1.0f);
  }
};

// Beyond twenty clients the network thread's wait set is made just large
// enough for them: three sockets each, the two listeners, the release event.
class ClientsTest : public ClientServerProcessTest, public ::testing::WithParamInterface<int> {
 protected:
  void SetUp() override {
    if (GetParam() > 20) N_Initializer::setMaximumWaitEvents(3 * GetParam() + 3);
    ClientServerProcessTest::SetUp();
    // Sixty processes starting one by one, each spinning through its world
    // clock exchange, can hold a core for a second on a loaded machine: a
    // heartbeat may take that long without meaning a dead peer.
    if (GetParam() > 20) heartbeat(1.0f, 5.0f);
  }
  std::vector<std::string> peerHeartbeat() const {
    return GetParam() > 20 ? std::vector<std::string>{"--hb-frequency", "1", "--hb-latency", "5"} : kSlowHeartbeat;
  }
  float allowedLatency() const { return GetParam() > 20 ? 5.0f : 1.0f; }
  void TearDown() override {
    ClientServerProcessTest::TearDown();
    N_Initializer::setMaximumWaitEvents(64);
  }
};

// Twenty clients, as many as the default wait set of 64 holds, and sixty in a
// larger one: each handed out once with its own address, round trips
// measured at both ends, reliable payloads answered in order and datagrams
// carried, then all leave.
TEST_P(ClientsTest, ExchangeAndLeave) {
  const int count = GetParam();
  N_Server server(port());
  server.setBandwidth(4000000);
  server.setMaximumBandwidthUsage(100000);
  ServerPump pump(server);
  std::vector<std::unique_ptr<PeerProcess>> peers;
  std::vector<N_Client*> clients;
  for (int i = 0; i < count; ++i) {
    peers.push_back(std::make_unique<PeerProcess>(2 + i, port(), peerHeartbeat()));
    clients.push_back(peers.back()->admit(pump));
    ASSERT_NE(nullptr, clients.back()) << peers.back()->host();
  }
  pumpFor(300, pump);
  EXPECT_EQ(std::size_t(count), pump.announced().size());
  EXPECT_EQ(std::size_t(count), std::set<N_Client*>(clients.begin(), clients.end()).size());

  for (auto& peer : peers) {
    peer->command("send-r " + std::to_string(kPayloads) + " c 10");
    peer->command("send-u " + std::to_string(kPayloads / 3) + " u 20");
  }
  std::map<N_Client*, std::vector<int>> reliable;
  std::map<N_Client*, int> unreliable;
  const Pump serve = [&] {
    pump();
    for (N_Client* client : clients) {
      for (const std::string& p : readPayloads(*client, 1)) {
        if (p[0] == 'u') ++unreliable[client];
        if (p[0] != 'c') continue;
        reliable[client].push_back(std::atoi(p.c_str() + 1));
        std::string answer = "e" + p.substr(1) + ";";
        client->queueReliable(answer.data(), static_cast<unsigned>(answer.size()), 0, 1);
      }
      client->flushReliable();
    }
  };
  EXPECT_TRUE(waitFor(
      [&] {
        return std::all_of(clients.begin(), clients.end(),
                           [&](N_Client* c) { return reliable[c].size() >= std::size_t(kPayloads); });
      },
      60000, serve));
  std::vector<int> inOrder(kPayloads);
  for (int k = 0; k < kPayloads; ++k) inOrder[k] = k;
  int datagrams = 0;
  for (int i = 0; i < count; ++i) {
    EXPECT_EQ(inOrder, reliable[clients[i]]) << peers[i]->host();
    EXPECT_TRUE(peers[i]->waitLine("e" + std::to_string(kPayloads - 1) + ";", 20000, serve)) << peers[i]->host();
    // Measured, and within the latency the heartbeat allows (sixty
    // processes under a sanitizer take more than a second to answer).
    // Replies carry no number: one that comes after the next heartbeat left,
    // from a server slower than the frequency, measures next to nothing, so
    // only the upper bound is checked.
    auto latency = peers[i]->waitLine("latency", 5000, serve);
    ASSERT_TRUE(latency) << peers[i]->host();
    EXPECT_LT(valueOf(*latency), allowedLatency());
    EXPECT_TRUE(waitFor([&] { return clients[i]->getLatency() > 0.0f; }, 5000, serve));
    EXPECT_LT(clients[i]->getLatency(), allowedLatency());
    datagrams += unreliable[clients[i]];
  }
  // Datagrams may be lost on a loaded machine, but the channel carries them.
  EXPECT_GT(datagrams, 0);
  EXPECT_LE(datagrams, count * (kPayloads / 3));

  for (auto& peer : peers) EXPECT_TRUE(peer->quit(20000, pump)) << peer->host();
  for (N_Client* client : clients) {
    EXPECT_TRUE(waitFor([&] { return !client->isConnected(); }, 10000, pump));
    server.disconnectClient(client);
  }
  EXPECT_EQ(0, ServerAccess::clientCount(server));
  EXPECT_EQ(0, ServerAccess::pendingControlCount(server));
}

INSTANTIATE_TEST_SUITE_P(Count, ClientsTest, ::testing::Values(3, 20, 60));

// With the real timers: a client that stops calling update is dropped by the
// server, and a server that stops calling update by its client.
TEST_F(ClientServerProcessTest, SilentEndsAreDropped) {
  // Generous limits while the ends come up, so that a loaded machine can't
  // drop them for the wrong reason.
  heartbeat(0.2f, 2.0f);
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess a(2, port(), {"--hb-frequency", "0.2", "--hb-latency", "5"});
  N_Client* ca = a.admit(pump);
  ASSERT_NE(nullptr, ca);
  // A silent client end: the server drops it.
  heartbeat(0.2f, 0.2f);
  a.command("stall 2");
  EXPECT_TRUE(waitFor([&] { return !ca->isConnected(); }, 3000, pump));
  EXPECT_TRUE(a.waitLine("lost", 5000, pump));
  server.disconnectClient(ca);
  pump.forget(ca);
  // A silent server (not updated any more): the client drops it.
  heartbeat(0.2f, 2.0f);
  PeerProcess b(3, port(), {"--hb-frequency", "0.2", "--hb-latency", "1"});
  N_Client* cb = b.admit(pump);
  ASSERT_NE(nullptr, cb);
  EXPECT_TRUE(b.waitLine("lost", 8000));
  EXPECT_TRUE(waitFor([&] { return !cb->isConnected(); }, 3000, pump));
}

// One client host: datagram batches and simulated loss. (The world timer's
// exchange is the scripted tests', byte by byte at both ends.)
TEST_F(ClientServerProcessTest, OneClientOnItsOwnHost) {
  heartbeat(5.0f, 5.0f);
  N_Server server(port());
  server.setBandwidth(4000000);  // room for the default request
  server.setMaximumBandwidthUsage(2000000);
  ServerPump pump(server);
  PeerProcess peer(2, port(), {"--hb-frequency", "5", "--hb-latency", "5"});
  N_Client* client = peer.admit(pump);
  ASSERT_NE(nullptr, client);
  ASSERT_TRUE(peer.waitLine("bandwidth 1250000", 5000, pump));
  peer.command("limits");
  auto limits = peer.waitLine("limits", 5000, pump);
  ASSERT_TRUE(limits);
  const unsigned largest = static_cast<unsigned>(valueOf(*limits));
  ASSERT_GT(largest, 200u);
  EXPECT_EQ(largest, client->getLargestUnreliablePacketSize());
  auto nextDatagram = [&] {
    void* m = nullptr;
    unsigned n = 0;
    if (!waitFor([&] { return client->poll(m, n); }, 5000, pump)) return std::string("<none>");
    return std::string(static_cast<const char*>(m), n);
  };
  // 9 and 5 would make exactly the limit: 5 waits, 1 fills up to one below.
  peer.command("qun 0 9 " + std::to_string(largest - 100) + " a");
  peer.command("qun 0 5 100 b");
  peer.command("qun 0 1 99 c");
  peer.command("fu");
  EXPECT_EQ(std::string(largest - 100, 'a') + std::string(99, 'c'), nextDatagram());
  pumpFor(150, pump);
  peer.command("fu");
  EXPECT_EQ(std::string(100, 'b'), nextDatagram());
  // A single payload of exactly the limit goes.
  pumpFor(150, pump);
  peer.command("qun 0 1 " + std::to_string(largest) + " d");
  peer.command("fu");
  EXPECT_EQ(largest, nextDatagram().size());

  // Simulated loss takes every unreliable message, nothing reliable, and
  // throws them away rather than leaving them waiting.
  N_Client::simulatePacketLoss(1.0f);
  peer.command("send-u 30 u 5");
  ASSERT_TRUE(peer.waitLine("sent 30", 10000, pump));
  peer.command("send-r 30 r 5");
  ASSERT_TRUE(peer.waitLine("sent 30", 10000, pump));
  pumpFor(300, pump);
  const std::vector<std::string> got = readPayloads(*client);
  std::vector<int> thirty(30);
  for (int i = 0; i < 30; ++i) thirty[i] = i;
  EXPECT_EQ(thirty, indicesOf(got, 'r'));
  EXPECT_TRUE(indicesOf(got, 'u').empty());
  N_Client::simulatePacketLoss(0.0f);
  EXPECT_TRUE(readPayloads(*client).empty());
  // Half: the same seed keeps the same messages.
  N_Client::simulatePacketLoss(0.5f);
  std::vector<int> kept[2];
  for (int round = 0; round < 2; ++round) {
    const char prefix = round == 0 ? 'v' : 'w';
    peer.command(std::string("send-u 40 ") + prefix + " 5");
    ASSERT_TRUE(peer.waitLine("sent 40", 10000, pump));
    pumpFor(300, pump);
    platform::srand(4321);
    kept[round] = indicesOf(readPayloads(*client), prefix);
  }
  EXPECT_EQ(kept[0], kept[1]);
  EXPECT_GT(kept[0].size(), 0u);
  EXPECT_LT(kept[0].size(), 40u);
  EXPECT_TRUE(std::is_sorted(kept[0].begin(), kept[0].end()));
  N_Client::simulatePacketLoss(0.0f);

  EXPECT_TRUE(peer.quit(10000, pump));
}

}  // namespace
