// The runtime's life: start and stop, further instances, a restart, the idle
// network thread, what the stop deletes and closes, stops in the hard cases
// (the network mutex still held, no network thread at all), and the order in
// which its two locks are taken.
#include <atomic>
#include <cstdio>
#include <ctime>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "fault_guard.h"
#include "free_port.h"
#include "raw_socket.h"
#include "runtime_test.h"
#include "threads.h"
#include "watchdog.h"
#include "win32.h"
#include "winsock.h"

namespace {

using RuntimeLife = RuntimeTest;

void sleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }
void pause() { std::this_thread::sleep_for(std::chrono::microseconds(500)); }


// The first instance starts the runtime on the chosen local host (a dotted
// number needs no lookup, a name must resolve before the start returns), a
// further one only counts, the last stop takes everything down, and a later
// start makes everything anew.
TEST(Runtime, StartsOnTheChosenLocalHostCountsInstancesAndRestarts) {
  AllocationBalance balance;
  const int idle = threadCount();
  for (const char* host : {"127.0.0.2", "localhost", "127.0.0.1"}) {
    platform::setLocalHost(host);
    platform::hostent* entry = platform::gethostbyname(host);
    ASSERT_NE(nullptr, entry) << host;
    const std::uint32_t expected = *reinterpret_cast<std::uint32_t*>(entry->h_addr_list[0]);
    ASSERT_EQ(nullptr, N_Address::getLocalAddress());
    {
      N_Initializer network;
      const N_Address* local = N_Address::getLocalAddress();
      ASSERT_NE(nullptr, local);
      EXPECT_EQ(expected, local->getIdentifier()) << host;
      const volatile char* given = host[0] == 'l' ? local->getStringName() : local->getStringNumber();
      EXPECT_STREQ(host, const_cast<const char*>(given)) << "the text it was made from";
      {
        N_Initializer further;
        Q_New<N_Address>("127.0.0.1");  // registered, so the last stop deletes it
      }
      EXPECT_EQ(local, N_Address::getLocalAddress()) << "the runtime stays up";
      EXPECT_TRUE(waitFor([&] { return threadCount() == idle + 1; })) << "one network thread";
    }
    EXPECT_EQ(nullptr, N_Address::getLocalAddress());
    EXPECT_TRUE(waitFor([&] { return threadCount() == idle; })) << "the network thread is still there";
    EXPECT_EQ(platform::SOCKET_ERROR, platform::WSACleanup()) << "the stop ended the use of Winsock";
  }
  EXPECT_TRUE(balance.settles());
}

TEST_F(RuntimeLife, IdleNetworkThreadBlocksInsteadOfSpinning) {
  for (int i = 0; i < 3; ++i) N_Address wake("127.0.0.1");
  sleepMs(200);
  const std::clock_t before = std::clock();  // the whole process: this thread only sleeps
  sleepMs(300);
  const double used = static_cast<double>(std::clock() - before) / CLOCKS_PER_SEC;
  EXPECT_LE(used, 0.05) << "processor time used in 300 ms of idling";
}

// Sockets with sends and reads in flight, a listener with connections nobody
// claimed, and addresses still registered go with the stop: ports closed,
// connections closed, every allocation given back (the fixture checks that).
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
  EXPECT_FALSE(portIsFree(listenPort));
  EXPECT_FALSE(portIsFree(udpPort));
  sleepMs(100);  // the network thread posts reads and issues sends
  stopRuntime();
  for (int peer : peers) {
    EXPECT_TRUE(raw::closedByPeer(peer, 10000));
    raw::closeFd(peer);
  }
  EXPECT_TRUE(portIsFree(listenPort));
  EXPECT_TRUE(portIsFree(udpPort));
}

// A thread that owns the network mutex by one level when it stops the
// runtime gives that level up first, or the network thread could never end.
TEST_F(RuntimeLife, StopFromTheThreadOwningTheNetworkMutex) {
  platform::HANDLE mutex = platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex");
  ASSERT_EQ(platform::WAIT_OBJECT_0, platform::WaitForSingleObject(mutex, platform::INFINITE));
  Q_New<N_Address>("127.0.0.1");  // wakes the network thread, which then waits for the mutex
  sleepMs(50);
  {
    Watchdog dog(20.0, "stop by the owner of the network mutex");
    stopRuntime();
  }
  platform::CloseHandle(mutex);
}

// Without its thread the runtime still comes up, and its stop doesn't wait
// for a thread that never ran.
TEST(Runtime, StartsAndStopsWithoutANetworkThread) {
  platform::setLocalHost("127.0.0.1");
  FaultGuard faults(platform::fault::Call::AfxBeginThread, {.countdown = 1, .persist = false, .result = 10055});
  Watchdog dog(20.0, "start and stop without a network thread");
  {
    N_Initializer network;
    EXPECT_EQ(1, platform::fault::fired(platform::fault::Call::AfxBeginThread));
    EXPECT_NE(nullptr, N_Address::getLocalAddress());
  }
  EXPECT_EQ(nullptr, N_Address::getLocalAddress());
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
  // Sockets read their peer's identifier with the runtime's mutex held.
  threads.emplace_back([&] {
    for (; !stop; ++rounds, pause()) {
      try {
        N_Socket udp(loopback(), port() + 1, N_Socket::SOCKET_UDP);
      } catch (Q_Exception* e) {
        ADD_FAILURE() << "socket: " << e->getErrorMessage();
      }
    }
  });
  // An accepted socket makes its own address with the mutex held, and
  // deletes it in its destruct, also with the mutex held.
  N_Listener listener(port());
  threads.emplace_back([&] {
    for (; !stop; ++rounds) {
      int client = raw::connectTo("127.0.0.1", port());
      N_Socket::ConnectData* data = nullptr;
      if (client >= 0 && waitFor([&] { return listener.pollConnect(data); })) {
        try {
          N_Socket accepted(data);
        } catch (Q_Exception* e) {
          ADD_FAILURE() << "accepted socket: " << e->getErrorMessage();
        }
      }
      raw::closeFd(client);
    }
  });
  // Addresses left for the stop to delete.
  threads.emplace_back([&] {
    for (int i = 0; i < 20 && !stop; ++i) {
      Q_New<N_Address>(i % 2 == 0 ? "localhost" : "127.0.0.1");
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
  });
  std::this_thread::sleep_for(std::chrono::seconds(2));
  stop = true;
  for (std::thread& t : threads) t.join();
  std::printf("%d rounds\n", rounds.load());
  EXPECT_GT(rounds.load(), 0);
  EXPECT_TRUE(waitFor([&] { return threadCount() <= idle; }, 30000)) << "resolvers still running";
}

}  // namespace
