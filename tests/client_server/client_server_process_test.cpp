// A server in this process (127.0.0.1) with client host processes, each on
// an address of its own (127.0.0.2 and up), so that every channel works as
// it would between machines, the unreliable one included.
#include <algorithm>
#include <set>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

using Access = N_ClientTestAccess;

std::vector<std::string> heartbeat(const char* frequency, const char* latency) {
  return {"--hb-frequency", frequency, "--hb-latency", latency};
}

class ClientServerProcessTest : public ClientServerTest {
 protected:
  // The server's object for the peer on `host`, once it was handed out.
  static N_Client* clientOf(const ServerPump& pump, const std::string& host) {
    for (N_Client* c : pump.announced()) {
      const volatile char* number = c->getAddress()->getStringNumber();
      if (number != nullptr && host == const_cast<const char*>(number)) return c;
    }
    return nullptr;
  }
  // Pumps until the peer reports its connection and the server handed it out.
  static N_Client* admit(PeerProcess& peer, const ServerPump& pump) {
    if (!peer.waitLine("connected", 20000, pump)) return nullptr;
    N_Client* client = nullptr;
    waitFor([&] { return (client = clientOf(pump, peer.host())) != nullptr; }, 5000, pump);
    return client;
  }
  // Every message that the server's end of a client can read now, split
  // into the payloads of the batches. With simulated loss a false result
  // doesn't mean that nothing is left, so it reads a fixed number of times
  // (a read that finds nothing draws nothing).
  static std::vector<std::string> readPayloads(N_Client& client, int reads = 500) {
    std::vector<std::string> out;
    void* m = nullptr;
    unsigned n = 0;
    for (int i = 0; i < reads; ++i) {
      if (!client.poll(m, n)) continue;
      std::string text(static_cast<const char*>(m), n);
      std::size_t start = 0;
      for (std::size_t end; (end = text.find(';', start)) != std::string::npos; start = end + 1)
        out.push_back(text.substr(start, end - start));
    }
    return out;
  }
  static std::vector<int> indicesOf(const std::vector<std::string>& payloads, char prefix) {
    std::vector<int> out;
    for (const std::string& p : payloads)
      if (!p.empty() && p[0] == prefix) out.push_back(std::atoi(p.c_str() + 1));
    return out;
  }
};

TEST_F(ClientServerProcessTest, ThreeClientsConnectMeasureLatencyAndLeave) {
  N_Server server(port());
  ServerPump pump(server);
  std::vector<std::unique_ptr<PeerProcess>> peers;
  for (int host = 2; host <= 4; ++host)
    peers.push_back(std::make_unique<PeerProcess>(host, port(), heartbeat("0.2", "0.2")));
  std::set<N_Client*> clients;
  for (auto& peer : peers) {
    ASSERT_TRUE(peer->started());
    N_Client* client = admit(*peer, pump);
    ASSERT_NE(nullptr, client) << peer->host();
    clients.insert(client);
  }
  // Each handed out once, none twice.
  pumpFor(300, pump);
  EXPECT_EQ(3u, pump.announced().size());
  EXPECT_EQ(3u, clients.size());

  // Round trips measured at both ends.
  for (auto& peer : peers) {
    auto line = peer->waitLine("latency", 5000, pump);
    ASSERT_TRUE(line) << peer->host();
    EXPECT_GT(valueOf(*line), 0.0);
    EXPECT_LT(valueOf(*line), 1.0);
  }
  for (N_Client* client : clients) {
    EXPECT_TRUE(waitFor([&] { return client->getLatency() > 0.0f; }, 5000, pump));
    EXPECT_LT(client->getLatency(), 1.0f);
    EXPECT_TRUE(client->isConnected());
  }

  for (auto& peer : peers) EXPECT_TRUE(peer->quit(10000, pump)) << peer->host();
  for (N_Client* client : clients) {
    EXPECT_TRUE(waitFor([&] { return !client->isConnected(); }, 5000, pump));
    server.disconnectClient(client);
  }
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
}

