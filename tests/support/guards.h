// Scopes of the tests: faults armed, process-wide limits set, a time limit.
//
//   FaultGuard faults(platform::fault::Call::WSAStartup, {.result = 10091});
//   LimitsGuard open(N_Limits::openNetwork());
//   Watchdog dog(20.0, "stop with the network mutex held");
#pragma once

#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <stop_token>
#include <thread>
#include <vector>

#include "N_Initializer.h"
#include "N_Limits.h"
#include "fault.h"
#include "vardel_platform.h"

// The allocation fault's own count of refusals starts anew at each arming;
// arming through here keeps the tally of them all (a refused allocation is
// counted as made and never given back, as Q_New counts it).
inline int g_iEarlierRefusals = 0;
inline void failAllocation(int nth, bool persist = false) {
  g_iEarlierRefusals += platform::fault::allocationsFailed();
  platform::fault::failAllocation(nth, persist);
}
inline int refusedAllocations() { return g_iEarlierRefusals + platform::fault::allocationsFailed(); }

// Whatever was armed while it lives (call plans, the allocation fault, the
// catalogue and version overrides) is disarmed when it goes.
struct FaultGuard {
  FaultGuard() = default;
  FaultGuard(platform::fault::Call call, platform::fault::Plan plan) { arm(call, plan); }
  ~FaultGuard() { platform::fault::disarmAll(); }
  FaultGuard(const FaultGuard&) = delete;
  FaultGuard& operator=(const FaultGuard&) = delete;

  void arm(platform::fault::Call call, platform::fault::Plan plan) { platform::fault::arm(call, plan); }
  void failAllocation(int nth, bool persist = false) { ::failAllocation(nth, persist); }
  void setCatalogue(const std::vector<platform::WSAPROTOCOL_INFOA>& entries) {
    platform::fault::setCatalogue(entries.data(), static_cast<int>(entries.size()));
  }
  void setAgreedVersion(platform::WORD version) { platform::fault::setAgreedVersion(version); }
};

// The process-wide limits for one scope; the earlier ones come back after.
struct LimitsGuard {
  explicit LimitsGuard(const N_Limits& limits) : before(N_Initializer::getLimits()) {
    N_Initializer::setLimits(limits);
  }
  ~LimitsGuard() { N_Initializer::setLimits(before); }
  LimitsGuard(const LimitsGuard&) = delete;
  LimitsGuard& operator=(const LimitsGuard&) = delete;
  N_Limits before;
};

// Ends the test process with a message if a scope takes longer than its
// limit, so that a hang (a deadlock, a stop that never returns) fails with a
// reason instead of running into the harness's time-out.
struct Watchdog {
  Watchdog(double seconds, const char* what)
      : thread([=](std::stop_token stop) {
          std::mutex m;
          std::unique_lock<std::mutex> hold(m);
          std::condition_variable_any().wait_for(hold, stop, std::chrono::duration<double>(seconds),
                                                 [] { return false; });
          if (stop.stop_requested()) return;
          std::fprintf(stderr, "\nWATCHDOG: \"%s\" still running after %.1f s; giving up\n", what, seconds);
          ::_exit(3);
        }) {}
  std::jthread thread;  // asked to stop and joined when the scope ends
};
