// The record of the control channel between an N_Client and its N_Server.
//
// Each control message is one packaged message of 4 or 8 bytes on the control
// socket (TCP, port 6000): the type word, then for types 1, 2 and 8 a value
// word. Both words are little-endian on the wire; there is no version,
// checksum or sequence number, so a reply is matched to its request only by
// arrival order.
//
//   type  name                        length  value
//   1     CONTROL_BANDWIDTH_REQUEST   8       bytes per second wanted (client -> server)
//   2     CONTROL_BANDWIDTH_GRANT     8       bytes per second granted (server -> client)
//   3     CONTROL_HEARTBEAT           4       either way
//   4     CONTROL_HEARTBEAT_REPLY     4       either way
//   5     CONTROL_ECHO                4       only foreign peers send it
//   6     CONTROL_ECHO_REPLY          4       server -> client
//   7     CONTROL_WORLD_TIME_REQUEST  4       client -> server
//   8     CONTROL_WORLD_TIME          8       IEEE 754 float bits: the server's world age
//
// Receivers drop, without any reply or change of state: unknown types, types
// that their end ignores, messages shorter than 4 bytes, and type 1, 2 or 8
// messages shorter than 8 bytes (nothing past a message is ever read).
#pragma once

#include <bit>
#include <cstdint>

#include "little_endian.h"

struct ControlMessage {
  enum Type : std::uint32_t {
    CONTROL_BANDWIDTH_REQUEST = 1,
    CONTROL_BANDWIDTH_GRANT = 2,
    CONTROL_HEARTBEAT = 3,
    CONTROL_HEARTBEAT_REPLY = 4,
    CONTROL_ECHO = 5,
    CONTROL_ECHO_REPLY = 6,
    CONTROL_WORLD_TIME_REQUEST = 7,
    CONTROL_WORLD_TIME = 8,
  };

  // Every client connects its control channel to this port of the server's
  // host; it is not configurable.
  static constexpr int CONTROL_PORT = 6000;

  std::uint32_t uType;
  std::uint32_t uValue;  // only in types 1, 2 and 8

  // Whether messages of `type` carry the value word.
  static constexpr bool hasValue(std::uint32_t type) {
    return type == CONTROL_BANDWIDTH_REQUEST || type == CONTROL_BANDWIDTH_GRANT || type == CONTROL_WORLD_TIME;
  }
  static constexpr unsigned sizeOf(std::uint32_t type) { return hasValue(type) ? 8u : 4u; }

  // The wire form: `bytes` receives sizeOf(uType) bytes.
  void encode(unsigned char* bytes) const {
    little_endian::put32(bytes, uType);
    if (hasValue(uType)) little_endian::put32(bytes + 4, uValue);
  }

  // Reads a received message. False for one too short for its type; uValue
  // is 0 for types without a value.
  bool decode(const void* data, unsigned size) {
    if (data == nullptr || size < 4) return false;
    const auto* bytes = static_cast<const unsigned char*>(data);
    uType = little_endian::get32(bytes);
    uValue = 0;
    if (hasValue(uType)) {
      if (size < 8) return false;
      uValue = little_endian::get32(bytes + 4);
    }
    return true;
  }

  float floatValue() const { return std::bit_cast<float>(uValue); }
  static std::uint32_t floatBits(float value) { return std::bit_cast<std::uint32_t>(value); }

};
