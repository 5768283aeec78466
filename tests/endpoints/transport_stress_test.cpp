// The transport under load: two hosts in two processes, and several threads
// sending on one socket while sockets come and go.
#include <thread>

#include "child_process.h"
#include "endpoint_test.h"

namespace {

class TransportStressTest : public EndpointTest {};

// This test on 127.0.0.1 and the transport peer on 127.0.0.2 exchange
// messages over TCP (port P) and UDP (P + 1 on each side's own address). The
// peer echoes everything: whole, in order and byte-identical.
TEST_F(TransportStressTest, TcpAndUdpExchangeWithAPeerProcess) {
  N_Listener listener(port());
  N_Address peerAddress("127.0.0.2");
  N_Socket udp(&peerAddress, port() + 1, N_Socket::SOCKET_UDP);
  ChildProcess peer(VARDEL_HOST_TRANSPORT_PEER, {"--port", std::to_string(port())});
  ASSERT_TRUE(peer.started()) << peer.startError();
  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(data); }, 20000));
  N_Socket tcp(data);
  EXPECT_STREQ("127.0.0.2", const_cast<const char*>(tcp.getAddress()->getStringNumber()));
  const std::size_t s = 65536;  // sizes around the chunk limit S - 16 and far past it, then a burst
  std::vector<Bytes> sent;
  for (std::size_t size : {0ul, 1ul, s - 17, s - 16, s - 15, s - 12, s, s + 1, 3 * (s - 16), 3 * (s - 16) + 1, 3ul << 20})
    sent.push_back(pattern(size, size));
  for (unsigned i = 0; i < 300; ++i) sent.push_back(pattern(i * 7 % 700, 1000 + i));
  for (const Bytes& m : sent) send(tcp, m);
  Bytes got;
  for (std::size_t i = 0; i < sent.size(); ++i) {
    ASSERT_TRUE(pollMessage(tcp, got, 20000)) << "echo " << i << " missing";
    ASSERT_TRUE(sent[i] == got) << "echo " << i << " differs";
  }
  for (unsigned size : {0, 1, 1400, 65507}) {  // one datagram at a time, up to the limit
    send(udp, pattern(size, size + 5));
    ASSERT_TRUE(nextMessage(udp, pattern(size, size + 5))) << "datagram of " << size;
  }
  send(tcp, Bytes{'q', 'u', 'i', 't'});
  const std::optional<int> code = peer.wait(20000);
  ASSERT_TRUE(code.has_value()) << "the peer didn't end";
  EXPECT_EQ(0, *code);
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  EXPECT_EQ(&tcp, reported);
}

constexpr int kSenders = 4, kMessagesPerSender = 500;

// Sender (1 byte), sequence (4 bytes), then a pattern of both.
Bytes makeMessage(int sender, unsigned sequence) {
  const std::size_t size = sequence % 10 == 0 ? 70000 + sequence * 13 : sequence * 131 % 3000;
  return concat({Bytes{static_cast<unsigned char>(sender)}, le32(sequence), pattern(size, sender * 100000 + sequence)});
}

// Checks each message on the network thread as it comes.
class CheckingSocket : public N_Socket {
 public:
  ~CheckingSocket() { destruct(); }
  bool receive(void* data, unsigned size) override {
    const auto* p = static_cast<const unsigned char*>(data);
    if (size < 5 || p[0] >= kSenders) return ++bad, false;
    const int sender = p[0];
    const unsigned sequence = p[1] | p[2] << 8 | p[3] << 16 | static_cast<unsigned>(p[4]) << 24;
    bad += sequence != next[sender] || makeMessage(sender, sequence) != Bytes(p, p + size);
    next[sender] = sequence + 1;
    ++total;
    return false;
  }
  unsigned next[kSenders] = {};
  std::atomic<int> total{0}, bad{0};
};

// Every message arrives whole, and each thread's in the order it sent them:
// the chunks of one send never interleave with another's.
TEST_F(TransportStressTest, ConcurrentSendersWhileSocketsComeAndGo) {
  N_Listener listener(port());
  CheckingSocket in;
  N_Socket out;
  ASSERT_TRUE(connectPair(listener, port(), in, out));
  std::atomic<bool> stop{false};
  std::atomic<int> churned{0}, churnFailures{0};
  std::thread churn([&] {  // sockets made, used once and destroyed, the last send left in flight
    const int churnPort = freePort();
    N_Listener churnListener(churnPort);
    while (!stop) {
      N_Socket a, b, udp(loopback(), freePort(), N_Socket::SOCKET_UDP);
      Bytes got, datagram;
      send(udp, pattern(64, 1));
      const bool ok = connectPair(churnListener, churnPort, b, a);
      if (ok) send(a, pattern(1000, 2));
      churnFailures += !ok || !pollMessage(b, got, 2000) || got != pattern(1000, 2) ||
                       !pollMessage(udp, datagram, 2000) || datagram != pattern(64, 1);
      if (ok) send(b, pattern(10, 3));
      ++churned;
    }
  });
  std::vector<std::thread> senders;
  for (int s = 0; s < kSenders; ++s)
    senders.emplace_back([&, s] {
      for (unsigned i = 0; i < kMessagesPerSender; ++i) {
        send(out, makeMessage(s, i));
        while (i % 16 == 15 && out.getBytesWaitingForSend() > (4 << 20)) platform::Sleep(1);
      }
    });
  for (std::thread& t : senders) t.join();
  EXPECT_TRUE(waitFor([&] { return in.total == kSenders * kMessagesPerSender; }, 60000)) << in.total;
  stop = true;
  churn.join();
  EXPECT_EQ(0, in.bad.load());
  for (unsigned next : in.next) EXPECT_EQ(kMessagesPerSender, next);
  EXPECT_EQ(0, churnFailures.load());
  EXPECT_GT(churned.load(), 0);
}

}  // namespace
