// Q_Timer ages and Q_Mutex nesting and exclusion.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <latch>
#include <thread>
#include <vector>

#include "Q_Mutex.h"
#include "Q_Timer.h"

namespace {

void sleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

// Whether another thread could take the mutex right now.
bool otherThreadCanTake(Q_Mutex& mutex) {
  bool took = false;
  std::thread([&] {
    took = mutex.tryLock();
    if (took) mutex.unlock();
  }).join();
  return took;
}

}  // namespace

TEST(QTimer, StartsAtZeroAndRuns) {
  Q_Timer timer;
  float start = timer.getAge();
  EXPECT_GE(start, 0.0f);
  EXPECT_LT(start, 1.0f);
  sleepMs(30);
  EXPECT_GE(timer.getAge(), 0.029f);
  EXPECT_GT(timer.getAge(), start);
}

TEST(QTimer, SetAgeRunsOnFromTheGivenAgeAndResetGoesBackToZero) {
  Q_Timer timer;
  timer.setAge(100.0f);
  float age = timer.getAge();
  EXPECT_GE(age, 100.0f);
  EXPECT_LT(age, 101.0f);
  sleepMs(30);
  EXPECT_GE(timer.getAge(), 100.029f);

  timer.setAge(-2.0f);
  age = timer.getAge();
  EXPECT_GE(age, -2.0f);
  EXPECT_LT(age, -1.0f);

  timer.reset();
  age = timer.getAge();
  EXPECT_GE(age, 0.0f);
  EXPECT_LT(age, 1.0f);
}

TEST(QTimer, ResetAloneMakesRawStorageATimerAndCopiesKeepTheAge) {
  void* raw = std::malloc(sizeof(Q_Timer));
  ASSERT_NE(nullptr, raw);
  std::memset(raw, 0xff, sizeof(Q_Timer));
  auto* timer = static_cast<Q_Timer*>(raw);
  timer->reset();
  float age = timer->getAge();
  EXPECT_GE(age, 0.0f);
  EXPECT_LT(age, 1.0f);

  Q_Timer old;
  old.setAge(50.0f);
  std::memcpy(raw, &old, sizeof(Q_Timer));
  EXPECT_GE(timer->getAge(), 50.0f);
  EXPECT_LT(timer->getAge(), 51.0f);
  std::free(raw);
}

TEST(QMutex, NestedLocksHoldUntilTheOutermostEnds) {
  Q_Mutex mutex;
  {
    Q_MutexLock outer(&mutex);
    {
      Q_MutexLock inner(&mutex);
      EXPECT_FALSE(otherThreadCanTake(mutex));
    }
    EXPECT_FALSE(otherThreadCanTake(mutex)) << "released at the inner unlock";
  }
  EXPECT_TRUE(otherThreadCanTake(mutex)) << "still held after the outermost unlock";
}

TEST(QMutex, ExcludesOtherThreads) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 20000;
  Q_Mutex mutex;
  long total = 0;  // guarded by mutex only
  std::latch start(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      start.arrive_and_wait();
      for (int i = 0; i < kRounds; ++i) {
        Q_MutexLock hold(&mutex);
        long seen = total;
        {
          Q_MutexLock again(&mutex);
          total = seen + 1;
        }
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(kThreads * kRounds, total);
}
