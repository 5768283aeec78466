/// @class N_Client
/// One peer of a client and server connection, with three channels to the
/// other end:
///
/// | Channel         | Transport, port | Carries                          |
/// |-----------------|-----------------|----------------------------------|
/// | reliable data   | TCP, P          | batches of the reliable queue    |
/// | unreliable data | UDP, P + 1      | batches of the unreliable queue  |
/// | control         | TCP, 6000       | heartbeats, bandwidth, world time |
///
/// The same class serves both ends. An application makes the client end from
/// a resolved N_Address and the server's data port P; N_Server makes the
/// server end of each accepted connection itself and hands it out through
/// N_Server::pollConnect. Both UDP ends bind port P + 1 of their own host, so
/// two clients on one IPv4 address can't share a server: run each on a
/// separate address (platform::setLocalHost). The same holds for a server and
/// a client on one machine.
///
/// A client-side loop:
///
/// @code
///   N_Client client(&serverAddress, 3123);
///   for (;;) {
///     client.update();                  // control channel, heartbeat
///     client.queueReliable(&event, sizeof event, 0, 5);
///     client.queueUnreliable(&state, sizeof state, kStateKey, 1);
///     client.flushReliable();           // paced by the bandwidth in force;
///     client.flushUnreliable();         // reliable first: one gate for both
///     void* m; unsigned n;
///     while (client.poll(m, n)) handle(m, n);  // m is valid until the next poll
///   }
/// @endcode
///
/// @par Life
/// The control channel is opened by the first update() that finds the
/// reliable channel connected. The update that then finds the control channel
/// connected does the first-update work: it requests the bandwidth in force
/// and synchronises the world timer, which busy-waits for up to about three
/// seconds. isConnected() is true from then on, until a channel is lost, the
/// heartbeat drops the peer, or disconnect() is called. Nothing reconnects:
/// construct() again (or destroy the object) to start over. Nothing here
/// waits for the network except updateWorldTimer().
///
/// @par Heartbeat
/// Both ends pass one heartbeat back and forth on the control
/// channel; the round trip is getLatency(). An end waits at most the latency
/// setting for the reply to its heartbeat, and at most latency + frequency
/// for the peer's own heartbeat after that; past either limit it disconnects
/// all three channels. The settings are process-wide, not exchanged: peers
/// should use the same ones. Either setting at 0 or below (or NaN) stops this
/// end from sending heartbeats and from timing out, but it still answers.
///
/// @par Bandwidth
/// setBandwidth() rules the local queues at once and, on the client
/// end, is also a request to the server; the server's grant then replaces it.
/// The queue limit is 4 seconds of data at that rate (bandwidth x 4, 32-bit),
/// the batch budget a quarter of a second (bandwidth / 4). A server grants each
/// client at most its N_Server::getMaximumBandwidthUsage(), 10240 bytes per
/// second by default, whatever the client asked for.
///
/// @par Payload queues
/// queue*() copies the payload; a non-zero key replaces the
/// queued payload of that key in place (its position stays, its priority and
/// size change). flush*() joins entries, highest priority first, into one
/// message below the budget (the first entry always goes, however large) and
/// shuts both flushes of this connection for bytes / bandwidth seconds. The
/// peer gets each batch as one message with no separators: only payloads that
/// the application can split again by their own contents may share a batch.
/// Unreliable payloads must stay within getLargestUnreliablePacketSize().
///
/// @warning The gate is shared: in one pass normally only the first flush that
/// finds a payload sends. Call flushReliable() before flushUnreliable(); the
/// other order never sends a reliable payload while unreliable traffic is
/// steady (see flushReliable()).
///
/// @par Edge cases, as this class settles them
///  - With the bandwidth at 0 a flush sends nothing and changes nothing (the
///    queue and the gate stay as they are), and a queue operation accepts only
///    zero-size payloads, since the queue limit is then 0.
///  - If the copy of a payload can't be allocated, queueReliable() and
///    queueUnreliable() throw Q_MemoryException_Allocation* with the queue
///    exactly as it was, a replaced entry included.
///  - updateWorldTimer() without a control socket returns false at once.
///  - On an object that isn't constructed, isConnected() is false,
///    getAddress() null, getPort() and getLargestUnreliablePacketSize() 0, and
///    disconnect(), update(), the flushes, the clears and poll() do nothing
///    (poll() gives false); a queue operation still applies the queue limit,
///    which is then 0, and drops a zero-size payload.
///  - A control message shorter than its type needs is dropped.
///
/// @par Threads
/// One object belongs to one thread at a time; it takes no lock of
/// its own (N_Socket locks what it shares with the network thread). On the
/// server end N_Server::update works on the object under the server's lock:
/// an application that uses such an object beside another thread's
/// N_Server::update has to exclude the two itself. The process-wide settings
/// (heartbeat and simulation) are atomics and may be set from any thread;
/// they take effect at the next step of every connection.
///
/// @par Simulated bad network
/// For testing an application: simulatePacketLoss()
/// throws away that share of the unreliable messages in poll(), and
/// simulateLatency() closes poll() for a random time between the two limits
/// (milliseconds) after every read. Chance comes from the library's rand() of
/// the calling thread, which starts at seed 1 in every thread (its srand isn't
/// exported), so a run that polls in the same order draws the same chances.
/// Sending and the control channel are never affected. The settings reach the
/// poll() of every N_Client of the process, a server's ends included.
/// Because the gate lets one message through per drawn time, it also limits
/// the rate of reads: what arrives faster waits in the sockets. For a delay
/// per message, a cap, duplication and reordering without that limit, use
/// the network model instead (simulateNetwork(), N_NetworkModel), which is
/// off by default and can run beside these settings.
///
/// @par Ownership
/// The object owns its three sockets and its two queues. The
/// N_Address given to construct() stays the caller's and must outlive the
/// object. Sockets belong to the runtime's registry: destroy the object before
/// the last N_Initializer goes; objects that may outlive it must come from new,
/// since the runtime's stop deletes the sockets it still holds.
#pragma once

