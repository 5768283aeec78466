// Q_DLList: order, addresses, removal, the getAt cache, allocation counts and
// an allocation that fails.
#include <gtest/gtest.h>

#include <cstdint>
#include <ostream>
#include <vector>

#include "N_Exceptions.h"
#include "Q_DLList.h"
#include "Q_Memory.h"
#include "fault.h"

namespace {

using IntList = Q_DLList<int>;
constexpr std::int32_t kInvalid = IntList::kInvalidCacheIndex;

// A list holding 0, 1, ..., count - 1.
void fill(IntList& list, int count) {
  for (int i = 0; i < count; ++i) *list.append() = i;
}

std::vector<int> walk(IntList& list) {
  std::vector<int> values;
  for (int* p = list.getFirst(); p != nullptr; p = list.getNext(p)) values.push_back(*p);
  return values;
}

int valueAt(IntList& list, int index) {
  int* p = list.getAt(index);
  return p != nullptr ? *p : -1;
}

struct Counts {
  int news = Q_Memory::sm_iNewCount.load();
  int deletes = Q_Memory::sm_iDeleteCount.load();
  int newsSince() const { return Q_Memory::sm_iNewCount.load() - news; }
  int deletesSince() const { return Q_Memory::sm_iDeleteCount.load() - deletes; }
};

}  // namespace

TEST(QDLList, EmptyListHasNoElements) {
  Counts counts;
  {
    IntList list;
    EXPECT_EQ(0, list.m_iCount);
    EXPECT_EQ(kInvalid, list.m_iCacheIndex);
    EXPECT_EQ(&list.m_tail, list.m_head.m_pNext);
    EXPECT_EQ(&list.m_head, list.m_tail.m_pPrev);
    EXPECT_EQ(nullptr, list.m_head.m_pPrev);
    EXPECT_EQ(nullptr, list.m_tail.m_pNext);
    EXPECT_EQ(nullptr, list.getFirst());
    EXPECT_EQ(nullptr, list.getAt(0));
  }
  EXPECT_EQ(0, counts.newsSince());
  EXPECT_EQ(0, counts.deletesSince()) << "the list's own bookkeeping allocates nothing";
}

TEST(QDLList, ElementsKeepOrderOfArrivalAndTheirAddresses) {
  IntList list;
  std::vector<int*> appended;
  for (int i = 0; i < 4; ++i) {
    appended.push_back(list.append());
    *appended.back() = 10 * i;
  }
  EXPECT_EQ(4, list.m_iCount);
  EXPECT_EQ((std::vector<int>{0, 10, 20, 30}), walk(list));
  int* p = list.getFirst();
  for (int* expected : appended) {
    EXPECT_EQ(expected, p);
    p = list.getNext(p);
  }
  EXPECT_EQ(nullptr, p) << "nothing after the last element";
  list.remove(appended[1]);
  EXPECT_EQ(appended[2], list.getNext(appended[0])) << "the others stay where they were";
}

TEST(QDLList, RemoveAtEitherEndAndInTheMiddle) {
  IntList list;
  fill(list, 5);
  int* first = list.getFirst();
  int* middle = list.getAt(2);
  int* last = list.getAt(4);
  list.remove(middle);
  EXPECT_EQ((std::vector<int>{0, 1, 3, 4}), walk(list));
  list.remove(first);
  EXPECT_EQ((std::vector<int>{1, 3, 4}), walk(list));
  list.remove(last);
  EXPECT_EQ((std::vector<int>{1, 3}), walk(list));
  EXPECT_EQ(2, list.m_iCount);
  EXPECT_EQ(3, valueAt(list, 1));

  // A walk that removes as it goes, taking the next element first.
  for (int* p = list.getFirst(); p != nullptr;) {
    int* next = list.getNext(p);
    list.remove(p);
    p = next;
  }
  EXPECT_EQ(0, list.m_iCount);
  EXPECT_EQ(nullptr, list.getFirst());
  EXPECT_EQ(&list.m_tail, list.m_head.m_pNext);
  EXPECT_EQ(&list.m_head, list.m_tail.m_pPrev);
  *list.append() = 7;
  EXPECT_EQ((std::vector<int>{7}), walk(list)) << "an emptied list is usable again";
}

