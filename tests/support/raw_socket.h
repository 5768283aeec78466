// Plain Linux TCP and UDP sockets for tests that play a peer outside the
// library (the stream byte by byte, resets). Kept apart from the
// Winsock-shaped headers, whose names Linux's macros would clash with.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace raw {

// A listening socket on `ip`, on `port` or one the system chooses (written back).
int listenOn(const char* ip, std::uint16_t& port);
int acceptOne(int listener, int timeoutMs);  // -1 on time-out
// A blocking connect, from the local address `from` as a host of its own if given; -1 on failure.
int connectTo(const char* ip, std::uint16_t port, const char* from = nullptr);
bool sendAll(int fd, const void* data, std::size_t size);
// Exactly `size` bytes within the time; false on time-out or close.
bool receiveExactly(int fd, void* data, std::size_t size, int timeoutMs);
// Whatever arrives within the time, until the peer closes.
std::vector<std::uint8_t> receiveFor(int fd, int timeoutMs);
// The peer closed (orderly or by reset) within the time; data first is dropped.
bool closedByPeer(int fd, int timeoutMs);
void reset(int fd);  // closes with RST instead of FIN
void closeFd(int fd);
int udpBound(const char* ip, std::uint16_t port);
std::uint16_t localPort(int fd);
void noDelay(int fd);  // small writes leave at once, each in a read of its own
// A free port on 127.0.0.1 for TCP and UDP (and port + 1 when asked),
// claimed against the other test processes of the machine.
std::uint16_t freePort(bool pairWithNext = false);
// Nobody listens on TCP `port` or holds UDP `port` (TIME_WAIT doesn't count).
bool portIsFree(std::uint16_t port);

}  // namespace raw
