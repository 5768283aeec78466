// Two processes exchange whole messages over TCP and UDP: one listens, the
// other connects. Every message is checked on arrival.
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "demo.h"
#include "vardel_platform.h"

namespace demo {
namespace {

using Clock = std::chrono::steady_clock;

const std::vector<unsigned> kTcpSizes = {0, 1, 100, 65520, 65521, 1u << 20};
constexpr int kBurst = 10000;
constexpr unsigned kBurstSize = 1024;
constexpr int kDatagrams = 200;
constexpr unsigned kDatagramSize = 512;

void pattern(std::vector<unsigned char>& out, unsigned size, unsigned seed) {
  out.resize(size);
  for (unsigned i = 0; i < size; ++i) out[i] = static_cast<unsigned char>(seed * 7 + i);
}

bool intact(const void* data, unsigned size, unsigned expectSize, unsigned seed) {
  if (size != expectSize) return false;
  const auto* p = static_cast<const unsigned char*>(data);
  for (unsigned i = 0; i < size; ++i)
    if (p[i] != static_cast<unsigned char>(seed * 7 + i)) return false;
  return true;
}

int exchange(const char* who, N_Socket& tcp, N_Socket& udp) {
  // Both sides have their datagram socket now; say so, then wait for the peer.
  const char ready[] = "ready";
  tcp.send(const_cast<char*>(ready), sizeof ready);
  void* data;
  unsigned size;
  auto deadline = Clock::now() + std::chrono::seconds(10);
  while (!tcp.poll(data, size)) {
    if (Clock::now() > deadline || !tcp.isConnected()) {
      std::printf("[%s] peer never got ready\n", who);
      return 1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }

  auto start = Clock::now();
  std::vector<unsigned char> message;
  std::size_t tcpBytes = 0;
  unsigned seed = 0;
  for (unsigned s : kTcpSizes) {
    pattern(message, s, seed++);
    tcp.send(message.data(), s);
    tcpBytes += s;
  }
  for (int i = 0; i < kBurst; ++i) {
    pattern(message, kBurstSize, seed++);
    tcp.send(message.data(), kBurstSize);
    tcpBytes += kBurstSize;
  }
  const unsigned tcpCount = seed;

  unsigned tcpGot = 0, tcpBad = 0, udpGot = 0, udpBad = 0;
  int udpSent = 0;
  auto lastDatagram = Clock::now();
  auto tcpDone = Clock::time_point{};
  deadline = Clock::now() + std::chrono::seconds(30);
  while (Clock::now() < deadline) {
    // Datagrams go out once the stream has arrived, at a modest pace; UDP
    // may still lose some when a receiver is busy, and each carries its
    // number to show which.
    if (tcpGot == tcpCount && udpSent < kDatagrams && Clock::now() - lastDatagram > std::chrono::microseconds(500)) {
      pattern(message, kDatagramSize, 1000 + static_cast<unsigned>(udpSent));
      std::memcpy(message.data(), &udpSent, sizeof udpSent);
      udp.send(message.data(), kDatagramSize);
      ++udpSent;
      lastDatagram = Clock::now();
    }
    bool any = false;
    while (tcpGot < tcpCount && tcp.poll(data, size)) {
      any = true;
      unsigned expect = tcpGot < kTcpSizes.size() ? kTcpSizes[tcpGot] : kBurstSize;
      if (!intact(data, size, expect, tcpGot)) ++tcpBad;
      if (++tcpGot == tcpCount) tcpDone = Clock::now();
    }
    while (udp.poll(data, size)) {
      any = true;
      int number = -1;
      if (size == kDatagramSize) std::memcpy(&number, data, sizeof number);
      std::vector<unsigned char> expect;
      pattern(expect, kDatagramSize, 1000 + static_cast<unsigned>(number));
      std::memcpy(expect.data(), &number, sizeof number);
      if (number < 0 || number >= kDatagrams || std::memcmp(expect.data(), data, kDatagramSize) != 0) ++udpBad;
      ++udpGot;
    }
    bool udpOver = udpSent == kDatagrams &&
                   (udpGot == kDatagrams || Clock::now() - lastDatagram > std::chrono::seconds(1));
    if (tcpGot == tcpCount && udpOver) break;
    if (!any) std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  double seconds = std::chrono::duration<double>((tcpGot == tcpCount ? tcpDone : Clock::now()) - start).count();
  std::printf("[%s] TCP: sent %u messages (%.1f MB), received %u of %u, %u damaged, %.0f MB/s each way\n", who,
              tcpCount, tcpBytes / 1e6, tcpGot, tcpCount, tcpBad, tcpBytes / 1e6 / seconds);
  std::printf("[%s] UDP: sent %d datagrams of %u bytes, received %u of %d (unreliable: the rest was lost), %u damaged\n",
              who, udpSent, kDatagramSize, udpGot, kDatagrams, udpBad);
  // Let the peer finish reading before this end goes away.
  tcp.send(const_cast<char*>(ready), sizeof ready);
  deadline = Clock::now() + std::chrono::seconds(5);
  while (Clock::now() < deadline && tcp.isConnected()) {
    if (tcp.poll(data, size) && size == sizeof ready) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return (tcpGot == tcpCount && tcpBad == 0 && udpBad == 0) ? 0 : 1;
}

int listenSide(const Options& options) {
  platform::setLocalHost(options.host.empty() ? "127.0.0.1" : options.host.c_str());
  N_Initializer network;
  N_Listener listener(options.port);
  std::printf("[listener %s] listening on port %d (TCP) and %d (UDP)\n",
              const_cast<const char*>(N_Address::getLocalAddress()->getStringNumber()), options.port,
              options.port + 1);
  std::fflush(stdout);
  N_Socket::ConnectData* connection = nullptr;
  auto deadline = Clock::now() + std::chrono::seconds(20);
  while (!listener.pollConnect(connection)) {
    if (Clock::now() > deadline || stopRequested()) return 1;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  N_Socket tcp(connection);
  N_Socket udp(tcp.getAddress(), options.port + 1, N_Socket::SOCKET_UDP);
  std::printf("[listener] accepted %s:%d\n", const_cast<const char*>(tcp.getAddress()->getStringNumber()),
              tcp.getPort());
  return exchange("listener", tcp, udp);
}

int connectSide(const Options& options, const std::string& server) {
  platform::setLocalHost(options.host.empty() ? "127.0.0.2" : options.host.c_str());
  N_Initializer network;
  N_Address address(server.c_str());
  if (address.getIdentifier() == 0 && !address.wait(5.0f) && address.getIdentifier() == 0) {
    std::printf("[connector] cannot resolve %s\n", server.c_str());
    return 1;
  }
  N_Socket tcp;
  auto deadline = Clock::now() + std::chrono::seconds(20);
  // The listener may still be starting: try again until it answers.
  while (!tcp.isConnected()) {
    tcp.construct(&address, options.port, N_Socket::SOCKET_TCP);
    for (int i = 0; i < 50 && !tcp.isConnected(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (Clock::now() > deadline || stopRequested()) return 1;
  }
  N_Socket udp(&address, options.port + 1, N_Socket::SOCKET_UDP);
  std::printf("[connector %s] connected to %s:%d\n",
              const_cast<const char*>(N_Address::getLocalAddress()->getStringNumber()), server.c_str(), options.port);
  return exchange("connector", tcp, udp);
}

}  // namespace

int runTransport(const Options& options) {
  try {
    std::string role = options.args.empty() ? "both" : options.args[0];
    if (role == "listen") return listenSide(options);
    if (role == "connect") return connectSide(options, options.args.size() > 1 ? options.args[1] : "127.0.0.1");
    // One command: a listener process on 127.0.0.1, this process on 127.0.0.2.
    int child = spawnSelf({"transport", "listen", "--host", "127.0.0.1", "--port", std::to_string(options.port)}, false);
    Options mine = options;
    mine.host = "127.0.0.2";
    int rc = connectSide(mine, "127.0.0.1");
    stopChild(child, 5000);
    return rc;
  } catch (Q_Exception* e) {
    std::printf("transport failed: %s\n", e->getErrorMessage());
    return 1;
  }
}

}  // namespace demo
