// The two locks, the runtime's mutex and the one shared by all addresses, are
// taken in one order only: never the runtime's while holding the address
// one. Threads that go both ways at once (an address destroyed on its own;
// sockets, which read and make and delete addresses with the runtime's mutex
// held) must all finish. Built with the thread
// sanitizer, this also checks the handshakes for data races. Only names the
// hosts file answers are used: thousands of lookups at once would otherwise
// load the machine's name server.
#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "allocation_balance.h"
#include "free_port.h"
#include "raw_socket.h"
#include "tasks.h"
#include "watchdog.h"
#include "win32.h"

namespace {

class NetworkMutex {
 public:
  NetworkMutex() : m_hMutex(platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex")) {}
  ~NetworkMutex() { platform::CloseHandle(m_hMutex); }
  void take() { platform::WaitForSingleObject(m_hMutex, platform::INFINITE); }
  void release() { platform::ReleaseMutex(m_hMutex); }

 private:
  platform::HANDLE m_hMutex;
};

TEST(LockOrder, AddressesAndSocketsOnAllPathsAtOnce) {
  platform::setLocalHost("127.0.0.1");
  std::uint16_t udpPort = pickFreePort();
  std::uint16_t listenPort = pickFreePort();
  ASSERT_NE(udpPort, 0);
  ASSERT_NE(listenPort, 0);
  AllocationBalance balance;
  {
    N_Initializer network;
    Watchdog dog(60.0, "addresses and sockets made and destroyed on six threads");
    std::atomic<bool> stop{false};
    std::atomic<int> rounds{0};
    std::vector<std::thread> threads;

    // Plain owners: construct, read, destroy.
    for (int t = 0; t < 2; ++t) {
      threads.emplace_back([&, t] {
        while (!stop) {
          N_Address a(t == 0 ? "localhost" : "127.0.0.1");
          (void)a.getIdentifier();
          (void)a.fullyResolved();
          a.construct("0.0.0.0");
          ++rounds;
          // Each round starts resolvers; let them keep up.
          std::this_thread::sleep_for(std::chrono::microseconds(500));
        }
      });
    }
    // The socket's way: the runtime's mutex first, then addresses inside it.
    threads.emplace_back([&] {
      NetworkMutex mutex;
      while (!stop) {
        mutex.take();
        N_Address* peer = Q_New<N_Address>("127.0.0.1");
        (void)peer->getStringNumber();
        Q_Delete(peer);
        mutex.release();
        ++rounds;
        std::this_thread::sleep_for(std::chrono::microseconds(500));
      }
    });
    // Sockets read their peer's identifier with the runtime's mutex held.
    N_Address peer("127.0.0.1");
    threads.emplace_back([&] {
      while (!stop) {
        try {
          N_Socket udp(&peer, udpPort, N_Socket::SOCKET_UDP);
          ++rounds;
        } catch (Q_Exception* e) {
          ADD_FAILURE() << "socket: " << e->getErrorMessage();
        }
        std::this_thread::sleep_for(std::chrono::microseconds(500));
      }
    });
    // An accepted socket makes its own address with the mutex held, and
    // deletes it again in its destruct, also with the mutex held.
    N_Listener listener(listenPort);
    threads.emplace_back([&] {
      while (!stop) {
        int client = raw::connectTo("127.0.0.1", listenPort);
        N_Socket::ConnectData* data = nullptr;
        if (client >= 0 && tasks::eventually([&] { return listener.pollConnect(data); }, 5.0)) {
          try {
            N_Socket accepted(data);
            ++rounds;
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
  }
  EXPECT_TRUE(balance.settles(20.0));
  platform::setLocalHost(nullptr);
}

}  // namespace
