// Failures of the runtime's start, one per test (every case runs in a process
// of its own): the exception and its text, what is left behind, and that a
// later N_Initializer of the process is a no-op.
#include <cstring>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "Q_Memory.h"
#include "fault.h"
#include "fault_guard.h"
#include "tasks.h"
#include "winsock.h"

namespace {

using platform::fault::Call;
using platform::WSAPROTOCOL_INFOA;

constexpr platform::DWORD kTcpBits[] = {platform::XP1_GUARANTEED_DELIVERY, platform::XP1_GUARANTEED_ORDER,
                                        platform::XP1_GRACEFUL_CLOSE, platform::XP1_EXPEDITED_DATA,
                                        platform::XP1_IFS_HANDLES};
constexpr platform::DWORD kUdpBits[] = {platform::XP1_CONNECTIONLESS, platform::XP1_MESSAGE_ORIENTED,
                                        platform::XP1_SUPPORT_BROADCAST, platform::XP1_SUPPORT_MULTIPOINT,
                                        platform::XP1_IFS_HANDLES};

platform::DWORD all(const platform::DWORD (&bits)[5]) {
  platform::DWORD flags = 0;
  for (platform::DWORD b : bits) flags |= b;
  return flags;
}

WSAPROTOCOL_INFOA entry(int family, platform::DWORD flags, int type = 1, int protocol = 6) {
  WSAPROTOCOL_INFOA info{};
  info.iAddressFamily = family;
  info.dwServiceFlags1 = flags;
  info.iSocketType = type;
  info.iProtocol = protocol;
  return info;
}

// Starts the runtime and expects it to throw C* with `text`.
template <class C>
void expectStartThrows(const char* text) {
  try {
    N_Initializer network;
    ADD_FAILURE() << "the start didn't throw";
  } catch (C* e) {
    ASSERT_NE(e, nullptr);
    EXPECT_STREQ(e->getErrorMessage(), text);
  } catch (Q_Exception* e) {
    ADD_FAILURE() << "wrong exception class, text \"" << e->getErrorMessage() << "\"";
  }
}

// After a failed start the count stays raised: a further instance neither
// throws nor starts anything, and its destruction stops nothing.
void expectLaterInstanceIsNoOp() {
  const N_Address* local = N_Address::getLocalAddress();
  std::set<int> before = tasks::ids();
  int news = Q_Memory::sm_iNewCount.load();
  {
    N_Initializer again;
    EXPECT_EQ(N_Address::getLocalAddress(), local);
  }
  EXPECT_EQ(Q_Memory::sm_iNewCount.load(), news) << "a further instance allocated";
  EXPECT_EQ(N_Address::getLocalAddress(), local);
  for (int tid : tasks::ids()) EXPECT_TRUE(before.count(tid)) << "a further instance started a thread";
}

class StartFailure : public ::testing::Test {
 protected:
  void SetUp() override {
    platform::setLocalHost("127.0.0.1");
    before = tasks::ids();
  }
  void TearDown() override { platform::setLocalHost(nullptr); }

  // No thread was started by the failed start.
  void expectNoNewThread() {
    for (int tid : tasks::ids()) EXPECT_TRUE(before.count(tid)) << "thread " << tid << " was started";
  }

