/// @class N_Listener
/// A TCP listening socket on a port of all local addresses.
///
/// The listener accepts nothing itself: the runtime's network thread accepts
/// on its behalf and leaves each connection as an N_Socket::ConnectData in the
/// runtime's connect queue, oldest first. pollConnect() finds the oldest entry
/// of this listener without taking it out; hand it to N_Socket (or N_Client)
/// exactly once, which consumes it, then poll again.
///
/// @warning An entry nobody consumes (or rejects with rejectConnect()) hides
/// the later entries of the same listener: pollConnect() keeps giving it.
///
/// No socket failure is reported: a listener whose bind or listen failed
/// (a port in use, say) simply never gets a connection.
///
/// @par Threads
/// Any thread may call the operations; each takes the runtime's mutex for a
/// moment and none waits for the network. construct() and destruct() of one
/// object must not run at once. receiveConnect() runs on the network thread.
/// A constructed N_Initializer must outlive every listener.
///
/// Copying is forbidden: two objects would own one socket, event and registry
/// entry.
#pragma once

#include "N_Socket.h"
#include "Q_Timer.h"
#include "vardel_export.h"
#include "vardel_platform.h"

class N_Initializer;

class VARDEL_API N_Listener {
 public:
  /// Opens `port`, as construct().
  /// @throws Q_MemoryException_Allocation* as construct().
  explicit N_Listener(int port = 3123);
  /// As destruct().
  ~N_Listener();

  /// Not copyable (see the class).
  N_Listener(const N_Listener&) = delete;
  /// Not assignable (see the class).
  N_Listener& operator=(const N_Listener&) = delete;

  /// Opens the port (on a constructed listener: closes the old one first).
  /// @throws Q_MemoryException_Allocation* if the registry entry can't be made;
  /// the object is then unconstructed and nothing of the attempt is left.
  void construct(int port);
  /// Closes the port. Entries of this listener that were never consumed stay
  /// in the connect queue until the runtime stops.
  void destruct();

  /// The port as given to construct(); 0 stays 0 even though the system chose
  /// one.
  int getPort();
  /// The oldest accepted connection of this listener, left in the queue.
  /// False, with `out` untouched, if there is none. The entry's socket is
  /// INVALID_SOCKET when the accept failed (no descriptor left): reject it.
  bool pollConnect(N_Socket::ConnectData*& out);
  /// Refuses an entry that pollConnect() gave instead of handing it over:
  /// closes its connection and frees it. The pointer is dead afterwards.
  /// False (and nothing done) if it isn't an entry of this listener.
  bool rejectConnect(N_Socket::ConnectData* data);

  /// Called on the network thread, with the runtime's mutex held, once for
  /// each accepted connection after its entry is queued. Nothing here. An
  /// override must not wait for a thread that needs the runtime's mutex, and
  /// its class must call destruct() in its own destructor: this destructor
  /// isn't virtual, and until destruct() the network thread may still call
  /// the override.
  virtual void receiveConnect(N_Socket::ConnectData* data);

 private:
  friend class N_Initializer;

  void initializeMembers();
  bool isConstructed() const;

  bool m_bConstructed;
  int m_iPort;
  platform::SOCKET m_socket;
  platform::WSAEVENT m_event;
  platform::sockaddr_in m_requestedAddress;
  platform::sockaddr_in m_localAddress;
  N_Listener** m_pRegistryEntry;
  // After an accept failed for lack of descriptors or memory the network
  // thread leaves the listener out of its wait for m_fRestSeconds, counted
  // by m_restTimer.
  Q_Timer m_restTimer;
  float m_fRestSeconds;
};
