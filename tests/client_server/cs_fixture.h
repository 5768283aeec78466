// Shared pieces of the client and server tests: a runtime on 127.0.0.1 whose
// allocations must balance at its stop, white-box hooks into N_Client and
// N_Server, a scripted server end and a scripted client end made of plain
// N_Sockets (for the exact bytes of the control channel), and client host
// processes (for the unreliable channel and for several clients at once).
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "ControlMessage.h"
#include "N_Address.h"
#include "N_Client.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Server.h"
#include "N_Socket.h"
#include "allocation_balance.h"
#include "child_process.h"

// White-box hooks: timer ages for the heartbeat limits, and the fields that
// the public interface doesn't show.
struct N_ClientTestAccess {
  struct Entry {
    unsigned key;
    unsigned priority;
    std::string payload;
  };
  static int state(const N_Client& c) { return c.m_heartbeatState; }
  static void setHeartbeatAge(N_Client& c, float age) { c.m_heartbeatTimer.setAge(age); }
  static void setIdleAge(N_Client& c, float age) { c.m_heartbeatIdleTimer.setAge(age); }
  static unsigned echoReplies(const N_Client& c) { return c.m_uEchoReplies; }
  static bool worldTimeReceived(const N_Client& c) { return c.m_bWorldTimeReceived; }
  static float worldTimeReply(const N_Client& c) { return c.m_fWorldTimeReply; }
  static unsigned requestedBandwidth(const N_Client& c) { return c.m_uRequestedBandwidth; }
  static unsigned reliableBytes(const N_Client& c) { return c.m_uReliableBytes; }
  static unsigned unreliableBytes(const N_Client& c) { return c.m_uUnreliableBytes; }
  static float nextFlushTime(const N_Client& c) { return c.m_fNextFlushTime; }
  static float nextPollTime(const N_Client& c) { return c.m_fNextPollTime; }
  static float sendAge(const N_Client& c) { return c.m_sendTimer.getAge(); }
  static N_Socket* controlSocket(const N_Client& c) { return c.m_pControlSocket; }
  static N_Socket* tcpSocket(const N_Client& c) { return c.m_pTcpSocket; }
  static std::vector<Entry> reliableEntries(const N_Client& c) { return entries(c.m_pReliableQueue); }
  static std::vector<Entry> unreliableEntries(const N_Client& c) { return entries(c.m_pUnreliableQueue); }

 private:
  static std::vector<Entry> entries(Q_DLList<N_Client::DataQueue>* queue) {
    std::vector<Entry> out;
    for (N_Client::DataQueue* e = queue->getFirst(); e != nullptr; e = queue->getNext(e))
      out.push_back({e->uKey, e->uPriority, std::string(e->pData, e->uSize)});
    return out;
  }
};

struct N_ServerTestAccess {
  // The grants that a division of `budget` with cap `maximum` gives clients
  // that asked for `requests`, in order.
  static std::vector<unsigned> grants(unsigned budget, unsigned maximum, const std::vector<unsigned>& requests) {
    unsigned total = 0;
    for (unsigned r : requests) total += N_Server::shareOf(r, maximum);
    N_Server::BandwidthDivision division = N_Server::divide(budget, total);
    std::vector<unsigned> out;
    for (unsigned r : requests) out.push_back(N_Server::grantOf(division, N_Server::shareOf(r, maximum)));
    return out;
  }
  static int clientCount(N_Server& s) { return s.m_pClients != nullptr ? s.m_pClients->m_iCount : -1; }
  static int pendingControlCount(N_Server& s) {
    return s.m_pPendingControlSockets != nullptr ? s.m_pPendingControlSockets->m_iCount : -1;
  }
  static std::vector<N_Client*> clients(N_Server& s) {
    std::vector<N_Client*> out;
    for (N_Client** e = s.m_pClients->getFirst(); e != nullptr; e = s.m_pClients->getNext(e)) out.push_back(*e);
    return out;
  }
};

namespace cs_test {

using Clock = std::chrono::steady_clock;
using Pump = std::function<void()>;

// Polls `done` (calling `pump` before each look) until it is true or the time
// is up.
bool waitFor(const std::function<bool()>& done, int milliseconds, const Pump& pump = {});
// Keeps calling `pump` for the whole time.
void pumpFor(int milliseconds, const Pump& pump);
void sleepMs(int milliseconds);
double secondsSince(Clock::time_point start);

// A control message as raw bytes, with `size` cut short when asked.
std::vector<unsigned char> controlBytes(std::uint32_t type, std::uint32_t value = 0, int size = -1);

// A runtime on 127.0.0.1 for each test. Heartbeats run at 0.2 s / 0.2 s and
// the simulation (the gate and the network model) is off unless a test says
// otherwise; all of it is put back afterwards. Every library allocation made
// during the test must have been given back once the runtime has stopped.
// Objects of the library must be gone before the test body ends (locals of
// the body are).
class ClientServerTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  const N_Address* loopback() const { return m_loopback.get(); }
  int port() const { return m_iPort; }
  // An allocation that a fault refused is counted without a release; the
  // balance at the end allows for those.
  void countRefusedAllocations(int n) { m_iRefused += n; }

