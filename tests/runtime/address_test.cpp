// Address resolution over the real name service of this machine: the half
// that was given is there at once, the resolver fills in the other half, and
// the shared block is freed by whoever lets go of it last. Expectations come
// from the platform's own lookups, so the tests don't depend on how this
// machine's hosts file names 127.0.0.1.
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ostream>
#include <set>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "Q_Memory.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "fault_guard.h"
#include "tasks.h"
#include "win32.h"
#include "winsock.h"

namespace {

using platform::fault::Call;

std::string text(const volatile char* s) { return s != nullptr ? std::string(const_cast<const char*>(s)) : "(null)"; }

// What the platform says about a name or a number, asked directly.
std::string forwardLookup(const char* name) {
  platform::hostent* host = platform::gethostbyname(name);
  if (host == nullptr || host->h_addr_list == nullptr || host->h_addr_list[0] == nullptr) return "(null)";
  platform::in_addr address;
  std::memcpy(&address.s_addr, host->h_addr_list[0], 4);
  return platform::inet_ntoa(address);
}

std::string reverseLookup(const char* number) {
  std::uint32_t identifier = platform::inet_addr(number);
  platform::hostent* host = platform::gethostbyaddr(reinterpret_cast<const char*>(&identifier), 4, platform::AF_INET);
  return host != nullptr && host->h_name != nullptr ? host->h_name : "(null)";
}

class Address : public ::testing::Test {
 protected:
  void SetUp() override {
    platform::setLocalHost("127.0.0.1");
    std::set<int> idle = tasks::ids();
    network = std::make_unique<N_Initializer>();
    // Let the local address's resolver finish (the network thread stays), so
    // that new threads are the test's resolvers.
    tasks::theNewThread(idle);
    threadsBefore = tasks::ids();
  }
  void TearDown() override {
    network.reset();
    platform::setLocalHost(nullptr);
  }

  // Every resolver started since SetUp has ended.
  bool resolversDone(double seconds = 30.0) {
    return tasks::eventually(
        [&] {
          for (int tid : tasks::ids())
            if (threadsBefore.count(tid) == 0) return false;
          return true;
        },
        seconds);
  }

  // Holds the one mutex that all addresses share, as a resolver would.
  struct AddressMutex {
    AddressMutex() : handle(platform::CreateMutexA(nullptr, platform::FALSE, "N_Address mutex")) {}
    ~AddressMutex() {
      release();
      platform::CloseHandle(handle);
    }
    void take() {
      platform::WaitForSingleObject(handle, platform::INFINITE);
      held = true;
    }
    void release() {
      if (held) platform::ReleaseMutex(handle);
      held = false;
    }
    platform::HANDLE handle;
    bool held = false;
  };

