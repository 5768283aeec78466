// The process-wide network runtime.
//
// Construct one N_Initializer before using any other class of the library and
// keep it for as long as the network is used:
//
//   int main() {
//     N_Initializer network;   // throws N_NetException* / Q_MemoryException*
//     ...
//   }
//
// The first instance brings the network up: the registries and queues, the
// global mutex and the release event, Winsock, a TCP and a UDP provider, the
// network thread, and the local address (N_Address::getLocalAddress()). Later
// instances only raise a count. When the last instance goes, the network
// thread is stopped and every socket, listener and address still registered is
// deleted, oldest first: sockets, then listeners, then addresses. Pointers the
// application still holds to them dangle afterwards, and they must have come
// from new. A runtime that went down can be started again; the start is then
// done anew, with a new network thread.
//
// The constructor returns only once the network thread runs and the local
// address has its identifier; the destructor returns once that thread has
// left its loop. Neither waits for anything else of the network. (A network
// thread that the system refused to start leaves a runtime without I/O, and
// a stop that doesn't wait for it.)
//
// A failed start (any exception from the first constructor) is not undone: the
// count stays raised, so every later N_Initializer of the process is a no-op
// and the runtime stays as far as it got. The local address is waited for at
// most 10 seconds; a host name that doesn't resolve by then (or whose lookup
// failed) ends the start with N_NetException_IPNotResolved, with the network
// thread running.
//
// Constructors and destructors of N_Initializer must not run at the same time
// on different threads.
#pragma once

#include <atomic>
#include <cstdint>

#include "N_Limits.h"
#include "N_Socket.h"
#include "Q_DLList.h"
#include "vardel_export.h"
#include "vardel_platform.h"

class N_Address;
class N_Listener;

class VARDEL_API N_Initializer {
 public:
  enum ThreadState : std::int32_t {
    THREAD_RUNNING = 0,
    THREAD_STOPPING = 1,
    THREAD_STOPPED = 2,
  };

  N_Initializer();
  ~N_Initializer();

  // A copy would be an instance that the count never saw.
  N_Initializer(const N_Initializer&) = delete;
  // Copies the Winsock start data only.
  N_Initializer& operator=(const N_Initializer& other);

  // Body of the network thread. The parameter isn't read; returns 0.
  static unsigned int threadNetwork(void* parameter);

  // The process-wide protections (N_Limits.h). May be called at any time,
  // before the first instance too; what runs picks the values up at its next
  // step.
  static void setLimits(const N_Limits& limits);
  static N_Limits getLimits();

 private:
  friend class N_Address;
  friend class N_Socket;
  friend class N_Listener;
  friend class N_Client;
  friend class N_Server;

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
  // Fills events[0..count) with the release event first and returns count.
  // A listener resting after a failed accept is left out; `timeout` is set
  // to the milliseconds until the first of them may come back (or INFINITE).
  static platform::DWORD buildWaitSet(platform::WSAEVENT* events, platform::DWORD& timeout);
  // Posts the reads of sockets whose receive backlog has fallen below its
  // bound since their reading paused.
  static void resumeReads();
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
  static N_Address* m_pLocalAddress;         // owned

  static Q_DLList<N_Socket*>* m_pSockets;
  static Q_DLList<N_Listener*>* m_pListeners;
  static Q_DLList<N_Address*>* m_pAddresses;
  static Q_DLList<N_Socket::ConnectData>* m_pConnectQueue;
  static Q_DLList<N_Socket::DataQueue>* m_pInProcessQueue;
  static Q_DLList<N_Socket::DataQueue>* m_pOutProcessQueue;
  // Kept beside the out queue so that neither the pump nor the byte count
  // walks the whole backlog: every entry before m_pPumpFrom is issued and
  // live (null: no entry needs the pump), and m_uBytesWaitingForSend is the
  // sum of wsaBuf.len over the queue. Both change under m_hMutex only.
  static N_Socket::DataQueue* m_pPumpFrom;
  static unsigned int m_uBytesWaitingForSend;
  // Set (under m_hMutex) when a paused socket may read again; the next pass
  // walks the sockets for it.
  static bool m_bReadsToResume;
};
