// Fault injection for one scope. Whatever was armed through the guard, or
// directly through platform::fault while it lives, is disarmed when it goes:
// call plans, the allocation fault, and the catalogue and version overrides.
//
//   FaultGuard faults;
//   faults.arm(platform::fault::Call::WSAStartup, {.result = 10091});
//   EXPECT_THROW(N_Initializer n, N_NetException_Unavailable*);
#pragma once

#include <vector>

#include "fault.h"
#include "vardel_platform.h"

class FaultGuard {
 public:
  FaultGuard() = default;
  FaultGuard(platform::fault::Call call, platform::fault::Plan plan) { arm(call, plan); }
  ~FaultGuard() { platform::fault::disarmAll(); }

  FaultGuard(const FaultGuard&) = delete;
  FaultGuard& operator=(const FaultGuard&) = delete;

  void arm(platform::fault::Call call, platform::fault::Plan plan) { platform::fault::arm(call, plan); }
  // The nth library allocation from now gives nothing (1: the next one).
  void failAllocation(int nth, bool persist = false) { platform::fault::failAllocation(nth, persist); }
  void setCatalogue(const std::vector<platform::WSAPROTOCOL_INFOA>& entries) {
    platform::fault::setCatalogue(entries.data(), static_cast<int>(entries.size()));
  }
  void setAgreedVersion(platform::WORD version) { platform::fault::setAgreedVersion(version); }
};
