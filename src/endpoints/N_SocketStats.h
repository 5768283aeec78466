/// @struct N_SocketStats
/// What one N_Socket carried since it was constructed (N_Socket::getStatistics();
/// N_ClientStats holds one for each channel of a connection).
///
/// @par Bytes
/// Bytes are counted where they cross into and out of the system, as the
/// peer's own socket sees them: on a packaged socket (TCP by default) each
/// message's 4-byte length prefix is included, on UDP a datagram's payload is
/// its size. Headers of IP, TCP and UDP are not. A packaged message of n bytes
/// therefore counts n + 4, on both ends.
///
/// @par When a count goes up
///  - Sent: once the system has taken the bytes (the send's completion has run
///    without an error); before that they are in uBytesWaitingForSend. A large
///    message leaves in chunks, and uBytesSent grows with each; uMessagesSent
///    counts the message when its last byte is taken. What a disconnect or
///    destruct() drops was never sent and is never counted.
///  - Received: uBytesReceived as the bytes are read from the system, so a
///    message that spans reads counts its bytes as they come; uMessagesReceived
///    once the message is whole and queued for poll() (or offered to
///    N_Socket::receive()). Bytes of a broken stream (see N_Socket) that were
///    read still count; the message they belonged to doesn't.
///
/// The counts are kept under the runtime's mutex by the code that moves the
/// data anyway; N_Socket::getStatistics() copies them out under it in one go.
/// They start at 0 at construct() and go back to 0 at destruct().
#pragma once

#include <cstdint>

#include "vardel_export.h"

struct VARDEL_API N_SocketStats {
  /// Bytes the system took for sending, length prefixes included.
  std::uint64_t uBytesSent = 0;
  /// Messages whose every byte the system took.
  std::uint64_t uMessagesSent = 0;
  /// Bytes read from the system, length prefixes included.
  std::uint64_t uBytesReceived = 0;
  /// Whole messages received.
  std::uint64_t uMessagesReceived = 0;
  /// Bytes handed to N_Socket::send() that the system hasn't taken yet,
  /// prefixes included (N_Socket::getQueuedSendBytes()).
  unsigned uBytesWaitingForSend = 0;
  /// Payload bytes of received messages that poll() hasn't handed out yet, no
  /// prefixes (N_Socket::getQueuedReceiveBytes()).
  unsigned uBytesWaitingToPoll = 0;
};
