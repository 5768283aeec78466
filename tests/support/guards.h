// Scopes of the tests: faults armed, process-wide limits set, a time limit.
//
//   FaultGuard faults;
//   faults.arm(platform::fault::Call::WSAStartup, {.result = 10091});
//   LimitsGuard open(N_Limits::openNetwork());
//   Watchdog dog(20.0, "stop with the network mutex held");
#pragma once

#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "N_Initializer.h"
#include "N_Limits.h"
#include "fault.h"
#include "vardel_platform.h"

// Whatever was armed through the guard, or directly through platform::fault
// while it lives, is disarmed when it goes: call plans, the allocation fault,
// and the catalogue and version overrides.
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

// The process-wide limits for one scope; the earlier ones come back after.
class LimitsGuard {
 public:
  explicit LimitsGuard(const N_Limits& limits) : m_before(N_Initializer::getLimits()) {
    N_Initializer::setLimits(limits);
  }
  ~LimitsGuard() { N_Initializer::setLimits(m_before); }

  LimitsGuard(const LimitsGuard&) = delete;
  LimitsGuard& operator=(const LimitsGuard&) = delete;

 private:
  N_Limits m_before;
};

// Ends the test process with a message if a scope takes longer than its
// limit, so that a hang (a deadlock, a stop that never returns) fails with a
// reason instead of running into the harness's time-out.
class Watchdog {
 public:
  Watchdog(double seconds, std::string what)
      : m_thread([this, seconds, what = std::move(what)] {
          std::unique_lock<std::mutex> hold(m_mutex);
          if (m_done.wait_for(hold, std::chrono::duration<double>(seconds), [this] { return m_bFinished; })) return;
          std::fprintf(stderr, "\nWATCHDOG: \"%s\" still running after %.1f s; giving up\n", what.c_str(), seconds);
          std::fflush(stderr);
          ::_exit(3);
        }) {}
  ~Watchdog() {
    {
      std::lock_guard<std::mutex> hold(m_mutex);
      m_bFinished = true;
    }
    m_done.notify_all();
    m_thread.join();
  }
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

 private:
  std::mutex m_mutex;
  std::condition_variable m_done;
  bool m_bFinished = false;
  std::thread m_thread;
};
