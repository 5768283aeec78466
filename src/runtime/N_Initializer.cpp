#include "N_Initializer.h"

#include <algorithm>

#include "N_Address.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "Q_Throw.h"
#include "Q_Timer.h"
#include "RuntimeLock.h"
#include "trace.h"
#include "win32.h"
#include "winsock.h"

namespace {

const char kNetworkMutexName[] = "Kelvane network mutex";
constexpr platform::WORD kWinsockVersion = 0x0002;  // 2.0
// How long the start waits for the local host's identifier.
constexpr float kLocalAddressSeconds = 10.0f;

constexpr platform::DWORD kTcpFlags = platform::XP1_GUARANTEED_DELIVERY | platform::XP1_GUARANTEED_ORDER |
                                      platform::XP1_GRACEFUL_CLOSE | platform::XP1_EXPEDITED_DATA |
                                      platform::XP1_IFS_HANDLES;
constexpr platform::DWORD kUdpFlags = platform::XP1_CONNECTIONLESS | platform::XP1_MESSAGE_ORIENTED |
                                      platform::XP1_SUPPORT_BROADCAST | platform::XP1_SUPPORT_MULTIPOINT |
                                      platform::XP1_IFS_HANDLES;

// Deletes every object a registry still names, oldest first, then whatever
// entries are left, then the list. Each object's destructor takes its own
// entry out, so the next entry is taken before the object goes.
template <class T>
void deleteRegistered(Q_DLList<T*>*& list) {
  if (list == nullptr) return;
  for (T** entry = list->getFirst(); entry != nullptr;) {
    T** next = list->getNext(entry);
    if (*entry != nullptr) Q_Delete(*entry);
    entry = next;
  }
  while (T** entry = list->getFirst()) list->remove(entry);
  Q_Delete(list);
  list = nullptr;
}

// The wait set's size for the next start, and the one in force (0 while no
// runtime runs).
std::atomic<platform::DWORD> g_waitEventsSet{platform::WSA_MAXIMUM_WAIT_EVENTS};
std::atomic<platform::DWORD> g_waitEventsInForce{0};
// The wait set at Winsock's size, the default.
platform::WSAEVENT g_defaultWaitSet[platform::WSA_MAXIMUM_WAIT_EVENTS];

// Frees the buffers the records of a queue still own, then the queue.
void deleteQueue(Q_DLList<N_Socket::DataQueue>*& queue) {
  if (queue == nullptr) return;
  for (N_Socket::DataQueue* entry = queue->getFirst(); entry != nullptr; entry = queue->getNext(entry)) {
    if (entry->pBuffer != nullptr) {
      Q_DeleteArray(static_cast<char*>(entry->pBuffer));
      entry->pBuffer = nullptr;
      entry->wsaBuf.buf = nullptr;
    }
  }
  Q_Delete(queue);
  queue = nullptr;
}

}  // namespace

std::uint32_t N_Initializer::m_uInstance = 0;
N_Initializer* N_Initializer::m_pActiveObject = nullptr;
std::atomic<N_Initializer::ThreadState> N_Initializer::m_threadState{THREAD_STOPPED};
platform::CWinThread* N_Initializer::m_pThread = nullptr;
bool N_Initializer::m_bThreadStartFailed = false;
int N_Initializer::m_iNumProtocols = 0;
platform::WSAPROTOCOL_INFOA* N_Initializer::m_installedProtocols = nullptr;
platform::WSAPROTOCOL_INFOA* N_Initializer::m_tcpProtocol = nullptr;
platform::WSAPROTOCOL_INFOA* N_Initializer::m_udpProtocol = nullptr;
platform::HANDLE N_Initializer::m_hMutex = nullptr;
platform::WSAEVENT N_Initializer::m_eventRelease = nullptr;
platform::WSAEVENT* N_Initializer::m_pWaitEvents = nullptr;
platform::DWORD N_Initializer::m_uWaitEvents = 0;
N_Address* N_Initializer::m_pLocalAddress = nullptr;
Q_DLList<N_Socket*>* N_Initializer::m_pSockets = nullptr;
Q_DLList<N_Listener*>* N_Initializer::m_pListeners = nullptr;
Q_DLList<N_Address*>* N_Initializer::m_pAddresses = nullptr;
Q_DLList<N_Socket::ConnectData>* N_Initializer::m_pConnectQueue = nullptr;
Q_DLList<N_Socket::DataQueue>* N_Initializer::m_pInProcessQueue = nullptr;
Q_DLList<N_Socket::DataQueue>* N_Initializer::m_pOutProcessQueue = nullptr;
N_Socket::DataQueue* N_Initializer::m_pPumpFrom = nullptr;
unsigned int N_Initializer::m_uBytesWaitingForSend = 0;
std::uint64_t N_Initializer::m_uNetworkPasses = 0;
std::uint64_t N_Initializer::m_uEventsServed = 0;
bool N_Initializer::m_bReadsToResume = false;

