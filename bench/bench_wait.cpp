// The cost of one wait of the platform layer beside N idle handles: N UDP
// sockets on 127.0.0.1, each selected for FD_READ on an event of its own, and
// one waiting thread. Each round a datagram goes to another of them, and the
// thread waits (alertably, as the network thread does) until the wait names
// that socket's index, enumerates its events and posts the read that
// re-enables FD_READ. What a round costs is what serving one event costs the
// network thread's wait when N handles are in its set.
#include "bench_wait.h"

#include "win32.h"
#include "winsock.h"

namespace {
// Winsock's values, taken before the Linux headers below define macros of
// the same names.
constexpr int kInet = platform::AF_INET;
constexpr int kDatagram = platform::SOCK_DGRAM;
constexpr int kUdp = platform::IPPROTO_UDP;
constexpr long kRead = platform::FD_READ;
}  // namespace

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

void readDone(platform::DWORD, platform::DWORD, platform::WSAOVERLAPPED*, platform::DWORD) {}

// Microseconds per round with `count` handles, over about `seconds`; 0 if a
// wait gave the wrong index or failed.
double roundMicros(platform::DWORD count, double seconds) {
  std::vector<platform::SOCKET> sockets(count);
  std::vector<platform::WSAEVENT> events(count);
  std::vector<std::uint16_t> ports(count);
  for (platform::DWORD i = 0; i < count; ++i) {
    sockets[i] = platform::WSASocketA(kInet, kDatagram, kUdp, nullptr, 0, platform::WSA_FLAG_OVERLAPPED);
    platform::sockaddr_in address{static_cast<std::uint16_t>(kInet), 0, {platform::inet_addr("127.0.0.1")}, {}};
    int length = sizeof address;
    platform::bind(sockets[i], reinterpret_cast<platform::sockaddr*>(&address), sizeof address);
    platform::getsockname(sockets[i], reinterpret_cast<platform::sockaddr*>(&address), &length);
    ports[i] = address.sin_port;
    events[i] = platform::WSACreateEvent();
    platform::WSAEventSelect(sockets[i], events[i], kRead);
  }
  const int sender = ::socket(AF_INET, SOCK_DGRAM, 0);
  char datagram[64] = {};
  char buffer[64];
  platform::WSABUF into{sizeof buffer, buffer};
  platform::WSAOVERLAPPED overlapped{};
  bool right = sender >= 0;
  std::uint64_t rounds = 0;
  const auto start = Clock::now();
  const auto end = start + std::chrono::duration<double>(seconds);
  for (; right && Clock::now() < end; ++rounds) {
    const platform::DWORD target = static_cast<platform::DWORD>((rounds * 7919) % count);
    ::sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = ports[target];
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::sendto(sender, datagram, sizeof datagram, 0, reinterpret_cast<::sockaddr*>(&to), sizeof to);
    platform::DWORD result, index = 0;
    do {
      result = platform::waitForAnyEvent(count, events.data(), 1000, platform::TRUE, &index);
    } while (result == platform::WSA_WAIT_IO_COMPLETION);
    right = result == platform::WSA_WAIT_EVENT_0 && index == target;
    platform::WSANETWORKEVENTS what{};
    platform::WSAEnumNetworkEvents(sockets[target], events[target], &what);
    platform::DWORD got = 0, flags = 0;
    platform::WSARecv(sockets[target], &into, 1, &got, &flags, &overlapped, readDone);
  }
  const double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
  if (sender >= 0) ::close(sender);
  for (platform::DWORD i = 0; i < count; ++i) {
    platform::closesocket(sockets[i]);
    platform::WSACloseEvent(events[i]);
  }
  platform::SleepEx(0, platform::TRUE);  // the last read's completion
  return right && rounds > 0 ? elapsed * 1e6 / static_cast<double>(rounds) : 0.0;
}

}  // namespace

std::vector<WaitCost> benchWaitCost(const std::vector<unsigned>& counts, double seconds) {
  platform::WSADATA data;
  platform::WSAStartup(0x0002, &data);
  std::vector<WaitCost> costs;
  std::printf("\nOne event served by a wait over N handles (UDP sockets on loopback, one datagram a round)\n");
  for (unsigned count : counts) {
    WaitCost cost{count, roundMicros(count, seconds)};
    std::printf("  N = %5u: %7.2f us a round%s\n", count, cost.microsPerRound,
                cost.microsPerRound > 0 ? "" : " (A WAIT FAILED OR NAMED THE WRONG INDEX)");
    std::fflush(stdout);
    costs.push_back(cost);
  }
  platform::WSACleanup();
  return costs;
}
