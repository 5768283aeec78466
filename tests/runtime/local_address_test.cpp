// The local address, the last step of the start: made from the host name the
// process reports, waited for until its identifier is known, and given up
// (bounded) when it can't be.
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "fault_guard.h"
#include "tasks.h"
#include "watchdog.h"
#include "winsock.h"

namespace {

using platform::fault::Call;

std::string text(const volatile char* s) { return s != nullptr ? std::string(const_cast<const char*>(s)) : "(null)"; }

class LocalAddress : public ::testing::Test {
 protected:
  void TearDown() override { platform::setLocalHost(nullptr); }

  // Starts the runtime and expects N_NetException_IPNotResolved, the network
  // thread left running and a later instance doing nothing.
  void expectNotResolved() {
    std::set<int> before = tasks::ids();
    Watchdog dog(60.0, "start with a local host that doesn't resolve");
    auto start = std::chrono::steady_clock::now();
    try {
      N_Initializer network;
      ADD_FAILURE() << "the start didn't throw";
    } catch (N_NetException_IPNotResolved* e) {
      EXPECT_STREQ(e->getErrorMessage(), "IP address is not resolved yet");
    } catch (Q_Exception* e) {
      ADD_FAILURE() << "wrong exception: " << e->getErrorMessage();
    }
    std::printf("start gave up after %.2f s\n",
                std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());

    const N_Address* local = N_Address::getLocalAddress();
    ASSERT_NE(local, nullptr);
    EXPECT_EQ(local->getIdentifier(), 0u);
    EXPECT_TRUE(tasks::eventually([&] {
      for (int tid : tasks::ids())
        if (before.count(tid) == 0) return true;
      return false;
    })) << "the network thread should be left running";

    N_Initializer again;  // a no-op: the count stayed raised
    EXPECT_EQ(N_Address::getLocalAddress(), local);
  }
};

TEST_F(LocalAddress, DottedHostNeedsNoLookup) {
  platform::setLocalHost("127.0.0.2");
  N_Initializer network;
  const N_Address* local = N_Address::getLocalAddress();
  ASSERT_NE(local, nullptr);
  EXPECT_EQ(local->getIdentifier(), platform::inet_addr("127.0.0.2"));
  EXPECT_EQ(text(local->getStringNumber()), "127.0.0.2");
}

TEST_F(LocalAddress, HostNameIsResolvedBeforeTheStartReturns) {
  platform::hostent* host = platform::gethostbyname("localhost");
  ASSERT_TRUE(host != nullptr && host->h_addr_list[0] != nullptr) << "this machine doesn't resolve localhost";
  std::uint32_t expected;
  std::memcpy(&expected, host->h_addr_list[0], 4);

  platform::setLocalHost("localhost");
  N_Initializer network;
  const N_Address* local = N_Address::getLocalAddress();
  ASSERT_NE(local, nullptr);
  EXPECT_EQ(local->getIdentifier(), expected);
  EXPECT_EQ(text(local->getStringName()), "localhost");
}

// The machine's own name: whatever the name service says about it, the
// start agrees.
TEST_F(LocalAddress, MachineHostName) {
  char name[1024] = {};
  ASSERT_EQ(platform::gethostname(name, sizeof name), 0);
  platform::hostent* host = platform::gethostbyname(name);
  bool resolves = host != nullptr && host->h_addr_list != nullptr && host->h_addr_list[0] != nullptr;
  if (!resolves) {
    expectNotResolved();
    return;
  }
  std::uint32_t expected;
  std::memcpy(&expected, host->h_addr_list[0], 4);
  N_Initializer network;
  ASSERT_NE(N_Address::getLocalAddress(), nullptr);
  EXPECT_EQ(N_Address::getLocalAddress()->getIdentifier(), expected);
}

TEST_F(LocalAddress, NameThatDoesNotResolveEndsTheStart) {
  platform::setLocalHost("no-such-host.invalid");
  expectNotResolved();
}

TEST_F(LocalAddress, FailedLookupEndsTheStart) {
  FaultGuard faults(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  platform::setLocalHost("localhost");
  expectNotResolved();
  EXPECT_EQ(platform::fault::fired(Call::gethostbyname), 1);
}

TEST_F(LocalAddress, AllZerosEndsTheStart) {
  platform::setLocalHost("0.0.0.0");
  expectNotResolved();
}

// No resolver means no lookup will ever come: the start gives up at once.
TEST_F(LocalAddress, ResolverThatCannotStartEndsTheStart) {
  // The first thread is the network thread, the second the resolver.
  FaultGuard faults(Call::AfxBeginThread, {.countdown = 2, .persist = false, .result = 10055});
  platform::setLocalHost("localhost");
  expectNotResolved();
  EXPECT_EQ(platform::fault::fired(Call::AfxBeginThread), 1);
}

// Without its thread the runtime still comes up, and its stop doesn't wait
// for a thread that never ran.
TEST_F(LocalAddress, NetworkThreadThatCannotStart) {
  FaultGuard faults(Call::AfxBeginThread, {.countdown = 1, .persist = false, .result = 10055});
  platform::setLocalHost("127.0.0.2");
  Watchdog dog(20.0, "start and stop without a network thread");
  {
    N_Initializer network;
    EXPECT_EQ(platform::fault::fired(Call::AfxBeginThread), 1);
    ASSERT_NE(N_Address::getLocalAddress(), nullptr);
  }
  EXPECT_EQ(N_Address::getLocalAddress(), nullptr);
}

}  // namespace
