// Client and server figures, in the same run as the transport figures:
//  - the round trip of a small payload through queueReliable, flushReliable
//    and N_Client::poll between a client and a server in this process;
//  - a server with 20 client processes (each its own loopback address), each
//    sending 64-byte unreliable payloads at 60 Hz: the server's CPU time per
//    second of wall time and the share of payloads delivered.
#include "bench_client_server.h"

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Initializer.h"
#include "N_Server.h"
#include "plain_tcp.h"
#include "vardel_platform.h"

namespace {

using Clock = std::chrono::steady_clock;

double cpuSeconds() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_utime.tv_sec + usage.ru_stime.tv_sec + (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

bench::Latency payloadRoundTrip(int rounds) {
  int port = 0;
  for (int i = 0; i < 50 && port == 0; ++i) {
    int p = bench::freePort();
    if (p != 0 && p < 65000) port = p;
  }
  N_Server server(port);
  server.setMaximumBandwidthUsage(1250000);  // measure the path, not the pacing of a small grant
  N_Address address("127.0.0.1");
  N_Client client(&address, port);
  N_Client* remote = nullptr;
  auto deadline = Clock::now() + std::chrono::seconds(10);
  while ((!client.isConnected() || remote == nullptr) && Clock::now() < deadline) {
    client.update();
    server.update();
    if (remote == nullptr) server.pollConnect(remote);
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  if (remote == nullptr || !client.isConnected()) {
    std::printf("payload round trip: no connection\n");
    return {};
  }
  std::vector<double> micros;
  std::vector<std::uint8_t> payload;
  for (int i = 0; i < rounds; ++i) {
    bench::fillMessage(payload, 32, static_cast<std::uint64_t>(i));
    auto start = Clock::now();
    client.queueReliable(payload.data(), 32, 0, 1);
    bool back = false;
    while (!back && Clock::now() - start < std::chrono::seconds(2)) {
      client.flushReliable();
      void* data;
      unsigned size;
      while (remote->poll(data, size)) remote->queueReliable(data, size, 0, 1);
      remote->flushReliable();
      if (client.poll(data, size)) {
        back = bench::checkMessage(static_cast<std::uint8_t*>(data), size, static_cast<std::uint64_t>(i));
        if (!back) break;
      }
      if (!back) std::this_thread::yield();
    }
    if (!back) break;
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  return bench::summarize(micros);
}

}  // namespace

// One of the 20 clients, in a process of its own (started by exec, so that it
// has a runtime of its own).
int clientPeer(const char* host, int port, double seconds) {
  platform::setLocalHost(host);
  N_Initializer network;
  N_Address server("127.0.0.1");
  N_Client client(&server, port);
  auto start = Clock::now();
  unsigned sequence = 0;
  while (Clock::now() - start < std::chrono::duration<double>(seconds + 3.0)) {
    auto tick = Clock::now();
    client.update();
    if (client.isConnected()) {
      unsigned char payload[64] = {};
      std::memcpy(payload, &sequence, sizeof sequence);
      ++sequence;
      client.queueUnreliable(payload, sizeof payload, 0, 1);
      client.flushUnreliable();
    }
    std::this_thread::sleep_until(tick + std::chrono::microseconds(16667));
  }
  return 0;
}

namespace {

void twentyClients(double seconds, ClientServerFigures& figures) {
  int port = bench::freePort();
  N_Server server(port);
  std::vector<pid_t> children;
  for (int i = 0; i < 20; ++i) {
    std::string host = "127.0.0." + std::to_string(i + 2);
    std::string portText = std::to_string(port);
    std::string secondsText = std::to_string(seconds);
    pid_t pid = fork();
    if (pid == 0) {
      execl("/proc/self/exe", "vardel_bench", "--client-peer", host.c_str(), portText.c_str(), secondsText.c_str(),
            static_cast<char*>(nullptr));
      _exit(127);
    }
    children.push_back(pid);
  }
  std::vector<N_Client*> clients;
  auto deadline = Clock::now() + std::chrono::seconds(15);
  while (clients.size() < 20 && Clock::now() < deadline) {
    server.update();
    N_Client* c;
    while (server.pollConnect(c)) clients.push_back(c);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  unsigned long received = 0;
  double cpuStart = cpuSeconds();
  auto start = Clock::now();
  while (Clock::now() - start < std::chrono::duration<double>(seconds)) {
    auto tick = Clock::now();
    server.update();
    for (N_Client* c : clients) {
      void* data;
      unsigned size;
      while (c->poll(data, size)) received += size / 64;
    }
    std::this_thread::sleep_until(tick + std::chrono::microseconds(16667));
  }
  double wall = std::chrono::duration<double>(Clock::now() - start).count();
  double cpu = cpuSeconds() - cpuStart;
  for (pid_t pid : children) {
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
  }
  double expected = static_cast<double>(clients.size()) * 60.0 * wall;
  std::printf("\nServer with %zu clients sending 64-byte unreliable payloads at 60 Hz for %.1f s\n", clients.size(),
              wall);
  std::printf("  server CPU: %.1f ms per second of wall time (%.1f%% of one core)\n", cpu / wall * 1000.0,
              cpu / wall * 100.0);
  std::printf("  delivered:  %lu payloads, %.1f%% of %.0f sent at 60 Hz\n", received,
              expected > 0 ? 100.0 * received / expected : 0.0, expected);
  figures.clients = clients.size();
  figures.seconds = wall;
  figures.serverCpuPercent = cpu / wall * 100.0;
  figures.deliveredPercent = expected > 0 ? 100.0 * received / expected : 0.0;
}

}  // namespace

ClientServerFigures benchClientServer(bool quick) {
  ClientServerFigures figures;
  figures.payloadRounds = quick ? 500 : 5000;
  figures.payload = payloadRoundTrip(figures.payloadRounds);
  std::printf("\nPayload round trip (32 bytes, queueReliable + flushReliable + poll, %d rounds)\n",
              figures.payloadRounds);
  std::printf("  median %.1f us, p99 %.1f us\n", figures.payload.medianMicros, figures.payload.p99Micros);
  twentyClients(quick ? 3.0 : 10.0, figures);
  return figures;
}
