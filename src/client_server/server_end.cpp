// The server end of a client: what N_Server does to one of its clients when
// it pairs it, hands it out, takes its bandwidth request and grants it a
// share.
#include "ControlMessage.h"
#include "N_Client.h"
#include "N_Limits.h"
#include "N_Socket.h"

bool N_Client::isDataConnected() const { return m_pTcpSocket != nullptr && m_pTcpSocket->isConnected(); }

void N_Client::pair(N_Socket* pControlSocket) {
  m_pControlSocket = pControlSocket;
  m_bNewConnection = true;
  m_heartbeatTimer.reset();
  m_heartbeatIdleTimer.reset();
}

bool N_Client::takeNewConnection() {
  if (!m_bNewConnection) return false;
  m_bNewConnection = false;
  return true;
}

void N_Client::recordBandwidthRequest(unsigned uRequested, bool bCollected) {
  m_uRequestedBandwidth = uRequested;
  // Collected requests are answered at the next division even when the
  // share stays the same.
  if (bCollected) m_bGrantAsked = true;
}

void N_Client::grantBandwidth(unsigned uGrant, bool bChangedOnly) {
  // By default sent whether it changed or not; a client without a live
  // control channel keeps the value and hears nothing.
  const bool tell = !bChangedOnly || uGrant != m_uBandwidth || m_bGrantAsked;
  m_bGrantAsked = false;
  m_uBandwidth = uGrant;
  if (tell && m_pControlSocket != nullptr && m_pControlSocket->isConnected())
    sendControl(m_pControlSocket, ControlMessage::CONTROL_BANDWIDTH_GRANT, uGrant);
}

double N_Client::getLargestSendBacklog() const {
  double largest = 0.0;
  for (N_Socket* socket : {m_pTcpSocket, m_pUdpSocket, m_pControlSocket}) {
    if (socket == nullptr) continue;
    const double cost = socket->getQueuedSendBytes() + double{N_Limits::kMessageCharge} * socket->getQueuedSendMessages();
    if (cost > largest) largest = cost;
  }
  return largest;
}
