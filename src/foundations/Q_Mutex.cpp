#include "Q_Mutex.h"

Q_Mutex::Q_Mutex() = default;
Q_Mutex::~Q_Mutex() = default;

void Q_Mutex::lock() { m_mutex.lock(); }
void Q_Mutex::unlock() { m_mutex.unlock(); }
bool Q_Mutex::tryLock() { return m_mutex.try_lock(); }

Q_MutexLock::Q_MutexLock(Q_Mutex* mutex) : m_pMutex(mutex) {
  if (m_pMutex != nullptr) m_pMutex->lock();
}

Q_MutexLock::~Q_MutexLock() {
  if (m_pMutex != nullptr) m_pMutex->unlock();
}
