// Ends the test process with a message if a scope takes longer than its limit,
// so that a hang (a deadlock, a stop that never returns) fails the test with a
// reason instead of running into the harness's time-out.
//
//   Watchdog dog(20.0, "stop with the network mutex held");
#pragma once

#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

class Watchdog {
 public:
  Watchdog(double seconds, std::string what);
  ~Watchdog();

  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

 private:
  std::mutex m_mutex;
  std::condition_variable m_done;
  bool m_bFinished = false;
  std::thread m_thread;
};
