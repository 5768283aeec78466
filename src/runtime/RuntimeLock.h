// Internal to the library: the runtime's mutex held for a scope. The mutex is
// recursive, so a holder may call into code that takes it again.
#pragma once

#include "N_Initializer.h"
#include "win32.h"

class RuntimeLock {
 public:
  RuntimeLock() { platform::WaitForSingleObject(N_Initializer::m_hMutex, platform::INFINITE); }
  ~RuntimeLock() { platform::ReleaseMutex(N_Initializer::m_hMutex); }
  RuntimeLock(const RuntimeLock&) = delete;
  RuntimeLock& operator=(const RuntimeLock&) = delete;
};
