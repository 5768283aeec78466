// Internal to the library: the socket options every socket and listener of
// the library sets. A refused option is no error here: the system's default
// serves then.
#pragma once

#include "winsock.h"

// Both buffers of every socket and listener.
constexpr int kSocketBufferSize = 65536;

inline void setIntOption(platform::SOCKET s, int option, int value) {
  platform::setsockopt(s, platform::SOL_SOCKET, option, reinterpret_cast<const char*>(&value), sizeof value);
}

// Both buffers at kSocketBufferSize, and, for a socket that binds a port of
// its own, address reuse.
inline void setBufferOptions(platform::SOCKET s, bool reuseAddress) {
  setIntOption(s, platform::SO_RCVBUF, kSocketBufferSize);
  setIntOption(s, platform::SO_SNDBUF, kSocketBufferSize);
  if (reuseAddress) setIntOption(s, platform::SO_REUSEADDR, 1);
}
