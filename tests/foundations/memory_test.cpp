// Counted allocation: Q_Memory's raw blocks and the object helpers, with
// injected allocation faults and allocation from several threads.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <latch>
#include <stdexcept>
#include <thread>
#include <vector>

#include "N_Exceptions.h"
#include "Q_Memory.h"
#include "Q_New.h"
#include "fault.h"

namespace {

struct Counts {
  int news = Q_Memory::sm_iNewCount.load();
  int deletes = Q_Memory::sm_iDeleteCount.load();
  int newsSince() const { return Q_Memory::sm_iNewCount.load() - news; }
  int deletesSince() const { return Q_Memory::sm_iDeleteCount.load() - deletes; }
};

// Runs `f` and gives the text of the allocation failure it threw, or null.
template <class F>
const char* allocationFailure(F f) {
  try {
    f();
  } catch (Q_MemoryException_Allocation* e) {
    return e->getErrorMessage();
  }
  return nullptr;
}

struct Widget {
  static inline int constructed = 0;
  int a;
  int b;
  Widget(int x, int y) : a(x), b(y) { ++constructed; }
};

struct Refuses {
  explicit Refuses(bool refuse) {
    if (refuse) throw std::runtime_error("refused");
  }
};

class FaultReset : public testing::Test {
 protected:
  void TearDown() override { platform::fault::disarmAll(); }
};

}  // namespace

using QMemoryBlocks = FaultReset;
using QMemoryObjects = FaultReset;

TEST_F(QMemoryBlocks, AllocateAndReleaseAreCountedAndUsable) {
  Counts counts;
  void* p = Q_Memory::allocate(100);
  ASSERT_NE(nullptr, p);
  std::memset(p, 0x5a, 100);
  EXPECT_EQ(0u, reinterpret_cast<std::uintptr_t>(p) % alignof(std::max_align_t));
  EXPECT_EQ(1, counts.newsSince());
  EXPECT_EQ(0, counts.deletesSince());
  Q_Memory::release(p);
  Q_Memory::release(nullptr);
  EXPECT_EQ(1, counts.newsSince());
  EXPECT_EQ(1, counts.deletesSince()) << "releasing null counts nothing";
}

TEST_F(QMemoryBlocks, AnInjectedFaultThrowsAndStillCounts) {
  Counts counts;
  platform::fault::failAllocation(2);
  void* first = Q_Memory::allocate(8);
  EXPECT_STREQ("Out of system memory resources", allocationFailure([] { Q_Memory::allocate(8); }));
  void* third = Q_Memory::allocate(8);
  EXPECT_EQ(1, platform::fault::allocationsFailed());
  EXPECT_EQ(3, counts.newsSince());
  Q_Memory::release(first);
  Q_Memory::release(third);
  EXPECT_EQ(2, counts.deletesSince());
}

TEST_F(QMemoryBlocks, CountersStayExactWithManyThreads) {
  constexpr int kThreads = 6;
  constexpr int kBlocks = 5000;
  Counts counts;
  std::latch start(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      start.arrive_and_wait();
      for (int i = 0; i < kBlocks; ++i) {
        void* p = Q_Memory::allocate(16);
        Q_Memory::release(p);
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(kThreads * kBlocks, counts.newsSince());
  EXPECT_EQ(kThreads * kBlocks, counts.deletesSince());
}

TEST_F(QMemoryObjects, NewAndDeleteAreCounted) {
  Counts counts;
  Widget* w = Q_New<Widget>(3, 4);
  EXPECT_EQ(3, w->a);
  EXPECT_EQ(4, w->b);
  EXPECT_EQ(1, counts.newsSince());
  Q_Delete(w);
  Q_Delete<Widget>(nullptr);
  EXPECT_EQ(1, counts.deletesSince());

  int* array = Q_NewArray<int>(64);
  for (int i = 0; i < 64; ++i) array[i] = i;
  EXPECT_EQ(63, array[63]);
  EXPECT_EQ(2, counts.newsSince());
  Q_DeleteArray(array);
  Q_DeleteArray<int>(nullptr);
  EXPECT_EQ(2, counts.deletesSince());
}

TEST_F(QMemoryObjects, AFaultThrowsBeforeAnyConstructorRuns) {
  Counts counts;
  int constructedBefore = Widget::constructed;
  platform::fault::failAllocation(1);
  EXPECT_STREQ("Out of system memory resources", allocationFailure([] { Q_New<Widget>(1, 2); }));
  EXPECT_EQ(constructedBefore, Widget::constructed);
  platform::fault::failAllocation(1);
  EXPECT_STREQ("Out of system memory resources", allocationFailure([] { Q_NewArray<char>(10); }));
  EXPECT_EQ(2, counts.newsSince());
  EXPECT_EQ(0, counts.deletesSince());
}

TEST_F(QMemoryObjects, AThrowingConstructorPassesItsExceptionAndCountsNothing) {
  Counts counts;
  EXPECT_THROW(Q_New<Refuses>(true), std::runtime_error);
  EXPECT_EQ(0, counts.newsSince());
  Q_Delete(Q_New<Refuses>(false));
  EXPECT_EQ(1, counts.newsSince());
  EXPECT_EQ(1, counts.deletesSince());
}
