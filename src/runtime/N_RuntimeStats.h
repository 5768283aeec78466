/// @struct N_RuntimeStats
/// The network runtime's own counts for the whole process
/// (N_Initializer::getStatistics()), copied out under the runtime's mutex in
/// one go. Open objects and waiting bytes are the state at that moment; the
/// two counters of the network thread run from the runtime's start. While no
/// runtime runs, all are 0.
#pragma once

#include <cstdint>

#include "vardel_export.h"

struct VARDEL_API N_RuntimeStats {
  /// N_Socket objects constructed and not yet destructed, of every kind
  /// (each N_Client holds up to three).
  unsigned uOpenSockets = 0;
  /// N_Listener objects listening (an N_Server is one and holds a second for
  /// the control port).
  unsigned uOpenListeners = 0;
  /// Bytes handed to N_Socket::send() by every socket that the system hasn't
  /// taken yet, length prefixes included (N_Socket::getBytesWaitingForSend()).
  unsigned uBytesWaitingForSend = 0;
  /// Passes of the network thread: each builds its wait set, issues the
  /// waiting sends and waits once.
  std::uint64_t uNetworkPasses = 0;
  /// Signalled socket and listener events that the network thread served
  /// (connects, reads, writes, closes and accepts; one per wake-up that named
  /// an open object).
  std::uint64_t uEventsServed = 0;
};
