// Checks that the library gave back every allocation it made, by its counters
// Q_Memory::sm_iNewCount and sm_iDeleteCount.
//
//   EXPECT_TRUE(allocationsBalance([] { N_Initializer network; ... }));
//
// Resolver threads may free their blocks a little after their address is
// gone, so the checks poll for a while before they give up.
#pragma once

#include <functional>

#include <gtest/gtest.h>

// Counts from the moment of construction.
class AllocationBalance {
 public:
  AllocationBalance();
  // Allocations made since construction and not released yet (negative if
  // more was released than allocated, which is a fault as well).
  int outstanding() const;
  // Polls until nothing is outstanding, for up to `seconds`.
  ::testing::AssertionResult settles(double seconds = 10.0) const;

 private:
  int m_iNewBase;
  int m_iDeleteBase;
};

// Runs `body` (typically a whole start and stop of the runtime, with work in
// between) and then expects everything it allocated to be released.
::testing::AssertionResult allocationsBalance(const std::function<void()>& body, double seconds = 10.0);

// The absolute counts are equal (polling for up to `seconds`): every
// allocation of the process so far was released.
::testing::AssertionResult allCountsBalanced(double seconds = 10.0);
