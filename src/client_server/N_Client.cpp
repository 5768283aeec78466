// N_Client: the object and its channels, update with the heartbeat, and the
// world timer.
#include "N_Client.h"

#include "ControlMessage.h"
#include "N_Address.h"
#include "Q_New.h"
#include "RuntimeLock.h"

std::atomic<float> N_Client::sm_fHeartbeatFrequency{4.0f};
std::atomic<float> N_Client::sm_fHeartbeatLatency{2.0f};

namespace {

// The world-time synchronisation: three exchanges of at most a second each;
// half the mean round trip stands for the reply's way back.
constexpr int kWorldTimeExchanges = 3;
constexpr float kWorldTimeTimeout = 1.0f;
constexpr double kReturnShare = 0.5;

}  // namespace

N_Client::N_Client() { initializeMembers(); }

N_Client::N_Client(N_Socket::ConnectData* pConnectData, int iPort) {
  initializeMembers();
  construct(pConnectData, iPort);
}

N_Client::N_Client(const N_Address* pAddress, int iPort) {
  initializeMembers();
  construct(pAddress, iPort);
}

N_Client::~N_Client() { destruct(); }

void N_Client::initializeMembers() {
  m_bNewConnection = false;
  m_pControlSocket = nullptr;
  m_uRequestedBandwidth = 0;
  m_uBandwidth = 0;
  m_fLatency = 0.0f;
  m_heartbeatState = HEARTBEAT_IDLE;
  m_heartbeatTimer.reset();
  m_heartbeatIdleTimer.reset();
  m_bConstructed = false;
  m_bFirstUpdate = false;
  m_uEchoReplies = 0;
  m_bWorldTimeReceived = false;
  m_fWorldTimeReply = 0.0f;
  m_worldTimer.reset();
  m_sendTimer.reset();
  m_fNextFlushTime = 0.0f;
  m_fNextPollTime = 0.0f;
  m_pTcpSocket = nullptr;
  m_pUdpSocket = nullptr;
  m_pReliableQueue = nullptr;
  m_pUnreliableQueue = nullptr;
  m_uReliableBytes = 0;
  m_uUnreliableBytes = 0;
  m_pairingTimer.reset();
  m_bGrantAsked = false;
  m_pSimulation = nullptr;
  m_reliableQueueStats = N_QueueStats{};
  m_unreliableQueueStats = N_QueueStats{};
  m_uSimulatedLost = 0;
  m_uSimulatedDelayed = 0;
  m_bGateHeldBack = false;
  m_uHeartbeats = 0;
  for (float& latency : m_afLatencyWindow) latency = 0.0f;
  m_uWorldTimeExchanges = 0;
  m_fWorldClockOffset = 0.0f;
}

void N_Client::construct(const N_Address* pAddress, int iPort) {
  destruct();
  try {
    m_bConstructed = true;
    m_uRequestedBandwidth = DEFAULT_BANDWIDTH;
    m_uBandwidth = DEFAULT_BANDWIDTH;
    m_bFirstUpdate = true;
    // The client end opens the heartbeat exchange.
    m_heartbeatState = HEARTBEAT_SEND;
    m_heartbeatTimer.reset();
    m_heartbeatIdleTimer.reset();
    m_worldTimer.reset();
    m_sendTimer.reset();
    m_pTcpSocket = Q_New<N_Socket>(pAddress, iPort, N_Socket::SOCKET_TCP);
    m_pUdpSocket = Q_New<N_Socket>(pAddress, iPort + 1, N_Socket::SOCKET_UDP);
    m_pReliableQueue = Q_New<Q_DLList<DataQueue>>();
    m_pUnreliableQueue = Q_New<Q_DLList<DataQueue>>();
  } catch (...) {
    destruct();
    throw;
  }
}

