// Failures of the runtime's start, each in a process of its own (a failed
// start isn't undone, and later instances of the process are no-ops): the
// exception, what is left behind, and that a further instance does nothing.
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <functional>
#include <ostream>
#include <string>
#include <vector>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "allocation_balance.h"
#include "fault_guard.h"
#include "runtime_test.h"
#include "threads.h"
#include "watchdog.h"
#include "winsock.h"

namespace {

using platform::DWORD;
using platform::WSAPROTOCOL_INFOA;
using platform::fault::Call;
using Arm = std::function<void(FaultGuard&)>;

constexpr DWORD kTcp[] = {platform::XP1_GUARANTEED_DELIVERY, platform::XP1_GUARANTEED_ORDER,
                          platform::XP1_GRACEFUL_CLOSE, platform::XP1_EXPEDITED_DATA, platform::XP1_IFS_HANDLES};
constexpr DWORD kUdp[] = {platform::XP1_CONNECTIONLESS, platform::XP1_MESSAGE_ORIENTED,
                          platform::XP1_SUPPORT_BROADCAST, platform::XP1_SUPPORT_MULTIPOINT, platform::XP1_IFS_HANDLES};
constexpr DWORD kAllTcp = 0x20066, kAllUdp = 0x20609;
constexpr const char* kNoTcp = "TCP protocol not found";
constexpr const char* kVersion = "Winsock version 2.0 or newer required";
constexpr const char* kNotResolved = "IP address is not resolved yet";

WSAPROTOCOL_INFOA entry(int family, DWORD flags) {
  WSAPROTOCOL_INFOA info{};
  info.iAddressFamily = family;
  info.dwServiceFlags1 = flags;
  return info;
}

Arm startup(int code) { return [=](FaultGuard& f) { f.arm(Call::WSAStartup, {1, false, code}); }; }
Arm version(platform::WORD agreed) { return [=](FaultGuard& f) { f.setAgreedVersion(agreed); }; }
Arm catalogue(std::vector<WSAPROTOCOL_INFOA> list) { return [=](FaultGuard& f) { f.setCatalogue(list); }; }
Arm localHost(const char* host, Call call = Call::Count, int countdown = 1) {
  return [=](FaultGuard& f) {
    platform::setLocalHost(host);
    if (call != Call::Count) f.arm(call, {countdown, true, 11001});
  };
}

struct StartCase {
  std::string name;
  Arm arm;
  const char* text;
  bool winsockLeftUp = true;  // only a refusal or a wrong version closes it
  bool threadRuns = false;    // the local address comes after the network thread
};
void PrintTo(const StartCase& c, std::ostream* os) { *os << c.name; }

std::vector<StartCase> startCases() {
  std::vector<StartCase> cases = {
      {"SystemNotReady", startup(10091), "WINSOCK: Network subsystem is unavailable", false},
      {"VersionNotSupported", startup(10092), "WINSOCK: DLL version out of range", false},
      {"ProcessLimit", startup(10067), "WINSOCK: Too many processes", false},
      {"OtherRefusalFailsTheVersionTest", startup(10014), kVersion, false},
      {"Version1_0", version(0x0001), kVersion, false},
      {"Version1_1", version(0x0101), kVersion, false},
      {"Version2_1", version(0x0102), kVersion, false},  // the minor version is the high byte
      {"Version2_2", version(0x0202), kVersion, false},
      {"Version3_0", version(0x0003), kVersion, false},
      {"EmptyCatalogue", catalogue({}), kNoTcp},
      {"FailedEnumeration", [](FaultGuard& f) { f.arm(Call::WSAEnumProtocolsA, {1, true, 10055}); }, kNoTcp},
      {"OnlyOutsideIpv4", catalogue({entry(23, kAllTcp | kAllUdp), entry(0, kAllTcp)}), kNoTcp},
      {"TcpIsJudgedFirst", catalogue({entry(2, kAllUdp & ~kTcp[4]), entry(2, kAllTcp & ~kTcp[4])}), kNoTcp},
      {"UnknownHost", localHost("no-such-host.invalid"), kNotResolved, true, true},
      {"FailedLookup", localHost("localhost", Call::gethostbyname), kNotResolved, true, true},
      {"AllZeros", localHost("0.0.0.0"), kNotResolved, true, true},
      // The first thread is the network thread, the second the resolver.
      {"NoResolver", localHost("localhost", Call::AfxBeginThread, 2), kNotResolved, true, true},
  };
  for (int i = 0; i < 5; ++i) {
    const std::string bit = std::to_string(i);
    cases.push_back({"TcpWithoutBit" + bit, catalogue({entry(2, kAllTcp & ~kTcp[i]), entry(2, kAllUdp)}), kNoTcp});
    cases.push_back({"UdpWithoutBit" + bit, catalogue({entry(2, kAllTcp), entry(2, kAllUdp & ~kUdp[i])}),
                     "UDP protocol not found"});
  }
  return cases;
}

class StartFailure : public ::testing::TestWithParam<StartCase> {};

TEST_P(StartFailure, ThrowsAndLaterInstancesAreNoOps) {
  const StartCase& c = GetParam();
  platform::setLocalHost("127.0.0.1");
  Watchdog dog(60.0, "a start that fails");
  const int idle = threadCount();
  FaultGuard faults;
  c.arm(faults);
  try {
    N_Initializer network;
    ADD_FAILURE() << "the start didn't throw";
  } catch (Q_Exception* e) {
    EXPECT_STREQ(c.text, e->getErrorMessage());
  }
  const N_Address* local = N_Address::getLocalAddress();
  ASSERT_EQ(c.threadRuns, local != nullptr);
  EXPECT_EQ(0u, local != nullptr ? local->getIdentifier() : 0u);
  EXPECT_TRUE(waitFor([&] { return threadCount() == idle + (c.threadRuns ? 1 : 0); }));
  EXPECT_EQ(c.winsockLeftUp ? 0 : platform::SOCKET_ERROR, platform::WSACleanup());

  AllocationBalance balance;
  const int threads = threadCount();
  {
    N_Initializer again;
    EXPECT_EQ(local, N_Address::getLocalAddress());
  }
  EXPECT_EQ(0, balance.outstanding()) << "a further instance allocated";
  EXPECT_EQ(threads, threadCount()) << "a further instance started a thread";
}

INSTANTIATE_TEST_SUITE_P(Each, StartFailure, ::testing::ValuesIn(startCases()),
                         [](const ::testing::TestParamInfo<StartCase>& p) { return p.param.name; });

// For each kind the first IPv4 entry with every bit wins, however late; type
// and protocol aren't looked at.
TEST(StartCatalogue, TheFirstEntryWithEveryBitServesEachKind) {
  platform::setLocalHost("127.0.0.1");
  FaultGuard faults;
  std::vector<WSAPROTOCOL_INFOA> late(20, entry(23, kAllTcp | kAllUdp));
  for (DWORD bit : kTcp) late.push_back(entry(2, kAllTcp & ~bit));
  late.push_back(entry(2, kAllUdp | 0x80000000u));
  late.push_back(entry(2, kAllTcp | 0x10u));
  for (const auto& list : {std::vector<WSAPROTOCOL_INFOA>{entry(2, kAllTcp | kAllUdp)}, late}) {
    faults.setCatalogue(list);
    try {
      N_Initializer network;
      EXPECT_NE(nullptr, N_Address::getLocalAddress());
    } catch (Q_Exception* e) {
      ADD_FAILURE() << "start failed: " << e->getErrorMessage();
    }
  }
}

// Allocation N = 1, 2, 3 ... of a start fails, each in a child process, until
// a start meets no failure. The start throws the allocation failure, or
// succeeds where the failure hit a thread that copes with it.
TEST(StartAllocation, EveryAllocationOfTheStartMayFail) {
  platform::setLocalHost("127.0.0.1");
  enum Outcome { kDone = 10, kThrew, kCoped, kOther };
  for (int n = 1;; ++n) {
    ASSERT_LT(n, 200) << "the start never ran without the failure";
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      platform::fault::failAllocation(n);
      int outcome = kOther;
      try {
        N_Initializer network;
        outcome = platform::fault::allocationsFailed() == 0 ? kDone : kCoped;
      } catch (Q_MemoryException_Allocation* e) {
        if (std::strcmp(e->getErrorMessage(), "Out of system memory resources") == 0) outcome = kThrew;
      } catch (...) {
      }
      ::_exit(outcome);
    }
    int status = 0;
    ASSERT_EQ(child, ::waitpid(child, &status, 0));
    const int outcome = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    if (outcome == kDone) break;
    ASSERT_TRUE(outcome == kThrew || outcome == kCoped) << "allocation " << n << ": outcome " << outcome;
    std::printf("allocation %d: %s\n", n, outcome == kThrew ? "the start threw" : "coped with");
  }
}

}  // namespace
