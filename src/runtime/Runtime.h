// Internal to the library: the one owner of the runtime's shared state.
//
// N_Initializer starts and stops the runtime and runs its network thread.
// The registries (sockets, listeners, addresses), the queues (accepted
// connections waiting for an owner, reads in flight, sends waiting or in
// flight) and the mutex that guards them are reached through this class
// only. Apart from present() and mutex(), every member is called with that
// mutex held (RuntimeLock); the lists are null while no runtime is up.
#pragma once

#include "N_Initializer.h"
#include "N_Socket.h"
#include "Q_DLList.h"

class N_Address;
class N_Listener;

class Runtime {
 public:
  static bool present() { return N_Initializer::m_uInstance > 0; }
  static platform::HANDLE mutex() { return N_Initializer::m_hMutex; }
  // Makes the network thread build its wait set again: after a list changed,
  // or before a handle that its wait may hold is closed.
  static void wake() {
    // Set already, the event still ends the thread's next wait: the thread
    // clears the mark when it resets the event, both under the mutex.
    if (released()) return;
    released() = true;
    N_Initializer::releaseThreadLoop();
  }
  // Whether the release event was set by wake() and not reset since.
  static bool& released();

  static platform::WSAPROTOCOL_INFOA* provider(bool stream) {
    return stream ? N_Initializer::m_tcpProtocol : N_Initializer::m_udpProtocol;
  }
  static N_Address* localAddress() { return N_Initializer::m_pLocalAddress; }

  static Q_DLList<N_Socket*>* sockets() { return N_Initializer::m_pSockets; }
  static Q_DLList<N_Listener*>* listeners() { return N_Initializer::m_pListeners; }
  static Q_DLList<N_Address*>* addresses() { return N_Initializer::m_pAddresses; }
  static Q_DLList<N_Socket::ConnectData>* connects() { return N_Initializer::m_pConnectQueue; }
  static Q_DLList<N_Socket::DataQueue>* reads() { return N_Initializer::m_pInProcessQueue; }
  static Q_DLList<N_Socket::DataQueue>* sends() { return N_Initializer::m_pOutProcessQueue; }
  // The completion routine of every read the library posts.
  static constexpr auto readComplete = &N_Initializer::receiveComplete;

  // Puts an object into its registry, so that the network thread serves it
  // from its next pass; throws Q_MemoryException_Allocation* with nothing
  // changed.
  template <class T>
  static T** enroll(Q_DLList<T*>* registry, T* object) {
    T** slot = registry->append();
    *slot = object;
    wake();
    return slot;
  }
  // Takes it out again (`slot` from enroll, or null) and clears `slot`.
  template <class T>
  static void withdraw(Q_DLList<T*>* registry, T**& slot) {
    if (slot != nullptr && registry != nullptr) registry->remove(slot);
    slot = nullptr;
    wake();
  }

  // The send queue and its pump (send_queue.cpp). Entries of one socket go
  // out in the order they were queued; the pump issues them on the network
  // thread, and a completion takes each out.
  //
  // A fresh entry at the end of the queue for `socket`, owning nothing yet.
  static N_Socket::DataQueue* appendSend(N_Socket* socket);
  // Takes `first` and every entry behind it out, freeing their buffers: a
  // message that could not be queued whole leaves nothing.
  static void dropSends(N_Socket::DataQueue* first);
  // The entries from `first` on, `bytes` in all, are queued; from `pumpFrom`
  // on (null: none) they wait for the pump, which is woken for them.
  static void sendsQueued(N_Socket::DataQueue* pumpFrom, unsigned bytes);
  // The network thread's queue of completions, for sends issued on other
  // threads (WSASendFor); null while that thread doesn't run.
  static void*& networkQueue();
  // The number of the last pass (see N_Initializer::pumpSends).
  static std::uint64_t lastPass() { return N_Initializer::m_uNetworkPasses; }
  // A completed entry leaves the queue (its buffer already freed).
  static void sendDone(N_Socket::DataQueue* entry);
  // The entries in flight of a socket that goes become orphans: Winsock may
  // still name their overlapped, so only the network side may free them.
  static void orphan(const N_Socket* socket);
  static unsigned bytesWaitingForSend() { return N_Initializer::m_uBytesWaitingForSend; }

  // A socket that paused reading may read again: the next pass posts it.
  static void resumeReads() {
    N_Initializer::m_bReadsToResume = true;
    wake();
  }
};
