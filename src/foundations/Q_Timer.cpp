#include "Q_Timer.h"

#include <chrono>
#include <type_traits>

static_assert(std::is_trivially_copyable_v<Q_Timer> && std::is_trivially_destructible_v<Q_Timer>,
              "records hold timers in raw storage");

namespace {

std::int64_t nowNanoseconds() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace

Q_Timer::Q_Timer() { reset(); }

void Q_Timer::reset() { m_iStartNanoseconds = nowNanoseconds(); }

float Q_Timer::getAge() const { return static_cast<float>(static_cast<double>(nowNanoseconds() - m_iStartNanoseconds) * 1e-9); }

void Q_Timer::setAge(float age) {
  m_iStartNanoseconds = nowNanoseconds() - static_cast<std::int64_t>(static_cast<double>(age) * 1e9);
}
