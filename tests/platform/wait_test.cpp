// WSAWaitForMultipleEvents: the lowest signalled index, manual reset,
// wake-ups from other threads, time-outs, and a wait that doesn't spin.
#include <chrono>
#include <ctime>
#include <thread>
#include <vector>

#include "fault.h"
#include "socket_pair.h"

using namespace platform_test;

namespace {

double threadCpuSeconds() {
  return static_cast<double>(std::clock()) / CLOCKS_PER_SEC;  // process CPU: the setter only sleeps
}

struct Events {
  std::vector<WSAEVENT> handles;
  explicit Events(int n) {
    for (int i = 0; i < n; ++i) handles.push_back(WSACreateEvent());
  }
  ~Events() {
    for (WSAEVENT e : handles) WSACloseEvent(e);
  }
};

}  // namespace

TEST(Wait, ReturnsTheLowestSignalledIndexAndEventsStaySignalledUntilReset) {
  Events e(64);
  ASSERT_TRUE(WSASetEvent(e.handles[63]));
  ASSERT_TRUE(WSASetEvent(e.handles[7]));
  EXPECT_EQ(7u, WSAWaitForMultipleEvents(64, e.handles.data(), FALSE, 0, FALSE));
  EXPECT_EQ(7u, WSAWaitForMultipleEvents(64, e.handles.data(), FALSE, 0, FALSE)) << "manual reset";
  ASSERT_TRUE(WSAResetEvent(e.handles[7]));
  EXPECT_EQ(63u, WSAWaitForMultipleEvents(64, e.handles.data(), FALSE, 0, FALSE));
  ASSERT_TRUE(WSAResetEvent(e.handles[63]));
  EXPECT_EQ(WSA_WAIT_TIMEOUT, WSAWaitForMultipleEvents(64, e.handles.data(), FALSE, 20, FALSE));
}

TEST(Wait, RejectsBadArgumentsAndDeadHandles) {
  Events e(65);
  EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(65, e.handles.data(), FALSE, 0, FALSE));
  EXPECT_EQ(WSA_INVALID_PARAMETER, WSAGetLastError());
  EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(0, e.handles.data(), FALSE, 0, FALSE));
  WSAEVENT dead = WSACreateEvent();
  ASSERT_TRUE(WSACloseEvent(dead));
  EXPECT_FALSE(WSASetEvent(dead));
  WSAEVENT set[2] = {e.handles[0], dead};
  EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(2, set, FALSE, 0, FALSE));
  EXPECT_EQ(WSA_INVALID_HANDLE, WSAGetLastError());
  platform::fault::arm(platform::fault::Call::WSAWaitForMultipleEvents, {1, false, WSAENETDOWN});
  EXPECT_EQ(WSA_WAIT_FAILED, WSAWaitForMultipleEvents(1, set, FALSE, 0, FALSE));
  EXPECT_EQ(WSAENETDOWN, WSAGetLastError());
  EXPECT_EQ(WSA_WAIT_TIMEOUT, WSAWaitForMultipleEvents(1, set, FALSE, 0, FALSE)) << "the plan fired once";
}

TEST(Wait, AnotherThreadsSetWakesABlockedWaitThatUsesNoCpu) {
  Events e(2);
  std::thread setter([&] {
    Sleep(300);
    WSASetEvent(e.handles[1]);
  });
  double before = threadCpuSeconds();
  DWORD result = WSAWaitForMultipleEvents(2, e.handles.data(), FALSE, 10000, TRUE);
  double used = threadCpuSeconds() - before;
  setter.join();
  EXPECT_EQ(1u, result);
  EXPECT_LT(used, 0.1) << "a blocked wait sleeps in the kernel instead of spinning";
}

TEST(Wait, ClosingAnEventDuringAWaitIsSafe) {
  WSAEVENT a = WSACreateEvent();
  WSAEVENT b = WSACreateEvent();
  std::thread closer([&] {
    Sleep(50);
    WSACloseEvent(b);
    WSASetEvent(a);
  });
  WSAEVENT set[2] = {a, b};
  EXPECT_EQ(0u, WSAWaitForMultipleEvents(2, set, FALSE, 5000, FALSE));
  closer.join();
  WSACloseEvent(a);
}