#include <atomic>
#include <cstdint>

#include "N_ClientStats.h"
#include "N_NetworkModel.h"
#include "N_Socket.h"
#include "Q_DLList.h"
#include "Q_Timer.h"
#include "vardel_export.h"

class N_Address;
class N_Server;
// White-box access for the library's own tests only.
struct N_ClientTestAccess;

class VARDEL_API N_Client {
 public:
  /// Where an end is in the heartbeat exchange.
  enum HeartbeatState : std::int32_t {
    HEARTBEAT_SEND = 1,          ///< This end's turn: the next step sends a heartbeat.
    HEARTBEAT_AWAIT_REPLY = 2,   ///< Our heartbeat is out.
    HEARTBEAT_AWAIT_PEER = 3,    ///< The reply came; the peer's heartbeat is due.
    HEARTBEAT_IDLE = 4,          ///< The peer's heartbeat was answered; resting.
  };

  /// One queued payload. Lists hold it as raw storage, filled field by field.
  /// The object's own; the application only sees the byte counts.
  struct DataQueue {
    char* pData;         ///< The entry's own copy of the payload.
    unsigned uSize;      ///< Bytes in pData.
    unsigned uKey;       ///< 0: never replaced.
    unsigned uPriority;  ///< Higher leaves first.
    Q_Timer age;         ///< Restarted whenever the entry is filled.
    bool bFlushed;       ///< Taken by the flush in progress.
  };

  /// Bytes per second that both ends start with, and what a client asks the
  /// server for unless setBandwidth() says otherwise.
  static constexpr unsigned DEFAULT_BANDWIDTH = 1250000;

