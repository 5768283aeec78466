// The foundations: counted allocation and Q_DLList on it, the exception
// family, Q_STR and Q_String, the diagnostic line, Q_Timer and Q_Mutex.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "N_Exceptions.h"
#include "Q_DLList.h"
#include "Q_Mutex.h"
#include "Q_New.h"
#include "Q_System.h"
#include "Q_Throw.h"
#include "Q_Timer.h"
#include "runtime_test.h"

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

// What a handler of type H caught, or null if the exception got past it.
template <class H>
void* caughtAs(const std::function<void()>& thrower) {
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
Q_Exception* thrown(const std::function<void()>& thrower) { return static_cast<Q_Exception*>(caughtAs<Q_Exception*>(thrower)); }

std::vector<std::string> g_lines;  // what the verbose sink got
void collect(const char* line) { g_lines.emplace_back(line); }

}  // namespace

// Each allocation and release counts once; null releases and a throwing
// constructor count nothing; an injected fault throws before any constructor
// and counts as made.
TEST(QMemory, AllocationsReleasesAndFaultsAreCountedOnce) {
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
  EXPECT_EQ(0, balance.outstanding());
  FaultGuard faults;
  Widget::constructed = 0;
  for (const auto& allocate : std::vector<std::function<void()>>{[] { Q_Memory::allocate(8); }, [] { Q_New<Widget>(1, 2); },
                                                                 [] { Q_NewArray<char>(10); }}) {
    faults.failAllocation(1);
    Q_Exception* e = thrown(allocate);
    ASSERT_NE(nullptr, e) << "an allocation gave memory it was told not to";
    EXPECT_STREQ("Out of system memory resources", e->getErrorMessage());
  }
  EXPECT_EQ(0, Widget::constructed);
  EXPECT_EQ(3, balance.outstanding());
}

TEST(QDLList, KeepsOrderAddressesAndIndicesThroughChangesAndFailuresAndFreesEverything) {
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
    {
      FaultGuard faults;
      faults.failAllocation(1);
      EXPECT_THROW(list.append(), Q_MemoryException_Allocation*);
    }
    EXPECT_EQ(3, balance.outstanding()) << "the refused allocation is counted, nothing else";
    for (int i : {3, 1}) list.remove(at[i]);
    EXPECT_EQ(nullptr, list.getFirst());
    EXPECT_EQ(nullptr, list.getAt(0));
    for (int i : {7, 8}) *list.append() = i;
    EXPECT_EQ((std::vector<int>{7, 8}), walk(list)) << "an emptied list is usable again";
    list.m_pSpareA = Q_Memory::allocate(32);
    list.m_pSpareB = Q_Memory::allocate(8);
  }
  EXPECT_EQ(1, balance.outstanding()) << "the destructors free the nodes left and both spare blocks, once";
  // getAt in any order, and after the list changed under an index.
  IntList list;
  for (int i = 0; i < 10; ++i) *list.append() = i;
  for (int i : {0, 1, 9, 8, 5, 0, 9, 3, 3, 8, 1, 6}) EXPECT_EQ(i, *list.getAt(i));
  for (int outside : {-1, 10, IntList::kInvalidCacheIndex}) EXPECT_EQ(nullptr, list.getAt(outside));
  *list.append() = 10;
  EXPECT_EQ(10, *list.getAt(10));
  list.remove(list.getFirst());
  EXPECT_EQ(3, *list.getAt(2)) << "index 2 is another element now";
  EXPECT_EQ(10, *list.getAt(9));
}

// Each class throws its text from one instance of its own; handlers of every
// base match, and the memory and network branches don't cross.
TEST(QException, EachClassThrowsItsTextFromAnInstanceOfItsOwn) {
  const std::pair<std::function<void()>, const char*> throws[] = {
      {Q_Throw<Q_MemoryException_Allocation>, "Out of system memory resources"},
      // The texts of a failed start are checked where the start fails (the runtime's tests).
      {Q_Throw<N_NetException_NoTCP>, "TCP protocol not found"},
      {Q_Throw<N_NetException_LocalAddressAlreadyInUse>, "Local address is already bound to other socket"},
      {Q_ThrowPacketsStackingUp, "Packets are stacking up. Already 4.00 seconds of data waiting in queue"},
      {[] { Q_ThrowPacketTooBig(70000, 65536); },
       "Packet 70000 bytes exceeds 65536 byte limit when not using distributed packet mechanism"},
  };
  std::set<Q_Exception*> instances;
  for (const auto& [thrower, text] : throws) {
    Q_Exception* e = thrown(thrower);
    ASSERT_NE(nullptr, e) << text;
    EXPECT_STREQ(text, e->getErrorMessage());
    EXPECT_EQ(e, thrown(thrower)) << "a second throw raises the same instance";
    instances.insert(e);
  }
  EXPECT_EQ(std::size(throws), instances.size());
  EXPECT_EQ(thrown(Q_Throw<Q_MemoryException_Allocation>), thrown(Q_ThrowAllocation));
  EXPECT_STREQ("Packet 99 bytes exceeds 42 byte limit when not using distributed packet mechanism",
               thrown([] { Q_ThrowPacketTooBig(99, 42); })->getErrorMessage());

  const std::function<void()> noTcp = Q_Throw<N_NetException_NoTCP>;
  void* instance = caughtAs<N_NetException_NoTCP*>(noTcp);
  ASSERT_NE(nullptr, instance);
  EXPECT_EQ(instance, caughtAs<N_NetException*>(noTcp));
  EXPECT_EQ(instance, caughtAs<CObject*>(noTcp));
  EXPECT_EQ(nullptr, caughtAs<N_NetException*>(Q_ThrowAllocation));
  EXPECT_NE(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowAllocation));
  EXPECT_EQ(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowPacketsStackingUp));
  EXPECT_STREQ("Q_Exception", static_cast<CObject*>(instance)->GetRuntimeClass()->m_lpszClassName);
}

