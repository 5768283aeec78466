#include "allocation_balance.h"

#include <chrono>
#include <thread>

#include "Q_Memory.h"

AllocationBalance::AllocationBalance()
    : m_iNewBase(Q_Memory::sm_iNewCount.load()), m_iDeleteBase(Q_Memory::sm_iDeleteCount.load()) {}

int AllocationBalance::outstanding() const {
  // Deletes first: a release is counted after its allocation, so this order
  // never shows a release without its allocation.
  const int deletes = Q_Memory::sm_iDeleteCount.load() - m_iDeleteBase;
  return Q_Memory::sm_iNewCount.load() - m_iNewBase - deletes;
}

::testing::AssertionResult AllocationBalance::settles(int target, double seconds) const {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  while (outstanding() != target && std::chrono::steady_clock::now() < deadline)
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  const int left = outstanding() - target;
  if (left == 0) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << left << " library allocation(s) not given back after " << seconds << " s";
}
