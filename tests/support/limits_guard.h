// The process-wide limits for one scope; the earlier ones come back after.
//
//   LimitsGuard open(N_Limits::openNetwork());
#pragma once

#include "N_Initializer.h"
#include "N_Limits.h"

class LimitsGuard {
 public:
  explicit LimitsGuard(const N_Limits& limits) : m_before(N_Initializer::getLimits()) {
    N_Initializer::setLimits(limits);
  }
  ~LimitsGuard() { N_Initializer::setLimits(m_before); }

  LimitsGuard(const LimitsGuard&) = delete;
  LimitsGuard& operator=(const LimitsGuard&) = delete;

 private:
  N_Limits m_before;
};