  /// Unconstructed (see the edge cases in the class).
  N_Client();
  /// Server end: takes over a connection accepted on the listener of port
  /// `iPort` (the data port P). N_Server makes these itself.
  /// @throws Q_MemoryException_Allocation* as construct(N_Socket::ConnectData*, int).
  /// @throws N_NetException_LocalAddressAlreadyInUse* as that construct().
  N_Client(N_Socket::ConnectData* pConnectData, int iPort);
  /// Client end: connects to `pAddress` (resolved already) at data port
  /// `iPort`, and to iPort + 1 for the unreliable channel. Returns at once;
  /// update() completes the connection.
  /// @throws N_NetException_IPNotResolved* as construct(const N_Address*, int).
  /// @throws N_NetException_LocalAddressAlreadyInUse* as that construct().
  /// @throws Q_MemoryException_Allocation* as that construct().
  /// @warning The UDP end binds port iPort + 1 of this host, as the server's
  /// end does on its own, and the server tells clients apart by IPv4 address
  /// only: one client per address, and on one machine the server and each
  /// client on an address of their own (platform::setLocalHost).
  N_Client(const N_Address* pAddress, int iPort);
  /// As destruct().
  ~N_Client();

  /// Not copyable: the object owns its sockets and queues.
  N_Client(const N_Client&) = delete;
  /// Not assignable.
  N_Client& operator=(const N_Client&) = delete;

  /// As the server-end constructor. Tears down what the object held first.
  /// @throws Q_MemoryException_Allocation* if memory runs out.
  /// @throws N_NetException_LocalAddressAlreadyInUse* if the UDP end can't
  /// bind port iPort + 1 of this host.
  ///
  /// After either the object is left unconstructed with nothing allocated,
  /// and the exception passes on. An entry the object didn't take over stays
  /// queued at its listener.
  void construct(N_Socket::ConnectData* pConnectData, int iPort);
  /// As the client-end constructor. Tears down what the object held first, so
  /// it also starts a lost connection over.
  /// @throws N_NetException_IPNotResolved* while `pAddress` has no number yet.
  /// @throws N_NetException_LocalAddressAlreadyInUse* if a local address is
  /// taken.
  /// @throws Q_MemoryException_Allocation* if memory runs out.
  ///
  /// After any of them the object is left unconstructed with nothing
  /// allocated, and the exception passes on.
  void construct(const N_Address* pAddress, int iPort);
  /// Closes the channels and frees whatever is still queued.
  void destruct();

  /// construct() succeeded and destruct() hasn't run since.
  bool isConstructed() const;
  /// The reliable and the control channel are both up.
  /// @note Once false it stays false: nothing reconnects. A server end is
  /// then the application's to give back with N_Server::disconnectClient(); a
  /// client end is started over with construct(). A TCP connect that fails
  /// (no server) reports nothing either: isConnected() just never becomes
  /// true, so give the connection a time limit.
  bool isConnected() const;
  /// Disconnects all channels that exist; the sockets stay until destruct().
  /// What the sockets still had queued for sending doesn't leave.
  void disconnect();
  /// The peer's address: the one given to the client end, the accepted peer's
  /// on the server end; null on an unconstructed object.
  const N_Address* getAddress() const;
  /// Client end: P. Server end: the peer's own port.
  int getPort() const;

  /// Rules the local queues at once; on the client end it is also a request
  /// to the server, sent now if the control channel is up (else by the first
  /// update), and the server's grant replaces it.
  /// @throws Q_MemoryException_Allocation* if the request is sent and its copy
  /// can't be made (N_Socket::send).
  void setBandwidth(unsigned uBandwidth);
  /// The rate in force: the last grant, or what was set since.
  unsigned getBandwidth() const;
  /// The largest unreliable batch: the UDP socket's send limit (0 on an
  /// unconstructed object). Larger unreliable payloads can't be sent.
  unsigned getLargestUnreliablePacketSize() const;

