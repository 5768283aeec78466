/// @class N_Socket
/// A TCP or UDP endpoint that carries whole messages.
///
/// Make one from an N_Address, a port and a SocketType (an outgoing socket), or
/// from a ConnectData that an N_Listener accepted. From then on call send() and
/// poll(); all network I/O happens on the runtime's network thread, so no call
/// here waits for the network. A constructed N_Initializer must outlive every
/// socket. Operations that touch the queues take the runtime's mutex for a
/// moment; the network thread holds it only while it moves data, never while
/// it waits.
///
/// @par Stream format
/// On TCP ("package mechanism", on by default for TCP, off for
/// UDP): each message is a 4-byte little-endian length followed by that many
/// payload bytes; nothing else, no magic, no checksum. A length of 0 is a valid
/// empty message. A message of any size up to 0x7FFFFFFB bytes (the largest a
/// receiver takes) may be sent; it leaves in chunks of at most
/// getMaximumSendPacketSize() - 16 payload bytes, which leave no trace in the
/// stream. Without the mechanism one send() is one WSASend of exactly the
/// caller's bytes (one datagram on UDP) and one read is one message. Both ends
/// must agree on the mechanism; nothing in the bytes says which is in use.
///
/// @par Threads and callbacks
///  - The three virtual operations are the way to hear of events on the
///    network thread. receiveConnect() and receiveDisconnect() (when the
///    network thread disconnects at FD_CLOSE or after a broken stream) run with
///    the runtime's mutex held: they must not wait for a thread that needs it,
///    and must not destroy their own socket. receive() runs with the mutex
///    released; it may call send() and poll(), and it may destroy (or
///    re-construct) its own socket, after which the network thread does not
///    touch it again.
///  - An exception thrown out of an override is dropped on the network thread
///    and the event or message is kept, as if the override had returned true.
///  - A derived class that overrides any of them must call destruct() in its
///    own destructor. The destructor here isn't virtual and runs after the
///    derived part is gone; until destruct() has unregistered the socket the
///    network thread may still call the overrides.
///  - destruct() on another thread while receive() runs for this socket waits
///    until receive() has returned, so a receive() override must not wait for
///    a thread that is destroying its socket.
///  - Flags read without a lock (isConnected, the event flag, the package flag,
///    the reassembly counters) are atomics. On an event the order is always:
///    the connected flag first, then the virtual operation, then the event
///    flag, so pollConnect()/pollDisconnect() never report a half-made event.
///  - pollConnect() and pollDisconnect() take the runtime's mutex for their
///    walk. getFirstSocket()/getNextSocket() hand out registry slots and cannot
///    be guarded across calls: don't construct or destroy sockets on another
///    thread while walking with them.
///
/// @par Receive-side robustness
/// Whatever a peer sends is parsed within the
/// library's own blocks. A length prefix that can't be true (above 0x7FFFFFFB,
/// so that length + 4 overflows a 32-bit int, or with the top bit set) or a
/// message that can't be allocated breaks the stream: the rest of what arrives
/// on it is dropped, the half-collected message is freed, and the socket is
/// disconnected, which the application sees as a disconnect event. Other
/// connections are not affected. An allocation that fails when the network
/// thread posts a read disconnects the socket the same way.
#pragma once

#include <atomic>
#include <cstdint>
#include <thread>

#include "N_SocketStats.h"
#include "Q_DLList.h"
#include "vardel_export.h"
#include "vardel_platform.h"

class N_Address;
class N_Listener;
class N_Initializer;
// White-box access for the library's own tests and fuzz targets only.
struct N_SocketTestAccess;

class VARDEL_API N_Socket {
 public:
  /// The transport of a socket.
  enum SocketType : std::int32_t { SOCKET_TCP = 0, SOCKET_UDP = 1 };
  /// @var N_Socket::SocketType N_Socket::SOCKET_TCP
  /// A stream; packaged (whole messages) by default.

  /// @var N_Socket::SocketType N_Socket::SOCKET_UDP
  /// Datagrams with one peer; not packaged by default.

