// Waits, mutexes, threads, rand, names, start-up, and the fault plans of
// every call.
#include <atomic>
#include <cstring>
#include <functional>
#include <thread>
#include <vector>

#include "fault.h"
#include "fault_guard.h"
#include "platform_test.h"

using namespace platform_test;
using platform::fault::Call;

namespace {

struct Events {
  std::vector<WSAEVENT> handles;
  explicit Events(int n) : handles(n) {
    for (WSAEVENT& e : handles) e = WSACreateEvent();
  }
  ~Events() {
    for (WSAEVENT e : handles) WSACloseEvent(e);
  }
  DWORD wait(DWORD count, DWORD milliseconds = 0) {
    return WSAWaitForMultipleEvents(count, handles.data(), FALSE, milliseconds, TRUE);
  }
};

// The error a call ended with, 0 if it succeeded.
int errorIf(bool failed) { return failed ? WSAGetLastError() : 0; }
unsigned noWork(void*) { return 0; }
void noRoutine(DWORD, DWORD, WSAOVERLAPPED*, DWORD) {}

}  // namespace

TEST(Wait, GivesTheLowestSignalledIndexAndEventsStaySetUntilReset) {
  Events e(65);
  ASSERT_TRUE(WSASetEvent(e.handles[63]) && WSASetEvent(e.handles[7]));
  EXPECT_EQ(7u, e.wait(64));
  EXPECT_EQ(7u, e.wait(64)) << "manual reset";
  ASSERT_TRUE(WSAResetEvent(e.handles[7]));
  EXPECT_EQ(63u, e.wait(64));
  ASSERT_TRUE(WSAResetEvent(e.handles[63]));
  EXPECT_EQ(WSA_WAIT_TIMEOUT, e.wait(64, 20));
  for (DWORD count : {0u, 65u}) {
    EXPECT_EQ(WSA_WAIT_FAILED, e.wait(count));
    EXPECT_EQ(WSA_INVALID_PARAMETER, WSAGetLastError());
  }
  ASSERT_TRUE(WSACloseEvent(e.handles[1]));
  EXPECT_FALSE(WSASetEvent(e.handles[1]));
  EXPECT_EQ(WSA_WAIT_FAILED, e.wait(2));
  EXPECT_EQ(WSA_INVALID_HANDLE, WSAGetLastError());
  e.handles[1] = WSACreateEvent();
}

TEST(Mutex, OneNameIsOneRecursiveMutexOwnedByAThread) {
  HANDLE a = CreateMutexA(nullptr, FALSE, "system test mutex");
  HANDLE b = CreateMutexA(nullptr, FALSE, "system test mutex");
  HANDLE owned = CreateMutexA(nullptr, TRUE, "another name");
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(a, INFINITE));
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, 50)) << "the owner may take it again";
  std::thread([&] {
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(b, 0)) << "both handles name one mutex";
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(a, 30));
    EXPECT_FALSE(ReleaseMutex(a)) << "a thread that doesn't own it can't release it";
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(owned, 0)) << "owned by its creator";
  }).join();
  EXPECT_TRUE(ReleaseMutex(a) && ReleaseMutex(b) && ReleaseMutex(owned));
  EXPECT_FALSE(ReleaseMutex(a)) << "released as often as taken";
  EXPECT_TRUE(CloseHandle(a));
  EXPECT_FALSE(CloseHandle(a));
  std::thread([&] {
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, 0)) << "the other handle still works";
    EXPECT_TRUE(ReleaseMutex(b));
  }).join();
  EXPECT_TRUE(CloseHandle(b) && CloseHandle(owned));
}

TEST(Rand, FollowsTheClassicSequencePerThreadOrOnAStateOfItsOwn) {
  platform::srand(1);
  for (int expected : {41, 18467, 6334, 26500, 19169}) EXPECT_EQ(expected, platform::rand());
  int fromThread = -1;
  std::thread([&] { fromThread = platform::rand(); }).join();
  EXPECT_EQ(41, fromThread) << "each thread starts at seed 1";
  for (unsigned seed : {0u, 777u, 0x9E3779B9u}) {
    platform::srand(seed);
    unsigned state = seed;
    for (int i = 0; i < 1000; ++i) {
      const int v = platform::rand();
      ASSERT_EQ(v, platform::rand(state));
      ASSERT_TRUE(v >= 0 && v <= 32767);
    }
  }
}

TEST(Names, TheLocalHostCanBeChosenAndLookupsGivePerThreadRecords) {
  char name[1024];
  platform::setLocalHost("127.0.0.2");
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STREQ("127.0.0.2", name);
  EXPECT_EQ(SOCKET_ERROR, platform::gethostname(name, 9)) << "no room for the end of the name";
  platform::setLocalHost(nullptr);
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STRNE("127.0.0.2", name);
  hostent* mine = gethostbyname("localhost");
  ASSERT_NE(nullptr, mine);
  EXPECT_EQ(0x0100007Fu, *reinterpret_cast<std::uint32_t*>(mine->h_addr_list[0])) << "network order";
  hostent* theirs = nullptr;
  std::thread([&] { theirs = gethostbyname("127.0.0.3"); }).join();
  EXPECT_NE(mine, theirs);
  EXPECT_EQ(nullptr, gethostbyname("no-such-host.invalid"));
  const int error = WSAGetLastError();  // try again where no name server is reachable
  EXPECT_TRUE(error == WSAHOST_NOT_FOUND || error == WSATRY_AGAIN) << error;
}