N_Initializer::N_Initializer() : m_wsaData{} {
  if (m_uInstance++ != 0) return;
  start();
}

N_Initializer::~N_Initializer() {
  if (m_uInstance == 0) return;
  if (--m_uInstance != 0) return;
  stop();
}

N_Initializer& N_Initializer::operator=(const N_Initializer& other) {
  m_wsaData = other.m_wsaData;
  return *this;
}

// Nothing done here is undone when a step throws: the count stays raised and
// later instances are no-ops (see the header).
void N_Initializer::start() {
  m_pThread = nullptr;
  m_bThreadStartFailed = false;
  m_pActiveObject = this;

  m_pSockets = Q_New<Q_DLList<N_Socket*>>();
  m_pListeners = Q_New<Q_DLList<N_Listener*>>();
  m_pAddresses = Q_New<Q_DLList<N_Address*>>();
  m_pConnectQueue = Q_New<Q_DLList<N_Socket::ConnectData>>();
  m_pInProcessQueue = Q_New<Q_DLList<N_Socket::DataQueue>>();
  m_pOutProcessQueue = Q_New<Q_DLList<N_Socket::DataQueue>>();
  m_pPumpFrom = nullptr;
  m_uBytesWaitingForSend = 0;
  m_uNetworkPasses = 0;
  m_uEventsServed = 0;
  m_bReadsToResume = false;

  m_hMutex = platform::CreateMutexA(nullptr, platform::FALSE, kNetworkMutexName);

  int started = WSAStartup(kWinsockVersion, &m_wsaData);
  switch (started) {
    case platform::WSASYSNOTREADY:
      Q_Throw<N_NetException_Unavailable>();
    case platform::WSAVERNOTSUPPORTED:
      Q_Throw<N_NetException_NotSupported>();
    case platform::WSAEPROCLIM:
      Q_Throw<N_NetException_ProcessLimit>();
    default:
      break;
  }
  // 2.0 exactly: a newer Winsock answers a request for 2.0 with 2.0. After
  // any other failed start m_wsaData is still zero and fails this test too,
  // but there is nothing to clean up then.
  platform::BYTE major = static_cast<platform::BYTE>(m_wsaData.wVersion & 0xFF);
  platform::BYTE minor = static_cast<platform::BYTE>(m_wsaData.wVersion >> 8);
  if (major != 2 || minor != 0) {
    if (started == 0) platform::WSACleanup();
    Q_Throw<N_NetException_VersionFailure>();
  }

  // The first call only tells the size of the catalogue.
  platform::DWORD bytes = 0;
  m_iNumProtocols = platform::WSAEnumProtocolsA(nullptr, nullptr, &bytes);
  m_installedProtocols = reinterpret_cast<platform::WSAPROTOCOL_INFOA*>(Q_NewArray<char>(bytes));
  m_iNumProtocols = WSAEnumProtocolsA(nullptr, m_installedProtocols, &bytes);
  // Never trust a count beyond the buffer it describes.
  int fits = static_cast<int>(bytes / sizeof(platform::WSAPROTOCOL_INFOA));
  if (m_iNumProtocols > fits) m_iNumProtocols = fits;

  chooseProviders();
  if (m_tcpProtocol == nullptr) Q_Throw<N_NetException_NoTCP>();
  if (m_udpProtocol == nullptr) Q_Throw<N_NetException_NoUDP>();

  m_eventRelease = platform::WSACreateEvent();
  Runtime::released() = false;
  // Once for the thread's life, never per pass: at the larger sizes the set
  // is too big for the thread's stack. Winsock's 64 take no allocation, so
  // the default start counts exactly what it always did.
  m_uWaitEvents = g_waitEventsSet.load();
  m_pWaitEvents = m_uWaitEvents > platform::WSA_MAXIMUM_WAIT_EVENTS ? Q_NewArray<platform::WSAEVENT>(m_uWaitEvents)
                                                                    : g_defaultWaitSet;
  g_waitEventsInForce.store(m_uWaitEvents);

  // The thread writes THREAD_RUNNING once, without looking; waiting for that
  // write here means no stop can be overwritten by it.
  m_pThread = platform::AfxBeginThread(threadNetwork, this, 0, 0, 0, nullptr);
  if (m_pThread == nullptr) {
    m_bThreadStartFailed = true;
  } else {
    while (m_threadState.load() != THREAD_RUNNING) platform::Sleep(1);
  }

  makeLocalAddress();
}