TEST_F(ClientServerProcessTest, GrantsFollowTheWorkedExamples) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  server.setBandwidth(100000);
  server.setMaximumBandwidthUsage(60000);
  ServerPump pump(server);
  const unsigned requests[] = {50000, 70000, 30000};
  const unsigned expected[] = {35714, 42857, 21429};
  std::vector<std::unique_ptr<PeerProcess>> peers;
  std::vector<N_Client*> clients;
  for (int i = 0; i < 3; ++i) {
    auto options = heartbeat("1", "1");
    options.insert(options.end(), {"--bandwidth", std::to_string(requests[i])});
    peers.push_back(std::make_unique<PeerProcess>(2 + i, port(), options));
  }
  for (auto& peer : peers) {
    clients.push_back(admit(*peer, pump));
    ASSERT_NE(nullptr, clients.back()) << peer->host();
  }
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(peers[i]->waitLine("bandwidth " + std::to_string(expected[i]), 5000, pump)) << i;
    EXPECT_EQ(expected[i], clients[i]->getBandwidth());
  }

  // Three clients at the default request, a budget of 10000 and the default
  // cap: 3333 each, 9999 in all.
  server.setBandwidth(10000);
  server.setMaximumBandwidthUsage(10240);
  for (auto& peer : peers) peer->command("bandwidth 1250000");
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(peers[i]->waitLine("bandwidth 3333", 5000, pump)) << i;
    EXPECT_TRUE(waitFor([&] { return clients[i]->getBandwidth() == 3333; }, 2000, pump));
  }

  // One leaves: the other two get its part in that same call.
  server.disconnectClient(clients[0]);
  EXPECT_EQ(5000u, clients[1]->getBandwidth());
  EXPECT_EQ(5000u, clients[2]->getBandwidth());
  EXPECT_TRUE(peers[1]->waitLine("bandwidth 5000", 5000, pump));
  EXPECT_TRUE(peers[2]->waitLine("bandwidth 5000", 5000, pump));
  EXPECT_TRUE(peers[0]->waitLine("lost", 5000, pump));
}

TEST_F(ClientServerProcessTest, WorldTimerFollowsTheServer) {
  // Slow heartbeats: the server stops answering below.
  N_Client::setHeartbeatFrequency(5.0f);
  N_Client::setHeartbeatLatency(5.0f);
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess peer(2, port(), heartbeat("5", "5"));
  ASSERT_NE(nullptr, admit(peer, pump));

  peer.command("sync");
  auto sync = peer.waitLine("sync", 10000, pump);
  ASSERT_TRUE(sync);
  ASSERT_EQ(0u, sync->find("sync 1 "));
  // Every round trip of the exchange was shorter than the whole of it.
  const double took = std::atof(sync->c_str() + 7);
  const double before = server.getWorldTimer().getAge();
  peer.command("time");
  auto time = peer.waitLine("time", 5000, pump);
  const double after = server.getWorldTimer().getAge();
  ASSERT_TRUE(time);
  const double world = valueOf(*time);
  EXPECT_GE(world, before - took);
  EXPECT_LE(world, after + took);

  // No answers: false after the one second of the first exchange.
  peer.command("sync");
  sync = peer.waitLine("sync", 10000);
  ASSERT_TRUE(sync);
  EXPECT_EQ(0u, sync->find("sync 0 ")) << *sync;
  const double failed = std::atof(sync->c_str() + 7);
  EXPECT_GE(failed, 1.0);
  EXPECT_LT(failed, 2.0);
}

TEST_F(ClientServerProcessTest, SilentEndsAreDropped) {
  N_Server server(port());
  ServerPump pump(server);
  // A client that stops calling update is dropped by the server...
  PeerProcess a(2, port(), heartbeat("0.2", "0.2"));
  N_Client* ca = admit(a, pump);
  ASSERT_NE(nullptr, ca);
  a.command("stall 2");
  EXPECT_TRUE(waitFor([&] { return !ca->isConnected(); }, 3000, pump));
  EXPECT_TRUE(a.waitLine("lost", 5000, pump));
  server.disconnectClient(ca);
  pump.forget(ca);

  // ...and a server that stops calling update is dropped by its client.
  PeerProcess b(3, port(), heartbeat("0.2", "0.2"));
  N_Client* cb = admit(b, pump);
  ASSERT_NE(nullptr, cb);
  EXPECT_TRUE(b.waitLine("lost", 5000));
  EXPECT_TRUE(waitFor([&] { return !cb->isConnected(); }, 3000, pump));
}

