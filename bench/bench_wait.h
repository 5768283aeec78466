// The cost of the platform layer's wait as its set of handles grows.
#pragma once

#include <vector>

struct WaitCost {
  unsigned handles = 0;
  double microsPerRound = 0;  // 0: a wait failed or named the wrong index
};

// Prints and returns the cost of serving one event per round, for each count
// of handles, each measured for about `seconds`.
std::vector<WaitCost> benchWaitCost(const std::vector<unsigned>& counts, double seconds);