void N_Client::construct(N_Socket::ConnectData* pConnectData, int iPort) {
  destruct();
  try {
    m_bConstructed = true;
    m_uRequestedBandwidth = DEFAULT_BANDWIDTH;
    m_uBandwidth = DEFAULT_BANDWIDTH;
    // The server end waits for the client's heartbeat first.
    m_heartbeatState = HEARTBEAT_AWAIT_PEER;
    m_pairingTimer.reset();
    m_heartbeatTimer.reset();
    m_heartbeatIdleTimer.reset();
    m_worldTimer.reset();
    m_sendTimer.reset();
    m_pTcpSocket = Q_New<N_Socket>(pConnectData);
    // The peer's unreliable end sits on P + 1 of its own host; the TCP
    // socket owns the peer's address, this one borrows it.
    m_pUdpSocket = Q_New<N_Socket>(m_pTcpSocket->getAddress(), iPort + 1, N_Socket::SOCKET_UDP);
    m_pReliableQueue = Q_New<Q_DLList<DataQueue>>();
    m_pUnreliableQueue = Q_New<Q_DLList<DataQueue>>();
  } catch (...) {
    destruct();
    throw;
  }
}

void N_Client::destruct() {
  if (!m_bConstructed) return;
  Q_Delete(m_pControlSocket);
  // The UDP socket borrows the address that the TCP socket owns on the
  // server end; neither reads it while going down.
  Q_Delete(m_pTcpSocket);
  Q_Delete(m_pUdpSocket);
  for (Q_DLList<DataQueue>* queue : {m_pReliableQueue, m_pUnreliableQueue}) {
    if (queue == nullptr) continue;
    for (DataQueue* entry = queue->getFirst(); entry != nullptr; entry = queue->getNext(entry))
      Q_DeleteArray(entry->pData);
    Q_Delete(queue);
  }
  deleteSimulation();
  initializeMembers();
}

bool N_Client::isConstructed() const { return m_bConstructed; }

bool N_Client::isConnected() const {
  return m_pTcpSocket != nullptr && m_pTcpSocket->isConnected() && m_pControlSocket != nullptr &&
         m_pControlSocket->isConnected();
}

void N_Client::disconnect() {
  if (m_pTcpSocket != nullptr) m_pTcpSocket->disconnect();
  if (m_pUdpSocket != nullptr) m_pUdpSocket->disconnect();
  if (m_pControlSocket != nullptr) m_pControlSocket->disconnect();
}

const N_Address* N_Client::getAddress() const { return m_pTcpSocket != nullptr ? m_pTcpSocket->getAddress() : nullptr; }

int N_Client::getPort() const { return m_pTcpSocket != nullptr ? m_pTcpSocket->getPort() : 0; }

void N_Client::setBandwidth(unsigned uBandwidth) {
  m_uBandwidth = uBandwidth;
  if (m_pControlSocket != nullptr && m_pControlSocket->isConnected())
    sendControl(m_pControlSocket, ControlMessage::CONTROL_BANDWIDTH_REQUEST, uBandwidth);
}

unsigned N_Client::getBandwidth() const { return m_uBandwidth; }

unsigned N_Client::getLargestUnreliablePacketSize() const {
  if (m_pUdpSocket == nullptr) return 0;
  int size = m_pUdpSocket->getMaximumSendPacketSize();
  return size > 0 ? static_cast<unsigned>(size) : 0;
}

void N_Client::sendControl(N_Socket* socket, std::uint32_t type, std::uint32_t value) {
  ControlMessage message{type, value};
  unsigned char bytes[8];
  message.encode(bytes);
  socket->send(bytes, ControlMessage::sizeOf(type));
}

// ---------------------------------------------------------------------------
// update and the heartbeat

void N_Client::update() {
  if (!m_bConstructed) return;
  if (m_pControlSocket == nullptr && m_pTcpSocket->isConnected())
    m_pControlSocket = Q_New<N_Socket>(m_pTcpSocket->getAddress(), ControlMessage::CONTROL_PORT, N_Socket::SOCKET_TCP);
  if (m_pControlSocket == nullptr || !m_pControlSocket->isConnected()) return;

  if (m_bFirstUpdate) {
    // Cleared first: the synchronisation below runs update() again.
    m_bFirstUpdate = false;
    m_heartbeatTimer.reset();
    m_heartbeatIdleTimer.reset();
    // A bandwidth set before the channel was up reaches the server now.
    setBandwidth(getBandwidth());
    // A failed synchronisation leaves the connection up; the application
    // may try again.
    updateWorldTimer();
  }
  stepHeartbeat();
  readControl();
}