TEST_F(ClientServerProcessTest, SimulatedLossTakesUnreliableMessagesOnly) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  ServerPump pump(server);
  PeerProcess peer(2, port(), heartbeat("1", "1"));
  N_Client* client = admit(peer, pump);
  ASSERT_NE(nullptr, client);

  // Everything unreliable is lost, nothing reliable.
  N_Client::simulatePacketLoss(1.0f);
  peer.command("send-u 30 u 5");
  ASSERT_TRUE(peer.waitLine("sent 30", 10000, pump));
  peer.command("send-r 30 r 5");
  ASSERT_TRUE(peer.waitLine("sent 30", 10000, pump));
  pumpFor(300, pump);
  std::vector<std::string> got = readPayloads(*client);
  std::vector<int> reliable = indicesOf(got, 'r');
  ASSERT_EQ(30u, reliable.size());
  for (int i = 0; i < 30; ++i) EXPECT_EQ(i, reliable[i]);
  EXPECT_TRUE(indicesOf(got, 'u').empty());
  // Thrown away, not left waiting.
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
  EXPECT_GT(kept[0].size(), 0u) << [&] {
    std::string all;
    for (const std::string& line : peer.process().lines()) all += line.substr(0, 60) + "\n";
    return all;
  }();
  EXPECT_LT(kept[0].size(), 40u);
  EXPECT_TRUE(std::is_sorted(kept[0].begin(), kept[0].end()));
  EXPECT_TRUE(peer.quit(10000, pump));
}

TEST_F(ClientServerProcessTest, UnreliableBatchesStayBelowTheDatagramLimit) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  // Room for the default request: a budget far above one datagram.
  server.setBandwidth(4000000);
  server.setMaximumBandwidthUsage(2000000);
  ServerPump pump(server);
  PeerProcess peer(2, port(), heartbeat("1", "1"));
  N_Client* client = admit(peer, pump);
  ASSERT_NE(nullptr, client);
  ASSERT_TRUE(peer.waitLine("bandwidth 1250000", 5000, pump));
  peer.command("limits");
  auto limits = peer.waitLine("limits", 5000, pump);
  ASSERT_TRUE(limits);
  const unsigned largest = static_cast<unsigned>(valueOf(*limits));
  ASSERT_GT(largest, 200u);
  EXPECT_EQ(largest, client->getLargestUnreliablePacketSize());

  auto nextDatagram = [&]() -> std::optional<std::string> {
    void* m = nullptr;
    unsigned n = 0;
    if (!waitFor([&] { return client->poll(m, n); }, 5000, pump)) return std::nullopt;
    return std::string(static_cast<const char*>(m), n);
  };
  // 9 and 5 would make exactly the limit: 5 waits, 1 fills up to one below.
  peer.command("qun 0 9 " + std::to_string(largest - 100) + " a");
  peer.command("qun 0 5 100 b");
  peer.command("qun 0 1 99 c");
  peer.command("fu");
  ASSERT_TRUE(peer.waitLine("flushed", 5000, pump));
  auto first = nextDatagram();
  ASSERT_TRUE(first);
  EXPECT_EQ(std::string(largest - 100, 'a') + std::string(99, 'c'), *first);
  pumpFor(150, pump);
  peer.command("fu");
  auto second = nextDatagram();
  ASSERT_TRUE(second);
  EXPECT_EQ(std::string(100, 'b'), *second);

  // A single payload of exactly the limit goes.
  pumpFor(150, pump);
  peer.command("qun 0 1 " + std::to_string(largest) + " d");
  peer.command("fu");
  auto third = nextDatagram();
  ASSERT_TRUE(third);
  EXPECT_EQ(largest, third->size());
  EXPECT_TRUE(peer.quit(10000, pump));
}

}  // namespace
