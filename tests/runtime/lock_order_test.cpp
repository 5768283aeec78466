// The two locks, the runtime's mutex and the one shared by all addresses, are
// taken in one order only: never the runtime's while holding the address
// one. Threads that go both ways at once (an address destroyed on its own,
// an address made and destroyed with the runtime's mutex held, as a socket
// does for its peer address) must all finish. Built with the thread
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
#include "Q_New.h"
#include "allocation_balance.h"
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

TEST(LockOrder, AddressesOnAllPathsAtOnce) {
  platform::setLocalHost("127.0.0.1");
  AllocationBalance balance;
  {
    N_Initializer network;
    Watchdog dog(60.0, "addresses made and destroyed on four threads");
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
