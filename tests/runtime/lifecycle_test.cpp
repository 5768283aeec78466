// The runtime's life: start and stop, further instances, restart, the idle
// network thread, the stop's clean-up of what is still registered, and the
// stop's hand-over of the network mutex.
#include <chrono>
#include <cstdio>
#include <ctime>
#include <memory>
#include <thread>

#include <gtest/gtest.h>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "free_port.h"
#include "raw_socket.h"
#include "tasks.h"
#include "vardel_platform.h"
#include "watchdog.h"
#include "win32.h"
#include "winsock.h"

namespace {

using Clock = std::chrono::steady_clock;

double millisecondsSince(Clock::time_point start) {
  return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

class Runtime : public ::testing::Test {
 protected:
  // A dotted local host needs no forward lookup, and its reverse lookup is
  // answered from the hosts file: the start doesn't depend on a name server.
  void SetUp() override { platform::setLocalHost("127.0.0.1"); }
  void TearDown() override { platform::setLocalHost(nullptr); }
};

TEST_F(Runtime, StartBringsUpThreadAndLocalAddressAndStopTakesThemDown) {
  ASSERT_EQ(N_Address::getLocalAddress(), nullptr);
  std::set<int> before = tasks::ids();
  AllocationBalance balance;
  int thread = -1;

  auto started = Clock::now();
  auto network = std::make_unique<N_Initializer>();
  double startMs = millisecondsSince(started);

  const N_Address* local = N_Address::getLocalAddress();
  ASSERT_NE(local, nullptr);
  EXPECT_EQ(local->getIdentifier(), platform::inet_addr("127.0.0.1"));
  ASSERT_NE(local->getStringNumber(), nullptr);
  EXPECT_STREQ(const_cast<const char*>(local->getStringNumber()), "127.0.0.1");
  thread = tasks::theNewThread(before);
  ASSERT_NE(thread, -1) << "the start should leave exactly one thread running";

  auto stopping = Clock::now();
  network.reset();
  double stopMs = millisecondsSince(stopping);
  std::printf("start %.1f ms, stop %.1f ms\n", startMs, stopMs);

  EXPECT_EQ(N_Address::getLocalAddress(), nullptr);
  EXPECT_TRUE(tasks::eventually([&] { return !tasks::alive(thread); })) << "network thread still there";
  EXPECT_TRUE(balance.settles());
  // The stop ended this process's use of Winsock.
  EXPECT_EQ(platform::WSACleanup(), platform::SOCKET_ERROR);
}

// A further instance only counts: whichever of two goes first, the runtime
// stays up until the other goes too.
void checkTwoInstances(bool firstGoesFirst) {
  std::set<int> before = tasks::ids();
  AllocationBalance balance;
  auto first = std::make_unique<N_Initializer>();
  const N_Address* local = N_Address::getLocalAddress();
  ASSERT_NE(local, nullptr);
  int thread = tasks::theNewThread(before);
  ASSERT_NE(thread, -1);

  auto second = std::make_unique<N_Initializer>();
  EXPECT_EQ(N_Address::getLocalAddress(), local) << "a further instance made a new local address";
  EXPECT_EQ(tasks::theNewThread(before), thread) << "a further instance started threads";

  // An address made now is registered with the running runtime, so the
  // final stop deletes it.
  Q_New<N_Address>("127.0.0.1");

  if (firstGoesFirst) {
    first.reset();
  } else {
    second.reset();
  }
  EXPECT_EQ(N_Address::getLocalAddress(), local);
  EXPECT_EQ(local->getIdentifier(), platform::inet_addr("127.0.0.1"));
  EXPECT_TRUE(tasks::alive(thread));
  EXPECT_GT(balance.outstanding(), 0);

  first.reset();
  second.reset();
  EXPECT_EQ(N_Address::getLocalAddress(), nullptr);
  EXPECT_TRUE(tasks::eventually([&] { return !tasks::alive(thread); }));
  EXPECT_TRUE(balance.settles());
}

TEST_F(Runtime, SecondInstanceOnlyCountsWhenFirstGoesFirst) { checkTwoInstances(true); }
TEST_F(Runtime, SecondInstanceOnlyCountsWhenSecondGoesFirst) { checkTwoInstances(false); }

TEST_F(Runtime, RestartInSameProcessMakesEverythingAnew) {
  AllocationBalance balance;
  std::set<int> before = tasks::ids();
  int firstThread = -1;
  {
    N_Initializer network;
    firstThread = tasks::theNewThread(before);
    ASSERT_NE(firstThread, -1);
  }
  ASSERT_TRUE(tasks::eventually([&] { return !tasks::alive(firstThread); }));

  platform::setLocalHost("localhost");
  {
    N_Initializer network;
    const N_Address* local = N_Address::getLocalAddress();
    ASSERT_NE(local, nullptr);
    EXPECT_EQ(local->getIdentifier(), platform::inet_addr("127.0.0.1"));
    EXPECT_STREQ(const_cast<const char*>(local->getStringName()), "localhost");
    int secondThread = tasks::theNewThread(before);
    ASSERT_NE(secondThread, -1);
    EXPECT_NE(secondThread, firstThread);

    // The new runtime's registry works: an address left behind goes with the stop.
    Q_New<N_Address>("localhost");
  }
  EXPECT_EQ(N_Address::getLocalAddress(), nullptr);
  EXPECT_TRUE(balance.settles());
}

// Processor time of the calling thread, from the kernel.
double threadCpuSeconds() {
  timespec t{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &t);
  return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) / 1e9;
}

TEST_F(Runtime, IdleNetworkThreadBlocksInsteadOfSpinning) {
  std::set<int> before = tasks::ids();
  N_Initializer network;
  int thread = tasks::theNewThread(before);
  ASSERT_NE(thread, -1);

  // First make sure the measurement can see a busy thread at all.
  std::atomic<int> spinnerId{-1};
  long spinnerTicks = -1;
  std::thread spinner([&] {
    spinnerId = static_cast<int>(::gettid());
    double begin = threadCpuSeconds();
    auto deadline = Clock::now() + std::chrono::seconds(5);
    while (threadCpuSeconds() - begin < 0.2 && Clock::now() < deadline) {
    }
    spinnerTicks = tasks::cpuTicks(spinnerId);
  });
  spinner.join();
  ASSERT_GE(spinnerTicks * 1000 / tasks::ticksPerSecond(), 100) << "CPU time of threads can't be measured here";

  // Then a few wake-ups, and a quiet spell.
  for (int i = 0; i < 3; ++i) N_Address wake("127.0.0.1");
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  long ticksBefore = tasks::cpuTicks(thread);
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  long ticksAfter = tasks::cpuTicks(thread);
  ASSERT_GE(ticksBefore, 0);
  ASSERT_GE(ticksAfter, 0);
  long usedMs = (ticksAfter - ticksBefore) * 1000 / tasks::ticksPerSecond();
  std::printf("network thread used %ld ms of processor time in 300 ms idle\n", usedMs);
  EXPECT_LE(usedMs, 50);
}

TEST_F(Runtime, StopDeletesAddressesStillRegistered) {
  AllocationBalance balance;
  {
    N_Initializer network;
    Q_New<N_Address>("127.0.0.1");
    Q_New<N_Address>("localhost");
    Q_New<N_Address>("0.0.0.0");
    N_Address* reconstructed = Q_New<N_Address>("localhost");
    reconstructed->construct("127.0.0.1");
    EXPECT_GT(balance.outstanding(), 0);
  }
  EXPECT_TRUE(balance.settles());
}

// Waits for the network thread to accept a connection for `listener`.
N_Socket::ConnectData* awaitConnection(N_Listener& listener) {
  N_Socket::ConnectData* data = nullptr;
  tasks::eventually([&] { return listener.pollConnect(data); }, 10.0);
  return data;
}

// Sockets (with sends and reads in flight), a listener and addresses that
// are still registered at the stop are deleted: their ports are closed and
// every allocation, queue records and buffers included, is released.
TEST_F(Runtime, StopDeletesSocketsListenersAndAddressesStillRegistered) {
  std::uint16_t listenPort = pickFreePort();
  std::uint16_t udpPort = pickFreePort();
  ASSERT_NE(listenPort, 0);
  ASSERT_NE(udpPort, 0);
  AllocationBalance balance;
  int peer = -1;
  {
    N_Initializer network;
    N_Listener* listener = Q_New<N_Listener>(listenPort);
    peer = raw::connectTo("127.0.0.1", listenPort);
    ASSERT_GE(peer, 0);
    N_Socket::ConnectData* data = awaitConnection(*listener);
    ASSERT_NE(data, nullptr);
    N_Socket* accepted = Q_New<N_Socket>(data);
    char payload[1000] = {};
    for (int i = 0; i < 20; ++i) accepted->send(payload, sizeof payload);
    ASSERT_TRUE(raw::sendAll(peer, payload, sizeof payload));

    N_Address* address = Q_New<N_Address>("127.0.0.1");
    N_Socket* udp = Q_New<N_Socket>(address, udpPort, N_Socket::SOCKET_UDP);
    udp->send(payload, 100);
    EXPECT_FALSE(portIsFree(udpPort));
    EXPECT_FALSE(portIsFree(listenPort));
    // Let the network thread post reads and issue sends.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  EXPECT_TRUE(raw::closedByPeer(peer, 10000)) << "the accepted connection wasn't closed";
  raw::closeFd(peer);
  EXPECT_TRUE(portIsFree(listenPort));
  EXPECT_TRUE(portIsFree(udpPort));
  EXPECT_TRUE(balance.settles());
}

// Connections accepted but never claimed: their records go with the stop,
// and their sockets are closed with Winsock.
TEST_F(Runtime, StopDropsUnclaimedConnections) {
  std::uint16_t port = pickFreePort();
  ASSERT_NE(port, 0);
  AllocationBalance balance;
  int peers[3] = {-1, -1, -1};
  {
    N_Initializer network;
    N_Listener listener(port);
    for (int& peer : peers) {
      peer = raw::connectTo("127.0.0.1", port);
      ASSERT_GE(peer, 0);
    }
    ASSERT_NE(awaitConnection(listener), nullptr);
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    listener.destruct();
  }
  for (int peer : peers) {
    EXPECT_TRUE(raw::closedByPeer(peer, 10000));
    raw::closeFd(peer);
  }
  EXPECT_TRUE(balance.settles());
}

// An address that the application destroyed itself before the stop is out of
// the registry; the stop must not touch it again.
TEST_F(Runtime, StopLeavesAddressesDestroyedBeforeAlone) {
  AllocationBalance balance;
  {
    N_Initializer network;
    N_Address* gone = Q_New<N_Address>("127.0.0.1");
    Q_New<N_Address>("localhost");
    Q_Delete(gone);
    N_Address onStack("localhost");
    onStack.destruct();
  }
  EXPECT_TRUE(balance.settles());
}

// A thread that still owns the network mutex by one level when it stops the
// runtime gives that level up first; otherwise the network thread, waiting
// for the mutex, could never end.
TEST_F(Runtime, StopFromThreadOwningNetworkMutexOneLevel) {
  std::set<int> before = tasks::ids();
  auto network = std::make_unique<N_Initializer>();
  int thread = tasks::theNewThread(before);
  ASSERT_NE(thread, -1);

  // The mutex has a fixed name; another handle to it is the same mutex.
  platform::HANDLE mutex = platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex");
  ASSERT_NE(mutex, nullptr);
  ASSERT_EQ(platform::WaitForSingleObject(mutex, platform::INFINITE), platform::WAIT_OBJECT_0);
  // Registering an address wakes the network thread, which then waits for
  // the mutex this thread holds.
  Q_New<N_Address>("127.0.0.1");
  std::this_thread::sleep_for(std::chrono::milliseconds(50));

  {
    Watchdog dog(20.0, "stop by the owner of the network mutex");
    network.reset();
  }
  EXPECT_TRUE(tasks::eventually([&] { return !tasks::alive(thread); }));
  platform::CloseHandle(mutex);
}

}  // namespace
