// The exception family: texts, the one static instance per class, the handler
// types that match, and throws from several threads at once.
//
// Each test case runs in a process of its own, so a "first throw" here is the
// first in the process.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <latch>
#include <new>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "N_Exceptions.h"
#include "Q_Throw.h"

// Counts the global operator new of this program, per thread, to show that a
// throw makes its exception object without it. Sanitizer runtimes bring their
// own operator new, so there the count isn't taken.
#if defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define NO_NEW_COUNT 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define NO_NEW_COUNT 1
#endif

namespace {
thread_local int t_operatorNewCalls = 0;
}  // namespace

#ifndef NO_NEW_COUNT
void* operator new(std::size_t size) {
  ++t_operatorNewCalls;
  if (void* p = std::malloc(size == 0 ? 1 : size)) return p;
  throw std::bad_alloc();
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete(void* p, std::size_t) noexcept { std::free(p); }
#endif

namespace {

// Runs `thrower` and gives what a handler of type H caught, or null if the
// exception got past H (it is then caught as void* so the test goes on).
template <class H, class F>
void* caughtAs(F thrower) {
  try {
    try {
      thrower();
    } catch (H caught) {
      return const_cast<void*>(static_cast<const void*>(caught));
    }
  } catch (void*) {
  }
  return nullptr;
}

template <class C>
C* thrownBy(void (*thrower)()) {
  try {
    thrower();
  } catch (C* caught) {
    return caught;
  }
  ADD_FAILURE() << "nothing of the expected class was thrown";
  return nullptr;
}

struct FixedText {
  void (*thrower)();
  const char* text;
};

const FixedText kFixedTexts[] = {
    {Q_Throw<Q_MemoryException_Allocation>, "Out of system memory resources"},
    {Q_Throw<N_NetException_Unavailable>, "WINSOCK: Network subsystem is unavailable"},
    {Q_Throw<N_NetException_NotSupported>, "WINSOCK: DLL version out of range"},
    {Q_Throw<N_NetException_ProcessLimit>, "WINSOCK: Too many processes"},
    {Q_Throw<N_NetException_VersionFailure>, "Winsock version 2.0 or newer required"},
    {Q_Throw<N_NetException_NoTCP>, "TCP protocol not found"},
    {Q_Throw<N_NetException_NoUDP>, "UDP protocol not found"},
    {Q_Throw<N_NetException_IPNotResolved>, "IP address is not resolved yet"},
    {Q_Throw<N_NetException_LocalAddressAlreadyInUse>, "Local address is already bound to other socket"},
};

}  // namespace

TEST(QExceptionTexts, EachFixedTextClassThrowsItsText) {
  for (const FixedText& expected : kFixedTexts) {
    Q_Exception* e = thrownBy<Q_Exception>(expected.thrower);
    ASSERT_NE(nullptr, e);
    EXPECT_STREQ(expected.text, e->getErrorMessage());
  }
}

TEST(QExceptionTexts, ConstructorsOfFixedTextClassesSetTheTextAndTheOthersNone) {
  EXPECT_STREQ("TCP protocol not found", N_NetException_NoTCP().getErrorMessage());
  EXPECT_STREQ("Out of system memory resources", Q_MemoryException_Allocation().getErrorMessage());
  EXPECT_STREQ("", N_NetException().getErrorMessage());
  EXPECT_STREQ("", Q_MemoryException().getErrorMessage());
  EXPECT_STREQ("", N_NetException_PacketTooBig().getErrorMessage());
  EXPECT_STREQ("", N_NetException_PacketsStackingUp().getErrorMessage());
}

TEST(QExceptionTexts, PacketTooBigNamesTheSizeThenTheLimit) {
  auto* e = thrownBy<N_NetException_PacketTooBig>([] { Q_ThrowPacketTooBig(70000, 65536); });
  ASSERT_NE(nullptr, e);
  EXPECT_STREQ("Packet 70000 bytes exceeds 65536 byte limit when not using distributed packet mechanism",
               e->getErrorMessage());
}

TEST(QExceptionTexts, PacketsStackingUpAlwaysReadsFourSeconds) {
  auto* e = thrownBy<N_NetException_PacketsStackingUp>(Q_ThrowPacketsStackingUp);
  ASSERT_NE(nullptr, e);
  EXPECT_STREQ("Packets are stacking up. Already 4.00 seconds of data waiting in queue", e->getErrorMessage());
}

TEST(QExceptionTexts, SetErrorCutsLongTextAndAssignmentCarriesIt) {
  std::string longText(2000, 'x');
  N_NetException_PacketTooBig a;
  a.setError("%s", longText.c_str());
  EXPECT_EQ(std::string(Q_Exception::kMaxErrorLength, 'x'), a.getErrorMessage());

  N_NetException_PacketTooBig b;
  b.setError("size %d", 12);
  a = b;
  EXPECT_STREQ("size 12", a.getErrorMessage());
  EXPECT_STREQ("size 12", b.getErrorMessage());
}

TEST(QExceptionTexts, GetErrorMessageFillsTheCallersBufferWithinItsSize) {
  N_NetException_NoTCP e;
  char buffer[8];
  std::memset(buffer, '#', sizeof buffer);
  unsigned help = 77;
  EXPECT_TRUE(e.GetErrorMessage(buffer, 4, &help));
  EXPECT_STREQ("TCP", buffer);
  EXPECT_EQ('#', buffer[4]) << "wrote past the size it was given";
  EXPECT_EQ(0u, help);
  EXPECT_FALSE(N_NetException().GetErrorMessage(buffer, sizeof buffer)) << "no text, no message";
}

TEST(QExceptionTexts, ReportErrorWritesTheTextToStandardError) {
  N_NetException_IPNotResolved e;
  testing::internal::CaptureStderr();
  static_cast<CException&>(e).ReportError();
  EXPECT_EQ("IP address is not resolved yet\n", testing::internal::GetCapturedStderr());
}

TEST(QExceptionInstance, TwoThrowsOfOneClassGiveOnePointerWithTheLatestText) {
  auto* first = thrownBy<N_NetException_PacketTooBig>([] { Q_ThrowPacketTooBig(10, 5); });
  ASSERT_NE(nullptr, first);
  EXPECT_STREQ("Packet 10 bytes exceeds 5 byte limit when not using distributed packet mechanism",
               first->getErrorMessage());
  auto* second = thrownBy<N_NetException_PacketTooBig>([] { Q_ThrowPacketTooBig(99, 42); });
  EXPECT_EQ(first, second);
  EXPECT_STREQ("Packet 99 bytes exceeds 42 byte limit when not using distributed packet mechanism",
               first->getErrorMessage());
}

TEST(QExceptionInstance, EachClassHasItsOwnInstance) {
  std::set<void*> instances;
  for (const FixedText& entry : kFixedTexts) instances.insert(caughtAs<void*>(entry.thrower));
  instances.insert(caughtAs<void*>(Q_ThrowPacketsStackingUp));
  instances.insert(caughtAs<void*>([] { Q_ThrowPacketTooBig(1, 0); }));
  EXPECT_EQ(std::size(kFixedTexts) + 2, instances.size());
  EXPECT_EQ(0u, instances.count(nullptr));
}

TEST(QExceptionInstance, AllocationHelperThrowsTheSameInstanceAsTheTemplate) {
  EXPECT_EQ(caughtAs<void*>(Q_Throw<Q_MemoryException_Allocation>), caughtAs<void*>(Q_ThrowAllocation));
}

TEST(QExceptionInstance, AThrowUsesNoOperatorNewNotEvenTheFirst) {
#ifdef NO_NEW_COUNT
  GTEST_SKIP() << "operator new belongs to the sanitizer here";
#endif
  t_operatorNewCalls = 0;
  void* caught = caughtAs<void*>(Q_Throw<N_NetException_VersionFailure>);
  caughtAs<void*>([] { Q_ThrowPacketTooBig(3, 2); });
  caughtAs<void*>(Q_Throw<N_NetException_VersionFailure>);
  EXPECT_NE(nullptr, caught);
  EXPECT_EQ(0, t_operatorNewCalls);
}

TEST(QExceptionInstance, ConcurrentFirstThrowsShareOneInstance) {
  constexpr int kThreads = 8;
  constexpr int kRounds = 200;
  std::vector<void*> seen(kThreads, nullptr);
  std::atomic<int> mismatches{0};
  std::latch start(kThreads);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      for (int round = 0; round < kRounds; ++round) {
        void* caught = caughtAs<N_NetException*>([i, round] {
          if (i % 2 == 0) Q_Throw<N_NetException_NoUDP>();
          Q_ThrowPacketTooBig(i, round);
        });
        if (i % 2 == 0) {
          if (seen[i] == nullptr) seen[i] = caught;
          if (caught == nullptr || caught != seen[i]) mismatches.fetch_add(1);
        }
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(0, mismatches.load());
  for (int i = 2; i < kThreads; i += 2) EXPECT_EQ(seen[0], seen[i]) << "thread " << i;
  auto* last = thrownBy<N_NetException_PacketTooBig>([] { Q_ThrowPacketTooBig(5, 6); });
  EXPECT_STREQ("Packet 5 bytes exceeds 6 byte limit when not using distributed packet mechanism",
               last->getErrorMessage());
}

TEST(QExceptionCatching, EveryBasePointerAndVoidPointerCatch) {
  auto thrower = Q_Throw<N_NetException_NoTCP>;
  void* instance = caughtAs<N_NetException_NoTCP*>(thrower);
  ASSERT_NE(nullptr, instance);
  EXPECT_EQ(instance, caughtAs<N_NetException*>(thrower));
  EXPECT_EQ(instance, caughtAs<Q_Exception*>(thrower));
  EXPECT_EQ(instance, caughtAs<CException*>(thrower));
  EXPECT_EQ(instance, caughtAs<CObject*>(thrower));
  EXPECT_EQ(instance, caughtAs<void*>(thrower));
  EXPECT_EQ(instance, caughtAs<const Q_Exception*>(thrower));
}

TEST(QExceptionCatching, TheTwoBranchesDoNotCatchEachOther) {
  EXPECT_EQ(nullptr, caughtAs<N_NetException*>(Q_ThrowAllocation));
  EXPECT_NE(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowAllocation));
  EXPECT_EQ(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowPacketsStackingUp));
  EXPECT_EQ(nullptr, caughtAs<N_NetException_NoTCP*>(Q_Throw<N_NetException_NoUDP>));
}

TEST(QExceptionRuntimeClass, EveryClassAnswersWithTheRootsRuntimeClass) {
  CObject* tcp = static_cast<CObject*>(caughtAs<CObject*>(Q_Throw<N_NetException_NoTCP>));
  CObject* memory = static_cast<CObject*>(caughtAs<CObject*>(Q_ThrowAllocation));
  ASSERT_NE(nullptr, tcp);
  ASSERT_NE(nullptr, memory);
  CRuntimeClass* runtimeClass = tcp->GetRuntimeClass();
  EXPECT_EQ(runtimeClass, memory->GetRuntimeClass());
  EXPECT_STREQ("Q_Exception", runtimeClass->m_lpszClassName);
  EXPECT_EQ(N_NetException_PacketTooBig().GetRuntimeClass(), runtimeClass);
}
