/// @class Q_Timer
/// A stopwatch on the monotonic clock: the age in seconds since construction
/// or the last reset.
///
/// The whole state is one integer and the destructor does nothing, so the class
/// stays trivially copyable: records kept in raw storage hold a Q_Timer that no
/// constructor ran for, and reset() alone makes it usable. It has no lock: a
/// timer that one thread resets must not be read by another at the same time.
#pragma once

#include <cstdint>

#include "vardel_export.h"

class VARDEL_API Q_Timer {
 public:
  /// Age 0.
  Q_Timer();
  /// Does nothing, so that the class stays trivially copyable.
  ~Q_Timer() = default;

  /// Age 0 from now.
  void reset();
  /// Seconds since the age was 0.
  /// @note A float: at an age of one hour its step is about 0.25 ms, at one
  /// day about 8 ms. A world clock that runs for days (N_Server::getWorldTimer)
  /// gets that coarse.
  float getAge() const;
  /// The age becomes `age` and runs on from there. Negative ages are allowed:
  /// the timer then reaches 0 that many seconds from now.
  void setAge(float age);

 private:
  std::int64_t m_iStartNanoseconds;  // steady-clock time at which the age was 0
};