TEST(QDLList, RecordsAreAlignedAndDoNotOverlap) {
  struct alignas(16) Record {
    long double weight;
    int id;
    char tag;
  };
  Q_DLList<Record> list;
  std::vector<Record*> records;
  for (int i = 0; i < 6; ++i) {
    Record* r = list.append();
    EXPECT_EQ(0u, reinterpret_cast<std::uintptr_t>(r) % alignof(Record));
    r->weight = i * 1.5L;
    r->id = i;
    r->tag = static_cast<char>('a' + i);
    records.push_back(r);
  }
  for (int i = 0; i < 6; ++i) {
    EXPECT_EQ(i * 1.5L, records[i]->weight);
    EXPECT_EQ(i, records[i]->id);
    EXPECT_EQ('a' + i, records[i]->tag);
  }
}

TEST(QDLListGetAt, EveryIndexInAnyOrder) {
  IntList list;
  fill(list, 10);
  for (int i = 0; i < 10; ++i) EXPECT_EQ(i, valueAt(list, i));
  for (int i = 9; i >= 0; --i) EXPECT_EQ(i, valueAt(list, i));
  for (int i : {5, 0, 9, 3, 3, 8, 1, 6}) {
    EXPECT_EQ(i, valueAt(list, i));
    EXPECT_EQ(i, list.m_iCacheIndex) << "the cache stays on the element given";
    EXPECT_EQ(list.m_pCacheData, list.getAt(i));
  }
}

TEST(QDLListGetAt, OutsideTheListGivesNullAndKeepsTheCache) {
  IntList empty;
  EXPECT_EQ(nullptr, empty.getAt(0));
  EXPECT_EQ(nullptr, empty.getAt(-1));

  IntList list;
  fill(list, 3);
  int* second = list.getAt(1);
  EXPECT_EQ(nullptr, list.getAt(3));
  EXPECT_EQ(nullptr, list.getAt(-1));
  EXPECT_EQ(nullptr, list.getAt(kInvalid));
  EXPECT_EQ(1, list.m_iCacheIndex);
  EXPECT_EQ(second, list.m_pCacheData);
}

TEST(QDLListGetAt, AppendAndRemoveInvalidateTheCache) {
  IntList list;
  fill(list, 4);
  EXPECT_EQ(2, valueAt(list, 2));
  *list.append() = 4;
  EXPECT_EQ(kInvalid, list.m_iCacheIndex);
  EXPECT_EQ(2, valueAt(list, 2));
  list.remove(list.getFirst());
  EXPECT_EQ(kInvalid, list.m_iCacheIndex);
  EXPECT_EQ(3, valueAt(list, 2)) << "index 2 is another element now";
  EXPECT_EQ(4, valueAt(list, 3));
}