  FaultGuard faults;
  std::set<int> before;
};

// ---- Winsock refuses to start ---------------------------------------------

TEST_F(StartFailure, SystemNotReady) {
  faults.arm(Call::WSAStartup, {.countdown = 1, .persist = false, .result = 10091});
  expectStartThrows<N_NetException_Unavailable>("WINSOCK: Network subsystem is unavailable");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

TEST_F(StartFailure, VersionNotSupported) {
  faults.arm(Call::WSAStartup, {.countdown = 1, .persist = false, .result = 10092});
  expectStartThrows<N_NetException_NotSupported>("WINSOCK: DLL version out of range");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

TEST_F(StartFailure, ProcessLimit) {
  faults.arm(Call::WSAStartup, {.countdown = 1, .persist = false, .result = 10067});
  expectStartThrows<N_NetException_ProcessLimit>("WINSOCK: Too many processes");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

// Another refusal than the three named isn't judged by its code; with
// nothing agreed on, the version test fails it.
TEST_F(StartFailure, OtherStartupErrorFailsTheVersionTest) {
  faults.arm(Call::WSAStartup, {.countdown = 1, .persist = false, .result = 10014});
  expectStartThrows<N_NetException_VersionFailure>("Winsock version 2.0 or newer required");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

// ---- The agreed version must be 2.0 exactly -------------------------------

class AgreedVersion : public StartFailure, public ::testing::WithParamInterface<platform::WORD> {};

TEST_P(AgreedVersion, OtherThanTwoZeroFailsAndClosesWinsock) {
  faults.setAgreedVersion(GetParam());
  expectStartThrows<N_NetException_VersionFailure>("Winsock version 2.0 or newer required");
  // Winsock was started once and closed again: nothing is left to close.
  EXPECT_EQ(platform::WSACleanup(), platform::SOCKET_ERROR);
  EXPECT_EQ(platform::WSAGetLastError(), platform::WSANOTINITIALISED);
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

// 1.0, 1.1, 2.1 (minor in the high byte), 2.2, 3.0.
INSTANTIATE_TEST_SUITE_P(Versions, AgreedVersion,
                         ::testing::Values(platform::WORD{0x0001}, platform::WORD{0x0101}, platform::WORD{0x0102},
                                           platform::WORD{0x0202}, platform::WORD{0x0003}));

// ---- Provider catalogue ---------------------------------------------------

TEST_F(StartFailure, EmptyCatalogueHasNoTcp) {
  faults.setCatalogue({});
  expectStartThrows<N_NetException_NoTCP>("TCP protocol not found");
  // Winsock stays started: only the version failure closes it.
  EXPECT_EQ(platform::WSACleanup(), 0);
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

TEST_F(StartFailure, FailedEnumerationHasNoTcp) {
  faults.arm(Call::WSAEnumProtocolsA, {.countdown = 1, .persist = true, .result = 10055});
  expectStartThrows<N_NetException_NoTCP>("TCP protocol not found");
  EXPECT_EQ(platform::fault::fired(Call::WSAEnumProtocolsA), 2);
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

TEST_F(StartFailure, TcpAndUdpOnlyOutsideIpv4HaveNoTcp) {
  faults.setCatalogue({entry(23, all(kTcpBits)), entry(23, all(kUdpBits), 2, 17), entry(0, all(kTcpBits))});
  expectStartThrows<N_NetException_NoTCP>("TCP protocol not found");
  expectNoNewThread();
}

class TcpBitMissing : public StartFailure, public ::testing::WithParamInterface<int> {};

TEST_P(TcpBitMissing, NoTcp) {
  platform::DWORD flags = all(kTcpBits) & ~kTcpBits[GetParam()];
  faults.setCatalogue({entry(2, flags), entry(2, all(kUdpBits), 2, 17)});
  expectStartThrows<N_NetException_NoTCP>("TCP protocol not found");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

INSTANTIATE_TEST_SUITE_P(EachBit, TcpBitMissing, ::testing::Range(0, 5));

class UdpBitMissing : public StartFailure, public ::testing::WithParamInterface<int> {};

TEST_P(UdpBitMissing, NoUdp) {
  platform::DWORD flags = all(kUdpBits) & ~kUdpBits[GetParam()];
  faults.setCatalogue({entry(2, all(kTcpBits)), entry(2, flags, 2, 17)});
  expectStartThrows<N_NetException_NoUDP>("UDP protocol not found");
  expectNoNewThread();
  expectLaterInstanceIsNoOp();
}

INSTANTIATE_TEST_SUITE_P(EachBit, UdpBitMissing, ::testing::Range(0, 5));

// TCP is judged first: with neither provider it is TCP that is missing.
TEST_F(StartFailure, NeitherProviderReportsTcp) {
  faults.setCatalogue({entry(2, all(kUdpBits) & ~platform::XP1_IFS_HANDLES),
                       entry(2, all(kTcpBits) & ~platform::XP1_IFS_HANDLES)});
  expectStartThrows<N_NetException_NoTCP>("TCP protocol not found");
}

// ---- Catalogues that do serve ---------------------------------------------

class Catalogue : public StartFailure {
 protected:
  void expectStarts() {
    try {
      N_Initializer network;
      EXPECT_NE(N_Address::getLocalAddress(), nullptr);
    } catch (Q_Exception* e) {
      ADD_FAILURE() << "start failed: " << e->getErrorMessage();
    }
  }
};

// One entry with all ten bits serves both kinds; socket type and protocol
// aren't looked at.
TEST_F(Catalogue, OneEntryServesBoth) {
  faults.setCatalogue({entry(2, all(kTcpBits) | all(kUdpBits), 99, 99)});
  expectStarts();
}

// The walk goes on past unusable entries, to the end of the catalogue.
TEST_F(Catalogue, UsableEntriesLateInTheCatalogue) {
  std::vector<WSAPROTOCOL_INFOA> list;
  for (int i = 0; i < 20; ++i) list.push_back(entry(23, all(kTcpBits) | all(kUdpBits)));
  for (int i = 0; i < 5; ++i) list.push_back(entry(2, all(kTcpBits) & ~kTcpBits[i]));
  list.push_back(entry(2, all(kUdpBits) | 0x80000000u, 2, 17));
  list.push_back(entry(2, all(kTcpBits) | 0x10u));
  faults.setCatalogue(list);
  expectStarts();
}

// ---- Allocations that give nothing ----------------------------------------
//
// The start allocates, in order: six lists, the catalogue buffer, the local
// address object, and inside its construct the shared block and the number
// string.

class AllocationFailure : public StartFailure, public ::testing::WithParamInterface<int> {};

TEST_P(AllocationFailure, RaisesAllocationAndKeepsWhatWasMade) {
  const int nth = GetParam();
  faults.failAllocation(nth);
  int news = Q_Memory::sm_iNewCount.load();
  int deletes = Q_Memory::sm_iDeleteCount.load();
  expectStartThrows<Q_MemoryException_Allocation>("Out of system memory resources");
  EXPECT_EQ(platform::fault::allocationsFailed(), 1);

  // Everything made before the failure stays (a failed start isn't undone);
  // the refused allocation is counted as well. A local address that failed
  // in its construct leaves nothing of its own.
  int expectedOutstanding = nth <= 8 ? nth : 8;
  int outstanding = (Q_Memory::sm_iNewCount.load() - news) - (Q_Memory::sm_iDeleteCount.load() - deletes);
  EXPECT_EQ(outstanding, expectedOutstanding);

  if (nth <= 7) {
    expectNoNewThread();
  } else {
    // The failure row of the local address: the network thread runs.
    EXPECT_NE(tasks::theNewThread(before), -1);
  }
  EXPECT_EQ(N_Address::getLocalAddress(), nullptr);
  expectLaterInstanceIsNoOp();
}

INSTANTIATE_TEST_SUITE_P(EachAllocation, AllocationFailure, ::testing::Range(1, 11));

}  // namespace
