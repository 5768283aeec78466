// The parts of the network thread's pass that deal with sockets and
// listeners: the wait set and the service of one signalled event (the send
// pump is with the rest of the send queue, in send_queue.cpp). All of it
// runs on the network thread with m_hMutex held.
#include <cstdint>
#include <cstring>

#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "trace.h"
#include "win32.h"
#include "winsock.h"

platform::DWORD N_Initializer::buildWaitSet(platform::DWORD& timeout) {
  platform::WSAEVENT* const events = m_pWaitEvents;
  const N_Limits limits = getLimits();
  const bool listenersFirst = limits.bListenersFirst;
  platform::DWORD count = 0;
  timeout = platform::WSA_INFINITE;
  events[count++] = m_eventRelease;
  auto addListeners = [&] {
    for (N_Listener** slot = m_pListeners->getFirst(); slot != nullptr && count < m_uWaitEvents;
         slot = m_pListeners->getNext(slot)) {
      N_Listener* listener = *slot;
      if (listener == nullptr) continue;
      // Resting after a failed accept: the wait ends when the rest does.
      float rest = listener->m_fRestSeconds - listener->m_restTimer.getAge();
      if (rest > 0.0f) {
        platform::DWORD milliseconds = static_cast<platform::DWORD>(rest * 1000.0f) + 1;
        if (milliseconds < timeout) timeout = milliseconds;
        continue;
      }
      listener->m_fRestSeconds = 0.0f;
      // A full accept queue: taking or refusing an entry wakes the thread.
      if (limits.uMaximumAcceptQueue != 0 && queuedConnects(listener) >= limits.uMaximumAcceptQueue) continue;
      events[count++] = listener->m_event;
    }
  };
  // By default sockets come first: with 63 sockets or more (at the default
  // size of 64) no listener is waited on. The lists keep their order, so the
  // same objects stay out until others go.
  if (listenersFirst) addListeners();
  for (N_Socket** slot = m_pSockets->getFirst(); slot != nullptr && count < m_uWaitEvents;
       slot = m_pSockets->getNext(slot))
    if (*slot != nullptr) events[count++] = (*slot)->m_event;
  if (!listenersFirst) addListeners();
  return count;
}

unsigned N_Initializer::queuedConnects(const N_Listener* listener) {
  unsigned queued = 0;
  for (N_Socket::ConnectData* entry = m_pConnectQueue->getFirst(); entry != nullptr;
       entry = m_pConnectQueue->getNext(entry))
    if (entry->pListener == listener) ++queued;
  return queued;
}

void N_Initializer::resumeReads() {
  if (!m_bReadsToResume) return;
  m_bReadsToResume = false;
  for (N_Socket** slot = m_pSockets->getFirst(); slot != nullptr; slot = m_pSockets->getNext(slot)) {
    N_Socket* socket = *slot;
    if (socket == nullptr || !socket->m_bReadResume) continue;
    socket->m_bReadResume = false;
    socket->postRead();
  }
}

void N_Initializer::serveEvent(platform::WSAEVENT handle) {
  // Found by handle, not by slot: the lists may have changed in the wait.
  N_Socket* socket = nullptr;
  for (N_Socket** slot = m_pSockets->getFirst(); slot != nullptr; slot = m_pSockets->getNext(slot)) {
    if (*slot != nullptr && (*slot)->m_event == handle) {
      socket = *slot;
      break;
    }
  }
  N_Listener* listener = nullptr;
  for (N_Listener** slot = m_pListeners->getFirst(); slot != nullptr; slot = m_pListeners->getNext(slot)) {
    if (*slot != nullptr && (*slot)->m_event == handle) {
      listener = *slot;
      break;
    }
  }
  if (socket != nullptr || listener != nullptr) ++m_uEventsServed;

  if (socket != nullptr) {
    // Zeroed first: a failed enumeration must not serve an old record again.
    platform::WSANETWORKEVENTS events;
    std::memset(&events, 0, sizeof events);
    N_Socket::chkErr(platform::WSAEnumNetworkEvents(socket->m_socket, socket->m_event, &events));
    long what = events.lNetworkEvents;
    if ((what & platform::FD_CONNECT) && events.iErrorCode[platform::FD_CONNECT_BIT] == 0 && !socket->m_bConnected) {
      socket->m_bConnected = true;
      bool keep = true;
      try {
        keep = socket->receiveConnect();
      } catch (...) {
        traceSwallowed("receiveConnect");
      }
      if (keep) socket->m_bEventPending = true;
    }
    if (what & platform::FD_READ) {
      // A socket whose unpolled messages passed the bound stops reading, so
      // that the peer's TCP waits; poll() lets it go on.
      unsigned backlog = getLimits().uReceiveBacklog;
      if (backlog != 0 && socket->receiveBacklogCost() >= backlog)
        socket->m_bReadPaused = true;
      else
        socket->postRead();
    }
    if (what & platform::FD_WRITE) socket->m_bWritable = true;
    if (what & platform::FD_CLOSE) {
      try {
        socket->disconnect();
      } catch (...) {
        traceSwallowed("disconnect at FD_CLOSE");
      }
    }
  }

  if (listener != nullptr) {
    platform::WSANETWORKEVENTS events;
    std::memset(&events, 0, sizeof events);
    N_Socket::chkErr(platform::WSAEnumNetworkEvents(listener->m_socket, listener->m_event, &events));
    if (!(events.lNetworkEvents & platform::FD_ACCEPT)) return;
    platform::WSASetLastError(0);
    N_Socket::ConnectData* entry = nullptr;
    try {
      entry = m_pConnectQueue->append();
    } catch (Q_MemoryException*) {
      // No room to keep the connection: accept it and close it, so that it
      // is refused rather than left waiting.
      platform::sockaddr_in address;
      int length = sizeof address;
      platform::SOCKET refused =
          WSAAccept(listener->m_socket, reinterpret_cast<platform::sockaddr*>(&address), &length, nullptr, 0);
      if (refused != platform::INVALID_SOCKET) platform::closesocket(refused);
      return;
    }
    entry->pListener = listener;
    std::memset(&entry->address, 0, sizeof entry->address);
    int length = sizeof entry->address;
    entry->socket = N_Socket::chkErr(platform::WSAAccept(
        listener->m_socket, reinterpret_cast<platform::sockaddr*>(&entry->address), &length, nullptr, 0));
    int error = platform::WSAGetLastError();
    if (error == platform::WSAECONNREFUSED) {
      m_pConnectQueue->remove(entry);
      return;
    }
    if (entry->socket == platform::INVALID_SOCKET && (error == platform::WSAEMFILE || error == platform::WSAENOBUFS)) {
      // The connection stays in the system's backlog; retrying at once would
      // spin on it until a descriptor is free.
      listener->m_fRestSeconds = getLimits().fAcceptBackoff;
      listener->m_restTimer.reset();
    }
    try {
      listener->receiveConnect(entry);
    } catch (...) {
      traceSwallowed("N_Listener::receiveConnect");
    }
  }
}