// Which anchor getAt starts from can't be seen in its result on a sound list.
// These cases make the head, the tail or the cache point one element away
// from the one they stand for; the value that comes back then tells where the
// walk began. The links between elements stay true, and the anchors are put
// right before the list is destroyed.
namespace {

struct AnchorCase {
  const char* what;
  int count;
  int cacheIndex;  // kInvalid for a fresh cache
  int cacheShift;  // the cache's data is this many elements from cacheIndex
  int headShift;   // the head's first node is this many elements on
  int tailShift;   // the tail's last node is this many elements back (negative)
  int index;
  int expected;    // the value that the expected anchor gives
};

std::ostream& operator<<(std::ostream& out, const AnchorCase& c) { return out << c.what; }

class QDLListAnchor : public testing::TestWithParam<AnchorCase> {};

TEST_P(QDLListAnchor, StartsFromTheNearestAnchor) {
  const AnchorCase& c = GetParam();
  IntList list;
  fill(list, c.count);
  std::vector<Q_DLListBaseNode*> nodes;
  std::vector<int*> data;
  for (int* p = list.getFirst(); p != nullptr; p = list.getNext(p)) data.push_back(p);
  for (Q_DLListBaseNode* n = list.m_head.m_pNext; n != &list.m_tail; n = n->m_pNext) nodes.push_back(n);
  ASSERT_EQ(static_cast<std::size_t>(c.count), nodes.size());

  list.m_iCacheIndex = c.cacheIndex;
  list.m_pCacheData = c.cacheIndex == kInvalid ? nullptr : data[c.cacheIndex + c.cacheShift];
  list.m_head.m_pNext = nodes[c.headShift];
  list.m_tail.m_pPrev = nodes[c.count - 1 + c.tailShift];

  int* got = list.getAt(c.index);

  list.m_head.m_pNext = nodes.front();
  list.m_tail.m_pPrev = nodes.back();
  ASSERT_NE(nullptr, got);
  EXPECT_EQ(c.expected, *got);
  EXPECT_EQ(c.index, list.m_iCacheIndex);
  EXPECT_EQ(got, list.m_pCacheData);
}

INSTANTIATE_TEST_SUITE_P(
    QDLList, QDLListAnchor,
    testing::Values(
        // d = 3, h = 3, t = 1: from the tail, one step back (a head walk would give 4).
        AnchorCase{"five, fresh cache, index 3", 5, kInvalid, 0, 1, -1, 3, 2},
        // d = 1, h = 2, t = 2: one step back from the cache (either end would give 2).
        AnchorCase{"five, cache on 3, index 2", 5, 3, 1, 0, 0, 2, 3},
        // d = 2, h = 2, t = 2: the tie goes to the cache, which is the head (the tail would give 1).
        AnchorCase{"five, fresh cache, index 2", 5, kInvalid, 0, 0, -1, 2, 2},
        // d = 1, h = 1, t = 2: from the head (the tail would give 0).
        AnchorCase{"four, fresh cache, index 1", 4, kInvalid, 0, 0, -1, 1, 1},
        // d = 2, h = 2, t = 1: from the tail (the head would give 3).
        AnchorCase{"four, fresh cache, index 2", 4, kInvalid, 0, 1, -1, 2, 1},
        // d = 2, h = 4, t = 2: the tie goes to the cache (the tail would give 3, the head 4).
        AnchorCase{"seven, cache on 2, index 4", 7, 2, 1, 0, -1, 4, 5},
        // d = 6, h = 1, t = 7: to the head (the cache would give 0, the tail 1).
        AnchorCase{"nine, cache on 7, index 1", 9, 7, -1, 1, 0, 1, 2},
        // d = 6, h = 7, t = 1: to the tail (the cache would give 8, the head 7).
        AnchorCase{"nine, cache on 1, index 7", 9, 1, 1, 0, -1, 7, 6}));

}  // namespace

TEST(QDLListMemory, EveryNodeIsCountedOnceEachWay) {
  Counts counts;
  {
    IntList list;
    fill(list, 3);
    EXPECT_EQ(3, counts.newsSince());
    list.remove(list.getAt(1));
    EXPECT_EQ(1, counts.deletesSince());
    list.m_pSpareA = Q_Memory::allocate(32);
  }
  EXPECT_EQ(4, counts.newsSince());
  EXPECT_EQ(4, counts.deletesSince()) << "the destructor frees the nodes left and the spare block";
}

TEST(QDLListMemory, AFailedAppendThrowsAndLeavesTheListAsItWas) {
  IntList list;
  fill(list, 2);
  list.getAt(1);
  Counts counts;
  platform::fault::failAllocation(1);
  const char* text = nullptr;
  try {
    list.append();
    ADD_FAILURE() << "append gave an element with no memory";
  } catch (Q_MemoryException_Allocation* e) {
    text = e->getErrorMessage();
  }
  platform::fault::disarmAll();
  EXPECT_STREQ("Out of system memory resources", text);
  EXPECT_EQ(1, counts.newsSince()) << "the allocation that gave nothing counts too";
  EXPECT_EQ(0, counts.deletesSince());
  EXPECT_EQ(2, list.m_iCount);
  EXPECT_EQ((std::vector<int>{0, 1}), walk(list));
  EXPECT_EQ(1, valueAt(list, 1));
  *list.append() = 2;
  EXPECT_EQ((std::vector<int>{0, 1, 2}), walk(list));
}

// A subclass that takes the node operations over is reached by append and
// remove, and by its own destructor's cleanup.
TEST(QDLListMemory, SubclassNodeOperationsAreUsed) {
  struct Tracking : Q_DLList<int> {
    int* allocated;
    int* freed;
    Tracking(int* a, int* f) : allocated(a), freed(f) {}
    ~Tracking() override { freeAll(); }
    int* allocateNode() override {
      ++*allocated;
      return Q_DLList<int>::allocateNode();
    }
    void freeNode(int* data) override {
      ++*freed;
      Q_DLList<int>::freeNode(data);
    }
  };
  int allocated = 0;
  int freed = 0;
  {
    Tracking list(&allocated, &freed);
    for (int i = 0; i < 3; ++i) *list.append() = i;
    list.remove(list.getFirst());
    EXPECT_EQ(3, allocated);
    EXPECT_EQ(1, freed);
  }
  EXPECT_EQ(3, freed);
}
