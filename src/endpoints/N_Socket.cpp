// N_Socket: the object, its life, the events and the queries. The send path
// is in socket_send.cpp, the receive path in socket_receive.cpp.
#include "N_Socket.h"

#include <cfloat>
#include <cstring>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "Q_New.h"
#include "Q_Throw.h"
#include "Runtime.h"
#include "RuntimeLock.h"
#include "socket_options.h"
#include "win32.h"
#include "winsock.h"

namespace {

// FD_READ | FD_WRITE | FD_CONNECT | FD_CLOSE
constexpr long kSocketEvents = 51;

}  // namespace

N_Socket::N_Socket() : m_remoteAddress{}, m_localAddress{} { initializeMembers(); }

N_Socket::N_Socket(ConnectData* data) : m_remoteAddress{}, m_localAddress{} {
  initializeMembers();
  construct(data);
}

N_Socket::N_Socket(const N_Address* address, int port, SocketType type) : m_remoteAddress{}, m_localAddress{} {
  initializeMembers();
  construct(address, port, type);
}

N_Socket::~N_Socket() { destruct(); }

bool N_Socket::isConstructed() const { return m_bConstructed; }

void N_Socket::initializeMembers() {
  m_bConstructed = false;
  m_pReceiveQueue = nullptr;
  m_pAddress = nullptr;
  m_iPort = 0;
  m_socketType = SOCKET_TCP;
  m_socket = 0;
  m_event = nullptr;
  m_pRegistryEntry = nullptr;
  m_iMaximumSendPacketSize = kSocketBufferSize;
  m_bConnected = false;
  m_bEventPending = false;
  m_bOwnsAddress = false;
  m_bWritable = false;
  m_bWriteCompletionPending = false;
  m_bPackage = false;
  m_iPacketBytesMissing = 0;
  m_iPacketBytesHave = 0;
  m_pPacketBuffer = nullptr;
  m_bStreamBroken = false;
  m_pDelivering = nullptr;
  m_uPumpHeldPass = 0;
  m_iPacketCapacity = 0;
  m_uQueuedSendBytes = 0;
  m_uQueuedSendMessages = 0;
  m_uQueuedReceiveBytes = 0;
  m_uQueuedReceiveMessages = 0;
  m_uBytesSent = 0;
  m_uMessagesSent = 0;
  m_uBytesReceived = 0;
  m_uMessagesReceived = 0;
  m_bReadPaused = false;
  m_bReadResume = false;
}

void N_Socket::baseConstructor() {
  initializeMembers();
  m_pReceiveQueue = Q_New<Q_DLList<DataQueue>>();
  m_bConstructed = true;
  m_bPackage = true;
  std::memset(&m_remoteAddress, 0, sizeof m_remoteAddress);
  std::memset(&m_localAddress, 0, sizeof m_localAddress);
  m_event = platform::WSACreateEvent();
}

void N_Socket::construct(ConnectData* data) {
  destruct();
  RuntimeLock lock;
  try {
    baseConstructor();
    m_remoteAddress = data->address;
    m_bConnected = true;
    m_socket = data->socket;
    setBufferOptions(m_socket, false);
    int limit = 0;
    int length = sizeof limit;
    if (platform::getsockopt(m_socket, platform::SOL_SOCKET, platform::SO_SNDBUF, reinterpret_cast<char*>(&limit),
                             &length) == 0)
      m_iMaximumSendPacketSize = limit;
    m_pAddress = Q_New<N_Address>(inet_ntoa(m_remoteAddress.sin_addr));
    m_bOwnsAddress = true;
    m_iPort = platform::ntohs(m_remoteAddress.sin_port);
    m_socketType = SOCKET_TCP;
    chkErr(platform::WSAEventSelect(m_socket, m_event, kSocketEvents));
    length = sizeof m_localAddress;
    chkErr(platform::getsockname(m_socket, reinterpret_cast<platform::sockaddr*>(&m_localAddress), &length));
    // Register before the entry goes, so that a failed registration leaves
    // the entry queued (its socket closed by the clean-up below).
    m_pRegistryEntry = Runtime::enroll(Runtime::sockets(), this);
    Runtime::connects()->remove(data);
  } catch (...) {
    lock.unlock();
    destruct();
    throw;
  }
}

