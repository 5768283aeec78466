#include "runtime_test.h"

#include <thread>

#include "fault.h"
#include "raw_socket.h"
#include "vardel_platform.h"

bool waitFor(const std::function<bool()>& done, int milliseconds, const Pump& pump) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  for (;;) {
    if (pump) pump();
    if (done()) return true;
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::microseconds(500));
  }
}

bool staysFalse(const std::function<bool()>& condition, int milliseconds, const Pump& pump) {
  return !waitFor(condition, milliseconds, pump);
}

void pumpFor(int milliseconds, const Pump& pump) {
  waitFor([] { return false; }, milliseconds, pump);
}

double secondsSince(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

void RuntimeTest::SetUp() {
  platform::fault::disarmAll();
  m_iRefusalsSeen = platform::fault::allocationsFailed();
  platform::setLocalHost("127.0.0.1");
  m_balance = AllocationBalance();
  m_runtime = std::make_unique<N_Initializer>();
  m_loopback = std::make_unique<N_Address>("127.0.0.1");
  // Its lookup is done before the test arms any fault.
  waitFor([&] { return m_loopback->fullyResolved(); }, 2000);
  m_iPort = freePort(true);
  sm_iNotedRefusals = 0;
}

void RuntimeTest::TearDown() {
  disarmFaults();
  stopRuntime();
  if (!m_bCheckBalance) return;
  // Resolver threads that nobody joins may still be giving back their blocks.
  const int refused = m_iRefused + sm_iNotedRefusals;
  EXPECT_TRUE(m_balance.settles(refused, 5.0));
}

void RuntimeTest::failAllocation(int nth, bool persist) {
  countRefusals();
  platform::fault::failAllocation(nth, persist);  // starts its count anew
  m_iRefusalsSeen = 0;
}

void RuntimeTest::disarmFaults() {
  countRefusals();
  platform::fault::disarmAll();  // leaves the count as it is
}

void RuntimeTest::stopRuntime() {
  m_loopback.reset();
  m_runtime.reset();
}

int RuntimeTest::freePort(bool pairWithNext) { return raw::freePort(pairWithNext); }

void RuntimeTest::countRefusals() {
  const int now = platform::fault::allocationsFailed();
  m_iRefused += now - m_iRefusalsSeen;
  m_iRefusalsSeen = now;
}
