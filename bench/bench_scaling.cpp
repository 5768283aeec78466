// A server with many clients. The server runs in this process with a wait
// set large enough for all of them (N_Initializer::setMaximumWaitEvents) and
// a loop of 60 passes a second, as a game server's; each client is a process
// of its own (this program again, --scale-client) on 127.0.0.N. A client
// sends a 64-byte unreliable payload 20 times a second and a reliable event
// once a second. When the measured window ends, the server tells each client
// to stop, and each reports what it actually sent (payloads that left its
// queue in a flush), so delivered shares are counted against that.
//
// Payloads of one message are joined without separators, so each kind has
// its size and its first byte: 'U' 64 bytes unreliable; 'E' (event, with its
// number), 'R' (report) and 'S' (stop) 16 bytes reliable.
#include "bench_scaling.h"

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <thread>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Initializer.h"
#include "N_Server.h"
#include "plain_tcp.h"
#include "report.h"
#include "vardel_platform.h"

namespace {

using Clock = std::chrono::steady_clock;
using Seconds = std::chrono::duration<double>;

constexpr unsigned kUnreliableSize = 64;
constexpr unsigned kReliableSize = 16;
constexpr auto kUnreliableEvery = std::chrono::milliseconds(50);
constexpr auto kEventEvery = std::chrono::seconds(1);
constexpr auto kServerTick = std::chrono::microseconds(16667);
constexpr auto kClientTick = std::chrono::milliseconds(10);
constexpr int kBatch = 10;  // clients started at once

struct Record {
  char kind;
  std::uint32_t a, b;  // event: its number; report: unreliable and reliable sent
};

void queueRecord(N_Client& client, Record r) {
  unsigned char bytes[kReliableSize] = {};
  bytes[0] = static_cast<unsigned char>(r.kind);
  std::memcpy(bytes + 4, &r.a, 4);
  std::memcpy(bytes + 8, &r.b, 4);
  client.queueReliable(bytes, sizeof bytes, 0, 2);
}

double cpuSeconds() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);  // the server's threads; the clients are children
  return usage.ru_utime.tv_sec + usage.ru_stime.tv_sec + (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

// What the server has of one client.
struct Seen {
  unsigned long unreliable = 0, events = 0, disorder = 0;
  std::uint32_t nextEvent = 0;
  bool reported = false;
  std::uint32_t unreliableSent = 0, reliableSent = 0;
};

void take(N_Client* client, Seen& seen) {
  void* data;
  unsigned size;
  while (client->poll(data, size)) {
    const auto* bytes = static_cast<const unsigned char*>(data);
    for (unsigned at = 0; at < size;) {
      if (bytes[at] == 'U') {
        ++seen.unreliable;
        at += kUnreliableSize;
        continue;
      }
      if (at + kReliableSize > size) break;
      Record r{static_cast<char>(bytes[at]), 0, 0};
      std::memcpy(&r.a, bytes + at + 4, 4);
      std::memcpy(&r.b, bytes + at + 8, 4);
      if (r.kind == 'E') {
        ++seen.events;
        if (r.a != seen.nextEvent) ++seen.disorder;
        seen.nextEvent = r.a + 1;
      } else if (r.kind == 'R') {
        seen.reported = true;
        seen.unreliableSent = r.a;
        seen.reliableSent = r.b;
      }
      at += kReliableSize;
    }
  }
}

ScaleFigures runSize(int count, double seconds) {
  ScaleFigures figures;
  figures.clients = count;
  figures.loadBefore = bench::loadAverage();
  const int port = bench::freePort();
  N_Server server(port);
  std::vector<pid_t> children;
  std::vector<N_Client*> clients;
  std::map<N_Client*, Seen> seen;
  const auto serve = [&] {
    server.update();
    for (N_Client* c = nullptr; server.pollConnect(c);) clients.push_back(c);
    for (N_Client* c : clients) take(c, seen[c]);
  };
  const auto pass = [&](Clock::time_point until) {
    while (Clock::now() < until) {
      const auto tick = Clock::now();
      serve();
      std::this_thread::sleep_until(tick + kServerTick);
    }
  };
  // A few at a time: each client's first update spins through its world
  // clock exchange, which a crowd of them would stretch for everybody.
  for (int i = 0; i < count; ++i) {
    const std::string host = "127.0.0." + std::to_string(i + 2), portText = std::to_string(port);
    const pid_t pid = fork();
    if (pid == 0) {
      execl("/proc/self/exe", "vardel_bench", "--scale-client", host.c_str(), portText.c_str(),
            static_cast<char*>(nullptr));
      _exit(127);
    }
    if (pid > 0) children.push_back(pid);
    if ((i + 1) % kBatch != 0 && i + 1 != count) continue;
    const auto deadline = Clock::now() + std::chrono::seconds(20);
    while (static_cast<int>(clients.size()) < i + 1 && Clock::now() < deadline) pass(Clock::now() + kServerTick);
  }
  figures.connected = static_cast<int>(clients.size());

  const double cpuStart = cpuSeconds();
  const auto start = Clock::now();
  pass(start + std::chrono::duration_cast<Clock::duration>(Seconds(seconds)));
  figures.seconds = Seconds(Clock::now() - start).count();
  figures.serverCpuPercent = (cpuSeconds() - cpuStart) / figures.seconds * 100.0;
  figures.loadAfter = bench::loadAverage();

  for (N_Client* c : clients) {
    queueRecord(*c, {'S', 0, 0});
    c->flushReliable();
  }
  const auto deadline = Clock::now() + std::chrono::seconds(15);
  const auto allReported = [&] {
    for (N_Client* c : clients)
      if (!seen[c].reported && c->isConnected()) return false;
    return true;
  };
  while (!allReported() && Clock::now() < deadline) pass(Clock::now() + kServerTick);
  for (N_Client* c : clients) {
    const Seen& s = seen[c];
    figures.reported += s.reported;
    figures.unreliableDelivered += s.unreliable;
    figures.reliableDelivered += s.events;
    figures.reliableDisorder += s.disorder;
    figures.unreliableSent += s.unreliableSent;
    figures.reliableSent += s.reliableSent;
  }
  for (pid_t pid : children) kill(pid, SIGTERM);
  for (pid_t pid : children) waitpid(pid, nullptr, 0);
  for (N_Client* c : clients) server.disconnectClient(c);
  return figures;
}

double share(unsigned long part, unsigned long whole) { return whole > 0 ? 100.0 * part / whole : 0.0; }

}  // namespace

