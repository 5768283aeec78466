// One peer of a client and server connection, with three channels to the
// other end:
//
//   reliable data    TCP, port P           batches of the reliable queue
//   unreliable data  UDP, port P + 1       batches of the unreliable queue
//   control          TCP, port 6000        ControlMessage records
//
// The same class serves both ends. An application makes the client end from
// a resolved N_Address and the server's data port P; N_Server makes the
// server end of each accepted connection itself and hands it out through
// N_Server::pollConnect. Both UDP ends bind port P + 1 of their own host, so
// two clients on one IPv4 address can't share a server: run each on a
// separate address (platform::setLocalHost).
//
// A client-side loop:
//
//   N_Client client(&serverAddress, 3123);
//   for (;;) {
//     client.update();                  // control channel, heartbeat
//     client.queueReliable(&state, sizeof state, kStateKey, 1);
//     client.flushReliable();           // paced by the bandwidth in force
//     void* m; unsigned n;
//     while (client.poll(m, n)) handle(m, n);
//   }
//
// Life. The control channel is opened by the first update() that finds the
// reliable channel connected. The update that then finds the control channel
// connected does the first-update work: it requests the bandwidth in force
// and synchronises the world timer, which busy-waits for up to about three
// seconds. isConnected() is true from then on, until a channel is lost, the
// heartbeat drops the peer, or disconnect() is called. Nothing reconnects:
// construct() again (or destroy the object) to start over. Nothing here
// waits for the network except updateWorldTimer().
//
// Heartbeat. Both ends pass one heartbeat back and forth on the control
// channel; the round trip is getLatency(). An end waits at most the latency
// setting for the reply to its heartbeat, and at most latency + frequency
// for the peer's own heartbeat after that; past either limit it disconnects
// all three channels. The settings are process-wide, not exchanged: peers
// should use the same ones. Either setting at 0 or below (or NaN) stops this
// end from sending heartbeats and from timing out, but it still answers.
//
// Bandwidth. setBandwidth() rules the local queues at once and, on the client
// end, is also a request to the server; the server's grant then replaces it.
// The queue limit is 4 seconds of data at that rate (bandwidth x 4, 32-bit),
// the batch budget a quarter of a second (bandwidth / 4).
//
// Payload queues. queue*() copies the payload; a non-zero key replaces the
// queued payload of that key in place (its position stays, its priority and
// size change). flush*() joins entries, highest priority first, into one
// message below the budget (the first entry always goes, however large) and
// shuts both flushes of this connection for bytes / bandwidth seconds. The
// peer gets each batch as one message with no separators: only payloads that
// the application can split again by their own contents may share a batch.
// Unreliable payloads must stay within getLargestUnreliablePacketSize().
//
// Edge cases, as this class settles them:
//  - With the bandwidth at 0 a flush sends nothing and changes nothing (the
//    queue and the gate stay as they are), and a queue operation accepts only
//    zero-size payloads, since the queue limit is then 0.
//  - If the copy of a payload can't be allocated, queueReliable() and
//    queueUnreliable() throw Q_MemoryException_Allocation* with the queue
//    exactly as it was, a replaced entry included.
//  - updateWorldTimer() without a control socket returns false at once.
//  - On an object that isn't constructed, isConnected() is false,
//    getAddress() null, getPort() and getLargestUnreliablePacketSize() 0, and
//    disconnect(), update(), the flushes, the clears and poll() do nothing
//    (poll() gives false); a queue operation still applies the queue limit,
//    which is then 0, and drops a zero-size payload.
//  - A control message shorter than its type needs is dropped.
//
// Threads. One object belongs to one thread at a time; it takes no lock of
// its own (N_Socket locks what it shares with the network thread). On the
// server end N_Server::update works on the object under the server's lock:
// an application that uses such an object beside another thread's
// N_Server::update has to exclude the two itself. The process-wide settings
// (heartbeat and simulation) are atomics and may be set from any thread;
// they take effect at the next step of every connection.
//
// Simulated bad network, for testing an application: simulatePacketLoss()
// throws away that share of the unreliable messages in poll(), and
// simulateLatency() closes poll() for a random time between the two limits
// (milliseconds) after every read. Chance comes from platform::rand() of the
// calling thread (seed it with platform::srand for a repeatable run). Sending
// and the control channel are never affected.
//
// Ownership. The object owns its three sockets and its two queues. The
// N_Address given to construct() stays the caller's and must outlive the
// object. Sockets belong to the runtime's registry: destroy the object before
// the last N_Initializer goes; objects that may outlive it must come from new,
// since the runtime's stop deletes the sockets it still holds.
#pragma once

