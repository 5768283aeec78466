// One sweep instead of many hand-numbered fault cases: the scenario runs
// again and again with the library's allocation (or a platform call) number
// N = 1, 2, 3 ... failing, until a run completes without the fault firing.
//
//   N_Initializer network;   // outside: a failed start is not retried
//   EXPECT_TRUE(sweepAllocations([&] {
//     N_Socket s(...);   // may throw where the fault fired
//   }));
//
// After each run it checks that
//  - the run ended normally, or by a library exception (Q_Exception*) when
//    the fault fired; any other end, or an exception without the fault, fails;
//  - every library allocation of the run was given back (a refused one is
//    counted as made, as Q_New counts it), waiting a little for resolvers;
//  - the scenario's own expectations held (it may use EXPECT_* and read
//    platform::fault::allocationsFailed() or fired() to see whether it met
//    the fault).
// The result says how many runs it took, or which run went wrong.
#pragma once

#include <functional>

#include <gtest/gtest.h>

#include "fault.h"

// Fails allocation N of each run.
::testing::AssertionResult sweepAllocations(const std::function<void()>& scenario, int maxRuns = 3000);
// Call N of `call` answers `result` in each run (see platform::fault::Plan).
::testing::AssertionResult sweepCall(platform::fault::Call call, int result, const std::function<void()>& scenario,
                                     int maxRuns = 3000);
