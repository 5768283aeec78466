// N_Server: accepting, pairing, and the control work of every client.
#include "N_Server.h"

#include "ControlMessage.h"
#include "N_Address.h"
#include "Q_Mutex.h"
#include "Q_New.h"

N_Server::N_Server(int port) : N_Listener(port) {
  initializeMembers();
  m_worldTimer.reset();
  constructionCode();
}

N_Server::~N_Server() {
  destruct();
  // The data port is closed while this is still an N_Server: once the
  // destructor of the base begins, the object's type changes under the
  // network thread, which may be calling receiveConnect on it.
  N_Listener::destruct();
}

void N_Server::initializeMembers() {
  m_bServerConstructed = false;
  m_pMutex = nullptr;
  m_pControlListener = nullptr;
  m_uBandwidth = 0;
  m_uMaximumBandwidthUsage = 0;
  m_pClients = nullptr;
  m_pPendingControlSockets = nullptr;
}

void N_Server::construct(int port) {
  destruct();
  N_Listener::construct(port);
  constructionCode();
}

void N_Server::constructionCode() {
  try {
    m_bServerConstructed = true;
    m_uBandwidth = N_Client::DEFAULT_BANDWIDTH;
    m_uMaximumBandwidthUsage = 10240;
    m_worldTimer.reset();
    m_pMutex = Q_New<Q_Mutex>();
    m_pClients = Q_New<Q_DLList<N_Client*>>();
    m_pPendingControlSockets = Q_New<Q_DLList<N_Socket*>>();
    m_pControlListener = Q_New<N_Listener>(ControlMessage::CONTROL_PORT);
  } catch (...) {
    destruct();
    throw;
  }
}

void N_Server::destruct() {
  if (!m_bServerConstructed) return;
  if (m_pClients != nullptr) {
    for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
      freeClient(*entry);
      *entry = nullptr;
    }
    Q_Delete(m_pClients);
    m_pClients = nullptr;
  }
  if (m_pPendingControlSockets != nullptr) {
    for (N_Socket** entry = m_pPendingControlSockets->getFirst(); entry != nullptr;
         entry = m_pPendingControlSockets->getNext(entry)) {
      Q_Delete(*entry);
      *entry = nullptr;
    }
    Q_Delete(m_pPendingControlSockets);
    m_pPendingControlSockets = nullptr;
  }
  Q_Delete(m_pMutex);
  Q_Delete(m_pControlListener);
  initializeMembers();
  m_worldTimer.reset();
}

bool N_Server::isConstructed() const { return m_bServerConstructed; }

N_Client* N_Server::allocateClient(N_Socket::ConnectData* pConnectData) {
  // The client's UDP socket goes to the peer's P + 1, P being our port.
  return Q_New<N_Client>(pConnectData, getPort());
}

void N_Server::freeClient(N_Client* pClient) { Q_Delete(pClient); }

void N_Server::update() {
  if (!m_bServerConstructed) return;
  Q_MutexLock lock(m_pMutex);

  // Data connections become clients at once; they stay invisible to the
  // application until their control channel is paired.
  N_Socket::ConnectData* data = nullptr;
  while (N_Listener::pollConnect(data)) {
    N_Client** slot = m_pClients->append();
    try {
      *slot = allocateClient(data);
    } catch (...) {
      m_pClients->remove(slot);
      throw;
    }
  }

  while (m_pControlListener->pollConnect(data)) {
    N_Socket** slot = m_pPendingControlSockets->append();
    try {
      *slot = Q_New<N_Socket>(data);
    } catch (...) {
      m_pPendingControlSockets->remove(slot);
      throw;
    }
  }

  // A control connection belongs to the oldest client of the same IPv4
  // address that has none yet; either may arrive first, and an unmatched
  // one waits for a later update.
  for (N_Socket** pending = m_pPendingControlSockets->getFirst(); pending != nullptr;) {
    N_Socket** nextPending = m_pPendingControlSockets->getNext(pending);
    const unsigned identifier = (*pending)->getAddress()->getIdentifier();
    for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
      N_Client* client = *entry;
      if (client->m_pControlSocket != nullptr || client->getAddress()->getIdentifier() != identifier) continue;
      client->m_pControlSocket = *pending;
      client->m_bNewConnection = true;
      client->m_heartbeatTimer.reset();
      client->m_heartbeatIdleTimer.reset();
      m_pPendingControlSockets->remove(pending);
      break;
    }
    pending = nextPending;
  }

  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry))
    serveControl(*entry);
}

void N_Server::serveControl(N_Client* client) {
  N_Socket* control = client->m_pControlSocket;
  if (control == nullptr || !control->isConnected()) return;
  client->stepHeartbeat();
  void* data = nullptr;
  unsigned size = 0;
  // Tested before every read: a channel lost midway ends the reading there.
  while (control->isConnected() && control->poll(data, size)) {
    ControlMessage message;
    if (!message.decode(data, size)) continue;
    switch (message.uType) {
      case ControlMessage::CONTROL_BANDWIDTH_REQUEST:
        client->m_uRequestedBandwidth = message.uValue;
        solveBandwidth();
        break;
      case ControlMessage::CONTROL_HEARTBEAT:
        client->receiveHeartbeat();
        break;
      case ControlMessage::CONTROL_HEARTBEAT_REPLY:
        client->receiveHeartbeatReply();
        break;
      case ControlMessage::CONTROL_ECHO:
        N_Client::sendControl(control, ControlMessage::CONTROL_ECHO_REPLY);
        break;
      case ControlMessage::CONTROL_WORLD_TIME_REQUEST:
        N_Client::sendControl(control, ControlMessage::CONTROL_WORLD_TIME,
                              ControlMessage::floatBits(m_worldTimer.getAge()));
        break;
      default:
        // Grants, echo replies, world times and unknown types are not for
        // this end.
        break;
    }
  }
}

bool N_Server::pollConnect(N_Client*& out) {
  if (!m_bServerConstructed) return false;
  Q_MutexLock lock(m_pMutex);
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
    if ((*entry)->m_bNewConnection) {
      (*entry)->m_bNewConnection = false;
      out = *entry;
      return true;
    }
  }
  return false;
}

void N_Server::disconnectClient(N_Client* client) {
  if (!m_bServerConstructed) return;
  Q_MutexLock lock(m_pMutex);
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr;) {
    N_Client** next = m_pClients->getNext(entry);
    if (*entry == client) {
      freeClient(client);
      *entry = nullptr;
      m_pClients->remove(entry);
    }
    entry = next;
  }
  // The others get the freed part back in this same call.
  solveBandwidth();
}

void N_Server::setBandwidth(unsigned uBandwidth) {
  m_uBandwidth = uBandwidth;
  solveBandwidth();
}

unsigned N_Server::getBandwidth() const { return m_uBandwidth; }

void N_Server::setMaximumBandwidthUsage(unsigned uMaximumBandwidthUsage) {
  m_uMaximumBandwidthUsage = uMaximumBandwidthUsage;
  solveBandwidth();
}

unsigned N_Server::getMaximumBandwidthUsage() const { return m_uMaximumBandwidthUsage; }

const Q_Timer& N_Server::getWorldTimer() const { return m_worldTimer; }