  /// One record for data in flight in either direction: a send entry on the
  /// runtime's out-queue, a read entry on its in-queue, a finished message on
  /// a socket's receive queue, or an orphan whose socket died. Lists allocate
  /// it with its fields unset; each stage sets what it needs. The runtime's
  /// own; applications never see one.
  struct DataQueue {
    char* pBuffer;                       ///< The owned allocation; null once handed on or freed.
    platform::WSABUF wsaBuf;             ///< Length and first byte of the data (may lie inside pBuffer).
    platform::WSAOVERLAPPED overlapped;  ///< hEvent points back at this record.
    bool bIssued;                        ///< Handed to Winsock.
    bool bComplete;                      ///< Message finished; on a send entry: its completion ran with an error.
    bool bConsumed;                      ///< poll() handed it out; the next poll() frees it.
    bool bLive;                          ///< The owning socket is alive.
    bool bMessageEnd;                    ///< A send entry that carries the last byte of its message.
    bool bDirect;                        ///< A read entry whose read went first into the message in collection.
    N_Socket* pSocket;                   ///< The owning socket; null for an orphan.
  };

  /// An accepted connection waiting for an owner (see N_Listener::pollConnect).
  struct ConnectData {
    N_Listener* pListener;          ///< The listener that accepted it.
    platform::SOCKET socket;        ///< The connection; INVALID_SOCKET if the accept failed.
    platform::sockaddr_in address;  ///< The peer's address and port.
  };

  /// Unconstructed: not connected, getters answer null/0, poll() false.
  N_Socket();
  /// As construct(ConnectData*).
  /// @throws Q_MemoryException_Allocation* as construct(ConnectData*).
  explicit N_Socket(ConnectData* data);
  /// As construct(const N_Address*, int, SocketType).
  /// @throws N_NetException_IPNotResolved* as that construct().
  /// @throws N_NetException_LocalAddressAlreadyInUse* as that construct().
  /// @throws Q_MemoryException_Allocation* as that construct().
  N_Socket(const N_Address* address, int port, SocketType type);
  /// As destruct().
  ~N_Socket();

  /// Not copyable: two objects would own one socket and registry entry.
  N_Socket(const N_Socket&) = delete;
  /// Not assignable.
  N_Socket& operator=(const N_Socket&) = delete;

  /// Takes over an accepted connection; `data` must come from an
  /// N_Listener::pollConnect and is freed on success (on failure it stays
  /// queued). The socket is connected from the start and never shows up in
  /// pollConnect(). getPort() is the peer's port.
  /// @throws Q_MemoryException_Allocation* if memory runs out; the object is
  /// then unconstructed.
  void construct(ConnectData* data);
  /// An outgoing socket, bound to the local host's address. TCP connects in
  /// the background (pollConnect/receiveConnect tell when it's done); UDP binds
  /// the same port as the peer's, reads as connected at once and exchanges
  /// datagrams with that one peer only.
  /// @throws N_NetException_IPNotResolved* while the address has no
  ///   identifier yet;
  /// @throws N_NetException_LocalAddressAlreadyInUse* if the local address is
  ///   taken;
  /// @throws Q_MemoryException_Allocation* if memory runs out.
  ///
  /// After any of them the object is unconstructed and may be constructed
  /// again.
  /// @note A TCP connect that fails (nobody listens) reports nothing: the
  /// socket just never becomes connected, and nothing retries. Construct it
  /// again after a time of your choosing.
  void construct(const N_Address* address, int port, SocketType type);
  /// Closes the socket without a disconnect event. Queued sends that haven't
  /// left are dropped, unread messages are freed. Waits while another thread
  /// runs receive() for this socket.
  void destruct();

