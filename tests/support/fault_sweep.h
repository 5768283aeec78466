// One sweep instead of many hand-numbered fault cases: the scenario runs with
// the library's allocation (or a platform call) number N = 1, 2, 3 ...
// failing, until a run meets no fault. Each run must end normally, or by a
// library exception (Q_Exception*) once the fault fired; give back every
// allocation (refused ones count as made); and meet the scenario's own
// expectations (it may read platform::fault::fired() to see the fault).
//
//   EXPECT_TRUE(sweepAllocations([&] { N_Socket s(...); }));
#pragma once

#include <functional>

#include <gtest/gtest.h>

#include "fault.h"

::testing::AssertionResult sweepAllocations(const std::function<void()>& scenario, int maxRuns = 3000);
// Call N of `call` answers `result` in each run (see platform::fault::Plan).
::testing::AssertionResult sweepCall(platform::fault::Call call, int result, const std::function<void()>& scenario,
                                     int maxRuns = 3000);
