// Linux-side helpers that raw_socket.h doesn't give, apart because Linux's
// socket macros clash with the Winsock-shaped library headers.
#pragma once

#include <cstdint>

namespace raw_peer {
std::uint16_t localPort(int fd);
// Small writes leave at once, so each lands in a read of its own.
void noDelay(int fd);
}  // namespace raw_peer
