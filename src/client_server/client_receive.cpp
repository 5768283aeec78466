// N_Client::poll and the simulated bad network.
#include <bit>
#include <cstdint>

#include "N_Client.h"
#include "win32.h"

std::atomic<unsigned> N_Client::sm_uSimulatedMinLatency{0};
std::atomic<unsigned> N_Client::sm_uSimulatedMaxLatency{0};
std::atomic<float> N_Client::sm_fSimulatedPacketLoss{0.0f};

namespace {

// Scales rand()'s 0..32767 to 0..1; 32767 gives 1 - 2^-30, so a loss of 1.0
// throws away every unreliable message.
constexpr float kRandomScale = 3.0518509e-05f;
constexpr float kSecondsPerMillisecond = 0.001f;
static_assert(std::bit_cast<std::uint32_t>(kRandomScale) == 0x38000100u);
static_assert(std::bit_cast<std::uint32_t>(kSecondsPerMillisecond) == 0x3A83126Fu);

double draw() { return static_cast<double>(platform::rand()) * static_cast<double>(kRandomScale); }

}  // namespace

bool N_Client::poll(void*& pMessage, unsigned& uMessageSize) {
  if (!m_bConstructed) return false;
  // The network model (off by default) takes in what the sockets hold on
  // every poll, gate shut or not, so that its arrival times are true ones.
  const bool modelled = simulateArrivals();
  if (m_sendTimer.getAge() < m_fNextPollTime) {
    // The gate only shuts while simulateLatency() is on: only then is this
    // look at the sockets paid for.
    if (!m_bGateHeldBack) m_bGateHeldBack = messageWaiting(modelled);
    return false;
  }

  bool result = false;
  if (modelled ? takeSimulated(true, pMessage, uMessageSize) : m_pTcpSocket->poll(pMessage, uMessageSize)) {
    // Reliable messages are never thrown away.
    result = true;
  } else if (modelled ? takeSimulated(false, pMessage, uMessageSize) : m_pUdpSocket->poll(pMessage, uMessageSize)) {
    const float loss = sm_fSimulatedPacketLoss.load(std::memory_order_relaxed);
    // The message is taken from the socket either way; a lost one is gone.
    result = !(loss > 0.0f && draw() < static_cast<double>(loss));
    if (!result) {
      ++m_uSimulatedLost;
      m_bGateHeldBack = false;
    }
  }
  if (result && m_bGateHeldBack) {
    ++m_uSimulatedDelayed;
    m_bGateHeldBack = false;
  }

  const unsigned minimum = sm_uSimulatedMinLatency.load(std::memory_order_relaxed);
  const unsigned maximum = sm_uSimulatedMaxLatency.load(std::memory_order_relaxed);
  if (minimum + maximum == 0) return result;

  // Both channels stay shut for a drawn time after every read, whether it
  // gave a message or not. With the maximum below the minimum the factor is
  // negative and the draw runs from the minimum down.
  m_fNextPollTime = m_sendTimer.getAge();
  const double u = draw();
  const double lo = static_cast<double>(minimum) * static_cast<double>(kSecondsPerMillisecond);
  const double hi = static_cast<double>(maximum) * static_cast<double>(kSecondsPerMillisecond);
  m_fNextPollTime = static_cast<float>(((hi - lo) * u + static_cast<double>(m_fNextPollTime)) + lo);
  return result;
}

void N_Client::simulateLatency(unsigned uMinLatency, unsigned uMaxLatency) {
  sm_uSimulatedMinLatency.store(uMinLatency, std::memory_order_relaxed);
  sm_uSimulatedMaxLatency.store(uMaxLatency, std::memory_order_relaxed);
}

void N_Client::simulatePacketLoss(float fPacketLoss) {
  sm_fSimulatedPacketLoss.store(fPacketLoss, std::memory_order_relaxed);
}
