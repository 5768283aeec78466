// Linux-side helpers for the transport tests that raw_socket.h doesn't give:
// kept in their own file because Linux's socket macros clash with the
// Winsock-shaped names of the library headers.
#pragma once

#include <cstdint>

namespace raw_peer {

// The local port of a connected or bound socket.
std::uint16_t localPort(int fd);
// Small writes leave at once instead of waiting for an acknowledgement.
void noDelay(int fd);
// True once the peer closed (or reset) the connection within `timeoutMs`.
bool closedByPeer(int fd, int timeoutMs);
// Waits up to `timeoutMs` for a connection attempt on a fresh socket to be
// refused or closed by the other side without data.
bool refusedOrClosed(const char* ip, std::uint16_t port, int timeoutMs);

}  // namespace raw_peer
