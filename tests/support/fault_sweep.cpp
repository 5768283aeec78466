#include "fault_sweep.h"

#include <string>

#include "N_Exceptions.h"
#include "runtime_test.h"

namespace {

// Runs the scenario with fault N armed by `arm`, N = 1, 2, ... until a run
// meets no fault (`fired` tells how often it fired).
::testing::AssertionResult sweep(const std::function<void(int n)>& arm, const std::function<int()>& fired,
                                 const std::function<void()>& scenario, int maxRuns) {
  for (int n = 1; n <= maxRuns; ++n) {
    AllocationBalance balance;
    const int refusedBefore = refusedAllocations();
    int hits = 0;
    std::string error;
    {
      FaultGuard guard;
      arm(n);
      try {
        scenario();
      } catch (Q_Exception* e) {
        error = e->getErrorMessage() != nullptr ? e->getErrorMessage() : "(no text)";
      } catch (...) {
        return ::testing::AssertionFailure() << "run " << n << " ended by an exception not of the library";
      }
      hits = fired();
    }
    if (::testing::Test::HasFailure())
      return ::testing::AssertionFailure() << "run " << n << ": the scenario's expectations failed";
    if (!error.empty() && hits == 0)
      return ::testing::AssertionFailure() << "run " << n << " threw without the fault: " << error;
    if (auto settled = balance.settles(refusedAllocations() - refusedBefore); !settled)
      return ::testing::AssertionFailure() << "run " << n << ": " << settled.message();
    if (hits == 0) return ::testing::AssertionSuccess() << n << " runs";
  }
  return ::testing::AssertionFailure() << "the fault still fired after " << maxRuns << " runs";
}

}  // namespace

::testing::AssertionResult sweepAllocations(const std::function<void()>& scenario, int maxRuns) {
  return sweep([](int n) { failAllocation(n); }, [] { return platform::fault::allocationsFailed(); }, scenario,
               maxRuns);
}

::testing::AssertionResult sweepCall(platform::fault::Call call, int result, const std::function<void()>& scenario,
                                     int maxRuns) {
  return sweep([=](int n) { platform::fault::arm(call, {.countdown = n, .persist = false, .result = result}); },
               [=] { return platform::fault::fired(call); }, scenario, maxRuns);
}
