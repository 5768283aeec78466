// The arithmetic of dividing a server's budget, checked number for number on
// the division the server itself uses (over the wire the same grants are
// checked by the server and process tests).
#include <gtest/gtest.h>

#include <vector>

#include "cs_fixture.h"

namespace {

using Grants = std::vector<unsigned>;

Grants grants(unsigned budget, unsigned maximum, const Grants& requests) {
  return N_ServerTestAccess::grants(budget, maximum, requests);
}

TEST(BandwidthDivision, WorkedExamples) {
  // Cut in proportion to the share; the grants add up to the budget here.
  EXPECT_EQ(Grants({35714, 42857, 21429}), grants(100000, 60000, {50000, 70000, 30000}));
  // The default request capped; no remainder is handed on (9999 in all).
  EXPECT_EQ(Grants({3333, 3333, 3333}), grants(10000, 10240, {1250000, 1250000, 1250000}));
  // The cut narrows to float: 21891894.9576 becomes 21891894, not 21891895.
  EXPECT_EQ(Grants({8108109, 1891892}), grants(10000000, 40000000, {30000003, 7000001}));
}

TEST(BandwidthDivision, TiesRoundToEven) {
  EXPECT_EQ(Grants({3, 3}), grants(5, 10240, {5, 5}));  // cuts 2.5 -> 2
  EXPECT_EQ(Grants({1, 1}), grants(3, 10240, {3, 3}));  // cuts 1.5 -> 2
}

TEST(BandwidthDivision, NoExcessGrantsTheShares) {
  // A total equal to the budget leaves nothing to take away.
  EXPECT_EQ(Grants({40000, 60000}), grants(100000, 60000, {40000, 60000}));
  EXPECT_EQ(Grants({10240}), grants(1250000, 10240, {1250000}));
  EXPECT_EQ(Grants({0, 7}), grants(100, 10240, {0, 7}));
}

TEST(BandwidthDivision, ZeroSharesAndZeroBudget) {
  EXPECT_EQ(Grants({0, 0}), grants(100, 0, {5000, 7000}));
  EXPECT_EQ(Grants({0, 0}), grants(100, 10240, {0, 0}));
  // The whole total is excess: every share below 2^24 goes to 0.
  EXPECT_EQ(Grants({0, 0, 0}), grants(0, 10240, {10240, 5000, 1}));
}

TEST(BandwidthDivision, CutRoundedPastTheShareIsHeldAtZero) {
  // Float total, excess and cut are all 16777220 here; the grant would wrap
  // to 4294967295.
  EXPECT_EQ(Grants({0}), grants(0, 40000000, {16777219}));
}

}  // namespace
