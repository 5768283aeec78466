// The shared test fixtures do what other tests rely on: a fault guard
// disarms, the balance sees a missing release, a child process is read,
// written, timed out and never left behind, and a picked port is free.
#include <signal.h>
#include <unistd.h>

#include <cerrno>

#include <gtest/gtest.h>

#include "Q_New.h"
#include "allocation_balance.h"
#include "child_process.h"
#include "fault_guard.h"
#include "free_port.h"
#include "raw_socket.h"
#include "win32.h"

namespace {

TEST(Fixtures, FaultGuardDisarmsEverythingAtScopeExit) {
  {
    FaultGuard faults(platform::fault::Call::CreateMutexA, {.countdown = 1, .persist = true, .result = 8});
    faults.failAllocation(1, true);
    EXPECT_EQ(platform::CreateMutexA(nullptr, platform::FALSE, nullptr), nullptr);
    EXPECT_THROW(Q_NewArray<char>(1), Q_MemoryException_Allocation*);
  }
  platform::HANDLE mutex = platform::CreateMutexA(nullptr, platform::FALSE, nullptr);
  EXPECT_NE(mutex, nullptr);
  platform::CloseHandle(mutex);
  char* p = Q_NewArray<char>(1);
  Q_DeleteArray(p);
}

TEST(Fixtures, AllocationBalanceSeesWhatIsNotReleased) {
  AllocationBalance balance;
  char* kept = Q_NewArray<char>(8);
  EXPECT_EQ(balance.outstanding(), 1);
  EXPECT_FALSE(balance.settles(0.05));
  Q_DeleteArray(kept);
  EXPECT_TRUE(balance.settles(0.05));
  EXPECT_TRUE(allocationsBalance([] { Q_DeleteArray(Q_NewArray<int>(3)); }));
  int* leaked = nullptr;
  EXPECT_FALSE(allocationsBalance([&] { leaked = Q_NewArray<int>(3); }, 0.05));
  Q_DeleteArray(leaked);
}

TEST(Fixtures, ChildProcessLinesInputAndExitStatus) {
  ChildProcess child("/bin/sh", {"-c", "echo first; echo ready now; read line; echo \"got $line\"; exit 7"});
  ASSERT_TRUE(child.started()) << child.startError();
  EXPECT_EQ(child.readLine(5000), "first");
  EXPECT_EQ(child.waitForLine("ready", 5000), "ready now");
  EXPECT_EQ(child.readLine(100), std::nullopt) << "nothing more before the input";
  ASSERT_TRUE(child.writeLine("hello"));
  EXPECT_EQ(child.readLine(5000), "got hello");
  EXPECT_EQ(child.wait(5000), 7);
  EXPECT_EQ(child.readLine(100), std::nullopt);
  EXPECT_EQ(child.lines().size(), 3u);
}

TEST(Fixtures, ChildProcessThatDoesNotExist) {
  ChildProcess child("/no/such/program");
  EXPECT_FALSE(child.started());
  EXPECT_FALSE(child.startError().empty());
  EXPECT_EQ(child.readLine(10), std::nullopt);
  EXPECT_EQ(child.wait(10), std::nullopt);
}

TEST(Fixtures, ChildProcessIsKilledAndReapedAtScopeExit) {
  int pid = -1;
  {
    ChildProcess child("/bin/sleep", {"60"});
    ASSERT_TRUE(child.started());
    pid = child.pid();
    EXPECT_EQ(child.wait(50), std::nullopt);
  }
  // Reaped: the pid no longer names a child of this process.
  errno = 0;
  EXPECT_EQ(::kill(pid, 0), -1);
  EXPECT_EQ(errno, ESRCH);
}

TEST(Fixtures, ChildProcessKilledBySignal) {
  ChildProcess child("/bin/sleep", {"60"});
  ASSERT_TRUE(child.started());
  child.kill(SIGTERM);
  EXPECT_EQ(child.wait(5000), 128 + SIGTERM);
}

TEST(Fixtures, PickedPortsAreFreeAndHeldPortsAreNot) {
  std::uint16_t port = pickFreePort();
  ASSERT_NE(port, 0);
  EXPECT_TRUE(portIsFree(port));
  std::uint16_t pair = pickFreePort(true);
  ASSERT_NE(pair, 0);
  EXPECT_TRUE(portIsFree(pair));
  EXPECT_TRUE(portIsFree(pair + 1));

  // Held with address reuse, as the library's sockets are, it isn't free.
  int udp = raw::udpBound("127.0.0.1", port);
  ASSERT_GE(udp, 0);
  EXPECT_FALSE(portIsFree(port));
  raw::closeFd(udp);
  std::uint16_t listening = pair;
  int tcp = raw::listenOn("0.0.0.0", listening);
  ASSERT_GE(tcp, 0);
  EXPECT_FALSE(portIsFree(pair));
  raw::closeFd(tcp);
  EXPECT_TRUE(portIsFree(pair));
}

}  // namespace
