// The runtime's life (start and its failures, further instances, restarts,
// the idle network thread, what the stop deletes and closes, the order of its
// two locks) and address resolution over this machine's real name service.
// Expectations come from the platform's own lookups, not from how the hosts
// file names 127.0.0.1.
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "N_Exceptions.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "fault_sweep.h"
#include "raw_socket.h"
#include "runtime_test.h"
#include "win32.h"
#include "winsock.h"

namespace {

using platform::DWORD;
using platform::WSAPROTOCOL_INFOA;
using platform::fault::Call;

// The threads of this process (the runtime's threads have no names).
int threadCount() {
  return static_cast<int>(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}));
}
// Sanitizers start a helper thread with the process's first thread; starting
// one at load makes that happen before any test counts.
const bool g_threadsWarmedUp = [] {
  std::thread([] {}).join();
  return true;
}();

void sleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }
std::string text(const volatile char* s) { return s != nullptr ? std::string(const_cast<const char*>(s)) : "(null)"; }
std::uint32_t lookUp(const char* host) {
  platform::hostent* entry = platform::gethostbyname(host);
  return entry != nullptr ? *reinterpret_cast<std::uint32_t*>(entry->h_addr_list[0]) : 0;
}

// What the start meets: the catalogue of providers, the agreed version, the
// local host and its lookup.
using Arm = std::function<void(FaultGuard&)>;
constexpr DWORD kAllTcp = 0x20066, kAllUdp = 0x20609;
constexpr const char* kVersion = "Winsock version 2.0 or newer required";
constexpr const char* kNotResolved = "IP address is not resolved yet";