int scaleClient(const char* host, int port) {
  platform::setLocalHost(host);
  N_Initializer network;
  N_Address server("127.0.0.1");
  N_Client client(&server, port);
  std::uint32_t unreliableSent = 0, events = 0, sequence = 0;
  bool stopped = false, reported = false, wasConnected = false;
  const auto begin = Clock::now();
  Clock::time_point nextPayload{}, nextEvent{}, stoppedAt{};
  for (;;) {
    const auto tick = Clock::now();
    client.update();
    if (!client.isConnected()) {
      // Gone, or never there: either way nothing more to do.
      if (wasConnected || tick - begin > std::chrono::seconds(60)) return reported ? 0 : 1;
      std::this_thread::sleep_until(tick + kClientTick);
      continue;
    }
    if (!wasConnected) nextPayload = nextEvent = Clock::now();
    wasConnected = true;
    if (!stopped && tick >= nextPayload) {
      unsigned char payload[kUnreliableSize] = {'U'};
      std::memcpy(payload + 4, &sequence, 4);
      ++sequence;
      client.queueUnreliable(payload, sizeof payload, 0, 1);
      nextPayload += kUnreliableEvery;
    }
    if (!stopped && tick >= nextEvent) {
      queueRecord(client, {'E', events++, 0});
      nextEvent += kEventEvery;
    }
    const unsigned waiting = client.getUnreliableBytesWaiting();
    client.flushReliable();  // first: one gate for both
    client.flushUnreliable();
    unreliableSent += (waiting - client.getUnreliableBytesWaiting()) / kUnreliableSize;
    void* data;
    unsigned size;
    while (client.poll(data, size))
      if (size >= 1 && static_cast<const char*>(data)[0] == 'S' && !stopped) stopped = true, stoppedAt = tick;
    if (stopped && !reported && client.getUnreliableBytesWaiting() == 0 && client.getReliableBytesWaiting() == 0) {
      queueRecord(client, {'R', unreliableSent, events});
      reported = true;
    }
    // The server ends the run; this end waits for it, within reason.
    if (stopped && tick - stoppedAt > std::chrono::seconds(20)) return reported ? 0 : 1;
    std::this_thread::sleep_until(tick + kClientTick);
  }
}

std::vector<ScaleFigures> benchScaling(const ScaleOptions& options) {
  N_Initializer::setMaximumWaitEvents(options.waitEvents);
  N_Initializer network;
  std::vector<ScaleFigures> all;
  std::printf(
      "\nA server with N client processes (64-byte unreliable payloads at 20 Hz, a reliable event a "
      "second), wait set %u, %.0f s measured each\n",
      N_Initializer::getMaximumWaitEvents(), options.seconds);
  std::printf("%8s %10s %22s %26s %12s %8s\n", "clients", "connected", "reliable delivered", "unreliable delivered",
              "server CPU", "load");
  for (int count : options.sizes) {
    ScaleFigures f = runSize(count, options.seconds);
    std::printf("%8d %6d/%-3d %8lu/%-6lu %6.1f%% %10lu/%-7lu %6.1f%% %10.1f%% %8.2f%s\n", f.clients, f.connected,
                f.clients, f.reliableDelivered, f.reliableSent, share(f.reliableDelivered, f.reliableSent),
                f.unreliableDelivered, f.unreliableSent, share(f.unreliableDelivered, f.unreliableSent),
                f.serverCpuPercent, f.loadAfter, f.reported < f.connected ? "  (some clients never reported)" : "");
    if (f.reliableDisorder > 0) std::printf("         ! %lu reliable events out of order\n", f.reliableDisorder);
    std::fflush(stdout);
    all.push_back(f);
  }
  return all;
}
