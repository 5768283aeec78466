/// @struct N_Limits
/// Bounds for a process that faces peers it can't trust.
///
/// By default the library does what its classes' headers describe: connections
/// that were accepted but never paired wait for ever, queues have no bound, an
/// N_Server serves every waiting control message in one update() and answers
/// every bandwidth request with a grant to every client. That is right on a
/// trusted network and wrong on the open one, where port scanners, broken
/// clients and attackers come on day one. One call, before or while the
/// runtime runs, turns on every protection with values that suit a real-time
/// server:
///
/// @code
///   N_Initializer::setLimits(N_Limits::openNetwork());
/// @endcode
///
/// Each value can be changed on its own afterwards:
///
/// @code
///   N_Limits limits = N_Limits::openNetwork();
///   limits.uMaximumMessageSize = 8 << 20;   // this application sends big maps
///   N_Initializer::setLimits(limits);
/// @endcode
///
/// The settings are process-wide and read where they apply: by the network
/// thread at its next pass, by N_Server at its next update(). A value of 0
/// switches that protection off. Even by default, two choices are the safe
/// ones: the largest message a receiver takes is 64 MiB, and a listener whose
/// accept failed for lack of descriptors or memory rests a quarter of a
/// second instead of retrying at once.
#pragma once

#include "vardel_export.h"

struct VARDEL_API N_Limits {
  /// What a waiting message counts against the receive and send backlogs
  /// beyond its own bytes: the memory of the record that holds it, so that
  /// a flood of tiny messages is bounded as tightly as one of large ones.
  static constexpr unsigned kMessageCharge = 128;

  /// @name Accepting
  /// @{

  /// Listeners take their places in the network thread's wait set before the
  /// sockets do, so that no number of connections keeps new ones out.
  bool bListenersFirst;
  /// Seconds that a listener is left out of the wait set after an accept
  /// failed for lack of descriptors or memory (the connection stays in the
  /// system's backlog and is accepted once there is room again).
  float fAcceptBackoff;
  /// Accepted connections a listener keeps waiting for pollConnect(); at
  /// this many it stops accepting until the application took or refused
  /// some. The system's backlog holds the rest and refuses what doesn't fit,
  /// so a connect flood can't pile up descriptors and memory faster than
  /// update() serves them. 0: no bound.
  unsigned uMaximumAcceptQueue;
  /// Connections the system keeps for a listener made while this is set,
  /// before any is accepted; beyond it a new one waits for its connect to be
  /// retried. Small, it keeps a flood from leaving thousands of dead
  /// connections to work through after it. 0: the system's largest.
  unsigned uListenBacklog;
  /// Seconds that N_Server keeps an accepted data connection without its
  /// control connection, or a control connection without its client, before
  /// it closes and frees it. With a time limit set, connections whose peer
  /// closed them before they were paired are also freed at the next update(),
  /// however young.
  float fPairingTimeout;
  /// Connections waiting to be paired (data connections without control and
  /// control connections without client) that N_Server keeps in all. When
  /// they are all taken, a new connection closes the oldest waiting one of
  /// another IPv4 address and takes its place, so that whoever fills them
  /// can't keep a newcomer out; if all are of its own address, it is closed
  /// on arrival. A connection that pairs at once with one already waiting
  /// takes no place.
  unsigned uMaximumUnpaired;
  /// As uMaximumUnpaired, for the connections from one IPv4 address.
  unsigned uMaximumUnpairedPerAddress;
  /// N_Server::update() refuses a connection that it can't make a client or
  /// a control socket of (memory or descriptors ran out, allocateClient
  /// threw) and goes on with the rest of its pass, instead of letting the
  /// exception out before the heartbeats of the clients it already has.
  bool bContainFailures;
  /// Name lookups (N_Address resolver threads) under way at once, process-
  /// wide. An address made beyond it keeps only what it was given (the
  /// number of an accepted peer, without its name), as if its lookup had
  /// failed, so that a connect flood can't become a flood of threads.
  unsigned uMaximumLookups;
  /// @}

  /// @name Memory per peer
  /// @{

  /// The largest message a packaged socket takes; a length above it ends the
  /// connection as a broken stream does. At most 0x7FFFFFFB. It is the
  /// receiver's bound: a peer that sends bigger messages loses its connection.
  unsigned uMaximumMessageSize;
  /// Short messages are copied out of the 64 KiB read buffer instead of
  /// keeping it, and the block of a long message grows with the bytes that
  /// actually arrived instead of being allocated at the length the prefix
  /// claims.
  bool bCompactMessages;
  /// Bytes of received messages not yet polled at which a socket stops
  /// reading; the system's buffers then fill and TCP slows the peer down.
  /// Reading resumes once poll() brought the backlog below the bound. Each
  /// message counts kMessageCharge bytes beyond its own.
  unsigned uReceiveBacklog;
  /// N_Server disconnects a client (all three channels, as the heartbeat
  /// does) when one of its sockets holds more unsent bytes than this many
  /// seconds of its bandwidth, but never for fewer than uMinimumSendBacklog.
  /// Each waiting message counts kMessageCharge bytes beyond its own.
  float fSendBacklogSeconds;
  /// The unsent bytes below which fSendBacklogSeconds never disconnects.
  unsigned uMinimumSendBacklog;
  /// @}

  /// @name The work of one N_Server::update()
  /// @{

  /// Control messages served per client and update; the rest wait for the
  /// next update().
  unsigned uControlBudget;
  /// Bandwidth requests are collected and the budget divided once per
  /// update(), and grants go only to the clients whose grant changed or that
  /// asked.
  bool bCoalesceBandwidth;
  /// @}

  /// What a process has until it calls N_Initializer::setLimits: every
  /// protection off, except uMaximumMessageSize (64 MiB) and fAcceptBackoff
  /// (0.25 s).
  static N_Limits defaults();
  /// Every protection on, with the values documented in the README: listeners
  /// first, 0.25 s accept rest, 64 accepted connections waiting per listener
  /// and 64 in the system's backlog,
  /// 5 s pairing limit, 32 unpaired connections (4
  /// per address), contained failures, 1 MiB messages, compact messages, 1 MiB
  /// receive backlog, 8 s (at least 256 KiB) send backlog, 64 control
  /// messages per client and update, collected bandwidth requests.
  static N_Limits openNetwork();
};