WSAPROTOCOL_INFOA entry(int family, DWORD flags) {
  WSAPROTOCOL_INFOA info{};
  info.iAddressFamily = family, info.dwServiceFlags1 = flags;
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

// The first instance starts the runtime on the chosen local host (a dotted
// number needs no lookup, a name must resolve before the start returns), a
// further one only counts, the last stop takes everything down, and a later
// start makes everything anew. Without its thread the runtime still comes
// up, and its stop doesn't wait for a thread that never ran. Without a
// runtime an address still resolves.
TEST(Runtime, StartsOnTheChosenLocalHostCountsInstancesAndRestarts) {
  Watchdog dog(60.0, "starts and stops");
  AllocationBalance balance;
  const int idle = threadCount();
  {
    N_Address alone("localhost");
    EXPECT_TRUE(alone.wait(10.0f));
  }
  EXPECT_TRUE(waitFor([&] { return threadCount() == idle; })) << "the resolver";
  struct Start { const char* host; Arm arm; bool threadless = false; };
  const std::vector<Start> starts = {{"127.0.0.2", localHost("127.0.0.2")}, {"localhost", localHost("localhost")},
                                     {"127.0.0.1", catalogue({entry(23, kAllTcp | kAllUdp), entry(2, kAllTcp | kAllUdp)})},
                                     {"127.0.0.1", [](FaultGuard& f) { f.arm(Call::AfxBeginThread, {1, false, 10055}); }, true}};
  for (std::size_t i = 0; i < starts.size(); ++i) {
    const Start& s = starts[i];
    SCOPED_TRACE(i);
    platform::setLocalHost("127.0.0.1");
    FaultGuard faults;
    s.arm(faults);
    const std::uint32_t expected = lookUp(s.host);
    ASSERT_NE(0u, expected);
    ASSERT_EQ(nullptr, N_Address::getLocalAddress());
    {
      N_Initializer network;
      EXPECT_EQ(s.threadless ? 1 : 0, platform::fault::fired(Call::AfxBeginThread));
      const N_Address* local = N_Address::getLocalAddress();
      ASSERT_NE(nullptr, local);
      EXPECT_EQ(expected, local->getIdentifier());
      const volatile char* given = s.host[0] == 'l' ? local->getStringName() : local->getStringNumber();
      EXPECT_STREQ(s.host, const_cast<const char*>(given)) << "the text it was made from";
      {
        N_Initializer further;
        Q_New<N_Address>("127.0.0.1");  // registered, so the last stop deletes it
      }
      EXPECT_EQ(local, N_Address::getLocalAddress()) << "the runtime stays up";
      EXPECT_TRUE(waitFor([&] { return threadCount() == idle + !s.threadless; })) << "one network thread";
    }
    EXPECT_EQ(nullptr, N_Address::getLocalAddress());
    EXPECT_TRUE(waitFor([&] { return threadCount() == idle; })) << "the network thread is still there";
    EXPECT_EQ(platform::SOCKET_ERROR, platform::WSACleanup()) << "the stop ended the use of Winsock";
  }
  EXPECT_TRUE(balance.settles());
}

using RuntimeLife = RuntimeTest;

TEST_F(RuntimeLife, IdleNetworkThreadBlocksInsteadOfSpinning) {
  for (int i = 0; i < 3; ++i) N_Address wake("127.0.0.1");
  sleepMs(200);
  const std::clock_t before = std::clock();  // the whole process: this thread only sleeps
  sleepMs(300);
  EXPECT_LE(static_cast<double>(std::clock() - before) / CLOCKS_PER_SEC, 0.05) << "processor time used in 300 ms of idling";
}

// Sockets with sends and reads in flight, a listener with connections nobody
// claimed, and addresses still registered go with the stop: ports closed,
// connections closed, every allocation given back (the fixture checks that).
// The stop comes from a thread that owns the network mutex by one level: it
// gives that level up first, or the network thread could never end.
TEST_F(RuntimeLife, StopDeletesAndClosesWhatIsStillRegistered) {
  const int listenPort = port(), udpPort = port() + 1;
  N_Listener* listener = Q_New<N_Listener>(listenPort);
  int peers[3];
  for (int& peer : peers) ASSERT_GE(peer = raw::connectTo("127.0.0.1", listenPort), 0);
  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener->pollConnect(data); }));
  N_Socket* accepted = Q_New<N_Socket>(data);
  char payload[1000] = {};
  for (int i = 0; i < 20; ++i) accepted->send(payload, sizeof payload);
  for (int peer : peers) ASSERT_TRUE(raw::sendAll(peer, payload, sizeof payload));
  N_Socket* udp = Q_New<N_Socket>(Q_New<N_Address>("127.0.0.1"), udpPort, N_Socket::SOCKET_UDP);
  udp->send(payload, 100);
  Q_New<N_Address>("localhost")->construct("127.0.0.1");
  Q_Delete(Q_New<N_Address>("localhost"));  // gone before the stop: not touched again
  N_Address destructed("127.0.0.1");
  destructed.destruct();
  EXPECT_FALSE(raw::portIsFree(listenPort));
  EXPECT_FALSE(raw::portIsFree(udpPort));
  sleepMs(100);  // the network thread posts reads and issues sends
  platform::HANDLE mutex = platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex");
  ASSERT_EQ(platform::WAIT_OBJECT_0, platform::WaitForSingleObject(mutex, platform::INFINITE));
  Q_New<N_Address>("127.0.0.1");  // wakes the network thread, which then waits for the mutex
  sleepMs(50);
  {
    Watchdog dog(20.0, "stop by the owner of the network mutex");
    stopRuntime();
  }
  platform::CloseHandle(mutex);
  for (int peer : peers) {
    EXPECT_TRUE(raw::closedByPeer(peer, 10000));
    raw::closeFd(peer);
  }
  EXPECT_TRUE(raw::portIsFree(listenPort));
  EXPECT_TRUE(raw::portIsFree(udpPort));
}

