/// @file
/// A lock that one thread may take again while it holds it; it is free once
/// every lock has been matched by an unlock. Q_MutexLock holds it for a scope.
#pragma once

#include <mutex>

#include "vardel_export.h"

/// A re-entrant lock: the thread that holds it may take it again, and it is
/// free once every lock() has been matched by an unlock().
class VARDEL_API Q_Mutex {
 public:
  /// A free lock.
  Q_Mutex();
  /// The lock must be free.
  ~Q_Mutex();
  /// Not copyable: a lock has one identity.
  Q_Mutex(const Q_Mutex&) = delete;
  /// Not assignable.
  Q_Mutex& operator=(const Q_Mutex&) = delete;

  /// Takes the lock, waiting as long as another thread holds it.
  void lock();
  /// Gives back one lock() of the calling thread, which must hold it.
  void unlock();
  /// Takes the lock if that needs no waiting; true if it was taken.
  bool tryLock();

 private:
  std::recursive_mutex m_mutex;
};

/// Holds a Q_Mutex for the scope of the object.
class VARDEL_API Q_MutexLock {
 public:
  /// Locks `mutex`, waiting if need be. Null takes nothing, so an object
  /// whose mutex is already gone can still run its scoped code.
  explicit Q_MutexLock(Q_Mutex* mutex);
  /// Unlocks what the constructor locked.
  ~Q_MutexLock();
  /// Not copyable: the lock is given back once.
  Q_MutexLock(const Q_MutexLock&) = delete;
  /// Not assignable.
  Q_MutexLock& operator=(const Q_MutexLock&) = delete;

 private:
  Q_Mutex* m_pMutex;
};
