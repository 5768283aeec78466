// N_Server: accepting, pairing, and the control work of every client.
#include "N_Server.h"

#include "ControlMessage.h"
#include "N_Address.h"
#include "N_Initializer.h"
#include "Q_Mutex.h"
#include "Q_New.h"
#include "RuntimeLock.h"
#include "trace.h"

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
  m_bSolvePending = false;
  m_bSolveCollected = false;
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
    m_pPendingControlSockets = Q_New<Q_DLList<PendingControl>>();
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
    for (PendingControl* entry = m_pPendingControlSockets->getFirst(); entry != nullptr;
         entry = m_pPendingControlSockets->getNext(entry)) {
      Q_Delete(entry->pSocket);
      entry->pSocket = nullptr;
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
  const N_Limits limits = N_Initializer::getLimits();
  acceptData(limits);
  acceptControl(limits);
  if (limits.fPairingTimeout > 0.0f) dropUnpaired(limits.fPairingTimeout);
  pair();
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
    N_Client* client = *entry;
    if (sendBacklogExceeded(client, limits)) client->disconnect();
    serveControl(client, limits);
  }
  if (m_bSolvePending || m_bSolveCollected) {
    const bool changedOnly = !m_bSolvePending;
    // Cleared first: a division that throws is due again at the next update.
    m_bSolveCollected = false;
    m_bSolvePending = true;
    solveBandwidth(changedOnly);
    m_bSolvePending = false;
  }
}

void N_Server::acceptData(const N_Limits& limits) {
  // Data connections become clients at once; they stay invisible to the
  // application until their control channel is paired.
  N_Socket::ConnectData* data = nullptr;
  while (N_Listener::pollConnect(data)) {
    // An accept that failed (no descriptor left) carries no connection.
    if (data->socket == platform::INVALID_SOCKET ||
        !admitUnpaired(limits, data->address.sin_addr.s_addr, false)) {
      N_Listener::rejectConnect(data);
      continue;
    }
    const platform::SOCKET socket = data->socket;
    try {
      N_Client** slot = m_pClients->append();
      try {
        *slot = allocateClient(data);
      } catch (...) {
        m_pClients->remove(slot);
        throw;
      }
    } catch (...) {
      if (!limits.bContainFailures) throw;
      rejectUnlessTaken(data, socket);
    }
  }
}

void N_Server::acceptControl(const N_Limits& limits) {
  N_Socket::ConnectData* data = nullptr;
  while (m_pControlListener->pollConnect(data)) {
    if (data->socket == platform::INVALID_SOCKET ||
        !admitUnpaired(limits, data->address.sin_addr.s_addr, true)) {
      m_pControlListener->rejectConnect(data);
      continue;
    }
    try {
      PendingControl* slot = m_pPendingControlSockets->append();
      slot->age.reset();
      try {
        slot->pSocket = Q_New<N_Socket>(data);
      } catch (...) {
        m_pPendingControlSockets->remove(slot);
        throw;
      }
    } catch (...) {
      if (!limits.bContainFailures) throw;
      // A socket that failed to come up leaves its entry queued.
      m_pControlListener->rejectConnect(data);
    }
  }
}

void N_Server::rejectUnlessTaken(N_Socket::ConnectData* data, platform::SOCKET socket) {
  // A client that took the entry over and then failed has freed it, and a
  // newer entry may stand at its address now; that one holds another handle,
  // since a handle comes back only after 2^24 reuses of its slot.
  RuntimeLock hold;
  Q_DLList<N_Socket::ConnectData>* queue = Runtime::connects();
  for (N_Socket::ConnectData* entry = queue != nullptr ? queue->getFirst() : nullptr; entry != nullptr;
       entry = queue->getNext(entry)) {
    if (entry == data && entry->socket == socket) {
      N_Listener::rejectConnect(data);
      return;
    }
  }
}

