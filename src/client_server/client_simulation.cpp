// N_Client's network model: per-connection queues between the sockets and
// poll(), following the process-wide N_NetworkModel. See N_NetworkModel.h
// for what a message goes through.
#include <atomic>
#include <cstdint>
#include <cstring>
#include <mutex>

#include "N_Client.h"
#include "Q_New.h"
#include "win32.h"

namespace {

std::mutex& modelLock() {
  static std::mutex lock;
  return lock;
}

// Under modelLock.
N_NetworkModel& modelInForce() {
  static N_NetworkModel model;
  return model;
}

// Read by every poll() without the lock: whether the model is on, and which
// setting is in force (a new one restarts each connection's draws).
std::atomic<bool> g_bModelOn{false};
std::atomic<unsigned> g_uModelVersion{0};

constexpr unsigned kUnreliableSeedOffset = 0x9E3779B9u;
constexpr double kDrawScale = 1.0 / 32768.0;
constexpr double kSecondsPerMillisecond = 0.001;

bool changesSomething(const N_NetworkModel& m) {
  return m.fDelay > 0.0f || m.fJitter > 0.0f || m.fLoss > 0.0f || m.fDuplicate > 0.0f ||
         (m.fReorder > 0.0f && m.fReorderWindow > 0.0f) || m.uBandwidth > 0;
}

// A held message: its own copy and its times on the connection's clock.
struct Held {
  char* pData;
  unsigned uSize;
  unsigned uCost;  // what it counts against the queue limit
  double dArrival;
  double dDue;
};

// 0 to 1 - 2^-15 from the connection's own generator.
double draw(unsigned& state) { return platform::rand(state) * kDrawScale; }

}  // namespace

struct N_Client::Simulation {
  N_NetworkModel model;
  unsigned uVersion = 0;
  bool bOn = false;  // the model in force changes something
  Q_Timer clock;     // arrivals and due times, in seconds
  double dNow = 0.0;  // the clock when the message at hand arrived, then when this poll reads
  unsigned uReliableState = 0;
  unsigned uUnreliableState = 0;
  double dLinkFree = 0.0;        // when the cap's link has sent all it took
  double dLastReliableDue = 0.0;  // reliable messages keep their order
  Q_DLList<Held> reliable;        // in order of arrival, due times rising
  Q_DLList<Held> unreliable;      // in order of arrival
  unsigned uHeldBytes = 0;
  char* pHandedOut = nullptr;  // the message the last poll() gave, valid until the next
  N_SimulationStats stats;
  double dDelaySum = 0.0;  // seconds, over the messages handed out

  ~Simulation() {
    for (Q_DLList<Held>* list : {&reliable, &unreliable})
      for (Held* h = list->getFirst(); h != nullptr; h = list->getNext(h)) Q_DeleteArray(h->pData);
    Q_DeleteArray(pHandedOut);
  }

  void adopt(const N_NetworkModel& m, unsigned version) {
    model = m;
    uVersion = version;
    bOn = changesSomething(m);
    // Switched off: the statistics of the last model stay readable.
    if (!bOn) return;
    uReliableState = m.uSeed;
    uUnreliableState = m.uSeed + kUnreliableSeedOffset;
    stats = N_SimulationStats{};
    stats.uQueuedBytes = uHeldBytes;
    stats.uPeakQueuedBytes = uHeldBytes;
    dDelaySum = 0.0;
  }

  bool hasRoom(unsigned cost) const {
    return uHeldBytes == 0 || std::uint64_t{uHeldBytes} + cost <= model.uQueueLimit;
  }

  double delayOf(double u) const {
    const double ms = static_cast<double>(model.fDelay) + static_cast<double>(model.fJitter) * (2.0 * u - 1.0);
    return ms > 0.0 ? ms * kSecondsPerMillisecond : 0.0;
  }

  // When a message of `size` bytes that arrives now is through the cap.
  double passLink(unsigned size) {
    if (model.uBandwidth == 0) return dNow;
    const double start = dLinkFree > dNow ? dLinkFree : dNow;
    dLinkFree = start + static_cast<double>(size) / static_cast<double>(model.uBandwidth);
    return dLinkFree;
  }

  // Copies the message onto `list`, due at `due`.
  void hold(Q_DLList<Held>& list, const void* data, unsigned size, double due) {
    char* copy = Q_NewArray<char>(size);
    if (size > 0) std::memcpy(copy, data, size);
    Held* h;
    try {
      h = list.append();
    } catch (...) {
      Q_DeleteArray(copy);
      throw;
    }
    h->pData = copy;
    h->uSize = size;
    h->uCost = size > 0 ? size : 1;
    h->dArrival = dNow;
    h->dDue = due;
    uHeldBytes += h->uCost;
    if (uHeldBytes > stats.uPeakQueuedBytes) stats.uPeakQueuedBytes = uHeldBytes;
    stats.uQueuedBytes = uHeldBytes;
    if (due > dNow) ++stats.uDelayed;
  }

  void takeReliable(const void* data, unsigned size) {
    ++stats.uReceived;
    const double delay = delayOf(draw(uReliableState));
    double due = passLink(size) + delay;
    if (due < dLastReliableDue) due = dLastReliableDue;
    dLastReliableDue = due;
    hold(reliable, data, size, due);
  }