  /// The peer's address; null on an unconstructed socket. Owned by the socket
  /// when it was accepted, by the caller of construct() otherwise.
  const N_Address* getAddress();
  /// SOCKET_TCP or SOCKET_UDP.
  SocketType getSocketType();
  /// The peer's port.
  int getPort();
  /// S: the limit of one WSASend. Without the package mechanism a send() of
  /// more than S bytes throws N_NetException_PacketTooBig*.
  int getMaximumSendPacketSize() const;
  /// The connection is up: an accepted socket from the start, an outgoing
  /// TCP socket once its connect completed, a UDP socket at once; false after
  /// a disconnect event.
  bool isConnected();
  /// Turns the package mechanism on (see the class). Both ends must agree.
  void enablePackage();
  /// Turns the package mechanism off (see the class). Both ends must agree.
  void disablePackage();
  /// Ends the sending direction and reports a disconnect event (once, also if
  /// the peer's close comes later). Messages already received can still be
  /// polled.
  /// @warning Messages still queued for sending (see getBytesWaitingForSend)
  /// don't leave any more: wait for the queue to drain first if they matter.
  void disconnect();
  /// Copies the message at once; the caller may reuse its buffer on return.
  /// Works in every constructed state: before the connect completes the
  /// message waits. A WSASend that fails for another reason than a full
  /// buffer is tried again when the network thread next runs (the next send
  /// or network event), and the socket's later messages wait behind it.
  /// Never waits for the network.
  /// @throws N_NetException_PacketTooBig* without the package mechanism, for
  ///   more than getMaximumSendPacketSize() bytes;
  /// @throws Q_MemoryException_Allocation* if the copy can't be made; nothing
  ///   is queued then.
  void send(void* data, unsigned int size);
  /// The next message, oldest first. It stays the socket's and is valid until
  /// the next poll() on this socket or its destruct(); every poll(), also one
  /// that returns false, frees the message the previous one handed out.
  /// @warning Copy what you keep before the next poll(), and don't poll the
  /// same socket from two threads.
  bool poll(void*& data, unsigned int& size);
  /// While a message spans reads: its size + 4. 0 between messages and while
  /// only part of a length prefix is in.
  int getReceivePacketSize() const;
  /// While a message spans reads: the bytes still to come; 0 otherwise.
  int getReceivePacketBytesMissing() const;
  /// Bytes waiting to be sent by every socket of the process (4 more per
  /// packaged message), counted until their completion has run.
  int getBytesWaitingForSend() const;
  /// This socket's own share of that: bytes still to be sent, prefixes
  /// included.
  unsigned int getQueuedSendBytes() const;
  /// How many entries (messages, or parts of a message larger than the
  /// system's send buffer) those bytes are in.
  unsigned int getQueuedSendMessages() const;
  /// Bytes of received messages that poll() hasn't handed out yet. With a
  /// receive backlog set (N_Limits) the socket stops reading at that bound.
  unsigned int getQueuedReceiveBytes() const;
  /// How many messages those bytes are in.
  unsigned int getQueuedReceiveMessages() const;
  /// What this socket carried since construct(), copied out under the
  /// runtime's mutex (see N_SocketStats for what counts as a byte and when);
  /// all 0 on an unconstructed socket.
  N_SocketStats getStatistics() const;

  /// The first slot of the runtime's socket registry, null if there is none
  /// (or the runtime is down); `*slot` is the socket. See the class about
  /// walking it while other threads make or destroy sockets.
  static N_Socket** getFirstSocket();
  /// The slot after `socket`, null after the last one.
  static N_Socket** getNextSocket(N_Socket** socket);
  /// Each call reports one socket with a pending connect event and clears
  /// it; loop until false.
  static bool pollConnect(const N_Socket*& socket);
  /// Each call reports one socket with a pending disconnect event and clears
  /// it; loop until false.
  static bool pollDisconnect(const N_Socket*& socket);
  /// An N_Initializer is alive (or a failed start left the count raised).
  static bool networkPresent();
  /// Not measured: always the largest float.
  static float ping(N_Address* address);

  /// A connect completed (network thread, runtime's mutex held). True keeps
  /// the event for pollConnect().
  virtual bool receiveConnect();
  /// The connection ended (network thread, runtime's mutex held; or the
  /// thread that called disconnect()). True keeps the event for
  /// pollDisconnect().
  virtual bool receiveDisconnect();
  /// A whole message arrived (network thread, mutex released). True keeps it
  /// for poll(); false frees it as soon as this returns.
  virtual bool receive(void* data, unsigned int size);

 private:
  friend class N_Initializer;
  friend class N_Listener;
  friend struct N_SocketTestAccess;

  bool isConstructed() const;
  void initializeMembers();
  void baseConstructor();
  static int chkErr(int result);
  static platform::SOCKET chkErr(platform::SOCKET result);
  static const char* getWSErrorName(int code);
  static void sendComplete(platform::DWORD dwError, platform::DWORD cbTransferred,
                           platform::OVERLAPPED* lpOverlapped, platform::DWORD dwFlags);

  static bool pollEvent(const N_Socket*& socket, bool connected);

  // Hands `count` send entries of this socket, from `entry` on, to Winsock in
  // one WSASend (the first one's overlapped names them all), in the pump's
  // pass `pass` or, with the network thread's queue of completions, at once
  // from the sending thread; false when they stay unissued for a later pass.
  static constexpr unsigned kJoinedSends = 8;
  bool issueSend(DataQueue* entry, unsigned count, std::uint64_t pass, void* completionQueue);
  // A copy of one piece of a message being sent.
  struct Chunk {
    char* buffer;
    unsigned int length;
  };
  // Queues the chunks of one message, with the runtime's mutex held, and
  // issues them when nothing of the socket is queued before them: then true,
  // and the caller writes them (WSAFlushSends on `socket`).
  bool sendQueued(const Chunk* chunks, std::size_t count, platform::SOCKET& socket);