void N_Socket::construct(const N_Address* address, int port, SocketType type) {
  destruct();
  RuntimeLock lock;
  Runtime::wake();
  try {
    baseConstructor();
    m_pAddress = address;
    m_iPort = port;
    m_socketType = type;
    platform::WSAPROTOCOL_INFOA* provider = Runtime::provider(true);
    if (type == SOCKET_UDP) {
      provider = Runtime::provider(false);
      m_bConnected = true;
      m_bPackage = false;
    }
    std::uint16_t family =
        static_cast<std::uint16_t>(provider != nullptr ? provider->iAddressFamily : platform::AF_INET);
    m_remoteAddress.sin_family = family;
    m_remoteAddress.sin_port = platform::htons(static_cast<std::uint16_t>(port));
    unsigned int identifier = address != nullptr ? address->getIdentifier() : 0;
    if (identifier == 0) Q_Throw<N_NetException_IPNotResolved>();
    m_remoteAddress.sin_addr.s_addr = identifier;
    m_localAddress.sin_family = family;
    m_localAddress.sin_port = type == SOCKET_UDP ? platform::htons(static_cast<std::uint16_t>(port)) : 0;
    const N_Address* local = N_Address::getLocalAddress();
    m_localAddress.sin_addr.s_addr = local != nullptr ? local->getIdentifier() : 0;
    m_socket = chkErr(platform::WSASocketA(platform::FROM_PROTOCOL_INFO, platform::FROM_PROTOCOL_INFO,
                                           platform::FROM_PROTOCOL_INFO, provider, 0, platform::WSA_FLAG_OVERLAPPED));
    chkErr(platform::WSAEventSelect(m_socket, m_event, kSocketEvents));
    setBufferOptions(m_socket, true);
    int limit = 0;
    int length = sizeof limit;
    if (platform::getsockopt(m_socket, platform::SOL_SOCKET,
                             type == SOCKET_UDP ? platform::SO_MAX_MSG_SIZE : platform::SO_SNDBUF,
                             reinterpret_cast<char*>(&limit), &length) == 0)
      m_iMaximumSendPacketSize = limit;
    if (platform::bind(m_socket, reinterpret_cast<const platform::sockaddr*>(&m_localAddress), sizeof m_localAddress) ==
            platform::SOCKET_ERROR &&
        platform::WSAGetLastError() == platform::WSAEADDRINUSE)
      Q_Throw<N_NetException_LocalAddressAlreadyInUse>();
    if (platform::WSAConnect(m_socket, reinterpret_cast<const platform::sockaddr*>(&m_remoteAddress),
                             sizeof m_remoteAddress, nullptr, nullptr, nullptr, nullptr) == platform::SOCKET_ERROR &&
        platform::WSAGetLastError() == platform::WSAEADDRINUSE)
      Q_Throw<N_NetException_LocalAddressAlreadyInUse>();
    length = sizeof m_localAddress;
    chkErr(platform::getsockname(m_socket, reinterpret_cast<platform::sockaddr*>(&m_localAddress), &length));
    m_pRegistryEntry = Runtime::enroll(Runtime::sockets(), this);
  } catch (...) {
    lock.unlock();
    destruct();
    throw;
  }
}

void N_Socket::destruct() {
  if (!m_bConstructed) return;
  RuntimeLock lock;
  Runtime::wake();
  awaitDelivery();
  chkErr(platform::WSAEventSelect(m_socket, m_event, 0));
  platform::WSACloseEvent(m_event);
  if (m_socket != 0) chkErr(platform::closesocket(m_socket));
  Runtime::orphan(this);
  if (m_pReceiveQueue != nullptr) {
    for (DataQueue* entry = m_pReceiveQueue->getFirst(); entry != nullptr; entry = m_pReceiveQueue->getNext(entry))
      Q_DeleteArray(entry->pBuffer);
    Q_Delete(m_pReceiveQueue);
    m_pReceiveQueue = nullptr;
  }
  Q_DeleteArray(m_pPacketBuffer);
  m_pPacketBuffer = nullptr;
  if (m_bOwnsAddress && m_pAddress != nullptr) Q_Delete(const_cast<N_Address*>(m_pAddress));
  m_pAddress = nullptr;
  if (m_pRegistryEntry != nullptr) Runtime::withdraw(Runtime::sockets(), m_pRegistryEntry);
  initializeMembers();
}

void N_Socket::disconnect() {
  // One event, whichever of the application and FD_CLOSE comes first.
  if (!m_bConnected.exchange(false)) return;
  platform::WSASendDisconnect(m_socket, nullptr);
  bool keep = true;
  try {
    keep = receiveDisconnect();
  } catch (...) {
    m_bEventPending = true;
    throw;
  }
  if (keep) m_bEventPending = true;
}

