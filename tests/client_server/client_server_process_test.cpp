// A server in this process (127.0.0.1) with client host processes, each on
// an address of its own (127.0.0.2 and up), so that every channel works as
// it would between machines, the unreliable one included.
#include <set>

#include "cs_fixture.h"

using namespace cs_test;

namespace {

// How long the clients probe, and the datagrams each sends meanwhile.
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr int kProbeMs = 600, kDatagrams = 20;  // twenty instrumented processes share the cores
#else
constexpr int kProbeMs = 3000, kDatagrams = 100;
#endif

// Beyond twenty clients the network thread's wait set is made just large
// enough for them: three sockets each, the two listeners, the release event.
class ClientsTest : public ClientServerTest, public ::testing::WithParamInterface<int> {
 protected:
  void SetUp() override {
    if (GetParam() > 20) N_Initializer::setMaximumWaitEvents(3 * GetParam() + 3);
    ClientServerTest::SetUp();
    // Twenty or sixty processes starting one by one, each spinning through
    // its world clock exchange, can hold a core for seconds on a loaded
    // machine (sixty under a sanitizer beside other builds): a heartbeat may
    // take that long without meaning a dead peer.
    heartbeat(1.0f, 15.0f);
  }
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
    peers.push_back(std::make_unique<PeerProcess>(2 + i, port()));
    clients.push_back(peers.back()->admit(pump));
    ASSERT_NE(nullptr, clients.back()) << peers.back()->host();
  }
  pumpFor(300, pump);
  EXPECT_EQ(std::size_t(count), pump.announced().size());
  EXPECT_EQ(std::size_t(count), std::set<N_Client*>(clients.begin(), clients.end()).size());

  // Numbered reliable payloads that the server echoes (the probe checks that
  // every one comes back, in order), and datagrams.
  for (auto& peer : peers) {
    peer->command("probe 10");
    peer->command("send-u " + std::to_string(kDatagrams) + " u 20");
  }
  const Pump serve = [&] {
    pump();
    for (N_Client* client : clients) echo(*client);
  };
  pumpFor(kProbeMs, serve);
  unsigned datagrams = 0;
  for (int i = 0; i < count; ++i) {
    const std::vector<double> final = probe(*peers[i], "stop", serve);
    ASSERT_EQ(3u, final.size()) << peers[i]->host();
    EXPECT_GT(final[0], 0) << peers[i]->host();
    EXPECT_EQ(final[0], final[1]) << peers[i]->host() << ": echoes lost"
                                  << (clients[i]->isConnected() ? "" : ", dropped by the server");
    EXPECT_EQ(0, final[2]) << peers[i]->host() << ": echoes out of order";
    datagrams += clients[i]->getStatistics().unreliable.uMessagesReceived;
  }
  // Datagrams may be lost on a loaded machine, but the channel carries them.
  EXPECT_GT(datagrams, 0u);
  EXPECT_LE(datagrams, static_cast<unsigned>(count * kDatagrams));

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
