// Named recursive mutexes with Win32's ownership rules, on pthread mutexes.
#include "internal.h"  // first: see the note there

#include <pthread.h>

#include <cerrno>
#include <ctime>
#include <map>

namespace platform {
namespace detail {
namespace {

struct MutexObject {
  pthread_mutex_t mutex;
  std::string name;
  // The owner is tracked here so that a release by another thread is refused
  // without ever calling pthread_mutex_unlock for it.
  std::atomic<pthread_t> owner{};
  std::atomic<bool> owned{false};
  int depth = 0;  // touched by the owner only

  void acquired() {
    if (depth++ == 0) {
      owner.store(pthread_self(), std::memory_order_relaxed);
      owned.store(true, std::memory_order_relaxed);
    }
  }
  bool ownedByCaller() const {
    return owned.load(std::memory_order_relaxed) && pthread_equal(owner.load(std::memory_order_relaxed), pthread_self());
  }
  MutexObject() {
    pthread_mutexattr_t attributes;
    pthread_mutexattr_init(&attributes);
    pthread_mutexattr_settype(&attributes, PTHREAD_MUTEX_RECURSIVE);
    pthread_mutex_init(&mutex, &attributes);
    pthread_mutexattr_destroy(&attributes);
  }
  ~MutexObject() { pthread_mutex_destroy(&mutex); }
  MutexObject(const MutexObject&) = delete;
  MutexObject& operator=(const MutexObject&) = delete;
};

// One handle: its own reference to the shared mutex object.
struct MutexHandle {
  std::shared_ptr<MutexObject> object;
};

// Neither table is ever destroyed: detached threads (resolvers) may still
// close their handles while the process exits.
HandleTable<MutexHandle>& mutexTable() {
  static auto* table = new HandleTable<MutexHandle>(HandleKind::Mutex);
  return *table;
}

struct Names {
  std::mutex lock;
  std::map<std::string, std::weak_ptr<MutexObject>> byName;
};
Names& names() {
  static auto* n = new Names;
  return *n;
}

}  // namespace
}  // namespace detail

HANDLE CreateMutexA(SECURITY_ATTRIBUTES*, BOOL bInitialOwner, const char* lpName) {
  int result = 0;
  if (fault::check(fault::Call::CreateMutexA, result)) {
    detail::fail(result);
    return nullptr;
  }
  std::shared_ptr<detail::MutexObject> object;
  if (lpName != nullptr && *lpName != '\0') {
    detail::Names& n = detail::names();
    std::lock_guard<std::mutex> hold(n.lock);
    std::weak_ptr<detail::MutexObject>& slot = n.byName[lpName];
    object = slot.lock();
    if (!object) {
      object = std::make_shared<detail::MutexObject>();
      object->name = lpName;
      slot = object;
    }
  } else {
    object = std::make_shared<detail::MutexObject>();
  }
  if (bInitialOwner && pthread_mutex_lock(&object->mutex) == 0) object->acquired();
  auto handle = std::make_shared<detail::MutexHandle>();
  handle->object = std::move(object);
  return detail::toHandle(detail::mutexTable().insert(std::move(handle)));
}

DWORD WaitForSingleObject(HANDLE hHandle, DWORD dwMilliseconds) {
  std::shared_ptr<detail::MutexHandle> handle = detail::mutexTable().find(detail::handleValue(hHandle));
  if (!handle) {
    detail::fail(WSA_INVALID_HANDLE);
    return WAIT_FAILED;
  }
  detail::MutexObject& object = *handle->object;
  pthread_mutex_t* mutex = &object.mutex;
  if (dwMilliseconds == INFINITE) {
    if (pthread_mutex_lock(mutex) != 0) return WAIT_FAILED;
    object.acquired();
    return WAIT_OBJECT_0;
  }
  if (dwMilliseconds == 0) {
    if (pthread_mutex_trylock(mutex) != 0) return WAIT_TIMEOUT;
    object.acquired();
    return WAIT_OBJECT_0;
  }
  timespec deadline;
  clock_gettime(CLOCK_REALTIME, &deadline);
  deadline.tv_sec += dwMilliseconds / 1000;
  deadline.tv_nsec += static_cast<long>(dwMilliseconds % 1000) * 1000000L;
  if (deadline.tv_nsec >= 1000000000L) {
    deadline.tv_sec += 1;
    deadline.tv_nsec -= 1000000000L;
  }
  int rc = pthread_mutex_timedlock(mutex, &deadline);
  if (rc == 0) {
    object.acquired();
    return WAIT_OBJECT_0;
  }
  return rc == ETIMEDOUT ? WAIT_TIMEOUT : WAIT_FAILED;
}

BOOL ReleaseMutex(HANDLE hMutex) {
  std::shared_ptr<detail::MutexHandle> handle = detail::mutexTable().find(detail::handleValue(hMutex));
  if (!handle) {
    detail::fail(WSA_INVALID_HANDLE);
    return 0;
  }
  detail::MutexObject& object = *handle->object;
  if (!object.ownedByCaller()) {
    detail::fail(WSAEACCES);
    return 0;
  }
  if (--object.depth == 0) object.owned.store(false, std::memory_order_relaxed);
  pthread_mutex_unlock(&object.mutex);
  return 1;
}

DWORD MutexHoldCount(HANDLE hMutex) {
  std::shared_ptr<detail::MutexHandle> handle = detail::mutexTable().find(detail::handleValue(hMutex));
  if (!handle || !handle->object->ownedByCaller()) return 0;
  return static_cast<DWORD>(handle->object->depth);
}

BOOL CloseHandle(HANDLE hObject) {
  std::uint64_t value = detail::handleValue(hObject);
  if ((value >> 56) == static_cast<std::uint64_t>(detail::HandleKind::Event)) return WSACloseEvent(hObject);
  std::shared_ptr<detail::MutexHandle> handle = detail::mutexTable().remove(value);
  if (!handle) {
    detail::fail(WSA_INVALID_HANDLE);
    return 0;
  }
  // The name map holds weak references only: the mutex goes with its last
  // handle, and a later CreateMutexA of the name makes a new one.
  return 1;
}

}  // namespace platform
