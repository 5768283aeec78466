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
// test was given back (refused ones count as made). Faults are disarmed
// before and after. Library objects of the test must be gone before TearDown
// (locals of the test body are).
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <memory>

#include "N_Address.h"
#include "N_Initializer.h"
#include "guards.h"

using Clock = std::chrono::steady_clock;
using Pump = std::function<void()>;  // called on every turn of a wait, e.g. a server's update()

// Calls `pump` and checks `done` until it holds or the time is up.
bool waitFor(const std::function<bool()>& done, int milliseconds = 5000, const Pump& pump = {});
inline bool staysFalse(const std::function<bool()>& condition, int milliseconds, const Pump& pump = {}) {
  return !waitFor(condition, milliseconds, pump);
}
inline void pumpFor(int milliseconds, const Pump& pump) {
  waitFor([] { return false; }, milliseconds, pump);
}
inline double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

// Library allocations made and not given back since construction, by the
// counters of Q_Memory (negative if more was given back, a fault as well).
class AllocationBalance {
 public:
  AllocationBalance();
  int outstanding() const;
  // Polls until `target` are outstanding, for up to `seconds`: resolver
  // threads may give their blocks back a little after their address is gone.
  ::testing::AssertionResult settles(int target = 0, double seconds = 10.0) const;

 private:
  int m_iNewBase, m_iDeleteBase;
};

class RuntimeTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;
  void stopRuntime();  // early; the balance is still checked at the end
  int outstanding() const { return m_balance.outstanding(); }
  const N_Address* loopback() const { return m_loopback.get(); }
  int port() const { return m_iPort; }  // free for TCP and UDP on 127.0.0.1, and port + 1 too
  static int freePort(bool pairWithNext = false);

 private:
  std::unique_ptr<N_Initializer> m_runtime;
  std::unique_ptr<N_Address> m_loopback;
  int m_iPort = 0, m_iRefusedBefore = 0;
  AllocationBalance m_balance;
};
