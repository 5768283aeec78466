// Internal to the library: a Win32 mutex held for a scope. The runtime's
// mutex is recursive, so a holder may call into code that takes it again;
// unlock() and lock() let a holder step out for a while (to run application
// code, or to let the network thread finish a delivery).
#pragma once

#include "Runtime.h"
#include "win32.h"

class MutexHold {
 public:
  explicit MutexHold(platform::HANDLE mutex) : m_hMutex(mutex) { lock(); }
  ~MutexHold() {
    if (m_bHeld) platform::ReleaseMutex(m_hMutex);
  }
  MutexHold(const MutexHold&) = delete;
  MutexHold& operator=(const MutexHold&) = delete;

  void lock() {
    platform::WaitForSingleObject(m_hMutex, platform::INFINITE);
    m_bHeld = true;
  }
  void unlock() {
    m_bHeld = false;
    platform::ReleaseMutex(m_hMutex);
  }

 private:
  platform::HANDLE m_hMutex;
  bool m_bHeld = false;
};

// The runtime's mutex, which guards its registries and queues.
class RuntimeLock : public MutexHold {
 public:
  RuntimeLock() : MutexHold(Runtime::mutex()) {}
};

// Steps out of the runtime's mutex that the caller holds, for a scope.
class RuntimeUnlock {
 public:
  RuntimeUnlock() { platform::ReleaseMutex(Runtime::mutex()); }
  ~RuntimeUnlock() { platform::WaitForSingleObject(Runtime::mutex(), platform::INFINITE); }
  RuntimeUnlock(const RuntimeUnlock&) = delete;
  RuntimeUnlock& operator=(const RuntimeUnlock&) = delete;
};