// The runtime's mutex and the one shared by all addresses are taken in one
// order only: never the runtime's while holding the address one. Threads that
// go both ways at once (an address on its own; sockets, which make, read and
// delete addresses with the runtime's mutex held) must all finish. Under the
// thread sanitizer this also checks the handshakes for races. Only names the
// hosts file answers are used, so the name server isn't flooded.
TEST_F(RuntimeLife, LockOrderHoldsOnAllPathsAtOnce) {
  Watchdog dog(60.0, "addresses and sockets made and destroyed on six threads");
  const int idle = threadCount();
  std::atomic<bool> stop{false};
  std::atomic<int> rounds{0};
  std::vector<std::thread> threads;
  const auto pause = [] { std::this_thread::sleep_for(std::chrono::microseconds(500)); };
  // Plain owners: construct, read, construct again, destroy.
  for (const char* host : {"localhost", "127.0.0.1"}) {
    threads.emplace_back([&, host] {
      for (; !stop; ++rounds, pause()) {
        N_Address a(host);
        (void)a.getIdentifier();
        (void)a.fullyResolved();
        a.construct("0.0.0.0");
      }
    });
  }
  // The socket's way: the runtime's mutex first, then addresses inside it.
  threads.emplace_back([&] {
    platform::HANDLE mutex = platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex");
    for (; !stop; ++rounds, pause()) {
      platform::WaitForSingleObject(mutex, platform::INFINITE);
      Q_Delete(Q_New<N_Address>("127.0.0.1"));
      platform::ReleaseMutex(mutex);
    }
    platform::CloseHandle(mutex);
  });
  // Sockets read their peer's identifier with the runtime's mutex held; an
  // accepted one makes its own address with the mutex held, and deletes it in
  // its destruct, also with the mutex held.
  N_Listener listener(port());
  for (bool accepted : {false, true}) {
    threads.emplace_back([&, accepted] {
      for (; !stop; ++rounds, pause()) try {
          const int client = accepted ? raw::connectTo("127.0.0.1", port()) : -1;
          N_Socket::ConnectData* data = nullptr;
          if (!accepted) N_Socket udp(loopback(), port() + 1, N_Socket::SOCKET_UDP);
          if (client >= 0 && waitFor([&] { return listener.pollConnect(data); })) N_Socket in(data);
          raw::closeFd(client);
        } catch (Q_Exception* e) {
          ADD_FAILURE() << e->getErrorMessage();
        }
    });
  }
  // Addresses left for the stop to delete.
  threads.emplace_back([&] {
    for (int i = 0; i < 20 && !stop; ++i, sleepMs(20)) Q_New<N_Address>(i % 2 == 0 ? "localhost" : "127.0.0.1");
  });
  sleepMs(2000);
  stop = true;
  for (std::thread& t : threads) t.join();
  EXPECT_GT(rounds.load(), 0);
  EXPECT_TRUE(waitFor([&] { return threadCount() <= idle; }, 30000)) << "resolvers still running";
}

// Failures of the start, each in a process of its own (a failed start isn't
// undone, and later instances of the process are no-ops): the exception,
// what is left behind, and that a further instance does nothing.
struct StartCase {
  std::string name;
  Arm arm;
  const char* text;
  bool winsockLeftUp = true;  // only a refusal or a wrong version closes it
  bool threadRuns = false;    // the local address comes after the network thread
};
void PrintTo(const StartCase& c, std::ostream* os) { *os << c.name; }

std::vector<StartCase> startCases() {
  return {
      {"SystemNotReady", startup(10091), "WINSOCK: Network subsystem is unavailable", false},
      {"VersionNotSupported", startup(10092), "WINSOCK: DLL version out of range", false},
      {"ProcessLimit", startup(10067), "WINSOCK: Too many processes", false},
      {"OtherRefusalFailsTheVersionTest", startup(10014), kVersion, false},
      {"Version1_1", version(0x0101), kVersion, false},
      {"Version2_1", version(0x0102), kVersion, false},  // the minor version is the high byte
      {"Version3_0", version(0x0003), kVersion, false},
      {"NoIpv4Tcp", catalogue({entry(23, kAllTcp | kAllUdp), entry(2, kAllTcp & ~0x2u), entry(2, kAllUdp)}), "TCP protocol not found"},
      {"FailedEnumeration", [](FaultGuard& f) { f.arm(Call::WSAEnumProtocolsA, {1, true, 10055}); }, "TCP protocol not found"},
      {"NoUdp", catalogue({entry(2, kAllTcp), entry(2, kAllUdp & ~0x200u)}), "UDP protocol not found"},
      {"UnknownHost", localHost("no-such-host.invalid"), kNotResolved, true, true},
      {"FailedLookup", localHost("localhost", Call::gethostbyname), kNotResolved, true, true},
      {"AllZeros", localHost("0.0.0.0"), kNotResolved, true, true},
      // The first thread is the network thread, the second the resolver.
      {"NoResolver", localHost("localhost", Call::AfxBeginThread, 2), kNotResolved, true, true},
  };
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
  }
}