// The first entry that has every required bit wins, for each kind on its
// own; the walk always covers the whole catalogue.
void N_Initializer::chooseProviders() {
  m_udpProtocol = nullptr;
  m_tcpProtocol = nullptr;
  for (int i = 0; i < m_iNumProtocols; ++i) {
    platform::WSAPROTOCOL_INFOA* entry = &m_installedProtocols[i];
    if (entry->iAddressFamily != platform::AF_INET) continue;
    if (m_tcpProtocol == nullptr && (entry->dwServiceFlags1 & kTcpFlags) == kTcpFlags) m_tcpProtocol = entry;
    if (m_udpProtocol == nullptr && (entry->dwServiceFlags1 & kUdpFlags) == kUdpFlags) m_udpProtocol = entry;
  }
}

// Waits, bounded, for the local host's identifier. A lookup that has ended
// without one won't bring it later, so the wait ends with it.
void N_Initializer::makeLocalAddress() {
  char name[1024] = {};
  platform::gethostname(name, static_cast<int>(sizeof name));
  m_pLocalAddress = Q_New<N_Address>(name);

  Q_Timer timer;
  while (m_pLocalAddress->getIdentifier() == 0 && m_pLocalAddress->lookupPending() &&
         timer.getAge() < kLocalAddressSeconds) {
    platform::Sleep(10);
  }
  if (m_pLocalAddress->getIdentifier() == 0) Q_Throw<N_NetException_IPNotResolved>();
}

void N_Initializer::stop() {
  // Frees the network thread if this thread still owns the mutex by a level.
  platform::ReleaseMutex(m_hMutex);

  if (!m_bThreadStartFailed) {
    m_threadState.store(THREAD_STOPPING);
    releaseThreadLoop();
    while (m_threadState.load() != THREAD_STOPPED) platform::Sleep(10);
    // The thread writes THREAD_STOPPED just before its last release of the
    // mutex; taking it once makes sure that release is done before anything
    // below closes the mutex.
    RuntimeLock once;
    platform::WSACloseCompletionQueue(Runtime::networkQueue());
    Runtime::networkQueue() = nullptr;
  }

  Q_DeleteArray(reinterpret_cast<char*>(m_installedProtocols));
  m_installedProtocols = nullptr;
  m_tcpProtocol = nullptr;
  m_udpProtocol = nullptr;

  // Its destructor takes it out of m_pAddresses.
  Q_Delete(m_pLocalAddress);
  m_pLocalAddress = nullptr;

  deleteRegistered(m_pSockets);
  deleteRegistered(m_pListeners);
  deleteRegistered(m_pAddresses);

  // Connections nobody claimed go with their records; their sockets are
  // closed by WSACleanup below.
  Q_Delete(m_pConnectQueue);
  m_pConnectQueue = nullptr;
  deleteQueue(m_pInProcessQueue);
  deleteQueue(m_pOutProcessQueue);
  m_pPumpFrom = nullptr;
  m_uBytesWaitingForSend = 0;

  if (m_pWaitEvents != g_defaultWaitSet) Q_DeleteArray(m_pWaitEvents);
  m_pWaitEvents = nullptr;
  g_waitEventsInForce.store(0);

  platform::WSACloseEvent(m_eventRelease);
  platform::CloseHandle(m_hMutex);
  m_hMutex = nullptr;
  platform::WSACleanup();
}

