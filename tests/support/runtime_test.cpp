#include "runtime_test.h"

#include <thread>

#include "Q_Memory.h"
#include "raw_socket.h"

bool waitFor(const std::function<bool()>& done, int milliseconds, const Pump& pump) {
  for (const auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);;) {
    if (pump) pump();
    if (done()) return true;
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::microseconds(500));
  }
}

AllocationBalance::AllocationBalance()
    : m_iNewBase(Q_Memory::sm_iNewCount.load()), m_iDeleteBase(Q_Memory::sm_iDeleteCount.load()) {}

int AllocationBalance::outstanding() const {
  // Deletes first: a release is counted after its allocation, so this order
  // never shows a release without its allocation.
  const int deletes = Q_Memory::sm_iDeleteCount.load() - m_iDeleteBase;
  return Q_Memory::sm_iNewCount.load() - m_iNewBase - deletes;
}

::testing::AssertionResult AllocationBalance::settles(int target, double seconds) const {
  waitFor([&] { return outstanding() == target; }, static_cast<int>(seconds * 1000));
  if (const int left = outstanding() - target; left != 0)
    return ::testing::AssertionFailure() << left << " library allocation(s) not given back after " << seconds << " s";
  return ::testing::AssertionSuccess();
}

void RuntimeTest::SetUp() {
  platform::fault::disarmAll();
  m_iRefusedBefore = refusedAllocations();
  platform::setLocalHost("127.0.0.1");
  m_balance = AllocationBalance();
  m_runtime = std::make_unique<N_Initializer>();
  m_loopback = std::make_unique<N_Address>("127.0.0.1");
  waitFor([&] { return m_loopback->fullyResolved(); }, 2000);  // before the test arms any fault
  m_iPort = freePort(true);
}

void RuntimeTest::TearDown() {
  platform::fault::disarmAll();
  stopRuntime();
  // Resolver threads that nobody joins may still be giving back their blocks.
  EXPECT_TRUE(m_balance.settles(refusedAllocations() - m_iRefusedBefore, 5.0));
}

void RuntimeTest::stopRuntime() {
  m_loopback.reset();
  m_runtime.reset();
}

int RuntimeTest::freePort(bool pairWithNext) { return raw::freePort(pairWithNext); }
