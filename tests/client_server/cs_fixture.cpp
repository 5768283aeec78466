#include "cs_fixture.h"

#include <cstdlib>


namespace cs_test {

void sleepMs(int milliseconds) { std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds)); }

std::vector<unsigned char> controlBytes(std::uint32_t type, std::uint32_t value, int size) {
  unsigned char bytes[8] = {};
  ControlMessage{type, value}.encode(bytes);
  for (int i = 0; i < 4; ++i) bytes[4 + i] = static_cast<unsigned char>(value >> (8 * i));
  const unsigned n = size >= 0 ? static_cast<unsigned>(size) : ControlMessage::sizeOf(type);
  return std::vector<unsigned char>(bytes, bytes + n);
}

std::string hostOf(const N_Client* client) {
  const volatile char* number = client->getAddress()->getStringNumber();
  return number != nullptr ? const_cast<const char*>(number) : "";
}

static Received parse(const void* message, unsigned size, Clock::time_point start) {
  const auto* b = static_cast<const unsigned char*>(message);
  auto word = [&](int at) { return b[at] | b[at + 1] << 8 | b[at + 2] << 16 | std::uint32_t{b[at + 3]} << 24; };
  return {size, size >= 4 ? word(0) : 0, size >= 8 ? word(4) : 0, secondsSince(start)};
}