  /// The client end's regular step, once per pass of the application's loop:
  /// opens the control channel once the reliable one is up, runs the
  /// heartbeat and reads control messages (grants, heartbeats, world time).
  /// Server ends are stepped by N_Server::update.
  /// @warning The update that finds the control channel newly connected does
  /// the first-update work (see the class): it requests the bandwidth and runs
  /// updateWorldTimer(), which busy-waits for up to about three seconds on a
  /// slow or silent server. Let that happen where a stall is acceptable, for
  /// example by calling update() until isConnected() before the game loop.
  /// @throws Q_MemoryException_Allocation* when the control socket or the copy
  /// of a control message (N_Socket::send) can't be made.
  void update();

  /// @name Heartbeat settings
  /// Process-wide, in seconds; any thread may set them, and every connection
  /// of the process follows at its next step. The defaults are a frequency
  /// of 4 and a latency of 2. They aren't exchanged: give both ends the same
  /// values.
  /// @{

  /// The rest between an answered heartbeat and this end's next one.
  static void setHeartbeatFrequency(float fFrequency);
  /// See setHeartbeatFrequency().
  static float getHeartbeatFrequency();
  /// How long a heartbeat may take; past it the connection is dropped.
  static void setHeartbeatLatency(float fLatency);
  /// See setHeartbeatLatency().
  static float getHeartbeatLatency();
  /// @}
  /// The last heartbeat round trip in seconds; 0 until the first.
  float getLatency() const;

  /// Three timed exchanges with the server; sets the world timer to the
  /// server's age plus half the mean round trip. Busy-waits up to 1 second
  /// per exchange, calling update() meanwhile, and gives false at the first
  /// that gets no reply; what the earlier exchanges set stays. The first
  /// update() runs it by itself.
  /// @throws Q_MemoryException_Allocation* as update().
  bool updateWorldTimer();
  /// The world clock, in line with N_Server::getWorldTimer() after
  /// updateWorldTimer(). On the server end it is never set: use
  /// N_Server::getWorldTimer() there.
  const Q_Timer& getWorldTimer() const;