TEST(Faults, PlansPersistWhenAskedAndDisarmingRestoresEverything) {
  FaultGuard faults(Call::WSAStartup, {1, true, WSAEPROCLIM});
  WSADATA data{};
  for (int i = 0; i < 2; ++i) EXPECT_EQ(WSAEPROCLIM, WSAStartup(0x0002, &data));
  EXPECT_EQ(2, platform::fault::fired(Call::WSAStartup));
  faults.failAllocation(2, true);
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  EXPECT_TRUE(platform::fault::allocationShouldFail() && platform::fault::allocationShouldFail());
  EXPECT_EQ(2, platform::fault::allocationsFailed());
  faults.setAgreedVersion(0x0101);
  faults.setCatalogue({});
  platform::fault::disarmAll();
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  EXPECT_EQ(0, WSAStartup(0x0002, &data));
  EXPECT_EQ(0x0002, data.wVersion);
  DWORD size = 0;
  EXPECT_EQ(SOCKET_ERROR, WSAEnumProtocolsA(nullptr, nullptr, &size));
  EXPECT_GT(size, 0u) << "the real catalogue is back";
  WSACleanup();
}

// Each call answers its plan's result on the second call only: the first and
// the third behave as without a plan.
TEST(Faults, EveryCallFailsAsItsPlanSays) {
  constexpr int kCode = 10050;
  Winsock ws;
  std::uint16_t port;
  SOCKET listener = makeListener(port), tcp = tcpSocket(), udp = udpSocket();
  WSAEVENT event = WSACreateEvent();
  sockaddr_in any = loopback(0);
  int length = sizeof any, option = 1;
  char buffer[4];
  WSABUF buf{sizeof buffer, buffer};
  WSAOVERLAPPED ov{};
  WSANETWORKEVENTS ne{};
  std::uint32_t loop = inet_addr("127.0.0.1");
  DWORD size = 0;
  const std::vector<std::pair<Call, std::function<int()>>> calls = {
      {Call::WSAStartup, [] { WSADATA d; int rc = WSAStartup(2, &d); return rc != 0 ? rc : WSACleanup(); }},
      {Call::WSAEnumProtocolsA, [&] { return errorIf(WSAEnumProtocolsA(nullptr, nullptr, &size) < 0); }},
      {Call::WSASocketA, [] { SOCKET s = udpSocket(); return s == INVALID_SOCKET ? WSAGetLastError() : closesocket(s); }},
      {Call::bind, [&] { return errorIf(bind(udp, asAddr(any), sizeof any) != 0); }},
      {Call::listen, [&] { return errorIf(listen(listener, 5) != 0); }},
      {Call::getsockname, [&] { return errorIf(getsockname(udp, reinterpret_cast<sockaddr*>(&any), &length) != 0); }},
      {Call::setsockopt, [&] { return errorIf(setsockopt(tcp, SOL_SOCKET, SO_KEEPALIVE, reinterpret_cast<char*>(&option), 4) != 0); }},
      {Call::getsockopt, [&] { return errorIf(getsockopt(tcp, SOL_SOCKET, SO_KEEPALIVE, reinterpret_cast<char*>(&option), &length) != 0); }},
      {Call::WSAConnect, [&] { return errorIf(connectTo(udp, port) != 0); }},
      {Call::WSAAccept, [&] { return errorIf(WSAAccept(listener, nullptr, nullptr, nullptr, 0) == INVALID_SOCKET); }},
      {Call::WSASendDisconnect, [&] { return errorIf(WSASendDisconnect(tcp, nullptr) != 0); }},
      {Call::WSAEventSelect, [&] { return errorIf(WSAEventSelect(tcp, event, FD_READ) != 0); }},
      {Call::WSAEnumNetworkEvents, [&] { return errorIf(WSAEnumNetworkEvents(tcp, event, &ne) != 0); }},
      {Call::WSASend, [&] { return errorIf(WSASend(tcp, &buf, 1, nullptr, 0, &ov, noRoutine) != 0); }},
      {Call::WSARecv, [&] { return errorIf(WSARecv(tcp, &buf, 1, nullptr, nullptr, &ov, noRoutine) != 0); }},
      {Call::closesocket, [] { return errorIf(closesocket(udpSocket()) != 0); }},
      {Call::WSACreateEvent, [] { WSAEVENT e = WSACreateEvent(); return e == nullptr ? WSAGetLastError() : !WSACloseEvent(e); }},
      {Call::WSAWaitForMultipleEvents, [&] { return errorIf(WSAWaitForMultipleEvents(1, &event, FALSE, 0, TRUE) == WSA_WAIT_FAILED); }},
      {Call::gethostbyname, [] { return errorIf(gethostbyname("localhost") == nullptr); }},
      {Call::gethostbyaddr, [&] { return errorIf(gethostbyaddr(reinterpret_cast<char*>(&loop), 4, AF_INET) == nullptr); }},
      {Call::CreateMutexA, [] { HANDLE h = CreateMutexA(nullptr, FALSE, nullptr); return h == nullptr ? WSAGetLastError() : !CloseHandle(h); }},
      {Call::AfxBeginThread, [] { return errorIf(AfxBeginThread(noWork, nullptr) == nullptr); }},
  };
  ASSERT_EQ(static_cast<std::size_t>(Call::Count), calls.size());
  for (const auto& [call, run] : calls) {
    FaultGuard faults(call, {.countdown = 2, .persist = false, .result = kCode});
    EXPECT_NE(kCode, run()) << platform::fault::name(call);
    EXPECT_EQ(kCode, run()) << platform::fault::name(call);
    EXPECT_NE(kCode, run()) << platform::fault::name(call);
    EXPECT_EQ(1, platform::fault::fired(call)) << platform::fault::name(call);
  }
  for (SOCKET s : {listener, tcp}) closesocket(s);
  WSACloseEvent(event);
}
