#include "watchdog.h"

#include <unistd.h>

#include <chrono>
#include <cstdio>

Watchdog::Watchdog(double seconds, std::string what) {
  m_thread = std::thread([this, seconds, what = std::move(what)] {
    std::unique_lock<std::mutex> hold(m_mutex);
    if (m_done.wait_for(hold, std::chrono::duration<double>(seconds), [this] { return m_bFinished; })) return;
    std::fprintf(stderr, "\nWATCHDOG: \"%s\" still running after %.1f s; giving up\n", what.c_str(), seconds);
    std::fflush(stderr);
    ::_exit(3);
  });
}

Watchdog::~Watchdog() {
  {
    std::lock_guard<std::mutex> hold(m_mutex);
    m_bFinished = true;
  }
  m_done.notify_all();
  m_thread.join();
}