bool N_Server::admitUnpaired(const N_Limits& limits, unsigned identifier, bool control) {
  if (limits.uMaximumUnpaired == 0 && limits.uMaximumUnpairedPerAddress == 0) return true;
  unsigned all = 0;
  unsigned same = 0;
  // Waiting connections of the same address that the new one pairs with at
  // once, so that it takes no place.
  unsigned partners = 0;
  // The oldest waiting connection of another address, which makes room when
  // all places are taken: whoever fills them can't keep a newcomer out, who
  // pairs within a round trip.
  N_Client** oldestClient = nullptr;
  PendingControl* oldestControl = nullptr;
  double oldestAge = -1.0;
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
    N_Client* client = *entry;
    if (client->isPaired()) continue;
    ++all;
    if (client->getAddress()->getIdentifier() == identifier) {
      ++same;
      if (control) ++partners;
    } else if (client->getUnpairedAge() > oldestAge) {
      oldestAge = client->getUnpairedAge();
      oldestClient = entry;
      oldestControl = nullptr;
    }
  }
  for (PendingControl* entry = m_pPendingControlSockets->getFirst(); entry != nullptr;
       entry = m_pPendingControlSockets->getNext(entry)) {
    ++all;
    if (entry->pSocket->getAddress()->getIdentifier() == identifier) {
      ++same;
      if (!control) ++partners;
    } else if (entry->age.getAge() > oldestAge) {
      oldestAge = entry->age.getAge();
      oldestControl = entry;
      oldestClient = nullptr;
    }
  }
  if (partners > 0) return true;
  if (limits.uMaximumUnpairedPerAddress != 0 && same >= limits.uMaximumUnpairedPerAddress) return false;
  if (limits.uMaximumUnpaired == 0 || all < limits.uMaximumUnpaired) return true;
  if (oldestClient != nullptr) {
    freeClient(*oldestClient);
    m_pClients->remove(oldestClient);
    return true;
  }
  if (oldestControl != nullptr) {
    Q_Delete(oldestControl->pSocket);
    m_pPendingControlSockets->remove(oldestControl);
    return true;
  }
  return false;
}

void N_Server::dropUnpaired(float timeout) {
  // Never handed out, so the application can't remove them itself.
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr;) {
    N_Client** next = m_pClients->getNext(entry);
    N_Client* client = *entry;
    if (!client->isPaired() && (client->getUnpairedAge() > timeout || !client->isDataConnected())) {
      freeClient(client);
      m_pClients->remove(entry);
    }
    entry = next;
  }
  for (PendingControl* entry = m_pPendingControlSockets->getFirst(); entry != nullptr;) {
    PendingControl* next = m_pPendingControlSockets->getNext(entry);
    if (entry->age.getAge() > timeout || !entry->pSocket->isConnected()) {
      Q_Delete(entry->pSocket);
      m_pPendingControlSockets->remove(entry);
    }
    entry = next;
  }
}

void N_Server::pair() {
  // A control connection belongs to the oldest client of the same IPv4
  // address that has none yet; either may arrive first, and an unmatched
  // one waits for a later update.
  for (PendingControl* pending = m_pPendingControlSockets->getFirst(); pending != nullptr;) {
    PendingControl* nextPending = m_pPendingControlSockets->getNext(pending);
    const unsigned identifier = pending->pSocket->getAddress()->getIdentifier();
    for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
      N_Client* client = *entry;
      if (client->isPaired() || client->getAddress()->getIdentifier() != identifier) continue;
      client->pair(pending->pSocket);
      m_pPendingControlSockets->remove(pending);
      break;
    }
    pending = nextPending;
  }
}

bool N_Server::sendBacklogExceeded(N_Client* client, const N_Limits& limits) {
  if (limits.fSendBacklogSeconds <= 0.0f || !client->isConnected()) return false;
  double bound = static_cast<double>(limits.fSendBacklogSeconds) * client->getBandwidth();
  if (bound < limits.uMinimumSendBacklog) bound = limits.uMinimumSendBacklog;
  return client->getLargestSendBacklog() > bound;
}

void N_Server::serveControl(N_Client* client, const N_Limits& limits) {
  N_Socket* control = client->getControlSocket();
  if (control == nullptr || !control->isConnected()) return;
  client->stepHeartbeat();
  void* data = nullptr;
  unsigned size = 0;
  // Tested before every read: a channel lost midway ends the reading there.
  // What the budget leaves waits for the next update.
  for (unsigned served = 0; (limits.uControlBudget == 0 || served < limits.uControlBudget) &&
                            control->isConnected() && control->poll(data, size);
       ++served) {
    ControlMessage message;
    if (!message.decode(data, size)) continue;
    switch (message.uType) {
      case ControlMessage::CONTROL_BANDWIDTH_REQUEST:
        client->recordBandwidthRequest(message.uValue, limits.bCoalesceBandwidth);
        if (limits.bCoalesceBandwidth) {
          m_bSolveCollected = true;
        } else {
          solveBandwidth();
        }
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
    if ((*entry)->takeNewConnection()) {
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
      try {
        freeClient(client);
      } catch (...) {
        // A derived freeClient that fails loses its object, not the list.
        traceSwallowed("freeClient");
      }
      *entry = nullptr;
      m_pClients->remove(entry);
    }
    entry = next;
  }
  // The others get the freed part back in this same call, or, if a grant
  // can't be sent now, at the next update.
  try {
    solveBandwidth();
  } catch (...) {
    m_bSolvePending = true;
  }
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
