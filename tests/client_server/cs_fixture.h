// Shared pieces of the client and server tests: the runtime fixture with the
// client settings put back, white-box hooks for the heartbeat timers and the
// pacing gates, a scripted client end made of plain N_Sockets (for the exact
// bytes of the control channel; the server end is raw_peer.h), and client
// host processes (for the unreliable channel and for several clients at once).
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "ControlMessage.h"
#include "N_Client.h"
#include "N_Exceptions.h"
#include "N_Listener.h"
#include "N_Server.h"
#include "N_Socket.h"
#include "child_process.h"
#include "raw_peer.h"
#include "runtime_test.h"

// Timer ages for the heartbeat limits and the pacing gates, which the public
// interface doesn't show.
struct N_ClientTestAccess {
  static int state(const N_Client& c) { return c.m_heartbeatState; }
  static void setHeartbeatAge(N_Client& c, float age) { c.m_heartbeatTimer.setAge(age); }
  static void setIdleAge(N_Client& c, float age) { c.m_heartbeatIdleTimer.setAge(age); }
  static unsigned echoReplies(const N_Client& c) { return c.m_uEchoReplies; }
  static float worldTimeReply(const N_Client& c) { return c.m_fWorldTimeReply; }
  static float nextFlushTime(const N_Client& c) { return c.m_fNextFlushTime; }
  static float nextPollTime(const N_Client& c) { return c.m_fNextPollTime; }
  static float sendAge(const N_Client& c) { return c.m_sendTimer.getAge(); }
  static N_Socket* tcpSocket(const N_Client& c) { return c.m_pTcpSocket; }
};

struct N_ServerTestAccess {
  static int clientCount(N_Server& s) { return s.m_pClients != nullptr ? s.m_pClients->m_iCount : -1; }
  static int pendingControlCount(N_Server& s) {
    return s.m_pPendingControlSockets != nullptr ? s.m_pPendingControlSockets->m_iCount : -1;
  }
};

namespace cs_test {

using CM = ControlMessage;
using Access = N_ClientTestAccess;
using ServerAccess = N_ServerTestAccess;
using Bytes = std::vector<unsigned char>;

inline void sleepMs(int milliseconds) { std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds)); }
std::string hostOf(const N_Client* client);

// Heartbeats at 0.2 s / 0.2 s and the simulation off unless a test says
// otherwise; all of it is put back afterwards.
class ClientServerTest : public RuntimeTest {
 protected:
  void SetUp() override;
  void TearDown() override;
  static void heartbeat(float frequency, float latency) {
    N_Client::setHeartbeatFrequency(frequency);
    N_Client::setHeartbeatLatency(latency);
  }
};

using raw_peer::controlBytes;
using raw_peer::Received;
using raw_peer::RawPeer;

// The client end played by plain sockets on the test thread: a data
// connection to `port` (later, if asked) and a control connection to 6000.
class ScriptedClient {
 public:
  ScriptedClient(const N_Address* server, int port, bool openDataNow = true);
  void openData() { m_data.emplace(m_pServer, m_iPort, N_Socket::SOCKET_TCP); }
  bool connected() { return m_data && m_data->isConnected() && m_control && m_control->isConnected(); }
  bool closed() { return !m_data->isConnected() && !m_control->isConnected(); }
  void send(std::uint32_t type, std::uint32_t value = 0) { sendRaw(controlBytes(type, value)); }
  void sendRaw(const Bytes& bytes) {
    m_control->send(const_cast<unsigned char*>(bytes.data()), unsigned(bytes.size()));
  }
  std::optional<Received> next(int milliseconds, const Pump& pump);
  std::vector<Received> drain(int milliseconds, const Pump& pump);  // all that arrives within the time
  // The value of the last grant among what arrives within the time.
  std::optional<std::uint32_t> lastGrant(const Pump& pump, int milliseconds = 300);
  N_Socket* data() { return &*m_data; }
  N_Socket* control() { return &*m_control; }

 private:
  const N_Address* m_pServer;
  int m_iPort;
  std::optional<N_Socket> m_data, m_control;
};

// update() then pollConnect() until false, keeping the clients handed out.
// Copies (a Pump holds one) share the list.
class ServerPump {
 public:
  explicit ServerPump(N_Server& server) : m_pServer(&server), m_announced(std::make_shared<std::vector<N_Client*>>()) {}
  void operator()() const {
    m_pServer->update();
    for (N_Client* c = nullptr; m_pServer->pollConnect(c);) m_announced->push_back(c);
  }
  const std::vector<N_Client*>& announced() const { return *m_announced; }
  void forget(N_Client* client) const { std::erase(*m_announced, client); }

 private:
  N_Server* m_pServer;
  std::shared_ptr<std::vector<N_Client*>> m_announced;
};

// A scripted client that the server has paired and handed out.
N_Client* pairUp(const ServerPump& pump, ScriptedClient& client);

// One client host process (tests/hosts/client_peer.cpp) on 127.0.0.<n>,
// with the heartbeat settings of this process.
class PeerProcess {
 public:
  PeerProcess(int hostNumber, int port);
  const std::string& host() const { return m_host; }
  // Reads lines until one contains `text`, pumping meanwhile.
  std::optional<std::string> waitLine(const std::string& text, int milliseconds, const Pump& pump = {});
  bool command(const std::string& line) { return m_process.writeLine(line); }
  bool quit(int milliseconds, const Pump& pump = {});  // "quit", and the process ends with 0
  N_Client* admit(const ServerPump& pump);             // "connected" and the server's hand-out
  ChildProcess& process() { return m_process; }

 private:
  std::string m_host;
  ChildProcess m_process;
};

// Echoes every message, as many as a pass takes, for the probes of the
// client hosts; a peer that doesn't read loses its echoes.
void echo(N_Client& client);
// Sends "probe <command>" to the host and gives the numbers of its answer.
std::vector<double> probe(PeerProcess& peer, const std::string& command, const Pump& pump);

}  // namespace cs_test
