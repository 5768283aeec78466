// Library allocations made and not given back since construction, by the
// counters of Q_Memory. Resolver threads may give their blocks back a little
// after their address is gone, so settles() polls for a while.
#pragma once

#include <gtest/gtest.h>

class AllocationBalance {
 public:
  AllocationBalance();
  // Negative if more was given back than made, which is a fault as well.
  int outstanding() const;
  // Polls until `target` allocations are outstanding (a refused allocation
  // counts as made and is never given back), for up to `seconds`.
  ::testing::AssertionResult settles(int target = 0, double seconds = 10.0) const;

 private:
  int m_iNewBase;
  int m_iDeleteBase;
};
