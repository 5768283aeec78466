// The one runtime fixture and the one wait of the whole suite.
//
//   class MyTest : public RuntimeTest {};
//   TEST_F(MyTest, Something) {
//     N_Socket s(loopback(), port(), N_Socket::SOCKET_TCP);
//     EXPECT_TRUE(waitFor([&] { return s.isConnected(); }));
//   }
//
// RuntimeTest runs the library's runtime on host 127.0.0.1 for each test and
// checks, once it has stopped, that every library allocation made during the
// test was given back (allocations refused by failAllocation() count as made
// and never given back, as Q_New counts them). Faults are disarmed before and
// after. Library objects of the test must be gone before TearDown (locals of
// the test body are).
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <memory>

#include "N_Address.h"
#include "N_Initializer.h"
#include "allocation_balance.h"

using Clock = std::chrono::steady_clock;
// Called on every turn of a wait, e.g. a server's update().
using Pump = std::function<void()>;

// Calls `pump` and checks `done` until it holds or the time is up.
bool waitFor(const std::function<bool()>& done, int milliseconds = 5000, const Pump& pump = {});
// True if `condition` stays false for the whole time.
bool staysFalse(const std::function<bool()>& condition, int milliseconds, const Pump& pump = {});
// Calls `pump` for the whole time.
void pumpFor(int milliseconds, const Pump& pump);
double secondsSince(Clock::time_point start);

class RuntimeTest : public ::testing::Test {
 public:
  // Allocations refused by a fault armed elsewhere (the sweeps), which count
  // as made and are never given back.
  static void noteRefused(int allocations) { sm_iNotedRefusals += allocations; }

 protected:
  void SetUp() override;
  void TearDown() override;

  // The library's `nth` allocation from now gives nothing; use this rather
  // than platform::fault directly, so that the balance knows of it.
  void failAllocation(int nth, bool persist = false);
  void disarmFaults();
  // Stops the runtime early (the balance is still checked at the end).
  void stopRuntime();
  // Library allocations made since SetUp and not given back.
  int outstanding() const { return m_balance.outstanding(); }

  const N_Address* loopback() const { return m_loopback.get(); }
  // A free port for TCP and UDP on 127.0.0.1, and port + 1 too.
  int port() const { return m_iPort; }
  static int freePort(bool pairWithNext = false);

  bool m_bCheckBalance = true;

 private:
  void countRefusals();

  std::unique_ptr<N_Initializer> m_runtime;
  std::unique_ptr<N_Address> m_loopback;
  int m_iPort = 0;
  AllocationBalance m_balance;
  int m_iRefused = 0;
  int m_iRefusalsSeen = 0;
  static inline int sm_iNotedRefusals = 0;
};