  std::unique_ptr<N_Initializer> network;
  std::set<int> threadsBefore;
  FaultGuard faults;
};

// ---- The two paths --------------------------------------------------------

TEST_F(Address, NumberIsThereAtOnceAndNameComesFromReverseLookup) {
  N_Address a("127.0.0.1");
  EXPECT_EQ(text(a.getStringNumber()), "127.0.0.1");
  EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.1"));

  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(text(a.getStringName()), reverseLookup("127.0.0.1"));
  EXPECT_EQ(text(a.getStringNumber()), "127.0.0.1");
  EXPECT_EQ(a.fullyResolved(), reverseLookup("127.0.0.1") != "(null)");
}

TEST_F(Address, NameIsThereAtOnceAndNumberComesFromForwardLookup) {
  std::string expected = forwardLookup("localhost");
  ASSERT_NE(expected, "(null)") << "this machine doesn't resolve localhost";

  N_Address a("localhost");
  EXPECT_EQ(text(a.getStringName()), "localhost");
  ASSERT_TRUE(a.wait(10.0f));
  EXPECT_TRUE(a.fullyResolved());
  EXPECT_EQ(text(a.getStringNumber()), expected);
  EXPECT_EQ(a.getIdentifier(), platform::inet_addr(expected.c_str()));
  // The caller's text stays the name, not a canonical one from the record.
  EXPECT_EQ(text(a.getStringName()), "localhost");
}

// ---- How the text is read -------------------------------------------------

struct Classification {
  const char* name;  // for the test's name
  const char* text;
  bool number;
};

void PrintTo(const Classification& c, std::ostream* os) { *os << c.name; }

class Classify : public Address, public ::testing::WithParamInterface<Classification> {};

// The lookups are made to fail at once: what matters here is which half was
// given and which lookup the resolver makes.
TEST_P(Classify, ByCharactersOnly) {
  const Classification& c = GetParam();
  faults.arm(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  N_Address a(c.text);
  if (c.number) {
    // The number path keeps the text itself as the number, shape or not.
    EXPECT_EQ(text(a.getStringNumber()), c.text);
    EXPECT_EQ(a.getStringName(), nullptr);
    EXPECT_EQ(a.getIdentifier(), platform::inet_addr(c.text));
  } else {
    EXPECT_EQ(text(a.getStringName()), c.text);
    EXPECT_EQ(a.getStringNumber(), nullptr);
  }
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(platform::fault::fired(Call::gethostbyname), c.number ? 0 : 1);
  EXPECT_EQ(platform::fault::fired(Call::gethostbyaddr), c.number ? 1 : 0);
}

INSTANTIATE_TEST_SUITE_P(Texts, Classify,
                         ::testing::Values(Classification{"DigitsOnly", "12345", true},
                                           Classification{"DotsOnly", "....", true},
                                           Classification{"Empty", "", true},
                                           Classification{"TooManyGroups", "1.2.3.4.5.6", true},
                                           Classification{"OneLetter", "1.2.3.x", false},
                                           Classification{"LetterAlone", "a", false},
                                           Classification{"TrailingSpace", "127.0.0.1 ", false},
                                           Classification{"ByteAbove7F", "12\x80", false},
                                           Classification{"Utf8", "\xC3\xA9t\xC3\xA9", false},
                                           Classification{"Minus", "-1", false}),
                         [](const ::testing::TestParamInfo<Classification>& p) { return p.param.name; });

TEST_F(Address, NullTextIsTheEmptyNumber) {
  N_Address a(nullptr);
  EXPECT_EQ(text(a.getStringNumber()), "");
  EXPECT_EQ(a.getIdentifier(), platform::INADDR_NONE);
  ASSERT_TRUE(resolversDone());
}

TEST_F(Address, AllZerosGivesZeroAndNoLookup) {
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  {
    N_Address zeros("0.0.0.0");
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(zeros.getIdentifier(), 0u);
    EXPECT_EQ(text(zeros.getStringName()), "(null)");
    EXPECT_EQ(platform::fault::fired(Call::gethostbyaddr), 0);
  }
  // Any other number is looked up.
  N_Address other("127.0.0.1");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(platform::fault::fired(Call::gethostbyaddr), 1);
}

// ---- Unconstructed objects ------------------------------------------------

TEST(AddressUnconstructed, AnswersNothingAndDestructsQuietly) {
  AllocationBalance balance;
  N_Address a;
  EXPECT_EQ(a.getStringName(), nullptr);
  EXPECT_EQ(a.getStringNumber(), nullptr);
  EXPECT_EQ(a.getIdentifier(), 0u);
  EXPECT_FALSE(a.fullyResolved());
  EXPECT_FALSE(a.wait(0.05f));
  a.destruct();
  a.destruct();
  EXPECT_EQ(balance.outstanding(), 0);
}

// Without a runtime an address still resolves; it just isn't registered.
TEST(AddressWithoutRuntime, ResolvesAndFreesEverything) {
  ASSERT_EQ(N_Address::getLocalAddress(), nullptr);
  AllocationBalance balance;
  {
    N_Address a("localhost");
    EXPECT_TRUE(a.wait(10.0f));
    N_Address b("127.0.0.1");
    EXPECT_EQ(b.getIdentifier(), platform::inet_addr("127.0.0.1"));
  }
  EXPECT_TRUE(balance.settles());
}

// ---- wait -----------------------------------------------------------------

TEST_F(Address, WaitTrueWhenResolvedAndFalseForNoTime) {
  N_Address a("localhost");
  ASSERT_TRUE(a.wait(10.0f));
  EXPECT_TRUE(a.wait(1.0f));
  EXPECT_FALSE(a.wait(0.0f));
  EXPECT_FALSE(a.wait(-1.0f));
}

TEST_F(Address, WaitRunsOutItsTimeOnAnUnresolvableName) {
  N_Address a("no-such-host.invalid");
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(a.wait(0.3f));
  double waited = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  EXPECT_GE(waited, 0.29);
}

TEST_F(Address, UnresolvableNameStaysUnresolved) {
  N_Address a("no-such-host.invalid");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(text(a.getStringName()), "no-such-host.invalid");
  EXPECT_EQ(a.getStringNumber(), nullptr);
  EXPECT_EQ(a.getIdentifier(), 0u);
  EXPECT_FALSE(a.fullyResolved());
}

// ---- Failing lookups ------------------------------------------------------

TEST_F(Address, FailedForwardLookupLeavesNameOnly) {
  faults.arm(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  N_Address a("localhost");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(platform::fault::fired(Call::gethostbyname), 1);
  EXPECT_EQ(text(a.getStringName()), "localhost");
  EXPECT_EQ(a.getStringNumber(), nullptr);
  EXPECT_EQ(a.getIdentifier(), 0u);
}

TEST_F(Address, FailedReverseLookupLeavesNumberOnly) {
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  N_Address a("127.0.0.1");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(platform::fault::fired(Call::gethostbyaddr), 1);
  EXPECT_EQ(a.getStringName(), nullptr);
  EXPECT_EQ(text(a.getStringNumber()), "127.0.0.1");
  EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.1"));
}

TEST_F(Address, ResolverThatCannotStartLeavesTheGivenHalf) {
  AllocationBalance balance;
  {
    faults.arm(Call::AfxBeginThread, {.countdown = 1, .persist = false, .result = 10055});
    N_Address a("localhost");
    EXPECT_EQ(platform::fault::fired(Call::AfxBeginThread), 1);
    EXPECT_EQ(text(a.getStringName()), "localhost");
    EXPECT_FALSE(a.wait(0.2f));
    EXPECT_EQ(a.getIdentifier(), 0u);
  }
  // The reference taken for the resolver was given back: destruct freed the block.
  EXPECT_EQ(balance.outstanding(), 0);
}

TEST_F(Address, WithoutItsMutexAnAddressKeepsTheGivenHalf) {
  AllocationBalance balance;
  {
    faults.arm(Call::CreateMutexA, {.countdown = 1, .persist = false, .result = 8});
    N_Address a("127.0.0.1");
    EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.1"));
    EXPECT_EQ(text(a.getStringNumber()), "127.0.0.1");
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(a.getStringName(), nullptr);
  }
  EXPECT_EQ(balance.outstanding(), 0);
}

// ---- Allocation failures --------------------------------------------------

struct AllocationCase {
  const char* name;
  const char* text;
  int nth;  // which allocation of construct fails
};

void PrintTo(const AllocationCase& c, std::ostream* os) { *os << c.name; }

class ConstructAllocation : public Address, public ::testing::WithParamInterface<AllocationCase> {};

// construct allocates the shared block, the string, and the registry entry.
// Whichever fails, the object ends unconstructed, nothing else stays
// allocated, and the object can be constructed again.
TEST_P(ConstructAllocation, LeavesObjectUnconstructedAndNothingAllocated) {
  const AllocationCase& c = GetParam();
  AllocationBalance balance;
  N_Address a;
  faults.failAllocation(c.nth);
  try {
    a.construct(c.text);
    ADD_FAILURE() << "construct didn't throw";
  } catch (Q_MemoryException_Allocation* e) {
    EXPECT_STREQ(e->getErrorMessage(), "Out of system memory resources");
  }
  EXPECT_EQ(platform::fault::allocationsFailed(), 1);
  EXPECT_EQ(a.getStringName(), nullptr);
  EXPECT_EQ(a.getStringNumber(), nullptr);
  EXPECT_EQ(a.getIdentifier(), 0u);
  ASSERT_TRUE(resolversDone());
  // The refused allocation is counted like any other; nothing more is out.
  EXPECT_EQ(balance.outstanding(), 1);

  a.construct("127.0.0.1");
  EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.1"));
}

// With "0.0.0.0" the resolver allocates nothing, so the third allocation is
// surely the registry entry; with a name the resolver's copy races with it.
INSTANTIATE_TEST_SUITE_P(Steps, ConstructAllocation,
                         ::testing::Values(AllocationCase{"NameBlock", "localhost", 1},
                                           AllocationCase{"NameString", "localhost", 2},
                                           AllocationCase{"NumberBlock", "0.0.0.0", 1},
                                           AllocationCase{"NumberString", "0.0.0.0", 2},
                                           AllocationCase{"NumberRegistryEntry", "0.0.0.0", 3}),
                         [](const ::testing::TestParamInfo<AllocationCase>& p) { return p.param.name; });

// A resolver that can't copy the name makes no lookup and still lets go of
// the block; nothing escapes its thread.
TEST_F(Address, ResolverWithoutMemoryForItsCopySkipsTheLookup) {
  faults.arm(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  AllocationBalance balance;
  {
    AddressMutex lock;
    lock.take();  // the resolver waits at its first step
    N_Address a("localhost");
    faults.failAllocation(1);
    lock.release();
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(platform::fault::allocationsFailed(), 1);
    EXPECT_EQ(platform::fault::fired(Call::gethostbyname), 0);
    EXPECT_EQ(a.getStringNumber(), nullptr);
  }
  EXPECT_EQ(balance.outstanding(), 1);
}

// ---- Owner and resolver end in either order -------------------------------

// The owner goes while the resolver hasn't even copied the name: the
// resolver finds no owner, makes no lookup and frees the block.
TEST_F(Address, DestroyedBeforeResolverStartsItsLookup) {
  faults.arm(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  AllocationBalance balance;
  {
    AddressMutex lock;
    lock.take();
    N_Address* a = Q_New<N_Address>("localhost");
    Q_Delete(a);
    EXPECT_GT(balance.outstanding(), 0) << "the block should wait for its resolver";
  }
  EXPECT_TRUE(balance.settles());
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(platform::fault::fired(Call::gethostbyname), 0);
}

// The owner goes while the lookup runs (the resolver has its copy): the
// resolver writes nothing into the dead owner and frees the block. The
// lookup is quick, so the test tries until it has caught the resolver
// before its write-back (the other order is checked as well on the way).
TEST_F(Address, DestroyedDuringLookup) {
  AllocationBalance balance;
  bool caught = false;
  for (int attempt = 0; attempt < 200 && !caught; ++attempt) {
    AddressMutex lock;
    int base = Q_Memory::sm_iNewCount.load();
    N_Address* a = Q_New<N_Address>("localhost");
    // Block, name, registry entry, the object: 4; the resolver's copy is the 5th.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (Q_Memory::sm_iNewCount.load() - base < 5 && std::chrono::steady_clock::now() < deadline) {
    }
    lock.take();
    caught = a->getStringNumber() == nullptr;
    Q_Delete(a);
    lock.release();
  }
  // On a loaded machine the resolver may win every time; the checks above
  // still hold then, only for the other order.
  if (!caught) std::printf("note: no resolver was caught between its copy and its write-back\n");
  ASSERT_TRUE(resolversDone());
  EXPECT_TRUE(balance.settles());
}

TEST_F(Address, DestroyedRightAwayManyTimes) {
  AllocationBalance balance;
  for (int i = 0; i < 50; ++i) {
    N_Address a(i % 2 == 0 ? "localhost" : "127.0.0.1");
  }
  EXPECT_TRUE(balance.settles());
  ASSERT_TRUE(resolversDone());
}

// Constructed again before the first resolver is done: each construct has
// its own block, and the old resolver can't write into the new data.
// Constructed again before the first resolver is done: each construct has
// its own block, and the old resolver can't write into the new data. The
// first lookup would write 127.0.0.1; the second, a reverse lookup, is made
// to fail.
TEST_F(Address, ConstructTwiceQuickly) {
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  AllocationBalance balance;
  {
    N_Address a("localhost");
    a.construct("127.0.0.2");
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(text(a.getStringNumber()), "127.0.0.2");
    EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.2"));
    EXPECT_EQ(a.getStringName(), nullptr);
  }
  EXPECT_TRUE(balance.settles());
}

// The same, with the first resolver caught between its copy and its
// write-back when the object is constructed again (tried until caught).
TEST_F(Address, ConstructAgainWhileFirstResolverWaitsToWriteBack) {
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  AllocationBalance balance;
  bool caught = false;
  for (int attempt = 0; attempt < 200 && !caught; ++attempt) {
    AddressMutex lock;
    int base = Q_Memory::sm_iNewCount.load();
    N_Address a("localhost");
    // Block, name, registry entry: 3; the resolver's copy is the 4th.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (Q_Memory::sm_iNewCount.load() - base < 4 && std::chrono::steady_clock::now() < deadline) {
    }
    lock.take();
    caught = a.getStringNumber() == nullptr;
    a.construct("127.0.0.2");
    lock.release();
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(text(a.getStringNumber()), "127.0.0.2");
    EXPECT_EQ(a.getIdentifier(), platform::inet_addr("127.0.0.2"));
    EXPECT_EQ(a.getStringName(), nullptr);
  }
  // On a loaded machine the resolver may win every time; the checks above
  // still hold then, only for the other order.
  if (!caught) std::printf("note: no resolver was caught between its copy and its write-back\n");
  EXPECT_TRUE(balance.settles());
}

}  // namespace
