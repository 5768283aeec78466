// Statistics: N_Client::getStatistics() on both ends against a peer of plain
// Linux sockets that counts every byte and message it sent and received
// itself, and N_Initializer::getStatistics() as objects come and go.
#include <algorithm>
#include <cmath>
#include <sstream>
#include <tuple>

#include "cs_fixture.h"
#include "win32.h"

using namespace cs_test;

namespace {

class StatisticsTest : public ClientServerTest {
 protected:
  // With the heartbeats stopped, all three channels come to rest: then the
  // two ends' counts must be the same, byte for byte.
  static N_ClientStats expectAgreement(N_Client& end, RawPeer& peer, const Pump& pump) {
    heartbeat(0.0f, 1.0f);
    pumpFor(200, pump);  // the last exchange ends: nothing answers a reply
    std::string differences;
    auto agree = [&] {
      const N_ClientStats s = end.getStatistics();
      const raw_peer::Direction sent = peer.sent(), got = peer.received();
      std::ostringstream out;
      for (auto [name, ours, in, back] : {std::tuple{"reliable", s.reliable, sent.reliable, got.reliable},
                                          {"unreliable", s.unreliable, sent.unreliable, got.unreliable},
                                          {"control", s.control, sent.control, got.control}})
        if (ours.uBytesWaitingForSend != 0 || ours.uBytesSent != back.bytes || ours.uMessagesSent != back.messages ||
            ours.uBytesReceived != in.bytes || ours.uMessagesReceived != in.messages)
          out << name << ": sent " << ours.uBytesSent << " B in " << ours.uMessagesSent << " (peer got " << back.bytes
              << " in " << back.messages << "), received " << ours.uBytesReceived << " in " << ours.uMessagesReceived
              << " (peer sent " << in.bytes << " in " << in.messages << "), waiting " << ours.uBytesWaitingForSend << "; ";
      differences = out.str();
      return differences.empty();
    };
    EXPECT_TRUE(waitFor(agree, 5000, pump)) << differences;
    return end.getStatistics();
  }
  // Every message poll() hands out, with its size, for the time given.
  static std::vector<unsigned> pollFor(N_Client& end, int milliseconds, const Pump& pump) {
    std::vector<unsigned> sizes;
    pumpFor(milliseconds, [&] {
      if (pump) pump();
      void* data;
      unsigned size;
      while (end.poll(data, size)) sizes.push_back(size);
    });
    return sizes;
  }
  // Flushes both queues, reliable first, until both are empty.
  static bool flushAll(N_Client& end, const Pump& pump) {
    return waitFor([&] {
      end.flushReliable();
      end.flushUnreliable();
      return end.getReliableBytesWaiting() + end.getUnreliableBytesWaiting() == 0;
    }, 3000, pump);
  }
};

TEST_F(StatisticsTest, ClientEndCountsWhatARawServerSentAndReceived) {
  heartbeat(0.05f, 1.0f);
  RawPeer server("127.0.0.2", "127.0.0.1", static_cast<std::uint16_t>(port()));
  server.heartbeatBack = true;
  server.worldTimeRuns = true;
  N_Address serverAddress("127.0.0.2");
  N_Client client(&serverAddress, port());
  const Pump update = [&] { client.update(); };
  ASSERT_TRUE(waitFor([&] { return client.isConnected(); }, 5000, update));
  N_ClientStats s = client.getStatistics();
  EXPECT_EQ(3u, s.uWorldTimeExchanges);  // the first update's synchronisation
  EXPECT_LT(std::abs(s.fWorldClockOffset), 0.1f);  // the clock was in line by the last one
  // Heartbeats every 50 ms or so: the window fills within a second or two.
  ASSERT_TRUE(waitFor([&] { return client.getStatistics().uHeartbeats > N_ClientStats::LATENCY_WINDOW; }, 8000, update));
  s = client.getStatistics();
  EXPECT_GT(s.fLatencyLowest, 0.0f);
  EXPECT_LE(s.fLatencyLowest, s.fLatencyMean);
  EXPECT_LE(s.fLatencyMean, s.fLatencyHighest);
  EXPECT_LE(s.fLatencyLowest, s.fLatency);
  EXPECT_LE(s.fLatency, s.fLatencyHighest);
  EXPECT_LT(s.fLatencyHighest, N_Client::getHeartbeatLatency());  // a longer one drops the peer
  EXPECT_EQ(client.getLatency(), s.fLatency);

  // A datagram takes entries by priority while they stay below the largest
  // size (9 and 5 would make it exactly: 5 waits); one of that size goes alone.
  client.setBandwidth(4000000);  // the budget of a batch is above that size
  const unsigned largest = client.getLargestUnreliablePacketSize();
  std::vector<char> datagram(largest);
  for (auto [size, priority] : {std::pair{largest - 100, 9u}, {100u, 5u}, {99u, 1u}})
    client.queueUnreliable(datagram.data(), size, 0, priority);
  auto flushed = [&] {
    client.flushUnreliable();
    return client.getUnreliableBytesWaiting() < largest - 1;
  };
  ASSERT_TRUE(waitFor(flushed));
  EXPECT_EQ(100u, client.getUnreliableBytesWaiting());
  client.queueUnreliable(datagram.data(), largest, 0, 1);
  ASSERT_TRUE(flushAll(client, update));

  // Known messages on every channel: 0 + 1 + 100 + 70000 payload bytes (the
  // last spans reads) and four prefixes in, three datagrams, a grant.
  for (std::size_t size : {0, 1, 100, 70000}) server.sendReliable(size, 'r');
  for (std::size_t size : {1, 24, 500}) server.sendUnreliable(size, 'u');
  server.sendControl(CM::CONTROL_BANDWIDTH_GRANT, 20000);
  ASSERT_TRUE(waitFor([&] { return client.getBandwidth() == 20000; }, 3000, update));
  std::vector<unsigned> sizes = pollFor(client, 200, update);
  EXPECT_EQ((std::vector<unsigned>{0, 1, 100, 70000, 1, 24, 500}), sizes);

  // Out: one batch of three reliable payloads, one datagram of the last of
  // three keyed ones; one payload above the queue limit (4 x 20000) refused.
  char payload[100] = {};
  for (int i = 0; i < 3; ++i) client.queueReliable(payload, 100, 0, 1);
  for (int i = 0; i < 3; ++i) client.queueUnreliable(payload, 24, 7, 1);
  std::vector<char> tooLarge(80001);
  EXPECT_THROW(client.queueReliable(tooLarge.data(), 80001, 0, 1), N_NetException_PacketsStackingUp*);
  s = client.getStatistics();
  EXPECT_EQ(300u, s.reliableQueue.uBytesWaiting);
  EXPECT_EQ(24u, s.unreliableQueue.uBytesWaiting);
  ASSERT_TRUE(flushAll(client, update));

  // The read gate: all of four datagrams lost; then of three reliable
  // messages already in the socket, the two behind the first are delayed.
  N_Client::simulatePacketLoss(1.0f);
  for (int i = 0; i < 4; ++i) server.sendUnreliable(10, 'l');
  ASSERT_TRUE(waitFor([&] { return client.getStatistics().unreliable.uMessagesReceived == 7; }, 3000, update));
  EXPECT_TRUE(pollFor(client, 100, update).empty());
  // Half of forty twice (told apart by size): the same seed keeps the same ones.
  N_Client::simulatePacketLoss(0.5f);
  std::vector<unsigned> kept[2];
  for (int round = 0; round < 2; ++round) {
    for (unsigned i = 0; i < 40; ++i) server.sendUnreliable(10 + i, 'h');
    ASSERT_TRUE(waitFor([&] { return client.getStatistics().unreliable.uMessagesReceived == 47u + 40 * round; }, 3000, update));
    platform::srand(4321);
    kept[round] = pollFor(client, 100, update);
  }
  EXPECT_EQ(kept[0], kept[1]);
  EXPECT_FALSE(kept[0].empty());
  EXPECT_LT(kept[0].size(), 40u);
  EXPECT_TRUE(std::is_sorted(kept[0].begin(), kept[0].end()));
  N_Client::simulatePacketLoss(0.0f);
  for (int i = 0; i < 3; ++i) server.sendReliable(8, 'd');
  ASSERT_TRUE(waitFor([&] { return client.getStatistics().reliable.uMessagesReceived == 7; }, 3000, update));
  N_Client::simulateLatency(30, 30);
  EXPECT_EQ(3u, pollFor(client, 300, update).size());
  N_Client::simulateLatency(0, 0);

  s = expectAgreement(client, server, update);
  EXPECT_EQ(70101u + 4 * 4 + 3 * 12u, s.reliable.uBytesReceived);
  EXPECT_EQ(304u, s.reliable.uBytesSent);  // one batch of 300, its prefix
  EXPECT_EQ(1u, s.reliable.uMessagesSent);
  EXPECT_EQ(24u + largest - 1 + 100 + largest, s.unreliable.uBytesSent);
  EXPECT_EQ(4u, s.unreliable.uMessagesSent);
  EXPECT_EQ(565u + 2 * 1180, s.unreliable.uBytesReceived);  // 10 + ... + 49, twice
  EXPECT_EQ(3u, s.reliableQueue.uPayloadsQueued);
  EXPECT_EQ(0u, s.reliableQueue.uPayloadsReplaced);
  EXPECT_EQ(1u, s.reliableQueue.uPayloadsRefused);
  EXPECT_EQ(7u, s.unreliableQueue.uPayloadsQueued);
  EXPECT_EQ(2u, s.unreliableQueue.uPayloadsReplaced);
  EXPECT_EQ(0u, s.unreliableQueue.uPayloadsRefused);
  EXPECT_EQ(0u, s.reliableQueue.uBytesWaiting + s.unreliableQueue.uBytesWaiting);
  EXPECT_EQ(4u + 80 - 2 * kept[0].size(), s.uSimulatedLost);
  EXPECT_EQ(2u, s.uSimulatedDelayed);
  EXPECT_EQ(0u, s.model.uReceived);  // the network model never ran
  EXPECT_EQ(20000u, s.uBandwidth);

  client.destruct();
  EXPECT_EQ(0u, client.getStatistics().reliable.uBytesSent);
  EXPECT_EQ(0u, client.getStatistics().uHeartbeats);
}

TEST_F(StatisticsTest, RuntimeCountsOpenObjectsWaitingBytesAndTheNetworkThread) {
  const N_RuntimeStats start = N_Initializer::getStatistics();
  char message[100] = {};
  {
    N_Listener listener(port());
    N_Socket never(loopback(), freePort(), N_Socket::SOCKET_TCP);  // nobody listens
    never.send(message, sizeof message);
    N_Socket out(loopback(), port(), N_Socket::SOCKET_TCP);
    N_Socket::ConnectData* accepted = nullptr;
    ASSERT_TRUE(waitFor([&] { return listener.pollConnect(accepted); }));
    N_Socket in(accepted);
    N_RuntimeStats open = N_Initializer::getStatistics();
    EXPECT_EQ(start.uOpenListeners + 1, open.uOpenListeners);
    EXPECT_EQ(start.uOpenSockets + 3, open.uOpenSockets);
    EXPECT_EQ(start.uBytesWaitingForSend + 104, open.uBytesWaitingForSend);  // its prefix too

    // Library to library: the sender's count is the receiver's; the large
    // message leaves in chunks and counts once.
    for (unsigned size : {0u, 10u, 100u}) out.send(message, size);
    std::vector<char> large(300000);
    ASSERT_LT(out.getMaximumSendPacketSize(), 300000);
    out.send(large.data(), 300000);
    ASSERT_TRUE(waitFor([&] { return in.getStatistics().uMessagesReceived == 4; }));
    EXPECT_TRUE(waitFor([&] { return out.getStatistics().uMessagesSent == 4; }));
    const N_SocketStats sent = out.getStatistics(), got = in.getStatistics();
    EXPECT_EQ(300110u + 4 * 4, sent.uBytesSent);
    EXPECT_EQ(sent.uBytesSent, got.uBytesReceived);
    EXPECT_EQ(300110u, got.uBytesWaitingToPoll);
    EXPECT_EQ(0u, got.uBytesSent + sent.uBytesReceived);
    EXPECT_EQ(104u, never.getStatistics().uBytesWaitingForSend);
    EXPECT_EQ(0u, never.getStatistics().uBytesSent);

    const N_RuntimeStats later = N_Initializer::getStatistics();
    EXPECT_GT(later.uNetworkPasses, start.uNetworkPasses);
    EXPECT_GT(later.uEventsServed, start.uEventsServed);  // the accept, the connect, the reads
  }
  const N_RuntimeStats closed = N_Initializer::getStatistics();
  EXPECT_EQ(start.uOpenListeners, closed.uOpenListeners);
  EXPECT_EQ(start.uOpenSockets, closed.uOpenSockets);
  EXPECT_TRUE(waitFor([&] { return N_Initializer::getStatistics().uBytesWaitingForSend == start.uBytesWaitingForSend; }));
  stopRuntime();
  const N_RuntimeStats down = N_Initializer::getStatistics();
  EXPECT_EQ(0u, down.uOpenSockets + down.uOpenListeners + down.uBytesWaitingForSend);
  EXPECT_EQ(0u, down.uNetworkPasses + down.uEventsServed);
}

}  // namespace
