/// @struct N_ClientStats
/// Everything one connection counts, on either end (N_Client::getStatistics()):
/// per channel what its socket carried, per payload queue what happened to
/// the payloads, what the simulated bad network did, the heartbeat's latency,
/// the world clock's last correction and the bandwidth in force.
///
/// It is a plain copy, taken in one call under the runtime's mutex, so the
/// channel counts of one copy belong together. An unconstructed N_Client gives
/// all 0, and construct() and destruct() start every count again from 0.
///
/// For rates, take two copies some time apart and divide the differences by
/// the time between them: the totals only grow while the object stays
/// constructed (the waiting bytes, the latency figures, the offset and the
/// bandwidth are states, not totals).
///
/// @code
///   N_ClientStats before = client.getStatistics();
///   ... one second later ...
///   N_ClientStats now = client.getStatistics();
///   std::uint64_t upBytesPerSecond = now.unreliable.uBytesSent - before.unreliable.uBytesSent;
///   float rttMs = now.fLatencyMean * 1000.0f;
/// @endcode
#pragma once

#include <cstdint>

#include "N_NetworkModel.h"
#include "N_SocketStats.h"
#include "vardel_export.h"

/// @struct N_QueueStats
/// What happened to the payloads of one of an N_Client's two queues
/// (N_ClientStats::reliableQueue, N_ClientStats::unreliableQueue).
struct VARDEL_API N_QueueStats {
  /// Payloads the queue took (queueReliable() or queueUnreliable() calls that
  /// returned), replacements included.
  std::uint64_t uPayloadsQueued = 0;
  /// Of those, payloads that replaced a waiting one of the same key; the one
  /// replaced never leaves.
  std::uint64_t uPayloadsReplaced = 0;
  /// Payloads refused by the queue limit (bandwidth x 4 bytes): the calls that
  /// threw N_NetException_PacketsStackingUp*.
  std::uint64_t uPayloadsRefused = 0;
  /// Payload bytes waiting in the queue now (getReliableBytesWaiting() or
  /// getUnreliableBytesWaiting()).
  unsigned uBytesWaiting = 0;
};

struct VARDEL_API N_ClientStats {
  /// How many heartbeats the latency figures cover at most: the latest 16
  /// round trips.
  static constexpr unsigned LATENCY_WINDOW = 16;

  /// The reliable channel: TCP on the data port P, packaged (each message one
  /// flushed batch, 4-byte prefix counted).
  N_SocketStats reliable;
  /// The unreliable channel: UDP on P + 1 (each message one datagram, one
  /// flushed batch).
  N_SocketStats unreliable;
  /// The control channel: TCP on port 6000, packaged; heartbeats, bandwidth
  /// and world time. All 0 until it is opened (client end) or paired (server
  /// end).
  N_SocketStats control;

  /// The reliable payload queue.
  N_QueueStats reliableQueue;
  /// The unreliable payload queue.
  N_QueueStats unreliableQueue;

  /// Unreliable messages that poll() threw away by
  /// N_Client::simulatePacketLoss().
  std::uint64_t uSimulatedLost = 0;
  /// Messages that poll() handed out after finding the gate of
  /// N_Client::simulateLatency() shut while they waited (each counted once,
  /// however long it waited).
  std::uint64_t uSimulatedDelayed = 0;
  /// What the network model did to this connection
  /// (N_Client::getSimulationStats()); all 0 if it never reached it.
  N_SimulationStats model;

  /// Heartbeat round trips measured since construct(); the figures below
  /// cover the latest LATENCY_WINDOW of them.
  std::uint64_t uHeartbeats = 0;
  /// The latest round trip in seconds (N_Client::getLatency()); 0 before the
  /// first.
  float fLatency = 0.0f;
  /// The shortest round trip of the window, in seconds.
  float fLatencyLowest = 0.0f;
  /// The longest round trip of the window, in seconds.
  float fLatencyHighest = 0.0f;
  /// The mean round trip of the window, in seconds.
  float fLatencyMean = 0.0f;

  /// World-time exchanges answered since construct() (client end: three per
  /// N_Client::updateWorldTimer(); the server end has none).
  std::uint64_t uWorldTimeExchanges = 0;
  /// How far the last answered exchange moved the world clock, in seconds:
  /// the server's estimated age minus the clock's own just before. Positive:
  /// the clock was behind. The first exchange of a connection moves it from
  /// 0 to the server's age; after that it shows the clocks' drift and the
  /// noise of the estimate. 0 before the first.
  float fWorldClockOffset = 0.0f;

  /// The bandwidth in force, bytes per second (N_Client::getBandwidth()): on
  /// the client end the server's last grant (or what was set since), on the
  /// server end the grant this end was given.
  unsigned uBandwidth = 0;
};
