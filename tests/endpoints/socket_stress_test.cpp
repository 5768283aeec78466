// Several threads send on one socket while others make and destroy sockets
// of their own. Every message must arrive whole, and each thread's messages
// in the order it sent them: the chunks of one send never interleave with
// another's. Meant to run under ThreadSanitizer as well.
#include <thread>

#include "transport_fixture.h"

using namespace transport_test;

namespace {

class SocketStressTest : public TransportTest {};

constexpr int kSenders = 4;
constexpr int kMessagesPerSender = 500;

// Message: sender (1 byte), sequence (4 bytes), then a pattern of both.
Bytes makeMessage(int sender, int sequence) {
  std::size_t size = sequence % 10 == 0 ? 70000 + static_cast<std::size_t>(sequence) * 13
                                        : static_cast<std::size_t>(sequence * 131 % 3000);
  Bytes body = pattern(size, static_cast<unsigned>(sender * 100000 + sequence));
  Bytes out = concat({Bytes{static_cast<unsigned char>(sender)}, le32(static_cast<std::uint32_t>(sequence)), body});
  return out;
}

// Checks each message on the network thread as it comes.
class CheckingSocket : public N_Socket {
 public:
  ~CheckingSocket() { destruct(); }
  bool receive(void* data, unsigned int size) override {
    const auto* p = static_cast<const unsigned char*>(data);
    if (size < 5 || p[0] >= kSenders) {
      ++bad;
      return false;
    }
    int sender = p[0];
    int sequence = static_cast<int>(p[1] | p[2] << 8 | p[3] << 16 | static_cast<unsigned>(p[4]) << 24);
    Bytes expected = makeMessage(sender, sequence);
    if (sequence != next[sender] || expected.size() != size || std::memcmp(expected.data(), p, size) != 0) ++bad;
    next[sender] = sequence + 1;
    ++total;
    return false;
  }
  int next[kSenders] = {};
  std::atomic<int> total{0};
  std::atomic<int> bad{0};
};

TEST_F(SocketStressTest, ConcurrentSendersWhileSocketsComeAndGo) {
  int port = freePort();
  N_Listener listener(port);
  CheckingSocket in;
  N_Socket out;
  ASSERT_TRUE(connectPair(listener, port, in, out));

  std::atomic<bool> stop{false};
  std::atomic<int> churned{0};
  std::atomic<int> churnFailures{0};
  std::vector<std::thread> threads;

  // Datagram sockets that talk to themselves, made and destroyed in a loop.
  threads.emplace_back([&] {
    while (!stop.load()) {
      N_Socket udp(loopback(), freePort(), N_Socket::SOCKET_UDP);
      send(udp, pattern(64, 1));
      Bytes got;
      if (!pollMessage(udp, got, 2000) || got != pattern(64, 1)) ++churnFailures;
      ++churned;
    }
  });
  // TCP pairs on a listener of their own, made, used once and destroyed.
  threads.emplace_back([&] {
    int churnPort = freePort();
    N_Listener churnListener(churnPort);
    while (!stop.load()) {
      N_Socket a, b;
      if (!connectPair(churnListener, churnPort, b, a)) {
        ++churnFailures;
        continue;
      }
      send(a, pattern(1000, 2));
      Bytes got;
      if (!pollMessage(b, got, 2000) || got != pattern(1000, 2)) ++churnFailures;
      send(b, pattern(10, 3));  // left queued or in flight when the pair goes
      ++churned;
    }
  });
  for (int s = 0; s < kSenders; ++s) {
    threads.emplace_back([&, s] {
      for (int i = 0; i < kMessagesPerSender; ++i) {
        send(out, makeMessage(s, i));
        if (i % 16 == 15)
          while (out.getBytesWaitingForSend() > (4 << 20)) platform::Sleep(1);
      }
    });
  }
  for (int s = 0; s < kSenders; ++s) threads[2 + static_cast<std::size_t>(s)].join();
  EXPECT_TRUE(waitFor([&] { return in.total.load() == kSenders * kMessagesPerSender; }, 60000))
      << in.total.load();
  stop = true;
  threads[0].join();
  threads[1].join();
  EXPECT_EQ(0, in.bad.load());
  for (int s = 0; s < kSenders; ++s) EXPECT_EQ(kMessagesPerSender, in.next[s]);
  EXPECT_EQ(0, churnFailures.load());
  EXPECT_GT(churned.load(), 0);
}

}  // namespace
