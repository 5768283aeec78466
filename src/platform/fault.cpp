// Fault plans for tests. The fast path is one relaxed load of `g_anyArmed`;
// everything else happens under a lock only while a test has armed something.
#include "fault.h"

#include <array>
#include <atomic>
#include <mutex>
#include <vector>

#include "internal.h"

namespace platform::fault {
namespace {

constexpr std::size_t kCalls = static_cast<std::size_t>(Call::Count);

struct ArmedPlan {
  bool armed = false;
  Plan plan;
  int calls = 0;
  int fired = 0;
};

struct State {
  std::mutex lock;
  std::array<ArmedPlan, kCalls> plans;
  int allocationCountdown = 0;  // 0: off
  bool allocationPersist = false;
  bool allocationFiring = false;
  int allocationsFailed = 0;
  bool catalogueSet = false;
  std::vector<WSAPROTOCOL_INFOA> catalogue;
  WORD version = 0x0002;
};

// Never destroyed: detached threads may still call in while the process exits.
State& state() {
  static State* s = new State;
  return *s;
}

std::atomic<bool> g_anyArmed{false};
std::atomic<bool> g_allocationArmed{false};

constexpr std::string_view kNames[] = {
#define PLATFORM_FAULT_NAME(name) #name,
    PLATFORM_FAULT_CALLS(PLATFORM_FAULT_NAME)
#undef PLATFORM_FAULT_NAME
};
static_assert(std::size(kNames) == kCalls, "one name per fault call");

void updateAnyArmed(State& s) {
  bool any = false;
  for (const ArmedPlan& p : s.plans) any = any || p.armed;
  g_anyArmed.store(any, std::memory_order_relaxed);
}

}  // namespace

void arm(Call call, Plan plan) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  ArmedPlan& p = s.plans[static_cast<std::size_t>(call)];
  p.armed = true;
  p.plan = plan;
  p.calls = 0;
  p.fired = 0;
  g_anyArmed.store(true, std::memory_order_relaxed);
}

void disarm(Call call) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  s.plans[static_cast<std::size_t>(call)].armed = false;
  updateAnyArmed(s);
}

void disarmAll() {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  for (ArmedPlan& p : s.plans) p.armed = false;
  g_anyArmed.store(false, std::memory_order_relaxed);
  s.allocationCountdown = 0;
  s.allocationPersist = false;
  s.allocationFiring = false;
  g_allocationArmed.store(false, std::memory_order_relaxed);
  s.catalogueSet = false;
  s.catalogue.clear();
  s.version = 0x0002;
}

int fired(Call call) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  return s.plans[static_cast<std::size_t>(call)].fired;
}

std::string_view name(Call call) {
  std::size_t i = static_cast<std::size_t>(call);
  return i < kCalls ? kNames[i] : std::string_view("?");
}

bool check(Call call, int& result) {
  if (!g_anyArmed.load(std::memory_order_relaxed)) return false;
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  ArmedPlan& p = s.plans[static_cast<std::size_t>(call)];
  if (!p.armed) return false;
  ++p.calls;
  bool fire = p.calls == p.plan.countdown || (p.plan.persist && p.calls > p.plan.countdown);
  if (!fire) return false;
  ++p.fired;
  result = p.plan.result;
  if (!p.plan.persist) {
    p.armed = false;
    updateAnyArmed(s);
  }
  return true;
}

void failAllocation(int nth, bool persist) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  s.allocationCountdown = nth < 1 ? 1 : nth;
  s.allocationPersist = persist;
  s.allocationFiring = false;
  s.allocationsFailed = 0;
  g_allocationArmed.store(true, std::memory_order_relaxed);
}

int allocationsFailed() {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  return s.allocationsFailed;
}

bool allocationShouldFail() {
  if (!g_allocationArmed.load(std::memory_order_relaxed)) return false;
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  if (s.allocationFiring) {
    ++s.allocationsFailed;
    return true;
  }
  if (s.allocationCountdown == 0) return false;
  if (--s.allocationCountdown > 0) return false;
  ++s.allocationsFailed;
  if (s.allocationPersist) {
    s.allocationFiring = true;
  } else {
    g_allocationArmed.store(false, std::memory_order_relaxed);
  }
  return true;
}

void setCatalogue(const WSAPROTOCOL_INFOA* entries, int count) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  s.catalogueSet = true;
  s.catalogue.assign(entries, entries + (count > 0 ? count : 0));
}

void setAgreedVersion(WORD version) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  s.version = version;
}

// Read by the layer's WSAStartup and WSAEnumProtocolsA.
bool catalogueOverride(std::vector<WSAPROTOCOL_INFOA>& out) {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  if (!s.catalogueSet) return false;
  out = s.catalogue;
  return true;
}

WORD agreedVersion() {
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  return s.version;
}

}  // namespace platform::fault
