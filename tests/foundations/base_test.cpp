// Small services: Q_STR's buffers, Q_String, the diagnostic line, Q_Timer and
// Q_Mutex.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Q_Mutex.h"
#include "Q_System.h"
#include "Q_Timer.h"

namespace {

std::mutex g_linesLock;
std::vector<std::string> g_lines;
void collect(const char* line) {
  std::lock_guard<std::mutex> hold(g_linesLock);
  g_lines.emplace_back(line);
}

bool otherThreadCanTake(Q_Mutex& mutex) {
  bool took = false;
  std::thread([&] {
    if ((took = mutex.tryLock())) mutex.unlock();
  }).join();
  return took;
}

}  // namespace

TEST(QStr, KeepsEachTextForSevenMoreCallsOfItsThreadAndCutsLongOnes) {
  const char* first = Q_STR("error %d on %s", 10054, "socket");
  std::vector<const char*> later;
  for (int i = 0; i < 7; ++i) later.push_back(Q_STR("%d", i));
  std::thread([] {
    for (int i = 0; i < 20; ++i) Q_STR("other thread %d", i);
  }).join();
  EXPECT_STREQ("error 10054 on socket", first);
  for (int i = 0; i < 7; ++i) EXPECT_EQ(std::to_string(i), later[i]);
  EXPECT_STREQ("", Q_STR(nullptr));
  EXPECT_EQ(std::string(2047, 'y'), Q_STR("%s", std::string(5000, 'y').c_str()));
  Q_String kept(Q_STR("kept %d", 1));
  for (int i = 0; i < 8; ++i) Q_STR("overwrite %d", i);
  EXPECT_STREQ("kept 1", kept.c_str());
  kept.assign("abcdef", 3);
  EXPECT_STREQ("abc", kept.c_str());
  EXPECT_EQ(3u, kept.length());
  kept.assign(nullptr, 4);
  EXPECT_EQ(0u, kept.length() + Q_String(nullptr).length());
}

TEST(QVerbose, LinesGoToStderrWhenOnAndToTheSinkUntilRemoved) {
  testing::internal::CaptureStderr();
  Sys->verbose("hidden %d", 1);
  Sys->setVerbose(true);
  EXPECT_TRUE(Sys->isVerbose());
  Sys->verbose("shown %d", 2);
  Sys->verbose("%s", "already ended\n");
  Sys->setVerbose(false);
  Sys->verbose("hidden %d", 3);
  EXPECT_EQ("shown 2\nalready ended\n", testing::internal::GetCapturedStderr());
  Sys->setVerboseSink(collect);
  Sys->verbose("%s", Q_STR("WSASend failed with %s (%d)", "WSAECONNRESET", 10054));
  Sys->verbose("100%% sure\n");
  Sys->setVerboseSink(nullptr);
  Sys->verbose("after removal");
  EXPECT_EQ((std::vector<std::string>{"WSASend failed with WSAECONNRESET (10054)", "100% sure"}), g_lines);
}

TEST(QTimer, RunsFromZeroOrTheAgeGivenAndResetsRawStorage) {
  Q_Timer timer;
  EXPECT_TRUE(timer.getAge() >= 0.0f && timer.getAge() < 1.0f);
  std::this_thread::sleep_for(std::chrono::milliseconds(30));
  EXPECT_GE(timer.getAge(), 0.029f);
  timer.setAge(100.0f);
  EXPECT_TRUE(timer.getAge() >= 100.0f && timer.getAge() < 101.0f);
  timer.setAge(-2.0f);
  EXPECT_TRUE(timer.getAge() >= -2.0f && timer.getAge() < -1.0f);
  // Records hold timers in raw storage that no constructor ran for.
  void* raw = std::malloc(sizeof(Q_Timer));
  std::memset(raw, 0xff, sizeof(Q_Timer));
  auto* stored = static_cast<Q_Timer*>(raw);
  stored->reset();
  EXPECT_TRUE(stored->getAge() >= 0.0f && stored->getAge() < 1.0f);
  std::memcpy(raw, &timer, sizeof(Q_Timer));
  EXPECT_TRUE(stored->getAge() >= -2.0f && stored->getAge() < -1.0f) << "a copy keeps the age";
  std::free(raw);
}

TEST(QMutex, NestedLocksHoldUntilTheOutermostEnds) {
  Q_Mutex mutex;
  {
    Q_MutexLock outer(&mutex);
    {
      Q_MutexLock inner(&mutex);
      Q_MutexLock none(nullptr);
    }
    EXPECT_FALSE(otherThreadCanTake(mutex)) << "released at the inner unlock";
  }
  EXPECT_TRUE(otherThreadCanTake(mutex)) << "still held after the outermost unlock";
}
