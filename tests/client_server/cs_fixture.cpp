#include "cs_fixture.h"

#include <iterator>
#include <sstream>

namespace cs_test {

std::string hostOf(const N_Client* client) {
  const volatile char* number = client->getAddress()->getStringNumber();
  return number != nullptr ? const_cast<const char*>(number) : "";
}

void ClientServerTest::SetUp() {
  RuntimeTest::SetUp();
  heartbeat(0.2f, 0.2f);
}

void ClientServerTest::TearDown() {
  heartbeat(4.0f, 2.0f);
  N_Client::simulateLatency(0, 0);
  N_Client::simulatePacketLoss(0.0f);
  N_Client::simulateNetwork(N_NetworkModel{});
  RuntimeTest::TearDown();
}

ScriptedClient::ScriptedClient(const N_Address* server, int port, bool openDataNow)
    : m_pServer(server), m_iPort(port) {
  if (openDataNow) openData();
  m_control.emplace(m_pServer, CM::CONTROL_PORT, N_Socket::SOCKET_TCP);
}

std::optional<Received> ScriptedClient::next(int milliseconds, const Pump& pump) {
  void* message = nullptr;
  unsigned size = 0;
  if (!waitFor([&] { return m_control->poll(message, size); }, milliseconds, pump)) return std::nullopt;
  return raw_peer::parse(message, size);
}

std::vector<Received> ScriptedClient::drain(int milliseconds, const Pump& pump) {
  std::vector<Received> out;
  for (const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds); Clock::now() < deadline;)
    if (auto r = next(1, pump)) out.push_back(*r);
  return out;
}

std::optional<std::uint32_t> ScriptedClient::lastGrant(const Pump& pump, int milliseconds) {
  std::optional<std::uint32_t> grant;
  for (const Received& r : drain(milliseconds, pump))
    if (r.type == CM::CONTROL_BANDWIDTH_GRANT && r.size == 8) grant = r.value;
  return grant;
}

N_Client* pairUp(const ServerPump& pump, ScriptedClient& client) {
  const std::size_t before = pump.announced().size();
  if (waitFor([&] { return pump.announced().size() > before && client.connected(); }, 5000, pump))
    return pump.announced().back();
  ADD_FAILURE() << "not paired: announced " << pump.announced().size() << " (before " << before << ")";
  return nullptr;
}

PeerProcess::PeerProcess(int hostNumber, int port)
    : m_host("127.0.0." + std::to_string(hostNumber)),
      m_process(VARDEL_HOST_CLIENT_PEER, {"--host", m_host, "--server", "127.0.0.1", "--port", std::to_string(port),
                                          "--hb-frequency", std::to_string(N_Client::getHeartbeatFrequency()),
                                          "--hb-latency", std::to_string(N_Client::getHeartbeatLatency())}) {}

std::optional<std::string> PeerProcess::waitLine(const std::string& text, int milliseconds, const Pump& pump) {
  for (const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds); Clock::now() < deadline;) {
    if (pump) pump();
    std::optional<std::string> line = m_process.readLine(1);
    if (line && line->find(text) != std::string::npos) return line;
  }
  return std::nullopt;
}

bool PeerProcess::quit(int milliseconds, const Pump& pump) {
  std::optional<int> code;
  return command("quit") && waitLine("bye", milliseconds, pump) &&
         waitFor([&] { return (code = m_process.wait(0)).has_value(); }, milliseconds, pump) && *code == 0;
}

N_Client* PeerProcess::admit(const ServerPump& pump) {
  N_Client* found = nullptr;
  auto handedOut = [&] {
    for (N_Client* c : pump.announced())
      if (hostOf(c) == m_host) found = c;
    return found != nullptr;
  };
  if (waitLine("connected", 20000, pump) && waitFor(handedOut, 5000, pump)) return found;
  std::string said;
  for (const std::string& line : m_process.lines()) said += "\n  " + line;
  ADD_FAILURE() << m_host << " did not connect; it said:" << said;
  return nullptr;
}

void echo(N_Client& client) try {
  void* message = nullptr;
  unsigned size = 0;
  for (int i = 0; i < 256 && client.poll(message, size); ++i) try {
      client.queueReliable(message, size, 0, 0);
    } catch (N_NetException_PacketsStackingUp*) {
      // The probes would show it if a good client lost one.
    }
  client.flushReliable();
} catch (Q_Exception*) {
}

std::vector<double> probe(PeerProcess& peer, const std::string& command, const Pump& pump) {
  peer.command("probe " + command);
  std::istringstream in(peer.waitLine("probe-", 20000, pump).value_or(""));
  std::string answer;
  in >> answer;
  return {std::istream_iterator<double>(in), {}};
}

}  // namespace cs_test
