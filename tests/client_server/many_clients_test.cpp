// Twenty client processes on one server: as many as the network thread's
// wait set holds (three sockets each, beside the two listeners and the
// release event). Each sends reliable and unreliable payloads, the server
// answers every reliable one, and then all leave. Every allocation the
// server process made must be given back.
#include <map>

#include "cs_fixture.h"

using namespace cs_test;

namespace {

constexpr int kClients = 20;
// A few seconds of traffic; fewer payloads under a sanitizer, where twenty
// instrumented processes share the machine's cores with the server.
#if defined(__has_feature)
#if __has_feature(thread_sanitizer) || __has_feature(address_sanitizer)
#define CS_TEST_SANITIZED 1
#endif
#endif
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__) || defined(CS_TEST_SANITIZED)
constexpr int kReliable = 60;
constexpr int kUnreliable = 20;
#else
constexpr int kReliable = 300;
constexpr int kUnreliable = 100;
#endif

class ManyClientsTest : public ClientServerTest {};

// "c12;c13;" -> {"c12", "c13"}
std::vector<std::string> split(const std::string& batch) {
  std::vector<std::string> out;
  std::size_t start = 0;
  for (std::size_t end; (end = batch.find(';', start)) != std::string::npos; start = end + 1)
    out.push_back(batch.substr(start, end - start));
  return out;
}

TEST_F(ManyClientsTest, TwentyClientsExchangeAndLeave) {
  N_Client::setHeartbeatFrequency(1.0f);
  N_Client::setHeartbeatLatency(1.0f);
  N_Server server(port());
  server.setBandwidth(4000000);
  server.setMaximumBandwidthUsage(100000);
  ServerPump pump(server);

  std::vector<std::unique_ptr<PeerProcess>> peers;
  std::vector<N_Client*> clients;
  for (int i = 0; i < kClients; ++i) {
    peers.push_back(std::make_unique<PeerProcess>(
        2 + i, port(), std::vector<std::string>{"--hb-frequency", "1", "--hb-latency", "1"}));
    ASSERT_TRUE(peers.back()->waitLine("connected", 20000, pump)) << peers.back()->host();
    ASSERT_TRUE(waitFor([&] { return pump.announced().size() == clients.size() + 1; }, 5000, pump));
    clients.push_back(pump.announced().back());
    const volatile char* number = clients.back()->getAddress()->getStringNumber();
    ASSERT_EQ(peers.back()->host(), std::string(const_cast<const char*>(number)));
  }

  for (auto& peer : peers) {
    peer->command("send-r " + std::to_string(kReliable) + " c 10");
    peer->command("send-u " + std::to_string(kUnreliable) + " u 20");
  }
  // The server reads every client and answers each reliable payload.
  std::map<N_Client*, std::vector<int>> reliable;
  std::map<N_Client*, int> unreliable;
  auto serve = [&] {
    pump();
    for (N_Client* client : clients) {
      void* m = nullptr;
      unsigned n = 0;
      while (client->poll(m, n)) {
        for (const std::string& token : split(std::string(static_cast<const char*>(m), n))) {
          if (token.empty()) continue;
          if (token[0] == 'c') {
            reliable[client].push_back(std::atoi(token.c_str() + 1));
            std::string answer = "e" + token.substr(1) + ";";
            client->queueReliable(answer.data(), static_cast<unsigned>(answer.size()), 0, 1);
          } else if (token[0] == 'u') {
            ++unreliable[client];
          }
        }
      }
      client->flushReliable();
    }
  };
  const bool allIn = waitFor(
      [&] {
        for (N_Client* client : clients)
          if (reliable[client].size() < static_cast<std::size_t>(kReliable)) return false;
        return true;
      },
      60000, serve);
  EXPECT_TRUE(allIn);
  for (std::size_t i = 0; i < clients.size(); ++i) {
    const auto& got = reliable[clients[i]];
    ASSERT_EQ(static_cast<std::size_t>(kReliable), got.size()) << peers[i]->host();
    for (int k = 0; k < kReliable; ++k) EXPECT_EQ(k, got[k]) << peers[i]->host();
    EXPECT_TRUE(clients[i]->isConnected()) << peers[i]->host();
  }
  // Each client hears the answer to its last payload.
  const std::string last = "e" + std::to_string(kReliable - 1) + ";";
  for (auto& peer : peers) EXPECT_TRUE(peer->waitLine(last, 20000, serve)) << peer->host();
  pumpFor(300, serve);
  // Datagrams may be lost on a loaded machine, but the channel carries them.
  int datagrams = 0;
  for (N_Client* client : clients) datagrams += unreliable[client];
  EXPECT_GT(datagrams, 0);
  EXPECT_LE(datagrams, kClients * kUnreliable);

  for (auto& peer : peers) peer->command("quit");
  for (auto& peer : peers) EXPECT_TRUE(peer->waitLine("bye", 20000, pump)) << peer->host();
  for (N_Client* client : clients) {
    EXPECT_TRUE(waitFor([&] { return !client->isConnected(); }, 10000, pump));
    server.disconnectClient(client);
  }
  EXPECT_EQ(0, N_ServerTestAccess::clientCount(server));
  EXPECT_EQ(0, N_ServerTestAccess::pendingControlCount(server));
}

}  // namespace