bool N_Socket::poll(void*& data, unsigned int& size) {
  RuntimeLock lock;
  bool found = false;
  if (m_pReceiveQueue != nullptr) {
    DataQueue* entry = m_pReceiveQueue->getFirst();
    while (entry != nullptr) {
      DataQueue* next = m_pReceiveQueue->getNext(entry);
      if (!entry->bConsumed) {
        data = entry->wsaBuf.buf;
        size = entry->wsaBuf.len;
        entry->bConsumed = true;
        m_uQueuedReceiveBytes -= entry->wsaBuf.len;
        --m_uQueuedReceiveMessages;
        found = true;
        break;
      }
      // A message whose receive() call still runs stays until it returns.
      if (entry != m_pDelivering) {
        Q_DeleteArray(entry->pBuffer);
        m_pReceiveQueue->remove(entry);
      }
      entry = next;
    }
  }
  if (m_bReadPaused && receiveBacklogCost() < N_Initializer::getLimits().uReceiveBacklog) {
    m_bReadPaused = false;
    m_bReadResume = true;
    Runtime::resumeReads();
  }
  return found;
}

const N_Address* N_Socket::getAddress() { return m_pAddress; }

N_Socket::SocketType N_Socket::getSocketType() { return m_socketType; }

int N_Socket::getPort() { return m_iPort; }

int N_Socket::getMaximumSendPacketSize() const { return m_iMaximumSendPacketSize; }

bool N_Socket::isConnected() { return m_bConnected; }

void N_Socket::enablePackage() { m_bPackage = true; }

void N_Socket::disablePackage() { m_bPackage = false; }

int N_Socket::getReceivePacketSize() const {
  int missing = m_iPacketBytesMissing;
  return missing > 0 ? m_iPacketBytesHave + missing : 0;
}

int N_Socket::getReceivePacketBytesMissing() const {
  int missing = m_iPacketBytesMissing;
  return missing > 0 ? missing : 0;
}

int N_Socket::getBytesWaitingForSend() const {
  RuntimeLock lock;
  return static_cast<int>(Runtime::bytesWaitingForSend());
}

unsigned int N_Socket::getQueuedSendBytes() const {
  RuntimeLock lock;
  return m_uQueuedSendBytes;
}

unsigned int N_Socket::getQueuedSendMessages() const {
  RuntimeLock lock;
  return m_uQueuedSendMessages;
}

unsigned int N_Socket::getQueuedReceiveMessages() const {
  RuntimeLock lock;
  return m_uQueuedReceiveMessages;
}

N_SocketStats N_Socket::getStatistics() const {
  N_SocketStats stats;
  RuntimeLock lock;
  stats.uBytesSent = m_uBytesSent;
  stats.uMessagesSent = m_uMessagesSent;
  stats.uBytesReceived = m_uBytesReceived;
  stats.uMessagesReceived = m_uMessagesReceived;
  stats.uBytesWaitingForSend = m_uQueuedSendBytes;
  stats.uBytesWaitingToPoll = m_uQueuedReceiveBytes;
  return stats;
}

std::uint64_t N_Socket::receiveBacklogCost() const {
  return m_uQueuedReceiveBytes + std::uint64_t{m_uQueuedReceiveMessages} * N_Limits::kMessageCharge;
}

unsigned int N_Socket::getQueuedReceiveBytes() const {
  RuntimeLock lock;
  return m_uQueuedReceiveBytes;
}

N_Socket** N_Socket::getFirstSocket() {
  return Runtime::sockets() != nullptr ? Runtime::sockets()->getFirst() : nullptr;
}

N_Socket** N_Socket::getNextSocket(N_Socket** socket) {
  return Runtime::sockets() != nullptr ? Runtime::sockets()->getNext(socket) : nullptr;
}

bool N_Socket::pollEvent(const N_Socket*& socket, bool connected) {
  if (Runtime::sockets() == nullptr) return false;
  RuntimeLock lock;
  Q_DLList<N_Socket*>* sockets = Runtime::sockets();
  for (N_Socket** slot = sockets->getFirst(); slot != nullptr; slot = sockets->getNext(slot)) {
    N_Socket* candidate = *slot;
    if (candidate == nullptr || !candidate->m_bEventPending || candidate->m_bConnected != connected) continue;
    candidate->m_bEventPending = false;
    socket = candidate;
    return true;
  }
  return false;
}

bool N_Socket::pollConnect(const N_Socket*& socket) { return pollEvent(socket, true); }

bool N_Socket::pollDisconnect(const N_Socket*& socket) { return pollEvent(socket, false); }

bool N_Socket::networkPresent() { return Runtime::present(); }

float N_Socket::ping(N_Address*) { return FLT_MAX; }

bool N_Socket::receiveConnect() { return true; }

bool N_Socket::receiveDisconnect() { return true; }

bool N_Socket::receive(void*, unsigned int) { return true; }

int N_Socket::chkErr(int result) { return result; }

platform::SOCKET N_Socket::chkErr(platform::SOCKET result) { return result; }

const char* N_Socket::getWSErrorName(int code) {
  const char* name = platform::wsaErrorName(code);
  return name != nullptr ? name : "Undetermined error";
}