TEST(QException, TextsAreCutCopiedAndReported) {
  N_NetException_PacketTooBig a, b;
  EXPECT_STREQ("", a.getErrorMessage());
  a.setError("%s", std::string(2000, 'x').c_str());
  EXPECT_EQ(std::string(Q_Exception::kMaxErrorLength, 'x'), a.getErrorMessage());
  b.setError("size %d", 12);
  a = b;
  EXPECT_STREQ("size 12", a.getErrorMessage());
  b.setError(nullptr);
  EXPECT_STREQ("", b.getErrorMessage());
  char buffer[8] = "#######";
  unsigned help = 77;
  EXPECT_TRUE(N_NetException_NoTCP().GetErrorMessage(buffer, 4, &help));
  EXPECT_STREQ("TCP", buffer);
  EXPECT_EQ('#', buffer[4]) << "wrote past the size it was given";
  EXPECT_EQ(0u, help);
  EXPECT_FALSE(N_NetException_NoTCP().GetErrorMessage(nullptr, 8));
  buffer[0] = '#';
  EXPECT_FALSE(CException().GetErrorMessage(buffer, sizeof buffer, &help));
  EXPECT_STREQ("", buffer) << "no message is an empty text";
  testing::internal::CaptureStderr();
  EXPECT_EQ(1, static_cast<CException&>(a).ReportError());
  EXPECT_EQ(1, CException().ReportError());
  EXPECT_EQ("size 12\nNo error message is available.\n", testing::internal::GetCapturedStderr());
}

// Q_STR keeps each text for seven more calls of its thread and cuts long
// ones; the diagnostic line goes to stderr when on, and to a sink until it is
// removed.
TEST(QSystem, TextsAndTheDiagnosticLine) {
  const char* first = Q_STR("error %d on %s", 10054, "socket");
  std::vector<const char*> later;
  for (int i = 0; i < 7; ++i) later.push_back(Q_STR("%d", i));
  std::thread([] {
    for (int i = 0; i < 20; ++i) Q_STR("other thread %d", i);
  }).join();
  EXPECT_STREQ("error 10054 on socket", first);
  for (int i = 0; i < 7; ++i) EXPECT_EQ(std::to_string(i), later[i]);
  EXPECT_STREQ("", Q_STR(nullptr));
  EXPECT_EQ(std::string(2047, 'y'), Q_STR("%s", std::string(5000, 'y').c_str()));
  Q_String kept(Q_STR("kept %d", 1));
  for (int i = 0; i < 8; ++i) Q_STR("overwrite %d", i);
  EXPECT_STREQ("kept 1", kept.c_str());
  kept.assign("abcdef", 3);
  EXPECT_STREQ("abc", kept.c_str());
  EXPECT_EQ(3u, kept.length());
  kept.assign(nullptr, 4);
  EXPECT_EQ(0u, kept.length() + Q_String(nullptr).length());

  testing::internal::CaptureStderr();
  Sys->verbose("hidden %d", 1);
  Sys->setVerbose(true);
  EXPECT_TRUE(Sys->isVerbose());
  Sys->verbose("shown %d", 2);
  Sys->verbose("%s", "already ended\n");
  Sys->setVerbose(false);
  Sys->verbose("hidden %d", 3);
  EXPECT_EQ("shown 2\nalready ended\n", testing::internal::GetCapturedStderr());
  Sys->setVerboseSink(collect);
  Sys->verbose("%s", Q_STR("WSASend failed with %s (%d)", "WSAECONNRESET", 10054));
  Sys->verbose("100%% sure\n");
  Sys->setVerboseSink(nullptr);
  Sys->verbose("after removal");
  EXPECT_EQ((std::vector<std::string>{"WSASend failed with WSAECONNRESET (10054)", "100% sure"}), g_lines);
}

// A timer runs from zero or the age given, also in raw storage that no
// constructor ran for (records hold them so); nested Q_Mutex locks hold until
// the outermost ends.
TEST(QSystem, TimerAndMutex) {
  Q_Timer timer;
  EXPECT_TRUE(timer.getAge() >= 0.0f && timer.getAge() < 1.0f);
  std::this_thread::sleep_for(std::chrono::milliseconds(30));
  EXPECT_GE(timer.getAge(), 0.029f);
  timer.setAge(-2.0f);
  EXPECT_TRUE(timer.getAge() >= -2.0f && timer.getAge() < -1.0f);
  void* raw = std::malloc(sizeof(Q_Timer));
  std::memset(raw, 0xff, sizeof(Q_Timer));
  auto* stored = static_cast<Q_Timer*>(raw);
  stored->reset();
  EXPECT_TRUE(stored->getAge() >= 0.0f && stored->getAge() < 1.0f);
  std::free(raw);

  Q_Mutex mutex;
  const auto otherThreadTakes = [&] {
    bool took = false;
    std::thread([&] {
      if ((took = mutex.tryLock())) mutex.unlock();
    }).join();
    return took;
  };
  {
    Q_MutexLock outer(&mutex);
    {
      Q_MutexLock inner(&mutex);
      Q_MutexLock none(nullptr);
    }
    EXPECT_FALSE(otherThreadTakes()) << "released at the inner unlock";
  }
  EXPECT_TRUE(otherThreadTakes()) << "still held after the outermost unlock";
}
