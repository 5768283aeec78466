// Mutexes, threads, rand, names, start-up and fault plans.
#include <atomic>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "fault.h"
#include "socket_pair.h"

using namespace platform_test;

TEST(Mutex, OneNameIsOneRecursiveMutexOwnedByThread) {
  HANDLE a = CreateMutexA(nullptr, FALSE, "system test mutex");
  HANDLE b = CreateMutexA(nullptr, FALSE, "system test mutex");
  ASSERT_NE(nullptr, a);
  ASSERT_NE(a, b);
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(a, INFINITE));
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, INFINITE)) << "the owner may take it again";
  std::thread other([&] {
    EXPECT_EQ(WAIT_TIMEOUT, WaitForSingleObject(b, 0)) << "both handles name one mutex";
    EXPECT_FALSE(ReleaseMutex(a)) << "a thread that doesn't own it can't release it";
  });
  other.join();
  EXPECT_TRUE(ReleaseMutex(a));
  EXPECT_TRUE(ReleaseMutex(b));
  EXPECT_FALSE(ReleaseMutex(a)) << "released as often as taken";
  EXPECT_TRUE(CloseHandle(a));
  std::thread again([&] {
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(b, 0)) << "the other handle still works";
    EXPECT_TRUE(ReleaseMutex(b));
  });
  again.join();
  EXPECT_TRUE(CloseHandle(b));
  EXPECT_FALSE(CloseHandle(b));
  HANDLE unrelated = CreateMutexA(nullptr, FALSE, "another name");
  ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(unrelated, 0));
  std::thread third([&] {
    HANDLE fresh = CreateMutexA(nullptr, FALSE, "system test mutex");
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(fresh, 0)) << "other names are other mutexes";
    ReleaseMutex(fresh);
    CloseHandle(fresh);
  });
  third.join();
  ReleaseMutex(unrelated);
  CloseHandle(unrelated);
}

TEST(Thread, AfxBeginThreadRunsTheBodyWithItsParameter) {
  std::atomic<int> value{0};
  CWinThread* t = AfxBeginThread([](void* p) -> unsigned {
    static_cast<std::atomic<int>*>(p)->store(42);
    return 0;
  }, &value);
  ASSERT_NE(nullptr, t);
  for (int i = 0; i < 500 && value == 0; ++i) Sleep(2);
  EXPECT_EQ(42, value.load());
  platform::fault::arm(platform::fault::Call::AfxBeginThread, {1, false, WSAENOBUFS});
  EXPECT_EQ(nullptr, AfxBeginThread([](void*) -> unsigned { return 0; }, nullptr));
}

TEST(Rand, FollowsTheClassicSequencePerThreadAndIsSeedable) {
  platform::srand(1);
  int first[5];
  for (int& v : first) v = platform::rand();
  EXPECT_EQ(41, first[0]);
  EXPECT_EQ(18467, first[1]);
  EXPECT_EQ(6334, first[2]);
  EXPECT_EQ(26500, first[3]);
  EXPECT_EQ(19169, first[4]);
  int fromThread = -1;
  std::thread t([&] { fromThread = platform::rand(); });
  t.join();
  EXPECT_EQ(41, fromThread) << "each thread starts at seed 1";
  platform::srand(777);
  int a = platform::rand();
  platform::srand(777);
  EXPECT_EQ(a, platform::rand());
  for (int i = 0; i < 100000; ++i) {
    int v = platform::rand();
    ASSERT_GE(v, 0);
    ASSERT_LE(v, 32767);
  }
}

TEST(Rand, OnAStateOfItsOwnFollowsTheSameSequenceOnAnyThread) {
  unsigned state = 1;
  EXPECT_EQ(41, platform::rand(state));
  EXPECT_EQ(18467, platform::rand(state));
  EXPECT_EQ(6334, platform::rand(state));
  // Whatever the thread's own state does meanwhile, and on any thread.
  for (unsigned seed : {0u, 777u, 0x9E3779B9u}) {
    platform::srand(seed);
    std::vector<int> expected(50);
    for (int& v : expected) v = platform::rand();
    platform::srand(5);
    unsigned mine = seed;
    std::vector<int> got(50);
    std::thread t([&] {
      for (int& v : got) {
        v = platform::rand(mine);
        platform::rand();
      }
    });
    t.join();
    EXPECT_EQ(expected, got) << seed;
  }
}

