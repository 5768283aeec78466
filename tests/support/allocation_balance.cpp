#include "allocation_balance.h"

#include <chrono>
#include <thread>

#include "Q_Memory.h"

namespace {

using Clock = std::chrono::steady_clock;

// Polls `difference` until it reads 0 or the time runs out; gives its last value.
int pollToZero(const std::function<int()>& difference, double seconds) {
  auto deadline = Clock::now() + std::chrono::duration<double>(seconds);
  int value = difference();
  while (value != 0 && Clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    value = difference();
  }
  return value;
}

}  // namespace

AllocationBalance::AllocationBalance()
    : m_iNewBase(Q_Memory::sm_iNewCount.load()), m_iDeleteBase(Q_Memory::sm_iDeleteCount.load()) {}

int AllocationBalance::outstanding() const {
  // Deletes first: a release is always counted after its allocation, so this
  // order never shows a release without its allocation.
  int deletes = Q_Memory::sm_iDeleteCount.load() - m_iDeleteBase;
  int news = Q_Memory::sm_iNewCount.load() - m_iNewBase;
  return news - deletes;
}

::testing::AssertionResult AllocationBalance::settles(double seconds) const {
  int left = pollToZero([this] { return outstanding(); }, seconds);
  if (left == 0) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << left << " allocation(s) outstanding after " << seconds << " s";
}

::testing::AssertionResult allocationsBalance(const std::function<void()>& body, double seconds) {
  AllocationBalance balance;
  body();
  return balance.settles(seconds);
}

::testing::AssertionResult allCountsBalanced(double seconds) {
  int left = pollToZero(
      [] {
        int deletes = Q_Memory::sm_iDeleteCount.load();
        return Q_Memory::sm_iNewCount.load() - deletes;
      },
      seconds);
  if (left == 0) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << "new count " << Q_Memory::sm_iNewCount.load() << ", delete count "
                                       << Q_Memory::sm_iDeleteCount.load();
}
