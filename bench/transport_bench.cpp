// Transport benchmark: message sockets of the library against a plain TCP
// socket pair with the same framing and, where their development packages were
// found at build time, ENet and ZeroMQ, all measured in one run.
//
//   vardel_bench [--quick] [--rounds N] [--json FILE]
//   vardel_bench --scaling [--seconds S] [--sizes 20,50,100,200] [--json FILE]
//   vardel_bench --size BYTES | --round-trip | --memory | --idle   (the library alone)
//
// Throughput is one-way, every message checked (size, content, order) at the
// receiver. The round trip is a 32-byte message echoed by the peer. Each
// figure is the median of several rounds (7 by default, 3 with --quick; three
// times as many, shorter ones for the round trip); within a round every
// transport runs once, in an order that rotates from round to round, so that
// a slow spell of the machine falls on all of them alike.
//
// After the table and the client and server figures come the library's heap
// bytes per idle connection end and per message queued behind a peer that
// doesn't read. --size, --round-trip and --memory measure one figure of the
// library alone, for profiling; --idle the CPU that idle connections take.
//
// --scaling measures instead a server with many client processes at each
// size (bench_scaling.cpp), and the platform layer's wait beside 64 to 4096
// handles (bench_wait.cpp); bench/plot_scaling.py draws its JSON.
#include <malloc.h>
#include <sys/resource.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "bench_client_server.h"
#include "bench_scaling.h"
#include "bench_wait.h"
#include "peer_transports.h"
#include "plain_tcp.h"
#include "report.h"
#include "win32.h"