 private:
  int m_iRefused = 0;
  std::unique_ptr<AllocationBalance> m_balance;
  std::unique_ptr<N_Initializer> m_runtime;
  std::unique_ptr<N_Address> m_loopback;
  int m_iPort = 0;
};

// One received control message, as the scripted ends record it.
struct Received {
  unsigned size;
  std::uint32_t type;
  std::uint32_t value;
  double at;  // seconds since the scripted end started
};

// The server end played by plain sockets on a thread of its own: it accepts
// the data connection on `port` and the control connection on 6000, records
// every control message and every data message, and answers heartbeats and
// world-time requests by its policy. The test thread meanwhile drives the
// N_Client under test, whose first update blocks in the world-time exchange.
class ScriptedServer {
 public:
  explicit ScriptedServer(int port);
  ~ScriptedServer();

  // Policy, changeable at any time.
  std::atomic<bool> answerHeartbeats{true};
  std::atomic<int> worldTimeAnswers{-1};  // how many more to answer; -1: all
  std::atomic<float> worldTimeValue{100.0f};

  std::vector<Received> control();
  std::vector<std::string> data();
  bool controlConnected();
  bool dataConnected();
  // Sends on the control channel (false if it isn't there yet).
  bool sendControl(const std::vector<unsigned char>& bytes);
  bool sendData(const std::string& bytes);
  // Waits until `count` control messages were received.
  bool waitControl(std::size_t count, int milliseconds, const Pump& pump);
  bool waitData(std::size_t count, int milliseconds, const Pump& pump);
  // Drops both connections (and stops answering).
  void hangUp();

 private:
  void run();

  N_Listener m_dataListener;
  N_Listener m_controlListener;
  std::mutex m_lock;
  N_Socket* m_pData = nullptr;
  N_Socket* m_pControl = nullptr;
  std::vector<Received> m_control;
  std::vector<std::string> m_dataMessages;
  Clock::time_point m_start;
  std::atomic<bool> m_bStop{false};
  std::thread m_thread;
};

// The client end played by plain sockets on the test thread: a data
// connection to `port` and a control connection to 6000, opened at once in
// that order unless told otherwise.
class ScriptedClient {
 public:
  ScriptedClient(const N_Address* server, int port, bool openDataNow = true, bool openControlNow = true);
  ~ScriptedClient();
  void openData();
  void openControl();
  bool connected();
  void send(std::uint32_t type, std::uint32_t value = 0);
  void sendRaw(const std::vector<unsigned char>& bytes);
  // The next control message within the time, calling `pump` while waiting.
  std::optional<Received> next(int milliseconds, const Pump& pump);
  // Every control message that arrives within the time.
  std::vector<Received> drain(int milliseconds, const Pump& pump);
  N_Socket* data() { return m_pData; }
  N_Socket* control() { return m_pControl; }

 private:
  const N_Address* m_pServer;
  int m_iPort;
  N_Socket* m_pData = nullptr;
  N_Socket* m_pControl = nullptr;
  Clock::time_point m_start;
};

// update() then pollConnect() until false, keeping the clients handed out.
// Copies (a Pump holds one) share the list.
class ServerPump {
 public:
  explicit ServerPump(N_Server& server)
      : m_pServer(&server), m_announced(std::make_shared<std::vector<N_Client*>>()) {}
  void operator()() const {
    m_pServer->update();
    N_Client* c = nullptr;
    while (m_pServer->pollConnect(c)) m_announced->push_back(c);
  }
  const std::vector<N_Client*>& announced() const { return *m_announced; }
  // Drops a client that the test had the server free.
  void forget(N_Client* client) const { std::erase(*m_announced, client); }

 private:
  N_Server* m_pServer;
  std::shared_ptr<std::vector<N_Client*>> m_announced;
};

// One client host process (tests/hosts/client_peer.cpp) on 127.0.0.<n>.
class PeerProcess {
 public:
  PeerProcess(int hostNumber, int port, std::vector<std::string> extra = {});
  ~PeerProcess();
  const std::string& host() const { return m_host; }
  bool started() const { return m_process.started(); }
  // Reads lines until one contains `text`, pumping meanwhile.
  std::optional<std::string> waitLine(std::string_view text, int milliseconds, const Pump& pump = {});
  // All lines read so far that start with `prefix`.
  std::vector<std::string> linesStartingWith(std::string_view prefix) const;
  bool command(std::string_view line) { return m_process.writeLine(line); }
  // Sends "quit" and waits for the process to end with 0.
  bool quit(int milliseconds, const Pump& pump = {});
  ChildProcess& process() { return m_process; }

 private:
  std::string m_host;
  ChildProcess m_process;
};

// The number after "<word> " in a line such as "bandwidth 35714".
double valueOf(const std::string& line);

}  // namespace cs_test
