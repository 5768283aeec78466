// Address resolution over the real name service of this machine: the half
// that was given is there at once, a resolver fills in the other, and the
// shared block is freed by whoever lets go of it last. Expectations come from
// the platform's own lookups, not from how the hosts file names 127.0.0.1.
#include <chrono>
#include <cstring>
#include <string>
#include <thread>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "fault_guard.h"
#include "fault_sweep.h"
#include "runtime_test.h"
#include "threads.h"
#include "win32.h"
#include "winsock.h"

namespace {

using platform::fault::Call;

std::string text(const volatile char* s) { return s != nullptr ? std::string(const_cast<const char*>(s)) : "(null)"; }

class Address : public RuntimeTest {
 protected:
  void SetUp() override {
    m_iIdle = threadCount() + 1;  // and the network thread
    RuntimeTest::SetUp();
    ASSERT_TRUE(resolversDone()) << "the runtime's own lookups";
  }
  bool resolversDone() {
    return waitFor([&] { return threadCount() == m_iIdle; }, 30000);
  }
  int m_iIdle = 0;
};

TEST_F(Address, TheGivenHalfIsThereAtOnceAndTheLookupBringsTheOther) {
  platform::hostent* forward = platform::gethostbyname("localhost");
  ASSERT_NE(nullptr, forward) << "this machine doesn't resolve localhost";
  platform::in_addr number;
  std::memcpy(&number.s_addr, forward->h_addr_list[0], 4);
  const std::string numberText = platform::inet_ntoa(number);
  const std::uint32_t loop = platform::inet_addr("127.0.0.1");
  platform::hostent* reverse = platform::gethostbyaddr(reinterpret_cast<const char*>(&loop), 4, platform::AF_INET);
  const std::string name = reverse != nullptr ? reverse->h_name : "(null)";

  N_Address byNumber("127.0.0.1");
  EXPECT_EQ("127.0.0.1", text(byNumber.getStringNumber()));
  EXPECT_EQ(loop, byNumber.getIdentifier());
  N_Address byName("localhost");
  EXPECT_EQ("localhost", text(byName.getStringName()));
  ASSERT_TRUE(byName.wait(10.0f));
  EXPECT_TRUE(byName.wait(1.0f));
  EXPECT_FALSE(byName.wait(0.0f)) << "no time, no success";
  EXPECT_EQ(numberText, text(byName.getStringNumber()));
  EXPECT_EQ(number.s_addr, byName.getIdentifier());
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(name, text(byNumber.getStringName()));
  EXPECT_EQ(reverse != nullptr, byNumber.fullyResolved());
  EXPECT_EQ("localhost", text(byName.getStringName())) << "the given name stays, not a canonical one";
}

// Digits and dots make a number, anything else a name; the shape isn't
// checked. With both lookups failing, only the given half is ever there.
TEST_F(Address, TextIsReadByItsCharactersOnly) {
  FaultGuard faults(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  for (const char* number : {"12345", "....", "", "1.2.3.4.5.6", "0.9"}) {
    N_Address a(number);
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(number, text(a.getStringNumber()));
    EXPECT_EQ(nullptr, a.getStringName()) << number;
    EXPECT_EQ(platform::inet_addr(number), a.getIdentifier()) << number;
  }
  for (const char* name : {"1.2.3.x", "/", ":", "127.0.0.1 ", "12\x80", "no-such-host.invalid"}) {
    N_Address a(name);
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(name, text(a.getStringName()));
    EXPECT_EQ(nullptr, a.getStringNumber()) << name;
    EXPECT_EQ(0u, a.getIdentifier()) << name;
  }
  EXPECT_EQ(6, platform::fault::fired(Call::gethostbyname));
  N_Address none(nullptr), zeros("0.0.0.0");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ("", text(none.getStringNumber())) << "null is the empty number";
  EXPECT_EQ(platform::INADDR_NONE, none.getIdentifier());
  EXPECT_EQ(0u, zeros.getIdentifier());
  EXPECT_EQ(6, platform::fault::fired(Call::gethostbyaddr)) << "0.0.0.0 is never looked up";
  const auto start = Clock::now();
  EXPECT_FALSE(none.wait(0.3f)) << "a number without a name never resolves fully";
  EXPECT_GE(secondsSince(start), 0.29) << "wait gave up early";
}

// Without its mutex, its resolver thread or a lookup's answer an address
// keeps the half it was given.
TEST_F(Address, APlatformFailureLeavesTheGivenHalf) {
  for (Call call : {Call::CreateMutexA, Call::AfxBeginThread, Call::gethostbyname, Call::gethostbyaddr}) {
    EXPECT_TRUE(sweepCall(call, 10055, [&] {
      N_Address name("localhost"), number("127.0.0.1");
      ASSERT_TRUE(resolversDone());
      EXPECT_EQ("localhost", text(name.getStringName()));
      EXPECT_EQ("127.0.0.1", text(number.getStringNumber()));
      const bool hit = platform::fault::fired(call) > 0;
      EXPECT_NE(hit, name.fullyResolved() && number.fullyResolved()) << platform::fault::name(call);
    })) << platform::fault::name(call);
  }
}

// A failed construct leaves the object unconstructed and nothing allocated,
// and it can be constructed again; a resolver without memory gives up.
TEST_F(Address, AnAllocationThatFailsLeavesNothingBehind) {
  for (const char* given : {"localhost", "127.0.0.1", "0.0.0.0"}) {
    EXPECT_TRUE(sweepAllocations([&] {
      N_Address a;
      try {
        a.construct(given);
      } catch (Q_MemoryException_Allocation*) {
        EXPECT_EQ(nullptr, a.getStringName());
        EXPECT_EQ(nullptr, a.getStringNumber());
        a.construct("0.0.0.0");
        EXPECT_EQ("0.0.0.0", text(a.getStringNumber()));
        throw;
      }
      ASSERT_TRUE(resolversDone());
    })) << given;
  }
}

// Held at its first step, a resolver finds its owner gone: no lookup, and
// it frees the block that waited for it.
TEST_F(Address, AResolverWhoseOwnerIsGoneMakesNoLookup) {
  FaultGuard faults(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  AllocationBalance balance;
  platform::HANDLE lock = platform::CreateMutexA(nullptr, platform::FALSE, "N_Address mutex");
  platform::WaitForSingleObject(lock, platform::INFINITE);
  Q_Delete(Q_New<N_Address>("localhost"));
  EXPECT_GT(balance.outstanding(), 0) << "the block should wait for its resolver";
  platform::ReleaseMutex(lock);
  platform::CloseHandle(lock);
  EXPECT_TRUE(balance.settles());
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(0, platform::fault::fired(Call::gethostbyname));
}

// The owner goes, or is constructed again, at times from "at once" to "after
// the lookup": an old resolver never writes into new data or a dead owner.
TEST_F(Address, OwnerGoesOrConstructsAgainWhileItsResolverRuns) {
  FaultGuard faults(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  for (int i = 0; i < 60; ++i) {
    N_Address* gone = Q_New<N_Address>(i % 2 == 0 ? "localhost" : "127.0.0.1");
    N_Address again("localhost");
    std::this_thread::sleep_for(std::chrono::microseconds(i * 30));
    Q_Delete(gone);
    again.construct("127.0.0.2");
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ("127.0.0.2", text(again.getStringNumber()));
    EXPECT_EQ(nullptr, again.getStringName());
  }
}

// Without a runtime an address still resolves; it just isn't registered.
TEST(AddressWithoutRuntime, ResolvesAndFreesEverything) {
  AllocationBalance balance;
  {
    N_Address a("localhost");
    EXPECT_TRUE(a.wait(10.0f));
  }
  EXPECT_TRUE(balance.settles());
}

}  // namespace
