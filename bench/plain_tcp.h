// The baseline: a plain TCP socket pair on loopback with the same 4-byte
// little-endian length prefix, written without the library.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace bench {

struct Throughput {
  double messagesPerSecond = 0;
  double megabytesPerSecond = 0;
  bool verified = false;
};

// The rates of `count` messages of `size` bytes in `seconds`.
inline void setRates(Throughput& t, std::size_t count, std::size_t size, double seconds) {
  t.messagesPerSecond = static_cast<double>(count) / seconds;
  t.megabytesPerSecond = static_cast<double>(count * size) / seconds / 1e6;
}

struct Latency {
  double medianMicros = 0;
  double p99Micros = 0;
  std::size_t samples = 0;  // round trips completed and checked; fewer than asked means one failed
};

// Fills `out` with the pattern of message `index`; checks it on the way in.
void fillMessage(std::vector<std::uint8_t>& out, std::size_t size, std::uint64_t index);
bool checkMessage(const std::uint8_t* data, std::size_t size, std::uint64_t index);
Latency summarize(std::vector<double>& micros);

// One send() per message (prefix and payload in one call), reads of 64 KiB.
Throughput plainThroughput(std::size_t size, std::size_t count);
Latency plainRoundTrip(std::size_t size, int rounds);

std::uint16_t freePort();

// A listening socket on the loopback `port` that never accepts nor reads:
// connections to it complete and then fill up. -1 if it can't listen.
int silentPeer(std::uint16_t port);
void closeSilentPeer(int fd);

}  // namespace bench
