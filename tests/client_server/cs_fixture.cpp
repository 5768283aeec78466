#include "cs_fixture.h"

#include <cstdlib>

#include "fault.h"
#include "free_port.h"
#include "vardel_platform.h"

namespace cs_test {

bool waitFor(const std::function<bool()>& done, int milliseconds, const Pump& pump) {
  auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  for (;;) {
    if (pump) pump();
    if (done()) return true;
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::microseconds(500));
  }
}

void pumpFor(int milliseconds, const Pump& pump) {
  auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (Clock::now() < deadline) {
    if (pump) pump();
    std::this_thread::sleep_for(std::chrono::microseconds(500));
  }
}

void sleepMs(int milliseconds) { std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds)); }

double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

std::vector<unsigned char> controlBytes(std::uint32_t type, std::uint32_t value, int size) {
  ControlMessage message{type, value};
  unsigned char bytes[8] = {};
  message.encode(bytes);
  // Fill the value word even for 4-byte types, so a cut or padded message
  // carries recognisable bytes.
  bytes[4] = static_cast<unsigned char>(value);
  bytes[5] = static_cast<unsigned char>(value >> 8);
  bytes[6] = static_cast<unsigned char>(value >> 16);
  bytes[7] = static_cast<unsigned char>(value >> 24);
  unsigned n = size >= 0 ? static_cast<unsigned>(size) : ControlMessage::sizeOf(type);
  return std::vector<unsigned char>(bytes, bytes + n);
}

void ClientServerTest::SetUp() {
  platform::fault::disarmAll();
  platform::setLocalHost("127.0.0.1");
  N_Client::setHeartbeatFrequency(0.2f);
  N_Client::setHeartbeatLatency(0.2f);
  N_Client::simulateLatency(0, 0);
  N_Client::simulatePacketLoss(0.0f);
  N_Client::simulateNetwork(N_NetworkModel{});
  m_balance = std::make_unique<AllocationBalance>();
  m_runtime = std::make_unique<N_Initializer>();
  m_loopback = std::make_unique<N_Address>("127.0.0.1");
  m_iPort = pickFreePort(true);
  ASSERT_GT(m_iPort, 0);
}

void ClientServerTest::TearDown() {
  platform::fault::disarmAll();
  m_loopback.reset();
  m_runtime.reset();
  N_Client::setHeartbeatFrequency(4.0f);
  N_Client::setHeartbeatLatency(2.0f);
  N_Client::simulateLatency(0, 0);
  N_Client::simulatePacketLoss(0.0f);
  N_Client::simulateNetwork(N_NetworkModel{});
  const bool settled = waitFor([&] { return m_balance->outstanding() == m_iRefused; }, 10000);
  EXPECT_TRUE(settled) << "library allocations outstanding: " << m_balance->outstanding() << ", refused by faults: "
                       << m_iRefused;
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
  while (!m_bStop) {
    {
      std::lock_guard<std::mutex> hold(m_lock);
      N_Socket::ConnectData* entry = nullptr;
      if (m_pData == nullptr && m_dataListener.pollConnect(entry)) m_pData = new N_Socket(entry);
      if (m_pControl == nullptr && m_controlListener.pollConnect(entry)) m_pControl = new N_Socket(entry);
      void* message = nullptr;
      unsigned size = 0;
      while (m_pControl != nullptr && m_pControl->poll(message, size)) {
        const auto* b = static_cast<const unsigned char*>(message);
        Received r{size, 0, 0, secondsSince(m_start)};
        if (size >= 4) r.type = b[0] | b[1] << 8 | b[2] << 16 | static_cast<std::uint32_t>(b[3]) << 24;
        if (size >= 8) r.value = b[4] | b[5] << 8 | b[6] << 16 | static_cast<std::uint32_t>(b[7]) << 24;
        m_control.push_back(r);
        if (r.type == ControlMessage::CONTROL_HEARTBEAT && answerHeartbeats) {
          auto reply = controlBytes(ControlMessage::CONTROL_HEARTBEAT_REPLY);
          m_pControl->send(reply.data(), static_cast<unsigned>(reply.size()));
        }
        if (r.type == ControlMessage::CONTROL_WORLD_TIME_REQUEST) {
          int left = worldTimeAnswers.load();
          if (left != 0) {
            if (left > 0) worldTimeAnswers = left - 1;
            auto reply =
                controlBytes(ControlMessage::CONTROL_WORLD_TIME, ControlMessage::floatBits(worldTimeValue.load()));
            m_pControl->send(reply.data(), static_cast<unsigned>(reply.size()));
          }
        }
      }
      while (m_pData != nullptr && m_pData->poll(message, size))
        m_dataMessages.emplace_back(static_cast<const char*>(message), size);
    }
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
}

std::vector<Received> ScriptedServer::control() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_control;
}

