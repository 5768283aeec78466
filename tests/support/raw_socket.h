// Plain Linux TCP sockets for tests that play a peer outside the library
// (reading and writing the stream byte by byte, resetting connections).
// Kept apart from the Winsock-shaped headers, whose names Linux's macros
// would clash with.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace raw {

// A listening socket on `ip`, port chosen by the system unless given.
int listenOn(const char* ip, std::uint16_t& port);
// Accepts one connection within `timeoutMs`; -1 on time-out.
int acceptOne(int listener, int timeoutMs);
// A blocking connect; -1 on failure.
int connectTo(const char* ip, std::uint16_t port);
// The same from the local address `from`, as a host of its own.
int connectFrom(const char* from, const char* ip, std::uint16_t port);
bool sendAll(int fd, const void* data, std::size_t size);
// Reads exactly `size` bytes within `timeoutMs`; false on time-out or close.
bool receiveExactly(int fd, void* data, std::size_t size, int timeoutMs);
// Reads whatever arrives within `timeoutMs` (until the peer closes or time ends).
std::vector<std::uint8_t> receiveFor(int fd, int timeoutMs);
// True once the peer has closed the connection (orderly or by reset) within
// `timeoutMs`; data that arrives first is read and dropped.
bool closedByPeer(int fd, int timeoutMs);
// Closes with RST instead of FIN.
void reset(int fd);
void closeFd(int fd);
// A UDP socket bound to ip:port; -1 on failure.
int udpBound(const char* ip, std::uint16_t port);
// A free port on 127.0.0.1 for both TCP and UDP (and for port + 1 when asked),
// claimed against the other test processes of the machine.
std::uint16_t freePort(bool pairWithNext = false);
// Nobody listens on TCP `port` and nobody holds UDP `port` (connections in
// TIME_WAIT don't count): shows that a listener or datagram socket closed.
bool portIsFree(std::uint16_t port);

}  // namespace raw
