// Internal to the library: the little-endian 32-bit word that the stream's
// length prefix and the control messages carry, whatever the host's order.
#pragma once

#include <cstdint>

namespace little_endian {

inline void put32(void* to, std::uint32_t word) {
  auto* b = static_cast<unsigned char*>(to);
  for (int i = 0; i < 4; ++i) b[i] = static_cast<unsigned char>(word >> (8 * i));
}

inline std::uint32_t get32(const void* from) {
  const auto* b = static_cast<const unsigned char*>(from);
  return std::uint32_t{b[0]} | std::uint32_t{b[1]} << 8 | std::uint32_t{b[2]} << 16 | std::uint32_t{b[3]} << 24;
}

}  // namespace little_endian