std::vector<std::string> ScriptedServer::data() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_dataMessages;
}

bool ScriptedServer::controlConnected() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_pControl != nullptr && m_pControl->isConnected();
}

bool ScriptedServer::dataConnected() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_pData != nullptr && m_pData->isConnected();
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

bool ScriptedServer::waitData(std::size_t count, int milliseconds, const Pump& pump) {
  return waitFor([&] { return data().size() >= count; }, milliseconds, pump);
}

void ScriptedServer::hangUp() {
  answerHeartbeats = false;
  worldTimeAnswers = 0;
  std::lock_guard<std::mutex> hold(m_lock);
  if (m_pControl != nullptr) m_pControl->disconnect();
  if (m_pData != nullptr) m_pData->disconnect();
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

void ScriptedClient::send(std::uint32_t type, std::uint32_t value) { sendRaw(controlBytes(type, value)); }

void ScriptedClient::sendRaw(const std::vector<unsigned char>& bytes) {
  m_pControl->send(const_cast<unsigned char*>(bytes.data()), static_cast<unsigned>(bytes.size()));
}

std::optional<Received> ScriptedClient::next(int milliseconds, const Pump& pump) {
  void* message = nullptr;
  unsigned size = 0;
  if (!waitFor([&] { return m_pControl->poll(message, size); }, milliseconds, pump)) return std::nullopt;
  const auto* b = static_cast<const unsigned char*>(message);
  Received r{size, 0, 0, secondsSince(m_start)};
  if (size >= 4) r.type = b[0] | b[1] << 8 | b[2] << 16 | static_cast<std::uint32_t>(b[3]) << 24;
  if (size >= 8) r.value = b[4] | b[5] << 8 | b[6] << 16 | static_cast<std::uint32_t>(b[7]) << 24;
  return r;
}

std::vector<Received> ScriptedClient::drain(int milliseconds, const Pump& pump) {
  std::vector<Received> out;
  auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (Clock::now() < deadline) {
    auto r = next(1, pump);
    if (r) out.push_back(*r);
  }
  return out;
}

// ---------------------------------------------------------------------------

PeerProcess::PeerProcess(int hostNumber, int port, std::vector<std::string> extra)
    : m_host("127.0.0." + std::to_string(hostNumber)),
      m_process(VARDEL_HOST_CLIENT_PEER, [&] {
        std::vector<std::string> args = {"--host",      "127.0.0." + std::to_string(hostNumber),
                                         "--server",    "127.0.0.1",
                                         "--port",      std::to_string(port)};
        args.insert(args.end(), extra.begin(), extra.end());
        return args;
      }()) {}

PeerProcess::~PeerProcess() = default;

std::optional<std::string> PeerProcess::waitLine(std::string_view text, int milliseconds, const Pump& pump) {
  auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (Clock::now() < deadline) {
    if (pump) pump();
    std::optional<std::string> line = m_process.readLine(1);
    if (line && line->find(text) != std::string::npos) return line;
  }
  return std::nullopt;
}

std::vector<std::string> PeerProcess::linesStartingWith(std::string_view prefix) const {
  std::vector<std::string> out;
  for (const std::string& line : m_process.lines())
    if (line.compare(0, prefix.size(), prefix) == 0) out.push_back(line);
  return out;
}

bool PeerProcess::quit(int milliseconds, const Pump& pump) {
  if (!command("quit")) return false;
  if (!waitLine("bye", milliseconds, pump)) return false;
  std::optional<int> code;
  waitFor([&] { return (code = m_process.wait(0)).has_value(); }, milliseconds, pump);
  return code && *code == 0;
}

double valueOf(const std::string& line) {
  std::size_t space = line.find(' ');
  return space == std::string::npos ? 0.0 : std::strtod(line.c_str() + space + 1, nullptr);
}

}  // namespace cs_test
