#include "fault_sweep.h"

#include <string>

#include "N_Exceptions.h"
#include "allocation_balance.h"
#include "guards.h"
#include "runtime_test.h"

namespace {

// Arms the fault of run `n`; after the run, tells how many times it fired
// and how many of those were refused allocations.
struct Fault {
  std::function<void(FaultGuard&, int n)> arm;
  std::function<int()> fired;
  bool allocations;
};

::testing::AssertionResult sweep(const Fault& fault, const std::function<void()>& scenario, int maxRuns) {
  for (int n = 1; n <= maxRuns; ++n) {
    AllocationBalance balance;
    int hits = 0;
    std::string error;
    {
      FaultGuard guard;
      fault.arm(guard, n);
      try {
        scenario();
      } catch (Q_Exception* e) {
        error = e->getErrorMessage() != nullptr ? e->getErrorMessage() : "(no text)";
      } catch (...) {
        return ::testing::AssertionFailure() << "run " << n << " ended by an exception not of the library";
      }
      hits = fault.fired();
    }
    if (::testing::Test::HasFailure())
      return ::testing::AssertionFailure() << "run " << n << ": the scenario's expectations failed";
    if (!error.empty() && hits == 0)
      return ::testing::AssertionFailure() << "run " << n << " threw without the fault: " << error;
    // A refused allocation is counted as made (Q_New counts every attempt).
    const int refused = fault.allocations ? hits : 0;
    RuntimeTest::noteRefused(refused);
    if (::testing::AssertionResult settled = balance.settles(refused); !settled)
      return ::testing::AssertionFailure() << "run " << n << ": " << settled.message();
    if (hits == 0) return ::testing::AssertionSuccess() << n << " runs";
  }
  return ::testing::AssertionFailure() << "the fault still fired after " << maxRuns << " runs";
}

}  // namespace

::testing::AssertionResult sweepAllocations(const std::function<void()>& scenario, int maxRuns) {
  return sweep({[](FaultGuard& g, int n) { g.failAllocation(n); }, [] { return platform::fault::allocationsFailed(); },
                true},
               scenario, maxRuns);
}

::testing::AssertionResult sweepCall(platform::fault::Call call, int result, const std::function<void()>& scenario,
                                     int maxRuns) {
  return sweep({[=](FaultGuard& g, int n) { g.arm(call, {.countdown = n, .persist = false, .result = result}); },
                [=] { return platform::fault::fired(call); }, false},
               scenario, maxRuns);
}