void ClientServerTest::heartbeat(float frequency, float latency) {
  N_Client::setHeartbeatFrequency(frequency);
  N_Client::setHeartbeatLatency(latency);
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

// ---------------------------------------------------------------------------

ScriptedServer::ScriptedServer(int port)
    : m_dataListener(port), m_controlListener(ControlMessage::CONTROL_PORT), m_start(Clock::now()) {
  m_thread = std::thread([this] { run(); });
}

ScriptedServer::~ScriptedServer() {
  m_bStop = true;
  m_thread.join();
  delete m_pControl;
  delete m_pData;
}

void ScriptedServer::run() {
  auto reply = [&](std::uint32_t type, std::uint32_t value = 0) {
    auto bytes = controlBytes(type, value);
    m_pControl->send(bytes.data(), static_cast<unsigned>(bytes.size()));
  };
  while (!m_bStop) {
    {
      std::lock_guard<std::mutex> hold(m_lock);
      N_Socket::ConnectData* entry = nullptr;
      if (m_pData == nullptr && m_dataListener.pollConnect(entry)) m_pData = new N_Socket(entry);
      if (m_pControl == nullptr && m_controlListener.pollConnect(entry)) m_pControl = new N_Socket(entry);
      void* message = nullptr;
      unsigned size = 0;
      while (m_pControl != nullptr && m_pControl->poll(message, size)) {
        const Received r = parse(message, size, m_start);
        m_control.push_back(r);
        if (r.type == CM::CONTROL_HEARTBEAT && answerHeartbeats) reply(CM::CONTROL_HEARTBEAT_REPLY);
        if (r.type == CM::CONTROL_WORLD_TIME_REQUEST && worldTimeAnswers != 0) {
          if (worldTimeAnswers > 0) --worldTimeAnswers;
          reply(CM::CONTROL_WORLD_TIME, CM::floatBits(worldTimeValue.load()));
        }
      }
    }
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
}

std::vector<Received> ScriptedServer::control() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_control;
}

std::size_t ScriptedServer::count(std::uint32_t type) {
  std::lock_guard<std::mutex> hold(m_lock);
  return std::count_if(m_control.begin(), m_control.end(), [&](const Received& r) { return r.type == type; });
}

bool ScriptedServer::connected(bool control) {
  std::lock_guard<std::mutex> hold(m_lock);
  N_Socket* s = control ? m_pControl : m_pData;
  return s != nullptr && s->isConnected();
}

bool ScriptedServer::sendControl(const std::vector<unsigned char>& bytes) {
  std::lock_guard<std::mutex> hold(m_lock);
  if (m_pControl == nullptr) return false;
  m_pControl->send(const_cast<unsigned char*>(bytes.data()), static_cast<unsigned>(bytes.size()));
  return true;
}

bool ScriptedServer::sendData(const std::string& bytes) {
  std::lock_guard<std::mutex> hold(m_lock);
  if (m_pData == nullptr) return false;
  m_pData->send(const_cast<char*>(bytes.data()), static_cast<unsigned>(bytes.size()));
  return true;
}

bool ScriptedServer::waitControl(std::size_t count, int milliseconds, const Pump& pump) {
  return waitFor([&] { return control().size() >= count; }, milliseconds, pump);
}

// ---------------------------------------------------------------------------

ScriptedClient::ScriptedClient(const N_Address* server, int port, bool openDataNow, bool openControlNow)
    : m_pServer(server), m_iPort(port), m_start(Clock::now()) {
  if (openDataNow) openData();
  if (openControlNow) openControl();
}

ScriptedClient::~ScriptedClient() {
  delete m_pControl;
  delete m_pData;
}

void ScriptedClient::openData() {
  if (m_pData == nullptr) m_pData = new N_Socket(m_pServer, m_iPort, N_Socket::SOCKET_TCP);
}

void ScriptedClient::openControl() {
  if (m_pControl == nullptr) m_pControl = new N_Socket(m_pServer, ControlMessage::CONTROL_PORT, N_Socket::SOCKET_TCP);
}

bool ScriptedClient::connected() {
  return m_pData != nullptr && m_pData->isConnected() && m_pControl != nullptr && m_pControl->isConnected();
}

void ScriptedClient::sendRaw(const std::vector<unsigned char>& bytes) {
  m_pControl->send(const_cast<unsigned char*>(bytes.data()), static_cast<unsigned>(bytes.size()));
}

std::optional<Received> ScriptedClient::next(int milliseconds, const Pump& pump) {
  void* message = nullptr;
  unsigned size = 0;
  if (!waitFor([&] { return m_pControl->poll(message, size); }, milliseconds, pump)) return std::nullopt;
  return parse(message, size, m_start);
}

std::vector<Received> ScriptedClient::drain(int milliseconds, const Pump& pump) {
  std::vector<Received> out;
  const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (Clock::now() < deadline)
    if (auto r = next(1, pump)) out.push_back(*r);
  return out;
}

std::optional<std::uint32_t> ScriptedClient::lastGrant(const Pump& pump, int milliseconds) {
  std::optional<std::uint32_t> grant;
  for (const Received& r : drain(milliseconds, pump))
    if (r.type == CM::CONTROL_BANDWIDTH_GRANT && r.size == 8) grant = r.value;
  return grant;
}

// ---------------------------------------------------------------------------

N_Client* pairUp(const ServerPump& pump, ScriptedClient& client) {
  const std::size_t before = pump.announced().size();
  if (!waitFor([&] { return pump.announced().size() > before && client.connected(); }, 5000, pump)) {
    ADD_FAILURE() << "not paired: announced " << pump.announced().size() << " (before " << before << ")";
    return nullptr;
  }
  return pump.announced().back();
}

PeerProcess::PeerProcess(int hostNumber, int port, std::vector<std::string> extra)
    : m_host("127.0.0." + std::to_string(hostNumber)), m_process(VARDEL_HOST_CLIENT_PEER, [&] {
        std::vector<std::string> args = {"--host", m_host, "--server", "127.0.0.1", "--port", std::to_string(port)};
        args.insert(args.end(), extra.begin(), extra.end());
        return args;
      }()) {}

std::optional<std::string> PeerProcess::waitLine(std::string_view text, int milliseconds, const Pump& pump) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (Clock::now() < deadline) {
    if (pump) pump();
    std::optional<std::string> line = m_process.readLine(1);
    if (line && line->find(text) != std::string::npos) return line;
  }
  return std::nullopt;
}

bool PeerProcess::quit(int milliseconds, const Pump& pump) {
  if (!command("quit") || !waitLine("bye", milliseconds, pump)) return false;
  std::optional<int> code;
  waitFor([&] { return (code = m_process.wait(0)).has_value(); }, milliseconds, pump);
  return code && *code == 0;
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

double valueOf(const std::string& line) {
  const std::size_t space = line.find(' ');
  return space == std::string::npos ? 0.0 : std::strtod(line.c_str() + space + 1, nullptr);
}

}  // namespace cs_test