  void takeUnreliable(const void* data, unsigned size) {
    ++stats.uReceived;
    // Five draws whatever happens, so that one message's fate never shifts
    // the draws of the next.
    const double uLoss = draw(uUnreliableState);
    const double uCopy = draw(uUnreliableState);
    const double uReorder = draw(uUnreliableState);
    const double delay = delayOf(draw(uUnreliableState));
    const double copyDelay = delayOf(draw(uUnreliableState));
    if (uLoss < static_cast<double>(model.fLoss)) {
      ++stats.uLost;
      return;
    }
    const unsigned cost = size > 0 ? size : 1;
    if (!hasRoom(cost)) {
      ++stats.uDropped;
      return;
    }
    const double through = passLink(size);
    double due = through + delay;
    if (model.fReorderWindow > 0.0f && uReorder < static_cast<double>(model.fReorder)) {
      ++stats.uReordered;
      due += static_cast<double>(model.fReorderWindow) * kSecondsPerMillisecond;
    }
    hold(unreliable, data, size, due);
    if (uCopy < static_cast<double>(model.fDuplicate)) {
      if (!hasRoom(cost)) {
        ++stats.uDropped;
        return;
      }
      ++stats.uDuplicated;
      hold(unreliable, data, size, through + copyDelay);
    }
  }
};

bool N_Client::simulateArrivals() {
  if (m_pSimulation == nullptr) {
    if (!g_bModelOn.load(std::memory_order_acquire)) return false;
    m_pSimulation = Q_New<Simulation>();
  }
  Simulation& s = *m_pSimulation;
  if (s.uVersion != g_uModelVersion.load(std::memory_order_acquire)) {
    std::lock_guard<std::mutex> hold(modelLock());
    s.adopt(modelInForce(), g_uModelVersion.load(std::memory_order_relaxed));
  }
  // The message handed out last is no longer the caller's.
  Q_DeleteArray(s.pHandedOut);
  s.pHandedOut = nullptr;
  if (!s.bOn) {
    // Off: what is still held goes first, at once; then the sockets directly.
    return s.reliable.m_iCount + s.unreliable.m_iCount > 0;
  }
  void* data = nullptr;
  unsigned size = 0;
  // Each arrival is timed once the socket gave it: a socket's poll may wait
  // for the network thread, which meanwhile may be storing that very message.
  // Reliable messages wait in the socket while the queue is full; the socket's
  // receive backlog then holds the peer back.
  while ((s.uHeldBytes == 0 || s.uHeldBytes < s.model.uQueueLimit) && m_pTcpSocket->poll(data, size)) {
    s.dNow = s.clock.getAge();
    s.takeReliable(data, size);
  }
  while (m_pUdpSocket->poll(data, size)) {
    s.dNow = s.clock.getAge();
    s.takeUnreliable(data, size);
  }
  s.dNow = s.clock.getAge();
  return true;
}

bool N_Client::takeSimulated(bool reliable, void*& pMessage, unsigned& uMessageSize) {
  Simulation& s = *m_pSimulation;
  Q_DLList<Held>& list = reliable ? s.reliable : s.unreliable;
  Held* next = list.getFirst();
  // Unreliable: the first to be due, the earlier arrival on a tie.
  if (!reliable)
    for (Held* h = next; h != nullptr; h = list.getNext(h))
      if (h->dDue < next->dDue) next = h;
  if (next == nullptr) {
    // Off and drained: later messages come from the sockets.
    if (!s.bOn) return reliable ? m_pTcpSocket->poll(pMessage, uMessageSize) : m_pUdpSocket->poll(pMessage, uMessageSize);
    return false;
  }
  if (s.bOn && next->dDue > s.dNow) return false;
  pMessage = next->pData;
  uMessageSize = next->uSize;
  s.pHandedOut = next->pData;
  s.uHeldBytes -= next->uCost;
  s.stats.uQueuedBytes = s.uHeldBytes;
  ++s.stats.uDelivered;
  s.dDelaySum += next->dDue - next->dArrival;
  list.remove(next);
  return true;
}

bool N_Client::messageWaiting(bool modelled) {
  if (modelled) {
    // What the model holds is waiting once it is due (or at once with the
    // model off); simulateArrivals() has just set the clock.
    Simulation& s = *m_pSimulation;
    for (Q_DLList<Held>* list : {&s.reliable, &s.unreliable})
      for (Held* h = list->getFirst(); h != nullptr; h = list->getNext(h))
        if (!s.bOn || h->dDue <= s.dNow) return true;
    if (s.bOn) return false;
  }
  return m_pTcpSocket->getQueuedReceiveMessages() + m_pUdpSocket->getQueuedReceiveMessages() > 0;
}

void N_Client::deleteSimulation() {
  Q_Delete(m_pSimulation);
  m_pSimulation = nullptr;
}

void N_Client::simulateNetwork(const N_NetworkModel& model) {
  std::lock_guard<std::mutex> hold(modelLock());
  modelInForce() = model;
  g_uModelVersion.fetch_add(1, std::memory_order_release);
  g_bModelOn.store(changesSomething(model), std::memory_order_release);
}

N_NetworkModel N_Client::getNetworkModel() {
  std::lock_guard<std::mutex> hold(modelLock());
  return modelInForce();
}

N_SimulationStats N_Client::getSimulationStats() const {
  if (m_pSimulation == nullptr) return N_SimulationStats{};
  N_SimulationStats stats = m_pSimulation->stats;
  if (stats.uDelivered > 0) stats.dMeanDelay = m_pSimulation->dDelaySum / stats.uDelivered * 1000.0;
  return stats;
}