#include <atomic>
#include <cstdint>

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
  enum HeartbeatState : std::int32_t {
    HEARTBEAT_SEND = 1,          // this end's turn: the next step sends a heartbeat
    HEARTBEAT_AWAIT_REPLY = 2,   // our heartbeat is out
    HEARTBEAT_AWAIT_PEER = 3,    // the reply came; the peer's heartbeat is due
    HEARTBEAT_IDLE = 4,          // the peer's heartbeat was answered; resting
  };

  // One queued payload. Lists hold it as raw storage, filled field by field.
  struct DataQueue {
    char* pData;         // the entry's own copy of the payload
    unsigned uSize;
    unsigned uKey;       // 0: never replaced
    unsigned uPriority;  // higher leaves first
    Q_Timer age;         // restarted whenever the entry is filled
    bool bFlushed;       // taken by the flush in progress
  };

  static constexpr unsigned DEFAULT_BANDWIDTH = 1250000;

  N_Client();
  // Server end: takes over a connection accepted on the listener of port
  // `iPort` (the data port P).
  N_Client(N_Socket::ConnectData* pConnectData, int iPort);
  // Client end: connects to `pAddress` (resolved already) at data port
  // `iPort`, and to iPort + 1 for the unreliable channel.
  N_Client(const N_Address* pAddress, int iPort);
  ~N_Client();

  N_Client(const N_Client&) = delete;
  N_Client& operator=(const N_Client&) = delete;

  // Both tear down what the object held first. On failure (Q_Memory-
  // Exception_Allocation*, or what N_Socket throws, such as
  // N_NetException_IPNotResolved*) the object is left unconstructed with
  // nothing allocated, and the exception passes on.
  void construct(N_Socket::ConnectData* pConnectData, int iPort);
  void construct(const N_Address* pAddress, int iPort);
  // Closes the channels and frees whatever is still queued.
  void destruct();

  bool isConstructed() const;
  // The reliable and the control channel are both up.
  bool isConnected() const;
  // Disconnects all channels that exist; the sockets stay until destruct().
  void disconnect();
  const N_Address* getAddress() const;
  // Client end: P. Server end: the peer's own port.
  int getPort() const;

  void setBandwidth(unsigned uBandwidth);
  // The rate in force: the last grant, or what was set since.
  unsigned getBandwidth() const;
  unsigned getLargestUnreliablePacketSize() const;

  // The client end's regular step; see above. Server ends are stepped by
  // N_Server::update. Exceptions of N_Socket::send pass out.
  void update();

  static void setHeartbeatFrequency(float fFrequency);
  static float getHeartbeatFrequency();
  static void setHeartbeatLatency(float fLatency);
  static float getHeartbeatLatency();
  // The last heartbeat round trip in seconds; 0 until the first.
  float getLatency() const;

  // Three timed exchanges with the server; sets the world timer to the
  // server's age plus half the mean round trip. Busy-waits up to 1 second
  // per exchange and gives false at the first that gets no reply; what the
  // earlier exchanges set stays.
  bool updateWorldTimer();
  const Q_Timer& getWorldTimer() const;

  // Throw N_NetException_PacketsStackingUp* when the queue would pass
  // bandwidth x 4 bytes; nothing is queued then.
  void queueReliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority);
  void queueUnreliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority);
  // flushUnreliable() throws N_NetException_PacketTooBig* for a single entry
  // above getLargestUnreliablePacketSize(); that entry is gone then.
  void flushReliable();
  void flushUnreliable();
  // Drops everything queued; the flush gate stays as it is.
  void clearReliable();
  void clearUnreliable();
  // Payload bytes waiting in each queue (what the queue limit counts).
  unsigned getReliableBytesWaiting() const;
  unsigned getUnreliableBytesWaiting() const;

  // The next message of the peer, reliable ones first. It stays the
  // socket's and is valid until the next poll(). On false the arguments
  // may have been written anyway.
  bool poll(void*& pMessage, unsigned& uMessageSize);
  static void simulateLatency(unsigned uMinLatency, unsigned uMaxLatency);
  static void simulatePacketLoss(float fPacketLoss);

 private:
  friend class N_Server;
  friend struct N_ClientTestAccess;

  void initializeMembers();
  // Heartbeat machine, shared by both ends (N_Server drives the server end).
  static bool heartbeatOn();
  void stepHeartbeat();
  void receiveHeartbeat();
  void receiveHeartbeatReply();
  void readControl();
  static void sendControl(N_Socket* socket, std::uint32_t type, std::uint32_t value = 0);

  void queuePayload(Q_DLList<DataQueue>* queue, unsigned& bytes, void* pPayload, unsigned uSize, unsigned uKey,
                    unsigned uPriority);
  void flushQueue(Q_DLList<DataQueue>* queue, unsigned& bytes, N_Socket* socket, bool unreliable);
  static void clearQueue(Q_DLList<DataQueue>* queue, unsigned& bytes);
  static int flushCompareQSort(const void* a, const void* b);

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

  static std::atomic<float> sm_fHeartbeatFrequency;
  static std::atomic<float> sm_fHeartbeatLatency;
  static std::atomic<unsigned> sm_uSimulatedMinLatency;
  static std::atomic<unsigned> sm_uSimulatedMaxLatency;
  static std::atomic<float> sm_fSimulatedPacketLoss;
};