bool N_Client::heartbeatOn() {
  // A NaN setting fails the comparison, so it switches the machine off too.
  return sm_fHeartbeatFrequency.load(std::memory_order_relaxed) > 0.0f &&
         sm_fHeartbeatLatency.load(std::memory_order_relaxed) > 0.0f;
}

void N_Client::stepHeartbeat() {
  if (!heartbeatOn()) return;
  const float frequency = sm_fHeartbeatFrequency.load(std::memory_order_relaxed);
  const float latency = sm_fHeartbeatLatency.load(std::memory_order_relaxed);
  switch (m_heartbeatState) {
    case HEARTBEAT_SEND:
      sendControl(m_pControlSocket, ControlMessage::CONTROL_HEARTBEAT);
      m_heartbeatState = HEARTBEAT_AWAIT_REPLY;
      m_heartbeatTimer.reset();
      break;
    case HEARTBEAT_AWAIT_REPLY:
      if (m_heartbeatTimer.getAge() > latency) disconnect();
      break;
    case HEARTBEAT_AWAIT_PEER:
      // The peer rests for its frequency, then its heartbeat may take the
      // latency; the sum is kept in double so it isn't rounded down.
      if (static_cast<double>(m_heartbeatTimer.getAge()) > static_cast<double>(latency) + static_cast<double>(frequency))
        disconnect();
      break;
    case HEARTBEAT_IDLE:
      // The heartbeat itself leaves at the next step.
      if (m_heartbeatIdleTimer.getAge() > frequency) m_heartbeatState = HEARTBEAT_SEND;
      break;
    default:
      break;
  }
}

void N_Client::receiveHeartbeat() {
  m_heartbeatIdleTimer.reset();
  m_heartbeatState = HEARTBEAT_IDLE;
  sendControl(m_pControlSocket, ControlMessage::CONTROL_HEARTBEAT_REPLY);
}

void N_Client::receiveHeartbeatReply() {
  m_fLatency = m_heartbeatTimer.getAge();
  m_afLatencyWindow[m_uHeartbeats++ % N_ClientStats::LATENCY_WINDOW] = m_fLatency;
  m_heartbeatState = HEARTBEAT_AWAIT_PEER;
  m_heartbeatTimer.reset();
}

void N_Client::readControl() {
  void* data = nullptr;
  unsigned size = 0;
  while (m_pControlSocket->poll(data, size)) {
    ControlMessage message;
    if (!message.decode(data, size)) continue;
    switch (message.uType) {
      case ControlMessage::CONTROL_BANDWIDTH_GRANT:
        m_uBandwidth = message.uValue;
        break;
      case ControlMessage::CONTROL_HEARTBEAT:
        receiveHeartbeat();
        break;
      case ControlMessage::CONTROL_HEARTBEAT_REPLY:
        receiveHeartbeatReply();
        break;
      case ControlMessage::CONTROL_ECHO_REPLY:
        ++m_uEchoReplies;
        break;
      case ControlMessage::CONTROL_WORLD_TIME:
        // Taken as the reply to whichever request waits: requests carry no
        // number.
        m_bWorldTimeReceived = true;
        m_fWorldTimeReply = message.floatValue();
        break;
      default:
        // Requests, echoes and unknown types are not for this end.
        break;
    }
  }
}

void N_Client::setHeartbeatFrequency(float fFrequency) {
  sm_fHeartbeatFrequency.store(fFrequency, std::memory_order_relaxed);
}

float N_Client::getHeartbeatFrequency() { return sm_fHeartbeatFrequency.load(std::memory_order_relaxed); }