TEST(Names, LocalHostCanBeChosenAndLookupsGivePerThreadRecords) {
  char name[1024];
  platform::setLocalHost("127.0.0.2");
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STREQ("127.0.0.2", name);
  platform::setLocalHost(nullptr);
  ASSERT_EQ(0, platform::gethostname(name, static_cast<int>(sizeof name)));
  EXPECT_STRNE("127.0.0.2", name);

  hostent* mine = gethostbyname("localhost");
  ASSERT_NE(nullptr, mine);
  ASSERT_NE(nullptr, mine->h_addr_list[0]);
  std::uint32_t address;
  std::memcpy(&address, mine->h_addr_list[0], 4);
  EXPECT_EQ(inet_addr("127.0.0.1"), address);
  hostent* theirs = nullptr;
  std::thread t([&] { theirs = gethostbyname("127.0.0.3"); });
  t.join();
  EXPECT_NE(mine, theirs);
  EXPECT_EQ(nullptr, gethostbyname("no-such-host.invalid"));
  // Not found; or, on a machine without a reachable name server, try again.
  const int error = WSAGetLastError();
  EXPECT_TRUE(error == WSAHOST_NOT_FOUND || error == WSATRY_AGAIN) << error;

  std::uint32_t loop = inet_addr("127.0.0.1");
  hostent* reverse = gethostbyaddr(reinterpret_cast<char*>(&loop), 4, AF_INET);
  ASSERT_NE(nullptr, reverse);
  EXPECT_NE(nullptr, reverse->h_name);
  platform::fault::arm(platform::fault::Call::gethostbyaddr, {1, false, WSANO_RECOVERY});
  EXPECT_EQ(nullptr, gethostbyaddr(reinterpret_cast<char*>(&loop), 4, AF_INET));
  EXPECT_EQ(WSANO_RECOVERY, WSAGetLastError());

  in_addr in{inet_addr("10.1.2.3")};
  EXPECT_STREQ("10.1.2.3", inet_ntoa(in));
  EXPECT_EQ(INADDR_NONE, inet_addr("1.2.3.256"));
  EXPECT_EQ(INADDR_NONE, inet_addr(""));
  EXPECT_EQ(0x0100007Fu, inet_addr("127.0.0.1")) << "network order";
}

TEST(Startup, AgreesOnTwoPointZeroAndDescribesTcpAndUdpProviders) {
  WSADATA data{};
  ASSERT_EQ(0, WSAStartup(0x0002, &data));
  EXPECT_EQ(0x0002, data.wVersion);
  DWORD size = 0;
  EXPECT_EQ(SOCKET_ERROR, WSAEnumProtocolsA(nullptr, nullptr, &size));
  EXPECT_EQ(WSAENOBUFS, WSAGetLastError());
  ASSERT_EQ(0u, size % sizeof(WSAPROTOCOL_INFOA));
  std::vector<WSAPROTOCOL_INFOA> list(size / sizeof(WSAPROTOCOL_INFOA));
  int n = WSAEnumProtocolsA(nullptr, list.data(), &size);
  ASSERT_EQ(static_cast<int>(list.size()), n);
  bool tcp = false, udp = false;
  for (const auto& p : list) {
    if (p.iAddressFamily != AF_INET) continue;
    tcp = tcp || (p.iSocketType == SOCK_STREAM && (p.dwServiceFlags1 & 0x20066) == 0x20066);
    udp = udp || (p.iSocketType == SOCK_DGRAM && (p.dwServiceFlags1 & 0x20609) == 0x20609);
  }
  EXPECT_TRUE(tcp);
  EXPECT_TRUE(udp);

  SOCKET s = WSASocketA(FROM_PROTOCOL_INFO, FROM_PROTOCOL_INFO, FROM_PROTOCOL_INFO, &list[1], 0, WSA_FLAG_OVERLAPPED);
  ASSERT_NE(INVALID_SOCKET, s);
  EXPECT_EQ(0, WSACleanup());
  EXPECT_EQ(SOCKET_ERROR, closesocket(s)) << "the last cleanup closed the socket";
  EXPECT_EQ(INVALID_SOCKET, WSASocketA(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0, 0));
  EXPECT_EQ(WSANOTINITIALISED, WSAGetLastError());
  EXPECT_EQ(SOCKET_ERROR, WSACleanup());
}

TEST(Faults, PlansFireAtTheirCountAndPersistWhenAsked) {
  using platform::fault::Call;
  WSADATA data{};
  platform::fault::arm(Call::WSAStartup, {2, false, WSASYSNOTREADY});
  EXPECT_EQ(0, WSAStartup(0x0002, &data));
  EXPECT_EQ(WSASYSNOTREADY, WSAStartup(0x0002, &data));
  EXPECT_EQ(0, WSAStartup(0x0002, &data));
  EXPECT_EQ(1, platform::fault::fired(Call::WSAStartup));
  platform::fault::arm(Call::WSAStartup, {1, true, WSAEPROCLIM});
  EXPECT_EQ(WSAEPROCLIM, WSAStartup(0x0002, &data));
  EXPECT_EQ(WSAEPROCLIM, WSAStartup(0x0002, &data));
  platform::fault::setAgreedVersion(0x0101);
  platform::fault::disarm(Call::WSAStartup);
  EXPECT_EQ(0, WSAStartup(0x0002, &data));
  EXPECT_EQ(0x0101, data.wVersion);
  WSAPROTOCOL_INFOA none{};
  platform::fault::setCatalogue(&none, 0);
  DWORD size = 123;
  EXPECT_EQ(0, WSAEnumProtocolsA(nullptr, nullptr, &size));
  EXPECT_EQ(0u, size);
  platform::fault::disarmAll();
  EXPECT_GT(WSAEnumProtocolsA(nullptr, nullptr, &(size = 0)), -2);
  EXPECT_GT(size, 0u) << "disarmAll restores the real catalogue";

  platform::fault::failAllocation(3);
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  EXPECT_TRUE(platform::fault::allocationShouldFail());
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  platform::fault::failAllocation(1, true);
  EXPECT_TRUE(platform::fault::allocationShouldFail());
  EXPECT_TRUE(platform::fault::allocationShouldFail());
  EXPECT_EQ(2, platform::fault::allocationsFailed());
  platform::fault::disarmAll();
  EXPECT_FALSE(platform::fault::allocationShouldFail());
  for (int i = 0; i < 4; ++i) WSACleanup();
}
