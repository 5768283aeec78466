/// @class N_Server
/// The accepting end of client and server connections.
///
/// A server listens on its data port P (it is an N_Listener) and on the fixed
/// control port 6000. It has no thread: everything happens in update(), which
/// the application calls once per pass of its loop:
///
/// @code
///   N_Server server(3123);
///   for (;;) {
///     server.update();
///     N_Client* client;
///     while (server.pollConnect(client)) welcome(client);
///     for (each client) {
///       if (!client->isConnected()) { server.disconnectClient(client); forget(client); continue; }
///       while (client->poll(m, n)) handle(m, n);       // m is valid until the next poll
///       client->queueReliable(...); client->queueUnreliable(...);
///       client->flushReliable(); client->flushUnreliable();   // in this order
///     }
///   }
/// @endcode
///
/// update() makes an N_Client of each accepted data connection, keeps each
/// accepted control connection until a client of the same IPv4 address
/// without one exists, pairs them, and then runs the heartbeat of every
/// paired client and answers its control messages (bandwidth requests,
/// heartbeats, world-time requests, echoes). A client is handed out by
/// pollConnect() exactly once, oldest first, and only after pairing.
///
/// @warning Pairing knows nothing but the address: two clients on one address
/// may get each other's control channel, so give every client host an address
/// of its own. Without N_Limits::fPairingTimeout, a data connection whose
/// client went away before pairing also stays, and takes the control channel
/// of that address's next client.
///
/// @warning The server never removes a client by itself. A client whose channel
/// died or whose heartbeat timed out stays (isConnected() false) and keeps its
/// share of the bandwidth until the application calls disconnectClient().
///
/// @par How many clients
/// Each client is three sockets of the network thread's wait set, beside the
/// server's two listeners and the thread's release event: the default set of
/// 64 holds 20 clients; once it is full the listeners are left out, and a
/// 21st client never completes its connection. N_Initializer::setMaximumWaitEvents(),
/// before the runtime starts, makes room for more: 3 x clients + 3.
///
/// @par Bandwidth
/// Each client's share is the smaller of what it asked for and
/// getMaximumBandwidthUsage() (default 10240). If the shares together exceed
/// getBandwidth() (default 1250000), each loses the part of the excess that
/// its share has of the sum, rounded to the nearest whole byte per second,
/// ties to even; no remainder is handed on, so the grants need not add up to
/// the budget exactly. Grants are worked out again, and sent to every client
/// with a connected control channel, at every request, at each setter and at
/// every disconnectClient(). A client counts with 1250000 asked until its
/// first request. The sums are 32-bit: keep the budget and the sum of the
/// shares below 2^31. Where the rounding of a cut above 2^24 would make it
/// greater than the share, the grant is held at 0 instead of wrapping.
///
/// After destruct(), update() and disconnectClient() do nothing and
/// pollConnect() gives false. The data port keeps accepting until the
/// listener goes (construct() again or the destructor); the control port is
/// closed.
///
/// @par Threads
/// update(), pollConnect() and disconnectClient() take the server's
/// own re-entrant lock, so they may be called from several application
/// threads. It doesn't cover an N_Client that pollConnect() handed out: its
/// payload operations must not run beside update() on another thread.
/// construct() and destruct() must run alone. The network thread never
/// enters this class.
///
/// @par Deriving
/// A class derived from N_Server may make its own clients: allocateClient()
/// must return a constructed, non-null N_Client that consumed `pConnectData`
/// (handed it to an N_Client or N_Socket exactly once), and freeClient()
/// destroys what it made. Call destruct() in the derived destructor for
/// freeClient() to be reached at the end.
///
/// @warning A second server on the machine opens port 6000 as well, and nothing
/// reports that its control listener got nothing: its clients never pair.
///
/// @par Open network
/// On the open network, call N_Initializer::setLimits(N_Limits::openNetwork())
/// first: unpaired connections then have a time limit and a cap, a client
/// that doesn't read what it is sent is disconnected, each update() serves a
/// bounded number of control messages per client and divides the bandwidth
/// at most once, and a connection that can't be taken is refused without
/// costing the other clients their update (N_Limits.h, and the README).
/// Whatever the limits, an accept that failed (no descriptor left) never
/// becomes a client.
#pragma once

#include <atomic>

#include "N_Client.h"
#include "N_Limits.h"
#include "N_Listener.h"
#include "Q_DLList.h"
#include "Q_Timer.h"
#include "vardel_export.h"

class Q_Mutex;
// White-box access for the library's own tests only.
struct N_ServerTestAccess;

class VARDEL_API N_Server : public N_Listener {
 public:
  /// Opens data port `port` and control port 6000 and starts the world
  /// clock, as construct().
  /// @throws Q_MemoryException_Allocation* as construct().
  explicit N_Server(int port = 3123);
  /// Frees every client (pointers from pollConnect() die) and closes both
  /// ports.
  ~N_Server();

  /// Not copyable: the server owns its clients and listeners.
  N_Server(const N_Server&) = delete;
  /// Not assignable.
  N_Server& operator=(const N_Server&) = delete;