  /// Copies the payload into the reliable queue (see the class about keys and
  /// priorities). Nothing is sent before flushReliable().
  /// @throws N_NetException_PacketsStackingUp* when the queue would pass
  /// bandwidth x 4 bytes (the bytes of an entry about to be replaced still
  /// count); nothing is queued then.
  /// @throws Q_MemoryException_Allocation* if the copy can't be made; the
  /// queue is exactly as it was.
  void queueReliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority);
  /// As queueReliable(), for the unreliable queue. A payload above
  /// getLargestUnreliablePacketSize() is accepted here and fails its flush.
  /// @throws N_NetException_PacketsStackingUp* as queueReliable().
  /// @throws Q_MemoryException_Allocation* as queueReliable().
  void queueUnreliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority);
  /// If the gate is open: joins reliable payloads, highest priority first,
  /// into one batch within the budget, sends it on TCP and shuts the gate for
  /// bytes / bandwidth seconds. Otherwise (or with an empty queue) does
  /// nothing. Never waits.
  /// @warning Both flushes share that one gate, so in one pass normally only
  /// the first flush that finds a payload sends. Call flushReliable() first,
  /// then flushUnreliable(), in every pass. The other order never sends a
  /// reliable payload while unreliable traffic is steady: the unreliable flush
  /// takes the open gate in every pass, and the reliable queue only grows
  /// until queueReliable() throws N_NetException_PacketsStackingUp*. In this
  /// order the unreliable queue waits for the passes without reliable data,
  /// which suits the usual traffic: rare reliable events, and state every
  /// pass whose key keeps only the newest waiting.
  /// @throws Q_MemoryException_Allocation* if memory runs out; if the send's
  /// copy failed, the batch already left the queue and is lost.
  void flushReliable();
  /// As flushReliable(), for the unreliable queue on UDP; each batch also
  /// stays below getLargestUnreliablePacketSize().
  /// @warning Call it after flushReliable(), never before: the two share one
  /// gate, and an unreliable flush first in every pass keeps the reliable
  /// queue from ever sending (see flushReliable()).
  /// @throws N_NetException_PacketTooBig* for a single entry above
  /// getLargestUnreliablePacketSize(); that entry is gone then.
  /// @throws Q_MemoryException_Allocation* as flushReliable().
  void flushUnreliable();
  /// Drops everything queued for reliable sending; the flush gate stays as it
  /// is.
  void clearReliable();
  /// Drops everything queued for unreliable sending; the flush gate stays as
  /// it is.
  void clearUnreliable();
  /// Payload bytes waiting in the reliable queue (what the queue limit
  /// counts).
  unsigned getReliableBytesWaiting() const;
  /// Payload bytes waiting in the unreliable queue (what the queue limit
  /// counts).
  unsigned getUnreliableBytesWaiting() const;

  /// The next message of the peer, reliable ones first. Each message is one
  /// batch of the peer's flush: its payloads joined with no separators. It
  /// stays the socket's and is valid until the next poll(). On false the
  /// arguments may have been written anyway.
  /// @warning Copy what you keep (or queue it, which copies) before the next
  /// poll(). With simulatePacketLoss() a lost message gives false although
  /// more may wait, and with simulateLatency() poll() gives false while the
  /// drawn delay runs: a `while (poll(...))` loop then ends early, and the rest
  /// waits for a later pass. With the network model on, a message waits in the
  /// model until its time comes (simulateNetwork()).
  bool poll(void*& pMessage, unsigned& uMessageSize);
  /// After every read, poll() of every N_Client of the process stays shut for
  /// a random time between the limits, in milliseconds; 0 and 0 turn it off.
  /// Any thread.
  static void simulateLatency(unsigned uMinLatency, unsigned uMaxLatency);
  /// poll() of every N_Client of the process throws away this share (0 to 1)
  /// of the unreliable messages; 0 turns it off. Any thread.
  static void simulatePacketLoss(float fPacketLoss);
  /// Puts the network model in force for the poll() of every N_Client of the
  /// process, a server's ends included, from each one's next poll(); a model
  /// that changes nothing (N_NetworkModel{}) turns it off. Any thread. See
  /// N_NetworkModel for what it does.
  /// @note While the model is on, poll() copies the messages it takes from the
  /// sockets, and may throw Q_MemoryException_Allocation* if a copy can't be
  /// made; that message is lost.
  static void simulateNetwork(const N_NetworkModel& model);
  /// The model set last; N_NetworkModel{} (off) until the first call.
  static N_NetworkModel getNetworkModel();
  /// What the network model did to this connection since the model in force
  /// was set (once it is off, since the last one that was on); all 0 if the
  /// model never reached this connection's poll().
  N_SimulationStats getSimulationStats() const;

  /// Everything this connection counts (N_ClientStats): bytes and messages of
  /// each channel, what the payload queues took, replaced and refused, what
  /// the simulated bad network did, the heartbeat latency of the last
  /// N_ClientStats::LATENCY_WINDOW round trips, the world clock's last
  /// correction and the bandwidth in force. One plain copy, taken under the
  /// runtime's mutex; all 0 on an unconstructed object. The counting itself
  /// is a few integer additions where the data passes anyway.
  /// @note As every other call here, on the server end it must not run beside
  /// another thread's N_Server::update (see Threads in the class).
  N_ClientStats getStatistics() const;

 private:
  friend class N_Server;
  friend struct N_ClientTestAccess;

  void initializeMembers();
  // The network model: this connection's queues, clock and generators
  // (client_simulation.cpp).
  struct Simulation;
  bool simulateArrivals();
  bool takeSimulated(bool reliable, void*& pMessage, unsigned& uMessageSize);
  void deleteSimulation();
  // Heartbeat machine, shared by both ends (N_Server drives the server end).
  static bool heartbeatOn();
  void stepHeartbeat();
  void receiveHeartbeat();
  void receiveHeartbeatReply();
  void readControl();
  static void sendControl(N_Socket* socket, std::uint32_t type, std::uint32_t value = 0);

  void queuePayload(Q_DLList<DataQueue>* queue, unsigned& bytes, N_QueueStats& stats, void* pPayload, unsigned uSize,
                    unsigned uKey, unsigned uPriority);
  // With the read gate shut: whether a message waits that it holds back.
  bool messageWaiting(bool modelled);
  void flushQueue(Q_DLList<DataQueue>* queue, unsigned& bytes, N_Socket* socket, bool unreliable);
  static void clearQueue(Q_DLList<DataQueue>* queue, unsigned& bytes);
  static int flushCompareQSort(const void* a, const void* b);

  // The server end's side of pairing and bandwidth (server_end.cpp): N_Server
  // works on its clients through these and touches no field of theirs.
  bool isPaired() const { return m_pControlSocket != nullptr; }
  float getUnpairedAge() const { return m_pairingTimer.getAge(); }
  bool isDataConnected() const;
  void pair(N_Socket* pControlSocket);
  bool takeNewConnection();
  void recordBandwidthRequest(unsigned uRequested, bool bCollected);
  unsigned getRequestedBandwidth() const { return m_uRequestedBandwidth; }
  void grantBandwidth(unsigned uGrant, bool bChangedOnly);
  // The most that one channel's queued sends cost (N_Limits::kMessageCharge).
  double getLargestSendBacklog() const;
  N_Socket* getControlSocket() const { return m_pControlSocket; }

  bool m_bNewConnection;
  N_Socket* m_pControlSocket;
  unsigned m_uRequestedBandwidth;
  unsigned m_uBandwidth;
  float m_fLatency;
  std::int32_t m_heartbeatState;
  Q_Timer m_heartbeatTimer;
  Q_Timer m_heartbeatIdleTimer;
  bool m_bConstructed;
  bool m_bFirstUpdate;
  unsigned m_uEchoReplies;
  bool m_bWorldTimeReceived;
  float m_fWorldTimeReply;
  Q_Timer m_worldTimer;
  Q_Timer m_sendTimer;
  float m_fNextFlushTime;
  float m_fNextPollTime;
  N_Socket* m_pTcpSocket;
  N_Socket* m_pUdpSocket;
  Q_DLList<DataQueue>* m_pReliableQueue;
  Q_DLList<DataQueue>* m_pUnreliableQueue;
  unsigned m_uReliableBytes;
  unsigned m_uUnreliableBytes;
  // Server end: the age since the connection was accepted, for the pairing
  // time limit; and a bandwidth request came since the last division.
  Q_Timer m_pairingTimer;
  bool m_bGrantAsked;
  // Made by the first poll() that finds the network model on.
  Simulation* m_pSimulation;
  // The statistics this object keeps itself (N_ClientStats); the sockets keep
  // those of the channels. uBytesWaiting of the queue records is unused.
  N_QueueStats m_reliableQueueStats;
  N_QueueStats m_unreliableQueueStats;
  std::uint64_t m_uSimulatedLost;
  std::uint64_t m_uSimulatedDelayed;
  // poll() found the read gate shut while a message waited; the next message
  // handed out counts as delayed.
  bool m_bGateHeldBack;
  std::uint64_t m_uHeartbeats;
  // The latest round trips, the one of heartbeat n at n % LATENCY_WINDOW.
  float m_afLatencyWindow[N_ClientStats::LATENCY_WINDOW];
  std::uint64_t m_uWorldTimeExchanges;
  float m_fWorldClockOffset;

  static std::atomic<float> sm_fHeartbeatFrequency;
  static std::atomic<float> sm_fHeartbeatLatency;
  static std::atomic<unsigned> sm_uSimulatedMinLatency;
  static std::atomic<unsigned> sm_uSimulatedMaxLatency;
  static std::atomic<float> sm_fSimulatedPacketLoss;
};
