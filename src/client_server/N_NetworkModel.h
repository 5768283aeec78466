/// @struct N_NetworkModel
/// A bad network between the sockets and N_Client::poll(), for testing an
/// application: a one-way delay with jitter drawn per message, loss,
/// duplication and reordering of unreliable messages, and a bandwidth cap
/// with a queue limit per connection.
///
/// It is set for the whole process with N_Client::simulateNetwork() and is
/// off by default; a model whose delay, jitter, loss, duplication, reordering
/// and cap are all 0 is off. It is separate from simulateLatency() and
/// simulatePacketLoss(), which it leaves as they are: with both on, those act
/// on what the model lets through.
///
/// @code
///   N_NetworkModel model;
///   model.fDelay = 40;          // ms, one way
///   model.fJitter = 10;         // each message 30 to 50 ms
///   model.fLoss = 0.05f;        // 5% of the unreliable messages
///   model.uBandwidth = 16000;   // bytes per second per connection
///   model.uSeed = 7;            // the same draws in every run
///   N_Client::simulateNetwork(model);
///   ...
///   N_Client::simulateNetwork(N_NetworkModel{});  // off again
/// @endcode
///
/// @par How a message goes through
/// While the model is on, each poll() of a connection first takes every
/// message waiting in its two sockets into the connection's own queues. Its
/// arrival time is then, on a clock of that connection. An unreliable message
/// may be lost there; a kept one passes the cap's link (one per connection,
/// shared by both channels, first come first served: it leaves the link
/// size / uBandwidth seconds after the link is free and it has arrived), and
/// becomes readable its own drawn delay after that, plus fReorderWindow if it
/// is one of the reordered ones. poll() hands out the reliable messages first
/// and the unreliable ones by the time they became readable. A reliable
/// message is never lost, copied or reordered, and never becomes readable
/// before an earlier one: its time is at least that of the one before.
///
/// @par Rate
/// Nothing but the cap limits the rate: every message that became readable
/// can be polled at once. With a cap, what arrives faster than the cap queues
/// up to uQueueLimit bytes; past it unreliable messages are dropped, and
/// reliable ones stay in the socket (whose receive backlog, N_Limits, then
/// holds the peer back) until the queue has room.
///
/// @par Memory
/// A connection holds at most uQueueLimit bytes of messages, plus one reliable
/// message that was taken while there was room (a message counts its size, at
/// least one byte). A message is always taken when the queue is empty, so one
/// larger than the limit still passes.
///
/// @par Chance
/// Each connection draws from two generators of platform::rand()'s kind
/// (state = state x 214013 + 2531011, bits 16 to 30 of the state, divided by
/// 32768) whose states it owns, so no thread or other connection changes its
/// draws. The reliable channel's starts at uSeed, the unreliable channel's at
/// uSeed + 0x9E3779B9. A reliable message takes one draw, for its delay. An
/// unreliable message takes five, whatever their outcome, in this order: loss,
/// duplication, reordering, its delay, the copy's delay. A delay from draw u
/// is fDelay + fJitter x (2u - 1), and never below 0. So a run whose
/// connections receive the same messages in the same order per channel loses,
/// copies, reorders and delays the same ones.
///
/// @par Changes
/// A new model takes effect at each connection's next poll(): the generators
/// start again from its seed and the connection's statistics
/// (N_Client::getSimulationStats()) start again from 0. Messages already held
/// keep their times. When the model goes off, what it still holds is readable
/// at once, in its order, before anything newer, and the statistics stay
/// those of the last model that was on.
#pragma once

#include "vardel_export.h"

struct VARDEL_API N_NetworkModel {
  /// One-way delay added to every message, in milliseconds.
  float fDelay = 0.0f;
  /// Each message's delay is drawn evenly from fDelay - fJitter to
  /// fDelay + fJitter, in milliseconds (a draw below 0 counts as 0).
  float fJitter = 0.0f;
  /// Share (0 to 1) of the unreliable messages thrown away.
  float fLoss = 0.0f;
  /// Share (0 to 1) of the unreliable messages delivered twice; the copy has a
  /// delay of its own.
  float fDuplicate = 0.0f;
  /// Share (0 to 1) of the unreliable messages held back by fReorderWindow, so
  /// that the messages that arrive within that time overtake them.
  float fReorder = 0.0f;
  /// How long a reordered message is held back beyond its delay, in
  /// milliseconds; 0 reorders nothing.
  float fReorderWindow = 0.0f;
  /// The cap: bytes per second per connection that pass the link, both
  /// channels together; 0 is no cap.
  unsigned uBandwidth = 0;
  /// Bytes of messages a connection may hold (see Memory above).
  unsigned uQueueLimit = 65536;
  /// Where the generators start (see Chance above).
  unsigned uSeed = 1;
};

/// @struct N_SimulationStats
/// What the network model did to one connection since the model in force was
/// set (N_Client::getSimulationStats()). Counts are of messages; a
/// duplicated message counts once in uReceived and its copy once in
/// uDuplicated.
struct VARDEL_API N_SimulationStats {
  /// Messages the model took from the connection's sockets.
  unsigned uReceived = 0;
  /// Messages (copies included) that poll() handed out.
  unsigned uDelivered = 0;
  /// Messages and copies that became readable later than they arrived
  /// (delay, jitter, reordering or the cap).
  unsigned uDelayed = 0;
  /// Unreliable messages thrown away by fLoss.
  unsigned uLost = 0;
  /// Copies made by fDuplicate.
  unsigned uDuplicated = 0;
  /// Unreliable messages held back by the reorder window.
  unsigned uReordered = 0;
  /// Unreliable messages and copies dropped because the queue limit was
  /// reached.
  unsigned uDropped = 0;
  /// Bytes the connection holds now.
  unsigned uQueuedBytes = 0;
  /// The most bytes it held at once.
  unsigned uPeakQueuedBytes = 0;
  /// Mean time from arrival until readable of the messages handed out, in
  /// milliseconds; 0 before the first.
  double dMeanDelay = 0.0;
};