  /// Takes the server down (destruct()), opens data port `port` again and the
  /// control port, and restarts the world clock. A port in use is not
  /// reported (see N_Listener).
  /// @throws Q_MemoryException_Allocation* when memory runs out; the server
  /// part is then unconstructed.
  void construct(int port);
  /// Frees every client and every pending control socket, and closes the
  /// control port; pointers from pollConnect() die.
  void destruct();

  /// The server's whole step, once per pass of the application's loop (see
  /// the class). Never waits for the network; its work grows with the
  /// clients and the control messages waiting.
  /// @throws Q_MemoryException_Allocation* when a client, a control socket or
  /// the copy of a control message (N_Socket::send) can't be made.
  /// @throws N_NetException_LocalAddressAlreadyInUse* when a client's UDP end
  /// can't bind its port, and whatever else an allocateClient() override
  /// throws.
  ///
  /// What was done before in the pass stands. With N_Limits::bContainFailures
  /// a connection that can't be made into a client or control socket is
  /// refused instead, and only N_Socket::send's exceptions pass out.
  void update();
  /// The next client that update() paired and that wasn't handed out yet.
  /// Never throws. The server keeps owning it: give it back with
  /// disconnectClient(), never delete it.
  bool pollConnect(N_Client*& out);
  /// Frees the client (the pointer is dead afterwards) and shares the
  /// bandwidth out again, also when the client wasn't one of this server's.
  /// Never throws: grants that can't be sent now are sent by the next
  /// update().
  /// @note The only way a client leaves: call it for every handed-out client
  /// whose isConnected() turned false.
  void disconnectClient(N_Client* client);

  /// Sets the budget shared by all clients, in bytes per second, and sends
  /// new grants at once.
  /// @throws Q_MemoryException_Allocation* if a grant's copy can't be made
  /// (N_Socket::send).
  void setBandwidth(unsigned uBandwidth);
  /// The budget shared by all clients; 1250000 by default.
  unsigned getBandwidth() const;
  /// Sets the most one client is granted, in bytes per second, and sends new
  /// grants at once.
  /// @throws Q_MemoryException_Allocation* as setBandwidth().
  void setMaximumBandwidthUsage(unsigned uMaximumBandwidthUsage);
  /// The most one client is granted; 10240 by default, so each client's
  /// queues and batches are paced at 10 KiB/s unless this is raised.
  unsigned getMaximumBandwidthUsage() const;

  /// The world clock that clients synchronise to: its age in seconds.
  const Q_Timer& getWorldTimer() const;

 protected:
  /// Makes the N_Client of an accepted data connection; by default an
  /// N_Client(pConnectData, getPort()). Called by update() with the server's
  /// lock held; see the class about overriding it.
  virtual N_Client* allocateClient(N_Socket::ConnectData* pConnectData);
  /// Destroys what allocateClient() made. Called with the server's lock
  /// held, by update(), disconnectClient() and destruct().
  virtual void freeClient(N_Client* pClient);
  /// construct() succeeded and destruct() hasn't run since.
  bool isConstructed() const;

 private:
  friend struct N_ServerTestAccess;

  // An accepted control connection waiting for its client.
  struct PendingControl {
    N_Socket* pSocket;
    Q_Timer age;  // since it was accepted
  };

  // The sums of one division of the budget (see solveBandwidth).
  struct BandwidthDivision {
    unsigned uExcess;
    float fTotal;
    float fExcess;
  };
  static unsigned shareOf(unsigned requested, unsigned maximum);
  static BandwidthDivision divide(unsigned budget, unsigned total);
  static unsigned grantOf(const BandwidthDivision& division, unsigned share);

  void initializeMembers();
  void constructionCode();
  // Divides the budget and sends the grants; with `changedOnly` only to
  // clients whose grant changed or that asked since the last division.
  void solveBandwidth(bool changedOnly = false);
  void acceptData(const N_Limits& limits);
  void acceptControl(const N_Limits& limits);
  // Whether one more connection of `identifier` may wait to be paired.
  bool admitUnpaired(const N_Limits& limits, unsigned identifier, bool control);
  void rejectUnlessTaken(N_Socket::ConnectData* data, platform::SOCKET socket);
  void dropUnpaired(float timeout);
  void pair();
  bool sendBacklogExceeded(N_Client* client, const N_Limits& limits);
  void serveControl(N_Client* client, const N_Limits& limits);

  bool m_bServerConstructed;
  Q_Mutex* m_pMutex;
  N_Listener* m_pControlListener;
  Q_Timer m_worldTimer;
  std::atomic<unsigned> m_uBandwidth;
  std::atomic<unsigned> m_uMaximumBandwidthUsage;
  Q_DLList<N_Client*>* m_pClients;
  Q_DLList<PendingControl>* m_pPendingControlSockets;
  // A division is due at the end of the next update(): in full after one
  // that failed (m_bSolvePending), or for the requests collected in this
  // one (m_bSolveCollected).
  bool m_bSolvePending;
  bool m_bSolveCollected;
};
