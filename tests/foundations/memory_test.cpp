// Counted allocation (blocks, objects, arrays, injected faults) and the one
// container built on it, Q_DLList.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <stdexcept>
#include <vector>

#include "N_Exceptions.h"
#include "Q_DLList.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "fault_guard.h"

namespace {

struct Widget {
  static inline int constructed = 0;
  int a, b;
  Widget(int x, int y) : a(x), b(y) { ++constructed; }
};

using IntList = Q_DLList<int>;

std::vector<int> walk(IntList& list) {
  std::vector<int> values;
  for (int* p = list.getFirst(); p != nullptr; p = list.getNext(p)) values.push_back(*p);
  return values;
}

}  // namespace

TEST(QMemory, EachAllocationCountsOnceAndEachReleaseOnce) {
  AllocationBalance balance;
  void* block = Q_Memory::allocate(100);
  EXPECT_EQ(0u, reinterpret_cast<std::uintptr_t>(block) % alignof(std::max_align_t));
  Widget* w = Q_New<Widget>(3, 4);
  EXPECT_TRUE(w->a == 3 && w->b == 4);
  int* array = Q_NewArray<int>(64);
  array[63] = 63;
  EXPECT_EQ(3, balance.outstanding());
  Q_Memory::release(block);
  Q_Delete(w);
  Q_DeleteArray(array);
  Q_Memory::release(nullptr);
  Q_Delete<Widget>(nullptr);
  Q_DeleteArray<int>(nullptr);
  EXPECT_THROW(Q_New<std::vector<int>>(std::size_t{1} << 62), std::length_error);
  EXPECT_EQ(0, balance.outstanding()) << "null releases and a throwing constructor count nothing";
}

TEST(QMemory, AnInjectedFaultThrowsBeforeAnyConstructorAndIsCounted) {
  AllocationBalance balance;
  FaultGuard faults;
  for (const std::function<void()>& allocate : std::vector<std::function<void()>>{
           [] { Q_Memory::allocate(8); }, [] { Q_New<Widget>(1, 2); }, [] { Q_NewArray<char>(10); }}) {
    faults.failAllocation(1);
    try {
      allocate();
      ADD_FAILURE() << "an allocation gave memory it was told not to";
    } catch (Q_MemoryException_Allocation* e) {
      EXPECT_STREQ("Out of system memory resources", e->getErrorMessage());
    }
  }
  EXPECT_EQ(0, Widget::constructed);
  EXPECT_EQ(3, balance.outstanding()) << "a refused allocation counts as made";
}

TEST(QDLList, KeepsOrderAndAddressesThroughRemovalsAndFreesEverything) {
  AllocationBalance balance;
  {
    IntList list;
    EXPECT_EQ(nullptr, list.getFirst());
    std::vector<int*> at;
    for (int i = 0; i < 5; ++i) *at.emplace_back(list.append()) = i;
    EXPECT_EQ(5, balance.outstanding()) << "one counted block per node";
    for (int i : {2, 0, 4}) list.remove(at[i]);
    EXPECT_EQ((std::vector<int>{1, 3}), walk(list));
    EXPECT_EQ(at[3], list.getNext(at[1])) << "the others stay where they were";
    EXPECT_EQ(2, list.m_iCount);
    for (int i : {3, 1}) list.remove(at[i]);
    EXPECT_EQ(nullptr, list.getFirst());
    EXPECT_EQ(nullptr, list.getAt(0));
    for (int i : {7, 8}) *list.append() = i;
    EXPECT_EQ((std::vector<int>{7, 8}), walk(list)) << "an emptied list is usable again";
    list.m_pSpareA = Q_Memory::allocate(32);
    list.m_pSpareB = Q_Memory::allocate(8);
  }
  EXPECT_EQ(0, balance.outstanding()) << "the destructor frees the nodes left and both spare blocks";
}

TEST(QDLList, GetAtAnyOrderMissesKeepTheCacheAndChangesDropIt) {
  IntList list;
  for (int i = 0; i < 10; ++i) *list.append() = i;
  for (int i : {0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 9, 8, 7, 6, 5, 4, 3, 2, 1, 0, 5, 0, 9, 3, 3, 8, 1, 6}) {
    ASSERT_NE(nullptr, list.getAt(i));
    EXPECT_EQ(i, *list.getAt(i));
    EXPECT_EQ(i, list.m_iCacheIndex) << "the cache stays on the element given";
  }
  int* six = list.getAt(6);
  for (int outside : {-1, 10, IntList::kInvalidCacheIndex}) EXPECT_EQ(nullptr, list.getAt(outside));
  EXPECT_EQ(six, list.m_pCacheData) << "a miss keeps the cache";
  *list.append() = 10;
  EXPECT_EQ(IntList::kInvalidCacheIndex, list.m_iCacheIndex);
  EXPECT_EQ(2, *list.getAt(2));
  list.remove(list.getFirst());
  EXPECT_EQ(IntList::kInvalidCacheIndex, list.m_iCacheIndex);
  EXPECT_EQ(3, *list.getAt(2)) << "index 2 is another element now";
  EXPECT_EQ(10, *list.getAt(9));
}

TEST(QDLList, AFailedAppendThrowsAndLeavesTheListAsItWas) {
  IntList list;
  for (int i : {0, 1}) *list.append() = i;
  AllocationBalance balance;
  {
    FaultGuard faults;
    faults.failAllocation(1);
    EXPECT_THROW(list.append(), Q_MemoryException_Allocation*);
  }
  EXPECT_EQ(1, balance.outstanding()) << "the refused allocation is counted, nothing else";
  EXPECT_EQ(2, list.m_iCount);
  *list.append() = 2;
  EXPECT_EQ((std::vector<int>{0, 1, 2}), walk(list));
}