class Address : public RuntimeTest {
 protected:
  void SetUp() override {
    m_iIdle = threadCount() + 1;  // and the network thread
    RuntimeTest::SetUp();
    ASSERT_TRUE(resolversDone()) << "the runtime's own lookups";
  }
  bool resolversDone() { return waitFor([&] { return threadCount() == m_iIdle; }, 30000); }
  int m_iIdle = 0;
};

TEST_F(Address, TheGivenHalfIsThereAtOnceAndTheLookupBringsTheOther) {
  const std::uint32_t forward = lookUp("localhost"), loop = platform::inet_addr("127.0.0.1");
  ASSERT_NE(0u, forward) << "this machine doesn't resolve localhost";
  const std::string numberText = platform::inet_ntoa(platform::in_addr{forward});
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
  EXPECT_EQ(forward, byName.getIdentifier());
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ(name, text(byNumber.getStringName()));
  EXPECT_EQ(reverse != nullptr, byNumber.fullyResolved());
  EXPECT_EQ("localhost", text(byName.getStringName())) << "the given name stays, not a canonical one";
}

// Digits and dots make a number, anything else a name. With both lookups
// failing, only the given half is ever there.
TEST_F(Address, TextIsReadByItsCharactersOnly) {
  FaultGuard faults(Call::gethostbyname, {.countdown = 1, .persist = true, .result = 11001});
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
  for (auto [given, number] : {std::pair{"1.2.3.4.5.6", true}, {"12345", true}, {"1.2.3.x", false}, {"127.0.0.1 ", false}}) {
    N_Address a(given);
    ASSERT_TRUE(resolversDone());
    EXPECT_EQ(given, text(number ? a.getStringNumber() : a.getStringName()));
    EXPECT_EQ(nullptr, number ? a.getStringName() : a.getStringNumber()) << given;
    EXPECT_EQ(number ? platform::inet_addr(given) : 0u, a.getIdentifier()) << given;
  }
  EXPECT_EQ(2, platform::fault::fired(Call::gethostbyname));
  N_Address none(nullptr), zeros("0.0.0.0");
  ASSERT_TRUE(resolversDone());
  EXPECT_EQ("", text(none.getStringNumber())) << "null is the empty number";
  EXPECT_EQ(platform::INADDR_NONE, none.getIdentifier());
  EXPECT_EQ(0u, zeros.getIdentifier());
  EXPECT_EQ(3, platform::fault::fired(Call::gethostbyaddr)) << "0.0.0.0 is never looked up";
  const auto start = Clock::now();
  EXPECT_FALSE(none.wait(0.3f)) << "a number without a name never resolves fully";
  EXPECT_GE(secondsSince(start), 0.29) << "wait gave up early";
}

// Without its mutex, its resolver thread or a lookup's answer an address
// keeps the half it was given. A failed construct leaves the object
// unconstructed and nothing allocated, and it can be constructed again; a
// resolver without memory gives up.
TEST_F(Address, APlatformOrAllocationFailureLeavesTheGivenHalf) {
  for (Call call : {Call::CreateMutexA, Call::AfxBeginThread, Call::gethostbyname, Call::gethostbyaddr}) {
    EXPECT_TRUE(sweepCall(call, 10055, [&] {
      N_Address name("localhost"), number("127.0.0.1");
      ASSERT_TRUE(resolversDone());
      EXPECT_EQ("localhost", text(name.getStringName()));
      EXPECT_EQ("127.0.0.1", text(number.getStringNumber()));
      // A met fault leaves one half out (that both come without one is the
      // lookup test's; a real lookup may fail now and then on a busy host).
      EXPECT_FALSE(platform::fault::fired(call) > 0 && name.fullyResolved() && number.fullyResolved());
    })) << platform::fault::name(call);
  }
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

// Held at its first step, a resolver finds its owner gone: no lookup, and it
// frees the block that waited for it. The owner goes, or is constructed
// again, at times from "at once" to "after the lookup": an old resolver never
// writes into new data or a dead owner.
TEST_F(Address, AResolverWhoseOwnerIsGoneOrConstructedAgain) {
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
  platform::fault::disarm(Call::gethostbyname);  // names resolve, numbers keep no name
  faults.arm(Call::gethostbyaddr, {.countdown = 1, .persist = true, .result = 11001});
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

}  // namespace
