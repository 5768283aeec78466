// A stopwatch on the monotonic clock: the age in seconds since construction
// or the last reset.
//
// The whole state is one integer and the destructor does nothing, so the class
// stays trivially copyable: records kept in raw storage hold a Q_Timer that no
// constructor ran for, and reset() alone makes it usable.
#pragma once

#include <cstdint>

#include "vardel_export.h"

class VARDEL_API Q_Timer {
 public:
  Q_Timer();  // age 0
  ~Q_Timer() = default;

  void reset();  // age 0 from now
  float getAge() const;
  // The age becomes `age` and runs on from there. Negative ages are allowed:
  // the timer then reaches 0 that many seconds from now.
  void setAge(float age);

 private:
  std::int64_t m_iStartNanoseconds;  // steady-clock time at which the age was 0
};