N_RuntimeStats N_Initializer::getStatistics() {
  N_RuntimeStats stats;
  // A runtime that isn't up (or whose start failed before its mutex) has
  // nothing to count.
  if (m_uInstance == 0 || m_hMutex == nullptr) return stats;
  RuntimeLock lock;
  if (m_pSockets != nullptr) stats.uOpenSockets = static_cast<unsigned>(m_pSockets->m_iCount);
  if (m_pListeners != nullptr) stats.uOpenListeners = static_cast<unsigned>(m_pListeners->m_iCount);
  stats.uBytesWaitingForSend = m_uBytesWaitingForSend;
  stats.uNetworkPasses = m_uNetworkPasses;
  stats.uEventsServed = m_uEventsServed;
  return stats;
}

void N_Initializer::releaseThreadLoop() { platform::WSASetEvent(m_eventRelease); }

void N_Initializer::setMaximumWaitEvents(unsigned uMaximumWaitEvents) {
  g_waitEventsSet.store(std::clamp<platform::DWORD>(uMaximumWaitEvents, platform::WSA_MAXIMUM_WAIT_EVENTS,
                                                    platform::LARGEST_WAIT_EVENTS));
}

unsigned N_Initializer::getMaximumWaitEvents() {
  const platform::DWORD inForce = g_waitEventsInForce.load();
  return inForce != 0 ? inForce : g_waitEventsSet.load();
}

int N_Initializer::acceptConnection(platform::WSABUF*, platform::WSABUF*, platform::_QualityOfService*,
                                    platform::_QualityOfService*, platform::WSABUF*, platform::WSABUF*, platform::UINT*,
                                    std::uintptr_t) {
  return platform::CF_ACCEPT;
}

unsigned int N_Initializer::threadNetwork(void*) {
  // A copy of the handle: the stop clears m_hMutex after this thread has
  // ended, and the last release comes after THREAD_STOPPED is written.
  MutexHold hold(m_hMutex);
  // Sends issued on other threads complete in this thread's waits.
  Runtime::networkQueue() = platform::WSAGetCompletionQueue();
  m_threadState.store(THREAD_RUNNING);

  platform::WSAEVENT* const events = m_pWaitEvents;
  int failedWaits = 0;
  while (m_threadState.load() == THREAD_RUNNING) {
    platform::DWORD count = 1;
    platform::DWORD timeout = platform::WSA_INFINITE;
    events[0] = m_eventRelease;
    try {
      count = buildWaitSet(timeout);
      resumeReads();
      pumpSends();
    } catch (...) {
      // Nothing may leave this thread; what failed is tried on the next pass.
      traceSwallowed("network pass");
    }
    hold.unlock();

    // Completion routines run inside this wait and take the mutex themselves.
    // Winsock's wait for any of the events, without its limit of 64: the
    // index comes apart from the result, so none can pass for another result.
    platform::DWORD index = 0;
    platform::DWORD result = platform::waitForAnyEvent(count, events, timeout, platform::TRUE, &index);
    if (m_threadState.load() != THREAD_RUNNING) break;

    // A wait that keeps failing (a broken release event, say) must not turn
    // into a busy loop; a single failure, from a handle closed just before
    // the wait, costs nothing.
    if (result == platform::WSA_WAIT_FAILED) {
      if (++failedWaits > 1) platform::Sleep(10);
    } else {
      failedWaits = 0;
    }

    hold.lock();
    if (result != platform::WSA_WAIT_EVENT_0) {
      // Failed, completions ran or a rest ended: nothing to serve; the next
      // pass builds the wait set anew.
    } else if (index == 0) {
      platform::WSAResetEvent(events[0]);
      Runtime::released() = false;
    } else if (index < count) {
      try {
        serveEvent(events[index]);
      } catch (...) {
        // An allocation that failed while serving costs that event only.
        traceSwallowed("network event");
      }
    }
  }

  m_threadState.store(THREAD_STOPPED);
  return 0;
}