void N_Client::setHeartbeatLatency(float fLatency) { sm_fHeartbeatLatency.store(fLatency, std::memory_order_relaxed); }

float N_Client::getHeartbeatLatency() { return sm_fHeartbeatLatency.load(std::memory_order_relaxed); }

float N_Client::getLatency() const { return m_fLatency; }

// ---------------------------------------------------------------------------
// world timer

bool N_Client::updateWorldTimer() {
  if (m_pControlSocket == nullptr) return false;
  float total = 0.0f;
  Q_Timer roundTrip;
  for (int k = 0; k < kWorldTimeExchanges; ++k) {
    sendControl(m_pControlSocket, ControlMessage::CONTROL_WORLD_TIME_REQUEST);
    m_bWorldTimeReceived = false;
    roundTrip.reset();
    // No sleep: the reply is read by update(), which also keeps the
    // heartbeat going meanwhile.
    while (roundTrip.getAge() < kWorldTimeTimeout && !m_bWorldTimeReceived) update();
    if (!m_bWorldTimeReceived) return false;
    total += roundTrip.getAge();
    // The mean of all round trips so far, halved, on top of the server's
    // age when it answered; one rounding to float at the end.
    const double estimate =
        (static_cast<double>(total) / (k + 1.0)) * kReturnShare + static_cast<double>(m_fWorldTimeReply);
    m_fWorldTimeReply = static_cast<float>(estimate);
    m_fWorldClockOffset = m_fWorldTimeReply - m_worldTimer.getAge();
    m_worldTimer.setAge(m_fWorldTimeReply);
    ++m_uWorldTimeExchanges;
  }
  return true;
}

const Q_Timer& N_Client::getWorldTimer() const { return m_worldTimer; }

// ---------------------------------------------------------------------------
// statistics

N_ClientStats N_Client::getStatistics() const {
  N_ClientStats stats;
  if (!m_bConstructed) return stats;
  // One lock around the whole copy: the channel counts change on the network
  // thread, under this mutex, and the copy's counts belong together.
  RuntimeLock lock;
  if (m_pTcpSocket != nullptr) stats.reliable = m_pTcpSocket->getStatistics();
  if (m_pUdpSocket != nullptr) stats.unreliable = m_pUdpSocket->getStatistics();
  if (m_pControlSocket != nullptr) stats.control = m_pControlSocket->getStatistics();
  stats.reliableQueue = m_reliableQueueStats;
  stats.reliableQueue.uBytesWaiting = m_uReliableBytes;
  stats.unreliableQueue = m_unreliableQueueStats;
  stats.unreliableQueue.uBytesWaiting = m_uUnreliableBytes;
  stats.uSimulatedLost = m_uSimulatedLost;
  stats.uSimulatedDelayed = m_uSimulatedDelayed;
  stats.model = getSimulationStats();
  stats.uHeartbeats = m_uHeartbeats;
  stats.fLatency = m_fLatency;
  const unsigned window = m_uHeartbeats < N_ClientStats::LATENCY_WINDOW ? static_cast<unsigned>(m_uHeartbeats)
                                                                         : N_ClientStats::LATENCY_WINDOW;
  if (window > 0) {
    double sum = 0.0;
    stats.fLatencyLowest = m_afLatencyWindow[0];
    stats.fLatencyHighest = m_afLatencyWindow[0];
    for (unsigned i = 0; i < window; ++i) {
      const float latency = m_afLatencyWindow[i];
      if (latency < stats.fLatencyLowest) stats.fLatencyLowest = latency;
      if (latency > stats.fLatencyHighest) stats.fLatencyHighest = latency;
      sum += static_cast<double>(latency);
    }
    stats.fLatencyMean = static_cast<float>(sum / window);
  }
  stats.uWorldTimeExchanges = m_uWorldTimeExchanges;
  stats.fWorldClockOffset = m_fWorldClockOffset;
  stats.uBandwidth = m_uBandwidth;
  return stats;
}
