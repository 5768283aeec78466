// Q_STR's buffers, the diagnostic line of Sys, and Q_String.
#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Q_System.h"

namespace {

std::mutex g_linesLock;
std::vector<std::string> g_lines;

void collect(const char* line) {
  std::lock_guard<std::mutex> hold(g_linesLock);
  g_lines.emplace_back(line);
}

std::atomic<int> g_counted{0};
void count(const char*) { g_counted.fetch_add(1); }

class QVerbose : public testing::Test {
 protected:
  void SetUp() override { g_lines.clear(); }
  void TearDown() override {
    Sys->setVerboseSink(nullptr);
    Sys->setVerbose(false);
  }
};

}  // namespace

TEST(QStr, FormatsAndKeepsEachTextForTheNextSevenCalls) {
  const char* first = Q_STR("error %d on %s", 10054, "socket");
  EXPECT_STREQ("error 10054 on socket", first);
  std::vector<const char*> later;
  for (int i = 0; i < 7; ++i) later.push_back(Q_STR("%d", i));
  EXPECT_STREQ("error 10054 on socket", first);
  for (int i = 0; i < 7; ++i) EXPECT_EQ(std::to_string(i), later[i]);
}

TEST(QStr, CutsLongTextAndKeepsThreadsApart) {
  std::string longText(5000, 'y');
  EXPECT_EQ(std::string(2047, 'y'), Q_STR("%s", longText.c_str()));

  const char* mine = Q_STR("main thread");
  std::thread([] {
    for (int i = 0; i < 20; ++i) Q_STR("other thread %d", i);
  }).join();
  EXPECT_STREQ("main thread", mine);
}

TEST(QString, CopiesTheGivenLength) {
  Q_String text;
  EXPECT_STREQ("", text.c_str());
  text.assign("abcdef", 3);
  EXPECT_STREQ("abc", text.c_str());
  EXPECT_EQ(3u, text.length());
  Q_String kept(Q_STR("kept %d", 1));
  for (int i = 0; i < 8; ++i) Q_STR("overwrite %d", i);
  EXPECT_STREQ("kept 1", kept.c_str());
  kept.assign(nullptr, 4);
  EXPECT_STREQ("", kept.c_str());
}

TEST_F(QVerbose, SilentUntilTurnedOn) {
  ASSERT_NE(nullptr, Sys);
  EXPECT_FALSE(Sys->isVerbose());
  testing::internal::CaptureStderr();
  Sys->verbose("hidden %d", 1);
  Sys->setVerbose(true);
  Sys->verbose("shown %d", 2);
  Sys->verbose("%s", "already ended\n");
  Sys->setVerbose(false);
  Sys->verbose("hidden %d", 3);
  EXPECT_EQ("shown 2\nalready ended\n", testing::internal::GetCapturedStderr());
}

TEST_F(QVerbose, TheSinkGetsEachLineUntilRemoved) {
  Sys->setVerboseSink(collect);
  Sys->verbose("%s", Q_STR("WSASend failed with %s (%d)", "WSAECONNRESET", 10054));
  Sys->verbose("100%% sure\n");
  Sys->setVerboseSink(nullptr);
  Sys->verbose("after removal");
  EXPECT_EQ((std::vector<std::string>{"WSASend failed with WSAECONNRESET (10054)", "100% sure"}), g_lines);
}

TEST_F(QVerbose, LinesFromManyThreadsWhileTheSinkChanges) {
  constexpr int kThreads = 4;
  constexpr int kLines = 2000;
  std::atomic<bool> done{false};
  std::thread toggler([&] {
    while (!done.load()) {
      Sys->setVerboseSink(count);
      Sys->setVerboseSink(nullptr);
    }
  });
  std::vector<std::thread> writers;
  for (int t = 0; t < kThreads; ++t) {
    writers.emplace_back([t] {
      for (int i = 0; i < kLines; ++i) Sys->verbose("thread %d line %d", t, i);
    });
  }
  for (std::thread& w : writers) w.join();
  done.store(true);
  toggler.join();
  EXPECT_LE(g_counted.load(), kThreads * kLines);

  g_counted.store(0);
  Sys->setVerboseSink(count);
  Sys->verbose("one");
  EXPECT_EQ(1, g_counted.load());
}