  // Receive path, on the network thread with the runtime's mutex held. The
  // bool results are false when the socket was destroyed during a receive()
  // call; the caller must not touch it again then.
  void postRead();
  // Whether the next read may go straight into the block of the message in
  // collection: its length is known, its block has room for all of it, and
  // no other read of this socket is under way.
  bool directReadable();
  // Counts the `bytes` that a direct read put into the block; false if the
  // socket was destroyed during a receive() call.
  bool receiveDirect(DataQueue* read, unsigned int bytes);
  // What the receive path takes from N_Limits, read once per read.
  struct ReadLimits {
    std::uint32_t uMaximumLength;
    bool bCompact;
  };
  bool receivePlain(DataQueue* read, unsigned int bytes, const ReadLimits& limits);
  bool receivePackaged(DataQueue* read, unsigned int bytes, const ReadLimits& limits);
  bool finishInRead(DataQueue* read, char* payload, unsigned int size, bool last, const ReadLimits& limits);
  // Makes room for `needed` bytes of the message in collection, of `total`
  // bytes in all, growing the block at least twofold.
  void reserveCollected(std::int64_t needed, std::int64_t total);
  bool deliver(DataQueue* read, DataQueue* message);
  DataQueue* appendMessage(char* buffer, char* data, unsigned int size);
  void breakStream();
  // In destruct(): waits, with the mutex given up meanwhile, until no
  // receive() call of another thread runs for this socket.
  void awaitDelivery();
  // Feeds `size` bytes to the receive path as one read that completed with
  // `error`, the way the network thread does; for the tests' white-box access.
  static void injectRead(N_Socket* socket, const void* bytes, unsigned int size, platform::DWORD error = 0);

  bool m_bConstructed;
  Q_DLList<DataQueue>* m_pReceiveQueue;
  const N_Address* m_pAddress;
  int m_iPort;
  SocketType m_socketType;
  platform::SOCKET m_socket;
  platform::WSAEVENT m_event;
  platform::sockaddr_in m_remoteAddress;
  platform::sockaddr_in m_localAddress;
  N_Socket** m_pRegistryEntry;
  int m_iMaximumSendPacketSize;
  std::atomic<bool> m_bConnected;
  std::atomic<bool> m_bEventPending;
  bool m_bOwnsAddress;
  bool m_bWritable;
  bool m_bWriteCompletionPending;
  std::atomic<bool> m_bPackage;
  std::atomic<int> m_iPacketBytesMissing;
  std::atomic<int> m_iPacketBytesHave;
  char* m_pPacketBuffer;
  // A nonsense length or a failed allocation broke the package stream; the
  // rest of its packaged reads is dropped.
  bool m_bStreamBroken;
  // The message entry whose receive() call runs now, with the mutex released,
  // and the thread that runs it; null otherwise. destruct() on another thread
  // waits while it is set, and poll() leaves that entry in place.
  DataQueue* m_pDelivering;
  std::thread::id m_deliveringThread;
  // The send pump's pass in which a WSASend of this socket failed for a
  // reason it retries later; the socket's later entries wait for that retry,
  // so that the stream keeps its order.
  std::uint64_t m_uPumpHeldPass;
  // Bytes allocated for m_pPacketBuffer while a body is collected; below
  // length + 4 while a long message grows with what arrived.
  std::int64_t m_iPacketCapacity;
  // Sums kept under the runtime's mutex: bytes and entries of this socket on
  // the out-queue, and of its messages that poll() hasn't handed out.
  unsigned int m_uQueuedSendBytes;
  unsigned int m_uQueuedSendMessages;
  unsigned int m_uQueuedReceiveBytes;
  unsigned int m_uQueuedReceiveMessages;
  // What the socket carried (N_SocketStats), under the runtime's mutex:
  // counted by sendComplete(), receiveComplete() and appendMessage().
  std::uint64_t m_uBytesSent;
  std::uint64_t m_uMessagesSent;
  std::uint64_t m_uBytesReceived;
  std::uint64_t m_uMessagesReceived;
  // What the unpolled messages count against the receive backlog.
  std::uint64_t receiveBacklogCost() const;
  // Reading stopped at the receive backlog; poll() sets m_bReadResume when
  // the backlog fell below it, and the network thread then posts the read.
  bool m_bReadPaused;
  bool m_bReadResume;
};
