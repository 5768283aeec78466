// A lock that one thread may take again while it holds it; it is free once
// every lock has been matched by an unlock. Q_MutexLock holds it for a scope.
#pragma once

#include <mutex>

#include "vardel_export.h"

class VARDEL_API Q_Mutex {
 public:
  Q_Mutex();
  ~Q_Mutex();
  Q_Mutex(const Q_Mutex&) = delete;
  Q_Mutex& operator=(const Q_Mutex&) = delete;

  void lock();
  void unlock();
  // Takes the lock if that needs no waiting.
  bool tryLock();

 private:
  std::recursive_mutex m_mutex;
};

class VARDEL_API Q_MutexLock {
 public:
  // Null takes nothing, so an object whose mutex is already gone can still
  // run its scoped code.
  explicit Q_MutexLock(Q_Mutex* mutex);
  ~Q_MutexLock();
  Q_MutexLock(const Q_MutexLock&) = delete;
  Q_MutexLock& operator=(const Q_MutexLock&) = delete;

 private:
  Q_Mutex* m_pMutex;
};
