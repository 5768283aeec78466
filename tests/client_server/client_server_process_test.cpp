// A server in this process (127.0.0.1) with client host processes, each on
// an address of its own (127.0.0.2 and up), so that every channel works as
// it would between machines, the unreliable one included.
#include <algorithm>
#include <cstdlib>
#include <map>
#include <set>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr int kPayloads = 60;  // twenty instrumented processes share the cores
#else
constexpr int kPayloads = 300;
#endif

// Beyond twenty clients the network thread's wait set is made just large
// enough for them: three sockets each, the two listeners, the release event.
class ClientsTest : public ClientServerTest, public ::testing::WithParamInterface<int> {
 protected:
  void SetUp() override {
    if (GetParam() > 20) N_Initializer::setMaximumWaitEvents(3 * GetParam() + 3);
    ClientServerTest::SetUp();
    // Twenty or sixty processes starting one by one, each spinning through
    // its world clock exchange, can hold a core for a second on a loaded
    // machine: a heartbeat may take that long without meaning a dead peer.
    heartbeat(1.0f, kLatency);
  }
  static constexpr float kLatency = 5.0f;
  void TearDown() override {
    ClientServerTest::TearDown();
    N_Initializer::setMaximumWaitEvents(64);
  }
};

// Twenty clients, as many as the default wait set of 64 holds, and sixty in a
// larger one: each handed out once with its own address, reliable payloads
// answered in order and datagrams carried, then all leave. (Latency is the
// scripted and statistics tests'.)
TEST_P(ClientsTest, ExchangeAndLeave) {
  const int count = GetParam();
  N_Server server(port());
  server.setBandwidth(4000000);
  server.setMaximumBandwidthUsage(100000);
  ServerPump pump(server);
  std::vector<std::unique_ptr<PeerProcess>> peers;
  std::vector<N_Client*> clients;
  for (int i = 0; i < count; ++i) {
    peers.push_back(std::make_unique<PeerProcess>(
        2 + i, port(), std::vector<std::string>{"--hb-frequency", "1", "--hb-latency", "5"}));
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
      void* m = nullptr;
      unsigned n = 0;
      const std::string batch = client->poll(m, n) ? std::string(static_cast<const char*>(m), n) : "";
      for (std::size_t at = 0, end; (end = batch.find(';', at)) != std::string::npos; at = end + 1) {
        if (batch[at] == 'u') ++unreliable[client];
        if (batch[at] != 'c') continue;
        reliable[client].push_back(std::atoi(batch.c_str() + at + 1));
        std::string answer = "e" + batch.substr(at + 1, end - at);
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

}  // namespace
