// The process-wide protections: their two sets of values and their store.
#include <mutex>

#include "N_Initializer.h"
#include "N_Limits.h"

namespace {

std::mutex& limitsLock() {
  static std::mutex lock;
  return lock;
}

N_Limits& current() {
  static N_Limits limits = N_Limits::defaults();
  return limits;
}

}  // namespace

N_Limits N_Limits::defaults() {
  N_Limits limits{};
  limits.bListenersFirst = false;
  limits.fAcceptBackoff = 0.25f;
  limits.uMaximumAcceptQueue = 0;
  limits.uListenBacklog = 0;
  limits.fPairingTimeout = 0.0f;
  limits.uMaximumUnpaired = 0;
  limits.uMaximumUnpairedPerAddress = 0;
  limits.bContainFailures = false;
  limits.uMaximumLookups = 0;
  limits.uMaximumMessageSize = 64u << 20;
  limits.bCompactMessages = false;
  limits.uReceiveBacklog = 0;
  limits.fSendBacklogSeconds = 0.0f;
  limits.uMinimumSendBacklog = 0;
  limits.uControlBudget = 0;
  limits.bCoalesceBandwidth = false;
  return limits;
}

N_Limits N_Limits::openNetwork() {
  N_Limits limits = defaults();
  limits.bListenersFirst = true;
  limits.uMaximumAcceptQueue = 64;
  limits.uListenBacklog = 64;
  limits.fPairingTimeout = 5.0f;
  limits.uMaximumUnpaired = 32;
  limits.uMaximumUnpairedPerAddress = 4;
  limits.bContainFailures = true;
  limits.uMaximumLookups = 16;
  limits.uMaximumMessageSize = 1u << 20;
  limits.bCompactMessages = true;
  limits.uReceiveBacklog = 1u << 20;
  limits.fSendBacklogSeconds = 8.0f;
  limits.uMinimumSendBacklog = 256u << 10;
  limits.uControlBudget = 64;
  limits.bCoalesceBandwidth = true;
  return limits;
}

void N_Initializer::setLimits(const N_Limits& limits) {
  N_Limits checked = limits;
  // A block of length + 4 must stay within a 32-bit int.
  if (checked.uMaximumMessageSize > 0x7FFFFFFBu || checked.uMaximumMessageSize == 0)
    checked.uMaximumMessageSize = 0x7FFFFFFBu;
  std::lock_guard<std::mutex> hold(limitsLock());
  current() = checked;
}

N_Limits N_Initializer::getLimits() {
  std::lock_guard<std::mutex> hold(limitsLock());
  return current();
}
