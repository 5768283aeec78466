/// @class N_Initializer
/// The process-wide network runtime.
///
/// Construct one N_Initializer before using any other class of the library and
/// keep it for as long as the network is used:
///
/// @code
///   int main() {
///     N_Initializer network;   // throws N_NetException* / Q_MemoryException*
///     ...
///   }
/// @endcode
///
/// The first instance brings the network up: the registries and queues, the
/// global mutex and the release event, Winsock, a TCP and a UDP provider, the
/// network thread, and the local address (N_Address::getLocalAddress()). Later
/// instances only raise a count. When the last instance goes, the network
/// thread is stopped and every socket, listener and address still registered is
/// deleted, oldest first: sockets, then listeners, then addresses. A runtime
/// that went down can be started again; the start is then done anew, with a
/// new network thread.
///
/// @warning Pointers the application still holds to those objects dangle after
/// the stop, and they must have come from new. Declare the N_Initializer
/// before every other object of the library in the same scope, so that it goes
/// last: a server, client, socket or address on the stack that outlives it is
/// deleted by the stop and then destroyed a second time.
///
/// The constructor returns only once the network thread runs and the local
/// address has its identifier; the destructor returns once that thread has
/// left its loop. Neither waits for anything else of the network. (A network
/// thread that the system refused to start leaves a runtime without I/O, and
/// a stop that doesn't wait for it.)
///
/// A failed start (any exception from the first constructor) is not undone: the
/// count stays raised, so every later N_Initializer of the process is a no-op
/// and the runtime stays as far as it got. The local address is waited for at
/// most 10 seconds; a host name that doesn't resolve by then (or whose lookup
/// failed) ends the start with N_NetException_IPNotResolved, with the network
/// thread running.
///
/// @par Threads
/// Constructors and destructors of N_Initializer must not run at the same time
/// on different threads. setLimits(), getLimits(), setMaximumWaitEvents() and
/// getMaximumWaitEvents() may be called from any thread.
#pragma once

#include <atomic>
#include <cstdint>

#include "N_Limits.h"
#include "N_RuntimeStats.h"
#include "N_Socket.h"
#include "Q_DLList.h"
#include "vardel_export.h"
#include "vardel_platform.h"

class N_Address;
class N_Listener;

class VARDEL_API N_Initializer {
 public:
  /// The state of the network thread, as the runtime's start and stop see it.
  enum ThreadState : std::int32_t {
    THREAD_RUNNING = 0,   ///< In its loop.
    THREAD_STOPPING = 1,  ///< Asked to leave its loop.
    THREAD_STOPPED = 2,   ///< Not running.
  };

  /// The first instance starts the runtime (see the class); later ones only
  /// count. Blocks until the network thread runs and the local address has
  /// its identifier: up to 10 seconds for a host name that doesn't resolve.
  /// @throws N_NetException* if the network can't be brought up: one of
  ///   N_NetException_Unavailable*, N_NetException_NotSupported*,
  ///   N_NetException_ProcessLimit* and N_NetException_VersionFailure* if
  ///   Winsock can't be started, N_NetException_NoTCP* or
  ///   N_NetException_NoUDP* if a provider is missing, and
  ///   N_NetException_IPNotResolved* if the local host has no address.
  /// @throws Q_MemoryException_Allocation* if memory runs out.
  ///
  /// A failed start is not undone (see the class).
  N_Initializer();
  /// The last instance stops the runtime and deletes every socket, listener
  /// and address still registered; it blocks until the network thread has
  /// left its loop.
  ~N_Initializer();

  /// A copy would be an instance that the count never saw.
  N_Initializer(const N_Initializer&) = delete;
  /// Copies the Winsock start data only.
  N_Initializer& operator=(const N_Initializer& other);

  /// Body of the network thread, which the runtime starts itself; not for
  /// applications to call. The parameter isn't read; returns 0.
  static unsigned int threadNetwork(void* parameter);

  /// Sets the process-wide protections (N_Limits). May be called at any time
  /// and from any thread, before the first instance too; what runs picks the
  /// values up at its next step. A uMaximumMessageSize of 0 or above
  /// 0x7FFFFFFB is taken as 0x7FFFFFFB.
  /// @note The defaults suit a trusted network only: a server on the open one
  /// should call `setLimits(N_Limits::openNetwork())` before it starts.
  static void setLimits(const N_Limits& limits);
  /// The protections in force; N_Limits::defaults() until setLimits().
  static N_Limits getLimits();
  /// The runtime's counts for the whole process (N_RuntimeStats), copied out
  /// under its mutex; all 0 while no runtime runs. Any thread, while an
  /// N_Initializer lives.
  static N_RuntimeStats getStatistics();

