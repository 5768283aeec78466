// Transport benchmark: message sockets of the library against a plain TCP
// socket pair with the same framing, measured side by side in one run.
//
//   vardel_bench [--quick]
//
// Throughput is one-way, every message checked byte for byte at the receiver.
// The round trip is a 32-byte message echoed by the peer.
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "bench_client_server.h"
#include "plain_tcp.h"
#include "win32.h"

namespace {

using Clock = std::chrono::steady_clock;

// Counts and checks messages on the network thread, freeing each at once.
class CheckingSocket : public N_Socket {
 public:
  ~CheckingSocket() { destruct(); }  // before the derived part goes: the network thread may call receive()
  std::size_t expectedSize = 0;
  std::atomic<std::uint64_t> received{0};
  std::atomic<bool> corrupt{false};
  bool receive(void* data, unsigned int size) override {
    std::uint64_t index = received.load(std::memory_order_relaxed);
    if (size != expectedSize || !bench::checkMessage(static_cast<const std::uint8_t*>(data), size, index))
      corrupt.store(true);
    received.store(index + 1, std::memory_order_release);
    return false;
  }
};

// Sends every message straight back.
class EchoSocket : public N_Socket {
 public:
  ~EchoSocket() { destruct(); }
  bool receive(void* data, unsigned int size) override {
    send(data, size);
    return false;
  }
};

// Hands each reply to the waiting application thread.
class ReplySocket : public N_Socket {
 public:
  ~ReplySocket() { destruct(); }
  std::mutex lock;
  std::condition_variable arrived;
  std::vector<std::uint8_t> reply;
  bool ready = false;
  bool receive(void* data, unsigned int size) override {
    std::lock_guard<std::mutex> hold(lock);
    reply.assign(static_cast<std::uint8_t*>(data), static_cast<std::uint8_t*>(data) + size);
    ready = true;
    arrived.notify_one();
    return false;
  }
  bool waitReply(int timeoutMs) {
    std::unique_lock<std::mutex> hold(lock);
    bool ok = arrived.wait_for(hold, std::chrono::milliseconds(timeoutMs), [&] { return ready; });
    ready = false;
    return ok;
  }
};

// A connected pair in this process: `out` connects, `in` is the accepted end.
template <class In, class Out>
bool connectPair(N_Listener& listener, N_Address& address, int port, In& in, Out& out) {
  out.construct(&address, port, N_Socket::SOCKET_TCP);
  N_Socket::ConnectData* data = nullptr;
  auto deadline = Clock::now() + std::chrono::seconds(5);
  while (!listener.pollConnect(data)) {
    if (Clock::now() > deadline) return false;
    platform::Sleep(1);
  }
  in.construct(data);
  while (!out.isConnected()) {
    if (Clock::now() > deadline) return false;
    platform::Sleep(1);
  }
  return true;
}

bench::Throughput libraryThroughput(std::size_t size, std::size_t count) {
  bench::Throughput t;
  int port = bench::freePort();
  N_Listener listener(port);
  N_Address address("127.0.0.1");
  CheckingSocket in;
  N_Socket out;
  in.expectedSize = size;
  if (!connectPair(listener, address, port, in, out)) return t;
  std::vector<std::uint8_t> message;
  auto start = Clock::now();
  for (std::size_t i = 0; i < count; ++i) {
    bench::fillMessage(message, size, i);
    out.send(message.data(), static_cast<unsigned>(size));
    // Keep the backlog bounded, as a real sender would.
    if ((i & 255) == 255) {
      while (static_cast<std::size_t>(out.getBytesWaitingForSend()) > (8u << 20)) platform::Sleep(1);
    }
  }
  auto deadline = Clock::now() + std::chrono::seconds(60);
  while (in.received.load(std::memory_order_acquire) < count && Clock::now() < deadline) platform::Sleep(1);
  double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  t.verified = in.received.load() == count && !in.corrupt.load();
  t.messagesPerSecond = static_cast<double>(count) / seconds;
  t.megabytesPerSecond = static_cast<double>(count * size) / seconds / 1e6;
  return t;
}

bench::Latency libraryRoundTrip(std::size_t size, int rounds) {
  int port = bench::freePort();
  N_Listener listener(port);
  N_Address address("127.0.0.1");
  EchoSocket echo;
  ReplySocket client;
  if (!connectPair(listener, address, port, echo, client)) return {};
  std::vector<double> micros;
  std::vector<std::uint8_t> message;
  for (int i = 0; i < rounds; ++i) {
    bench::fillMessage(message, size, static_cast<std::uint64_t>(i));
    auto start = Clock::now();
    client.send(message.data(), static_cast<unsigned>(size));
    if (!client.waitReply(5000)) break;
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    if (!bench::checkMessage(client.reply.data(), client.reply.size(), static_cast<std::uint64_t>(i))) {
      std::fprintf(stderr, "round trip: reply %d corrupt\n", i);
      break;
    }
  }
  return bench::summarize(micros);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 5 && std::strcmp(argv[1], "--client-peer") == 0)
    return clientPeer(argv[2], std::atoi(argv[3]), std::atof(argv[4]));
  bool quick = false;
  std::size_t only = 0;  // --size N: one throughput case alone, for profiling
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--quick") == 0) quick = true;
    if (std::strcmp(argv[i], "--size") == 0 && i + 1 < argc) only = std::strtoul(argv[++i], nullptr, 10);
  }
  N_Initializer network;
  if (only != 0) {
    bench::Throughput lib = libraryThroughput(only, (64u << 20) / (only + 64));
    std::printf("%zu bytes: %.0f msg/s, %.1f MB/s%s\n", only, lib.messagesPerSecond, lib.megabytesPerSecond,
                lib.verified ? "" : " (VERIFY FAILED)");
    return 0;
  }
  std::printf("Transport: one-way throughput over loopback, every message checked\n");
  std::printf("%10s %10s | %12s %9s | %12s %9s | %7s\n", "size", "messages", "plain msg/s", "MB/s", "vardel msg/s",
              "MB/s", "ratio");
  struct Case {
    std::size_t size;
    std::size_t count;
  };
  const Case cases[] = {{64, quick ? 50000u : 500000u},
                        {1024, quick ? 20000u : 200000u},
                        {65536, quick ? 1000u : 10000u},
                        {200000, quick ? 300u : 3000u}};
  for (const Case& c : cases) {
    bench::Throughput plain = bench::plainThroughput(c.size, c.count);
    bench::Throughput lib = libraryThroughput(c.size, c.count);
    std::printf("%10zu %10zu | %12.0f %9.1f | %12.0f %9.1f | %6.2fx%s\n", c.size, c.count, plain.messagesPerSecond,
                plain.megabytesPerSecond, lib.messagesPerSecond, lib.megabytesPerSecond,
                lib.messagesPerSecond / plain.messagesPerSecond,
                (plain.verified && lib.verified) ? "" : "  (VERIFY FAILED)");
  }
  int rounds = quick ? 2000 : 20000;
  bench::Latency plainRtt = bench::plainRoundTrip(32, rounds);
  bench::Latency libRtt = libraryRoundTrip(32, rounds);
  std::printf("\nRound trip of a 32-byte message (%d rounds)\n", rounds);
  std::printf("%10s | %10s %10s\n", "", "median us", "p99 us");
  std::printf("%10s | %10.1f %10.1f\n", "plain", plainRtt.medianMicros, plainRtt.p99Micros);
  std::printf("%10s | %10.1f %10.1f\n", "vardel", libRtt.medianMicros, libRtt.p99Micros);
  std::printf("%10s | %9.2fx %9.2fx\n", "ratio", libRtt.medianMicros / plainRtt.medianMicros,
              libRtt.p99Micros / plainRtt.p99Micros);
  benchClientServer(quick);
  return 0;
}
