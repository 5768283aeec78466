#include "N_Listener.h"

#include <cstring>

#include "N_Initializer.h"
#include "Runtime.h"
#include "RuntimeLock.h"
#include "socket_options.h"
#include "win32.h"
#include "winsock.h"

N_Listener::N_Listener(int port) {
  initializeMembers();
  construct(port);
}

N_Listener::~N_Listener() { destruct(); }

void N_Listener::initializeMembers() {
  m_bConstructed = false;
  m_iPort = 0;
  m_socket = 0;
  m_event = nullptr;
  std::memset(&m_requestedAddress, 0, sizeof m_requestedAddress);
  std::memset(&m_localAddress, 0, sizeof m_localAddress);
  m_pRegistryEntry = nullptr;
  m_restTimer.reset();
  m_fRestSeconds = 0.0f;
}

bool N_Listener::isConstructed() const { return m_bConstructed; }

void N_Listener::construct(int port) {
  if (m_bConstructed) destruct();
  RuntimeLock lock;
  Runtime::wake();
  m_iPort = port;
  m_event = platform::WSACreateEvent();
  platform::WSAPROTOCOL_INFOA* provider = Runtime::provider(true);
  m_requestedAddress.sin_family =
      static_cast<std::uint16_t>(provider != nullptr ? provider->iAddressFamily : platform::AF_INET);
  m_requestedAddress.sin_port = platform::htons(static_cast<std::uint16_t>(port));
  m_requestedAddress.sin_addr.s_addr = platform::INADDR_ANY;
  m_localAddress = m_requestedAddress;
  m_socket =
      N_Socket::chkErr(platform::WSASocketA(platform::FROM_PROTOCOL_INFO, platform::FROM_PROTOCOL_INFO,
                                            platform::FROM_PROTOCOL_INFO, provider, 0, platform::WSA_FLAG_OVERLAPPED));
  setBufferOptions(m_socket, true);
  // Selected before bind and listen; the network thread only waits on the
  // event once the registry below has it.
  N_Socket::chkErr(platform::WSAEventSelect(m_socket, m_event, platform::FD_ACCEPT));
  N_Socket::chkErr(
      platform::bind(m_socket, reinterpret_cast<const platform::sockaddr*>(&m_localAddress), sizeof m_localAddress));
  const unsigned backlog = N_Initializer::getLimits().uListenBacklog;
  N_Socket::chkErr(platform::listen(m_socket, backlog != 0 ? static_cast<int>(backlog) : platform::SOMAXCONN));
  int length = sizeof m_localAddress;
  N_Socket::chkErr(platform::getsockname(m_socket, reinterpret_cast<platform::sockaddr*>(&m_localAddress), &length));
  try {
    m_pRegistryEntry = Runtime::enroll(Runtime::listeners(), this);
  } catch (...) {
    // Nothing of the attempt stays: the object is left unconstructed.
    N_Socket::chkErr(platform::closesocket(m_socket));
    platform::WSACloseEvent(m_event);
    initializeMembers();
    throw;
  }
  Runtime::wake();
  m_bConstructed = true;
}

void N_Listener::destruct() {
  if (!m_bConstructed) return;
  RuntimeLock lock;
  Runtime::wake();
  N_Socket::chkErr(platform::closesocket(m_socket));
  platform::WSACloseEvent(m_event);
  Runtime::withdraw(Runtime::listeners(), m_pRegistryEntry);
  initializeMembers();
}

int N_Listener::getPort() { return m_iPort; }

bool N_Listener::pollConnect(N_Socket::ConnectData*& out) {
  RuntimeLock lock;
  Q_DLList<N_Socket::ConnectData>* queue = Runtime::connects();
  if (queue == nullptr) return false;
  for (N_Socket::ConnectData* entry = queue->getFirst(); entry != nullptr; entry = queue->getNext(entry)) {
    if (entry->pListener == this) {
      out = entry;
      return true;
    }
  }
  return false;
}

bool N_Listener::rejectConnect(N_Socket::ConnectData* data) {
  RuntimeLock lock;
  Q_DLList<N_Socket::ConnectData>* queue = Runtime::connects();
  for (N_Socket::ConnectData* entry = queue != nullptr ? queue->getFirst() : nullptr; entry != nullptr;
       entry = queue->getNext(entry)) {
    if (entry != data || entry->pListener != this) continue;
    if (entry->socket != platform::INVALID_SOCKET && entry->socket != 0)
      N_Socket::chkErr(platform::closesocket(entry->socket));
    queue->remove(entry);
    // The listener may have stopped accepting at a full queue.
    Runtime::wake();
    return true;
  }
  return false;
}

void N_Listener::receiveConnect(N_Socket::ConnectData*) {}