namespace {

using Clock = std::chrono::steady_clock;

// Counts and checks messages on the network thread, freeing each at once.
class CheckingSocket : public N_Socket {
 public:
  ~CheckingSocket() { destruct(); }  // before the derived part goes: the network thread may call receive()
  std::size_t expectedSize = 0;
  std::uint64_t expectedCount = 0;
  std::atomic<std::uint64_t> received{0};
  std::atomic<bool> corrupt{false};
  Clock::time_point last;  // when the last message was checked; read after `received` reaches the count
  bool receive(void* data, unsigned int size) override {
    std::uint64_t index = received.load(std::memory_order_relaxed);
    if (size != expectedSize || !bench::checkMessage(static_cast<const std::uint8_t*>(data), size, index))
      corrupt.store(true);
    if (index + 1 == expectedCount) last = Clock::now();
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
    {
      std::lock_guard<std::mutex> hold(lock);
      reply.assign(static_cast<std::uint8_t*>(data), static_cast<std::uint8_t*>(data) + size);
      ready = true;
    }
    // Outside the lock: the woken thread must not wait for it at once.
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
  in.expectedCount = count;
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
  // The receiver's clock, not this loop's: the sleep above would add up to a
  // millisecond.
  t.verified = in.received.load(std::memory_order_acquire) == count && !in.corrupt.load();
  double seconds = std::chrono::duration<double>((t.verified ? in.last : Clock::now()) - start).count();
  setRates(t, count, size, seconds);
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
    double micro = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
    if (client.reply.size() != size ||
        !bench::checkMessage(client.reply.data(), client.reply.size(), static_cast<std::uint64_t>(i))) {
      std::fprintf(stderr, "round trip: reply %d corrupt\n", i);
      break;
    }
    micros.push_back(micro);
  }
  return bench::summarize(micros);
}

// Heap in use, all arenas (the library allocates on several threads).
std::size_t heapInUse() {
  struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

// Heap bytes per idle connection end (beside the N_Socket object itself) and
// per message queued by a sender whose peer doesn't read.
void libraryMemory() {
  constexpr int kPairs = 20;  // 40 ends: within the default wait set of 64
  constexpr int kMessages = 20000;
  int port = bench::freePort();
  N_Listener listener(port);
  N_Address address("127.0.0.1");
  std::vector<std::unique_ptr<N_Socket>> ends;
  for (int i = 0; i < 2 * kPairs; ++i) ends.push_back(std::make_unique<N_Socket>());
  platform::Sleep(50);
  const std::size_t before = heapInUse();
  for (int i = 0; i < kPairs; ++i)
    if (!connectPair(listener, address, port, *ends[2 * i], *ends[2 * i + 1])) {
      std::printf("\nHeap: no connection (pair %d)\n", i);
      return;
    }
  platform::Sleep(200);
  const std::size_t connected = heapInUse();
  std::printf("\nHeap: %.0f bytes per idle connection end", double(connected - before) / (2 * kPairs));
  // A peer that accepts and never reads: the sender's queue holds what the
  // kernel's buffers don't.
  port = bench::freePort();
  const int peer = bench::silentPeer(static_cast<std::uint16_t>(port));
  N_Socket out;
  out.construct(&address, port, N_Socket::SOCKET_TCP);
  for (auto deadline = Clock::now() + std::chrono::seconds(5); !out.isConnected() && Clock::now() < deadline;)
    platform::Sleep(1);
  std::vector<std::uint8_t> message;
  bench::fillMessage(message, 64, 0);
  platform::Sleep(50);
  const std::size_t idle = heapInUse();
  for (int i = 0; i < kMessages; ++i) out.send(message.data(), 64);
  platform::Sleep(200);
  const unsigned queued = out.getQueuedSendMessages();
  if (queued > 0)
    std::printf(", %.0f bytes per queued 64 B message (%u queued)", double(heapInUse() - idle) / queued, queued);
  std::printf("\n");
  out.destruct();
  bench::closeSilentPeer(peer);
}

// CPU time of the whole process (every thread) while 20 connected socket
// pairs have nothing to do for 10 s.
void libraryIdle() {
  constexpr int kPairs = 20;
  int port = bench::freePort();
  N_Listener listener(port);
  N_Address address("127.0.0.1");
  std::vector<std::unique_ptr<N_Socket>> ends;
  for (int i = 0; i < 2 * kPairs; ++i) ends.push_back(std::make_unique<N_Socket>());
  for (int i = 0; i < kPairs; ++i)
    if (!connectPair(listener, address, port, *ends[2 * i], *ends[2 * i + 1])) return;
  platform::Sleep(200);
  const auto cpu = [] {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return (usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1e3 +
           (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e3;
  };
  const double before = cpu();
  platform::Sleep(10000);
  std::printf("Idle: %d connected socket pairs, %.1f ms of CPU in 10 s\n", kPairs, cpu() - before);
}

struct Transport {
  std::string name;
  bench::Throughput (*throughput)(std::size_t size, std::size_t count);
  bench::Latency (*roundTrip)(std::size_t size, int rounds);
};

std::vector<Transport> transports(bench::Report& report) {
  std::vector<Transport> all = {{"plain TCP", bench::plainThroughput, bench::plainRoundTrip},
                                {"vardel", libraryThroughput, libraryRoundTrip}};
  report.library = 1;
#ifdef VARDEL_BENCH_ENET
  all.push_back({"ENet", bench::enetThroughput, bench::enetRoundTrip});
  report.versions.push_back("ENet " + bench::enetVersion() + " reliable channel, enet_host_service 1 ms");
#endif
#ifdef VARDEL_BENCH_ZMQ
  all.push_back({"ZeroMQ", bench::zmqThroughput, bench::zmqRoundTrip});
  report.versions.push_back("ZeroMQ " + bench::zmqVersion() + " PUSH/PULL and REQ/REP over tcp");
#endif
  for (const Transport& t : all) report.transports.push_back(t.name);
  return all;
}

bench::Measure measure(const std::string& name, const std::string& unit, bool higherIsBetter, std::size_t count,
                       std::size_t transportCount) {
  bench::Measure m;
  m.name = name;
  m.unit = unit;
  m.higherIsBetter = higherIsBetter;
  m.count = count;
  m.rounds.resize(transportCount);
  m.verified.assign(transportCount, true);
  return m;
}

// A server with 20 to 200 clients, and the platform's wait beside 64 to 4096
// handles: how their cost grows.
int scaling(int argc, char** argv) {
  ScaleOptions options;
  std::string json;
  for (int i = 2; i + 1 < argc; i += 2) {
    if (std::strcmp(argv[i], "--seconds") == 0) {
      options.seconds = std::atof(argv[i + 1]);
    } else if (std::strcmp(argv[i], "--sizes") == 0) {
      options.sizes.clear();
      for (const char* at = argv[i + 1]; *at != 0;) {
        char* end = nullptr;
        options.sizes.push_back(static_cast<int>(std::strtol(at, &end, 10)));
        at = *end == ',' ? end + 1 : end;
      }
    } else if (std::strcmp(argv[i], "--json") == 0) {
      json = argv[i + 1];
    }
  }
  const std::vector<ScaleFigures> sizes = benchScaling(options);
  const std::vector<WaitCost> waits = benchWaitCost({64, 256, 1024, 4096}, 2.0);
  if (!json.empty() && !bench::writeScalingJson(options, sizes, waits, json)) {
    std::fprintf(stderr, "could not write %s\n", json.c_str());
    return 1;
  }
  bool complete = true;
  for (const ScaleFigures& f : sizes)
    complete = complete && f.connected == f.clients && f.reported == f.clients && f.reliableDisorder == 0 &&
               f.reliableDelivered == f.reliableSent;
  for (const WaitCost& w : waits) complete = complete && w.microsPerRound > 0;
  return complete ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 5 && std::strcmp(argv[1], "--client-peer") == 0)
    return clientPeer(argv[2], std::atoi(argv[3]), std::atof(argv[4]));
  if (argc == 4 && std::strcmp(argv[1], "--scale-client") == 0) return scaleClient(argv[2], std::atoi(argv[3]));
  if (argc >= 2 && std::strcmp(argv[1], "--scaling") == 0) return scaling(argc, argv);
  bool quick = false;
  int rounds = 0;
  std::string json;
  std::size_t only = 0;  // --size N: one throughput case of the library alone, for profiling
  bool roundTripOnly = false;  // --round-trip: the library's round trip alone, for profiling
  bool memoryOnly = false;     // --memory: the library's heap figures alone
  bool idleOnly = false;       // --idle: CPU of idle connections over 10 s
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--quick") == 0) {
      quick = true;
    } else if (std::strcmp(argv[i], "--round-trip") == 0) {
      roundTripOnly = true;
    } else if (std::strcmp(argv[i], "--memory") == 0) {
      memoryOnly = true;
    } else if (std::strcmp(argv[i], "--idle") == 0) {
      idleOnly = true;
    } else if (std::strcmp(argv[i], "--size") == 0 && i + 1 < argc) {
      only = std::strtoul(argv[++i], nullptr, 10);
    } else if (std::strcmp(argv[i], "--rounds") == 0 && i + 1 < argc) {
      rounds = std::atoi(argv[++i]);
    } else if (std::strcmp(argv[i], "--json") == 0 && i + 1 < argc) {
      json = argv[++i];
    } else {
      std::fprintf(stderr,
                   "usage: %s [--quick] [--rounds N] [--json FILE] | --size BYTES | --round-trip | --memory | --idle\n"
                   "       %s --scaling [--seconds S] [--sizes N,N,...] [--json FILE]\n",
                   argv[0], argv[0]);
      return 2;
    }
  }
  N_Initializer network;
  if (only != 0) {
    bench::Throughput lib = libraryThroughput(only, (64u << 20) / (only + 64));
    std::printf("%zu bytes: %.0f msg/s, %.1f MB/s%s\n", only, lib.messagesPerSecond, lib.megabytesPerSecond,
                lib.verified ? "" : " (VERIFY FAILED)");
    return 0;
  }
  if (idleOnly) {
    libraryIdle();
    return 0;
  }
  if (memoryOnly) {
    libraryMemory();
    return 0;
  }
  if (roundTripOnly) {
    bench::Latency lib = libraryRoundTrip(32, 20000);
    std::printf("32 bytes: round trip median %.1f us, p99 %.1f us\n", lib.medianMicros, lib.p99Micros);
    return 0;
  }
  if (rounds <= 0) rounds = quick ? 3 : 7;
  // A round trip depends on where the scheduler puts the threads, which is
  // drawn afresh with each round's threads: more and shorter rounds for it.
  const int latencyRounds = 3 * rounds;

  bench::Report report;
  report.loadBefore = bench::loadAverage();
  report.rounds = rounds;
  report.quick = quick;
  std::vector<Transport> all = transports(report);
  const std::size_t n = all.size();

  // Counts per round: a fraction of a second each for the fast transports.
  struct Case {
    const char* name;
    const char* unit;
    std::size_t size;
    std::size_t count;
  };
  const Case cases[] = {{"64 B messages", "msg/s", 64, quick ? 40000u : 200000u},
                        {"1 KiB messages", "MB/s", 1024, quick ? 20000u : 100000u},
                        {"64 KiB messages", "MB/s", 65536, quick ? 500u : 3000u},
                        {"200000 B messages", "MB/s", 200000, quick ? 200u : 1000u}};
  const int roundTrips = quick ? 500 : 2000;

  std::printf("Measuring %zu transports, %d rounds (round trip %d):", n, rounds, latencyRounds);
  for (const Transport& t : all) std::printf(" %s", t.name.c_str());
  std::printf("\n");
  for (const Case& c : cases) {
    bench::Measure m = measure(c.name, c.unit, true, c.count, n);
    for (int r = 0; r < rounds; ++r) {
      for (std::size_t k = 0; k < n; ++k) {
        std::size_t t = (k + static_cast<std::size_t>(r)) % n;
        bench::Throughput got = all[t].throughput(c.size, c.count);
        m.rounds[t].push_back(c.size == 64 ? got.messagesPerSecond : got.megabytesPerSecond);
        if (!got.verified) m.verified[t] = false;
      }
    }
    std::printf("  %s done\n", c.name);
    std::fflush(stdout);
    report.measures.push_back(std::move(m));
  }
  bench::Measure median = measure("32 B round trip", "us", false, static_cast<std::size_t>(roundTrips), n);
  bench::Measure p99 = measure("32 B round trip p99", "us", false, static_cast<std::size_t>(roundTrips), n);
  for (int r = 0; r < latencyRounds; ++r) {
    for (std::size_t k = 0; k < n; ++k) {
      std::size_t t = (k + static_cast<std::size_t>(r)) % n;
      bench::Latency got = all[t].roundTrip(32, roundTrips);
      median.rounds[t].push_back(got.medianMicros);
      p99.rounds[t].push_back(got.p99Micros);
      if (got.samples != static_cast<std::size_t>(roundTrips)) median.verified[t] = p99.verified[t] = false;
    }
  }
  report.measures.push_back(std::move(median));
  report.measures.push_back(std::move(p99));
  report.latencyRounds = latencyRounds;
  report.loadAfter = bench::loadAverage();
  printTable(report);

  ClientServerFigures clientServer = benchClientServer(quick);
  libraryMemory();
  if (!json.empty()) {
    if (!bench::writeJson(report, clientServer, json)) {
      std::fprintf(stderr, "could not write %s\n", json.c_str());
      return 1;
    }
    std::printf("\nwrote %s\n", json.c_str());
  }
  bool allVerified = true;
  for (const bench::Measure& m : report.measures)
    for (bool v : m.verified) allVerified = allVerified && v;
  return allVerified ? 0 : 1;
}