  /// Sets how many objects the network thread waits on at once: the size of
  /// its wait set, its release event included. Sockets take their places
  /// oldest first, then listeners (with N_Limits::bListenersFirst the other
  /// way round); what doesn't fit isn't served until others go, though its
  /// sends still leave. The default, 64, is Winsock's limit, and with it an
  /// N_Server holds (64 - 3) / 3 = 20 clients: each client is three sockets,
  /// beside the server's two listeners. A larger size holds more: 604 for 200
  /// clients, 4096 for 1364.
  ///
  /// Values below 64 are taken as 64, values above 65536 as 65536. The size
  /// is read when the runtime starts (the first N_Initializer): a call while
  /// it runs changes the next start only. The wait set is allocated once, at
  /// that start, and the thread's wait costs the same whatever its size; its
  /// passes walk the sockets and listeners, as they do at any size. Every
  /// connection is a descriptor: a server of many clients may need a higher
  /// descriptor limit (`ulimit -n`) as well.
  static void setMaximumWaitEvents(unsigned uMaximumWaitEvents);
  /// The size of the wait set: while the runtime runs the one it started
  /// with, otherwise the one its next start takes (64 until
  /// setMaximumWaitEvents()).
  static unsigned getMaximumWaitEvents();

 private:
  friend class Runtime;  // the owner of the shared state below

  void start();
  static void stop();
  static void chooseProviders();
  static void makeLocalAddress();

  // Wakes the network thread out of its wait. Called with m_hMutex held by
  // whoever changed a list (or closes a handle the wait set may hold), so
  // the thread finds the change complete when it gets the mutex back.
  static void releaseThreadLoop();

  // Winsock condition function; accepts whatever it is given.
  static int acceptConnection(platform::WSABUF* callerId, platform::WSABUF* callerData,
                              platform::_QualityOfService* sqos, platform::_QualityOfService* gqos,
                              platform::WSABUF* calleeId, platform::WSABUF* calleeData,
                              platform::UINT* group, std::uintptr_t callbackData);

  // One pass of the network thread, with m_hMutex held (network_pass.cpp).
  // Fills m_pWaitEvents[0..count) with the release event first and returns
  // count (at most m_uWaitEvents).
  // A listener resting after a failed accept is left out; `timeout` is set
  // to the milliseconds until the first of them may come back (or INFINITE).
  static platform::DWORD buildWaitSet(platform::DWORD& timeout);
  // Posts the reads of sockets whose receive backlog has fallen below its
  // bound since their reading paused.
  static void resumeReads();
  // Entries of the connect queue that belong to `listener`.
  static unsigned queuedConnects(const N_Listener* listener);
  static void pumpSends();
  static void serveEvent(platform::WSAEVENT handle);
  // Completion routine of the reads that the pass posts.
  static void receiveComplete(platform::DWORD error, platform::DWORD bytes,
                              platform::OVERLAPPED* overlapped, platform::DWORD flags);

  platform::WSADATA m_wsaData;  // filled by the instance that starts the runtime

  static std::uint32_t m_uInstance;          // live instances, failed starts included
  static N_Initializer* m_pActiveObject;     // the instance that started the runtime
  // Written by the network thread (RUNNING, STOPPED) and the stop (STOPPING);
  // atomic because the start and the stop poll it while that thread runs.
  static std::atomic<ThreadState> m_threadState;
  static platform::CWinThread* m_pThread;
  static bool m_bThreadStartFailed;  // AfxBeginThread gave null: nothing to stop
  static int m_iNumProtocols;
  static platform::WSAPROTOCOL_INFOA* m_installedProtocols;  // owned
  static platform::WSAPROTOCOL_INFOA* m_tcpProtocol;         // an element of the catalogue
  static platform::WSAPROTOCOL_INFOA* m_udpProtocol;
  static platform::HANDLE m_hMutex;          // "Kelvane network mutex", recursive
  static platform::WSAEVENT m_eventRelease;  // slot 0 of every wait set
  // The network thread's wait set, allocated by the start with the size then
  // set (owned; written before the thread starts, then its own).
  static platform::WSAEVENT* m_pWaitEvents;
  static platform::DWORD m_uWaitEvents;
  static N_Address* m_pLocalAddress;         // owned

  static Q_DLList<N_Socket*>* m_pSockets;
  static Q_DLList<N_Listener*>* m_pListeners;
  static Q_DLList<N_Address*>* m_pAddresses;
  static Q_DLList<N_Socket::ConnectData>* m_pConnectQueue;
  static Q_DLList<N_Socket::DataQueue>* m_pInProcessQueue;
  static Q_DLList<N_Socket::DataQueue>* m_pOutProcessQueue;
  // Facts kept beside the out queue (see send_queue.cpp).
  static N_Socket::DataQueue* m_pPumpFrom;
  static unsigned int m_uBytesWaitingForSend;
  // The network thread's passes (numbered by pumpSends, which runs once in
  // each; 0 is never a pass number) and the events it served, under m_hMutex.
  static std::uint64_t m_uNetworkPasses;
  static std::uint64_t m_uEventsServed;
  // Set (under m_hMutex) when a paused socket may read again; the next pass
  // walks the sockets for it.
  static bool m_bReadsToResume;
};
