// WSAWaitForMultipleEvents and waitForAnyEvent: the one place where a thread
// blocks on the network. Each thread keeps its wait set from one wait to the
// next (internal.h): an epoll descriptor with its wake-up descriptor, the
// sockets of its events and the sockets of its own operations registered, so
// that a wait over the same handles as the last costs nothing in their
// number, and neither does a signalled event.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <poll.h>
#include <pthread.h>
#include <sys/epoll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <new>

namespace platform {
namespace detail {
namespace {

using Clock = std::chrono::steady_clock;

// Readiness reported by epoll is handed on as poll's: the bits are the same.
static_assert(EPOLLIN == POLLIN && EPOLLOUT == POLLOUT && EPOLLERR == POLLERR && EPOLLHUP == POLLHUP &&
              EPOLLRDHUP == POLLRDHUP);

constexpr int kBatch = 64;  // readiness taken from epoll per call

std::atomic<unsigned> g_forks{0};

// Forks of this process so far, as the children count them.
unsigned forks() {
  static const int watching = pthread_atfork(nullptr, nullptr, [] { g_forks.fetch_add(1); });
  (void)watching;
  return g_forks.load();
}

void linkWaiter(EventObject& event, WaitEntry& entry) {
  entry.prevWaiter = nullptr;
  entry.nextWaiter = event.waiters;
  if (event.waiters != nullptr) event.waiters->prevWaiter = &entry;
  event.waiters = &entry;
}

void unlinkWaiter(EventObject& event, WaitEntry& entry) {
  if (entry.prevWaiter != nullptr) entry.prevWaiter->nextWaiter = entry.nextWaiter;
  if (entry.nextWaiter != nullptr) entry.nextWaiter->prevWaiter = entry.prevWaiter;
  if (event.waiters == &entry) event.waiters = entry.nextWaiter;
  entry.prevWaiter = entry.nextWaiter = nullptr;
}

void dropFrom(std::vector<WaitEntry*>& list, WaitEntry* entry) {
  auto it = std::find(list.begin(), list.end(), entry);
  if (it == list.end()) return;
  *it = list.back();
  list.pop_back();
}

int remainingMilliseconds(bool infinite, Clock::time_point deadline) {
  if (infinite) return -1;
  auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left > 0 ? static_cast<int>(std::min<long long>(left, 1 << 30)) : 0;
}

// What a readiness report does to a socket: pending reads take the data
// before it could count as FD_READ, pending sends go on, and what is left is
// recorded as network events (socket lock held).
void serveReadiness(SocketState& socket, short revents) {
  if (socket.closed) return;
  if (!socket.receives.empty() && (revents & (POLLIN | POLLHUP | POLLERR | POLLRDHUP))) progressReceives(socket);
  if (!socket.sends.empty() && (revents & (POLLOUT | POLLHUP | POLLERR))) {
    socket.sendBlocked = false;
    progressSends(socket);
  }
  recordReadiness(socket, revents);
}

}  // namespace

void syncInterest(SocketState& socket) {
  const std::uint32_t want = socket.closed || socket.fd < 0 ? 0 : static_cast<std::uint16_t>(pollInterest(socket));
  if (want == socket.interest) return;
  const std::uint32_t had = socket.interest;
  socket.interest = want;
  for (SocketState::Watch& watch : socket.watches) {
    // One refused before is in an unknown state: applied whole.
    watch.refused = !watch.set->control(socket.fd, watch.id, watch.refused ? ~0u : had, want);
    if (!watch.refused) continue;
    std::lock_guard<std::mutex> hold(eventLock());
    watch.set->noteRefused();
  }
}

void relinkLocked(EventObject& event) {
  for (WaitEntry* entry = event.waiters; entry != nullptr; entry = entry->nextWaiter) entry->set->noteRelink(*entry);
}

// ---- WaitSet ------------------------------------------------------------------

bool WaitSet::inherited() const { return generation_ != g_forks.load(); }

bool WaitSet::ready() {
  if (epoll_ >= 0 && !inherited()) return true;
  if (epoll_ >= 0) {
    // A child of a fork: the descriptor is its parent's too. Let go of it
    // without a word to the kernel, and start afresh.
    forget();
    ::close(epoll_);
    epoll_ = -1;
  }
  generation_ = forks();
  const int fd = sys::epoll_create1(EPOLL_CLOEXEC);
  if (fd < 0) {
    fail(wsaErrorFromErrno(errno));
    return false;
  }
  epoll_event wake{};
  wake.events = EPOLLIN;
  wake.data.u64 = 0;
  if (sys::epoll_ctl(fd, EPOLL_CTL_ADD, owner_.wakeFd(), &wake) != 0) {
    fail(wsaErrorFromErrno(errno));
    ::close(fd);
    return false;
  }
  epoll_ = fd;
  return true;
}

bool WaitSet::control(int fd, std::uint64_t id, std::uint32_t had, std::uint32_t want) {
  if (inherited() || epoll_ < 0) return true;
  epoll_event event{};
  event.events = want;
  event.data.u64 = id;
  // The usual step first; the others when this set's descriptor disagrees
  // (a registration it refused before).
  if (want != 0 && had == 0) {
    if (sys::epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event) == 0) return true;
    if (errno != EEXIST) return false;
  }
  if (want == 0) return sys::epoll_ctl(epoll_, EPOLL_CTL_DEL, fd, &event) == 0 || errno == ENOENT;
  if (sys::epoll_ctl(epoll_, EPOLL_CTL_MOD, fd, &event) == 0) return true;
  return errno == ENOENT && sys::epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event) == 0;
}

void WaitSet::noteSignalled(WaitEntry& entry) {
  if (!entry.candidate) {
    entry.candidate = true;
    signalled_.push_back(&entry);  // room for every entry is reserved
  }
  if (sleeping_) owner_.wake();
}

void WaitSet::noteRelink(WaitEntry& entry) {
  if (!entry.relink) {
    entry.relink = true;
    relinks_.push_back(&entry);  // room for every entry is reserved
  }
  if (sleeping_) owner_.wake();
}

void WaitSet::noteRefused() {
  refused_ = true;
  if (sleeping_) owner_.wake();
}

bool WaitSet::use(DWORD count, const WSAEVENT* handles) {
  const bool stale = stale_.exchange(false);
  if (!stale && handles_.size() == count && std::equal(handles, handles + count, handles_.begin())) return true;
  // Until the new array is in place, no wait may take the old one for it.
  handles_.clear();
  const unsigned epoch = ++epoch_;
  std::vector<std::uint64_t> created;
  const auto undo = [&] {
    for (std::uint64_t key : created) entries_.erase(key);
    if (stale) stale_ = true;  // the next wait looks at every handle again
  };
  try {
    // Every handle resolved, and every allocation made, before anything that
    // other threads see changes: a closed handle or a lack of memory leaves
    // the set as it was.
    created.reserve(count);
    handles_.reserve(count);
    for (DWORD i = 0; i < count; ++i) {
      const std::uint64_t key = handleValue(handles[i]);
      auto found = entries_.find(key);
      if (found != entries_.end() && found->second->epoch == epoch) continue;  // the lowest index counts
      // A handle of the last wait names the same event unless one was closed.
      if (found != entries_.end() && !(stale && !findEvent(handles[i]))) {
        found->second->epoch = epoch;
        found->second->nextIndex = i;
        continue;
      }
      std::shared_ptr<EventObject> event = found == entries_.end() ? findEvent(handles[i]) : nullptr;
      if (!event) {
        undo();
        fail(WSA_INVALID_HANDLE);
        return false;
      }
      auto entry = std::make_unique<WaitEntry>();
      entry->set = this;
      entry->event = std::move(event);
      entry->epoch = epoch;
      entry->nextIndex = i;
      entries_.emplace(key, std::move(entry));
      created.push_back(key);
    }
    released_.reserve(entries_.size());
    std::lock_guard<std::mutex> hold(eventLock());
    signalled_.reserve(entries_.size());
    relinks_.reserve(entries_.size());
  } catch (const std::bad_alloc&) {
    undo();
    fail(WSA_NOT_ENOUGH_MEMORY);
    return false;
  }
  // Nothing below allocates.
  released_.clear();
  {
    std::lock_guard<std::mutex> hold(eventLock());
    for (auto& [key, entry] : entries_) {
      if (entry->epoch != epoch) {
        unlinkWaiter(*entry->event, *entry);
        if (entry->candidate) dropFrom(signalled_, entry.get());
        if (entry->relink) dropFrom(relinks_, entry.get());
        if (entry->socket) released_.push_back(entry->socket.get());
        continue;
      }
      entry->index = entry->nextIndex;
      if (entry->linked) continue;
      entry->linked = true;
      linkWaiter(*entry->event, *entry);
      if (entry->event->signalled) noteSignalled(*entry);
      noteRelink(*entry);  // its socket is registered at the next settle
    }
  }
  for (SocketState* socket : released_) unref(socket);
  std::erase_if(entries_, [&](const auto& item) { return item.second->epoch != epoch; });
  handles_.assign(handles, handles + count);
  return true;
}

bool WaitSet::ref(const std::shared_ptr<SocketState>& socket) {
  auto found = sockets_.find(socket.get());
  if (found != sockets_.end()) {
    ++found->second.refs;
    return true;
  }
  const std::uint64_t id = nextId_++;
  sockets_.emplace(socket.get(), Registration{socket, id, 1});
  try {
    ids_.emplace(id, socket.get());
  } catch (...) {
    sockets_.erase(socket.get());
    throw;
  }
  SocketGuard hold(*socket);
  if (socket->closed || socket->fd < 0) return true;  // never in the descriptor; only counted
  syncInterest(*socket);
  try {
    socket->watches.push_back({this, id, false});
  } catch (...) {
    ids_.erase(id);
    sockets_.erase(socket.get());
    throw;
  }
  if (socket->interest == 0 || control(socket->fd, id, 0, socket->interest)) return true;
  fail(wsaErrorFromErrno(errno));
  socket->watches.pop_back();
  ids_.erase(id);
  sockets_.erase(socket.get());
  return false;
}

void WaitSet::unref(SocketState* socket) {
  auto found = sockets_.find(socket);
  if (found == sockets_.end() || --found->second.refs > 0) return;
  const std::shared_ptr<SocketState> keep = std::move(found->second.socket);
  const std::uint64_t id = found->second.id;
  ids_.erase(id);
  sockets_.erase(found);
  std::lock_guard<std::mutex> hold(keep->lock);
  auto watch = std::find_if(keep->watches.begin(), keep->watches.end(),
                            [&](const SocketState::Watch& w) { return w.set == this; });
  if (watch == keep->watches.end()) return;  // closed meanwhile: out of the descriptor already
  if (keep->interest != 0 || watch->refused) control(keep->fd, id, watch->refused ? ~0u : keep->interest, 0);
  keep->watches.erase(watch);
}

bool WaitSet::settle(std::vector<IoSocket>& io) {
  try {
    for (;;) {
      WaitEntry* entry;
      std::shared_ptr<SocketState> linked;
      {
        std::lock_guard<std::mutex> hold(eventLock());
        if (relinks_.empty()) break;
        entry = relinks_.back();
        relinks_.pop_back();
        entry->relink = false;
        linked = entry->event->socket.lock();
      }
      if (linked == entry->socket) continue;
      if (linked && !ref(linked)) {
        std::lock_guard<std::mutex> hold(eventLock());
        noteRelink(*entry);  // tried again by the next wait
        return false;
      }
      if (entry->socket) unref(entry->socket.get());
      entry->socket = std::move(linked);
    }
    for (IoSocket& mine : io) {
      if (mine.registered) continue;
      if (!ref(mine.socket)) return false;
      mine.registered = true;
    }
  } catch (const std::bad_alloc&) {
    fail(WSA_NOT_ENOUGH_MEMORY);
    return false;
  }
  if (!refused_.exchange(false)) return true;
  // The system refused to change registrations: each is applied whole, and
  // what goes through stays done if another is refused again.
  for (auto& [state, registration] : sockets_) {
    SocketState& socket = *registration.socket;
    std::lock_guard<std::mutex> hold(socket.lock);
    for (SocketState::Watch& watch : socket.watches) {
      if (watch.set != this || !watch.refused) continue;
      watch.refused = !control(socket.fd, watch.id, ~0u, socket.interest);
      if (!watch.refused) continue;
      fail(wsaErrorFromErrno(errno));
      refused_ = true;
      return false;
    }
  }
  return true;
}

void WaitSet::flush(std::vector<IoSocket>& io) {
  // Queued sends go to the kernel; sockets with nothing under way any more
  // leave the list and the descriptor.
  for (std::size_t i = 0; i < io.size();) {
    SocketState& socket = *io[i].socket;
    bool keep;
    {
      SocketGuard hold(socket);
      if (!socket.closed && !socket.sends.empty() && !socket.sendBlocked) progressSends(socket);
      keep = !socket.closed && (!socket.sends.empty() || !socket.receives.empty());
    }
    if (keep) {
      ++i;
      continue;
    }
    if (io[i].registered) unref(&socket);
    io[i] = std::move(io.back());
    io.pop_back();
  }
}

long WaitSet::arm(bool events) {
  std::lock_guard<std::mutex> hold(eventLock());
  if (!relinks_.empty() || refused_) return kSettle;
  const long index = events ? lowestSignalled() : -1;
  sleeping_ = index < 0;
  return index;
}

long WaitSet::lowestSignalled() {
  long lowest = -1;
  for (std::size_t i = 0; i < signalled_.size();) {
    WaitEntry* entry = signalled_[i];
    if (!entry->event->signalled) {
      entry->candidate = false;
      signalled_[i] = signalled_.back();
      signalled_.pop_back();
      continue;
    }
    if (lowest < 0 || entry->index < static_cast<DWORD>(lowest)) lowest = static_cast<long>(entry->index);
    ++i;
  }
  return lowest;
}

bool WaitSet::sleep(int timeout) {
  epoll_event ready[kBatch];
  int n = sys::epoll_wait(epoll_, ready, kBatch, timeout);
  const int error = errno;
  {
    std::lock_guard<std::mutex> hold(eventLock());
    sleeping_ = false;
  }
  if (n < 0) {
    errno = error;
    return false;
  }
  // All that is ready is recorded before a wait picks the lowest index.
  while (n > 0) {
    for (int i = 0; i < n; ++i) {
      if (ready[i].data.u64 == 0) {
        owner_.drainWake();
        continue;
      }
      auto found = ids_.find(ready[i].data.u64);
      if (found == ids_.end()) continue;  // let go of since
      SocketState& socket = *found->second;
      SocketGuard hold(socket);
      serveReadiness(socket, static_cast<short>(ready[i].events));
    }
    n = n == kBatch ? sys::epoll_wait(epoll_, ready, kBatch, 0) : 0;
  }
  return true;
}

void WaitSet::forget() {
  for (auto& [state, registration] : sockets_) {
    std::lock_guard<std::mutex> hold(registration.socket->lock);
    std::erase_if(registration.socket->watches, [&](const SocketState::Watch& w) { return w.set == this; });
  }
  sockets_.clear();
  ids_.clear();
  for (IoSocket& mine : owner_.ioSockets) mine.registered = false;
  {
    std::lock_guard<std::mutex> hold(eventLock());
    for (auto& [key, entry] : entries_)
      if (entry->linked) unlinkWaiter(*entry->event, *entry);
    signalled_.clear();
    relinks_.clear();
  }
  entries_.clear();
  handles_.clear();
}

void WaitSet::close() {
  forget();
  if (epoll_ >= 0) ::close(epoll_);
  epoll_ = -1;
}

// ---- The wait -----------------------------------------------------------------

DWORD waitForEvents(DWORD count, const WSAEVENT* handles, DWORD milliseconds, bool alertable, DWORD& index) {
  Reactor& self = *Reactor::current();
  WaitSet& set = self.waits;
  if (!self.ready() || !set.ready()) return WSA_WAIT_FAILED;
  // Without events (SleepEx) those of the last wait stay registered for the
  // next one; only their results are not given.
  const bool events = count > 0;
  if (events && !set.use(count, handles)) return WSA_WAIT_FAILED;
  const bool infinite = milliseconds == WSA_INFINITE;
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(infinite ? 0 : milliseconds);
  for (;;) {
    if (alertable) {
      self.takeAdopted();
      set.flush(self.ioSockets);
      if (self.runCompletions()) return WSA_WAIT_IO_COMPLETION;
    }
    if (!set.settle(self.ioSockets)) return WSA_WAIT_FAILED;
    const long signalled = set.arm(events);
    if (signalled == WaitSet::kSettle) continue;
    if (signalled >= 0) {
      index = static_cast<DWORD>(signalled);
      return WSA_WAIT_EVENT_0;
    }
    // Completions posted by other threads after the look below have written
    // the wake descriptor, so this wait returns at once.
    if (alertable) self.beginSleep();
    const int timeout = (alertable && self.hasCompletions()) ? 0 : remainingMilliseconds(infinite, deadline);
    const bool slept = set.sleep(timeout);
    self.endSleep();
    if (!slept) {
      if (errno == EINTR) continue;
      fail(wsaErrorFromErrno(errno));
      return WSA_WAIT_FAILED;
    }
    if (!infinite && Clock::now() >= deadline) {
      if (alertable && self.runCompletions()) return WSA_WAIT_IO_COMPLETION;
      std::lock_guard<std::mutex> hold(eventLock());
      const long last = events ? set.lowestSignalled() : -1;
      if (last < 0) return WSA_WAIT_TIMEOUT;
      index = static_cast<DWORD>(last);
      return WSA_WAIT_EVENT_0;
    }
  }
}

}  // namespace detail

namespace {

// The checks of both waits, then the wait: `limit` events at most.
DWORD checkedWait(DWORD count, const WSAEVENT* handles, DWORD limit, bool all, DWORD timeout, BOOL alertable,
                  DWORD& index) {
  int result = 0;
  if (fault::check(fault::Call::WSAWaitForMultipleEvents, result)) {
    detail::fail(result);
    return WSA_WAIT_FAILED;
  }
  // Waiting for all events at once is not offered: nothing here needs it.
  if (count == 0 || count > limit || handles == nullptr || all) {
    detail::fail(WSA_INVALID_PARAMETER);
    return WSA_WAIT_FAILED;
  }
  return detail::waitForEvents(count, handles, timeout, alertable != 0, index);
}

}  // namespace

DWORD waitForAnyEvent(DWORD cEvents, const WSAEVENT* lphEvents, DWORD dwTimeout, BOOL fAlertable, DWORD* lpdwIndex) {
  DWORD index = 0;
  const DWORD result = checkedWait(cEvents, lphEvents, LARGEST_WAIT_EVENTS, false, dwTimeout, fAlertable, index);
  if (lpdwIndex != nullptr) *lpdwIndex = index;
  return result;
}

DWORD WSAWaitForMultipleEvents(DWORD cEvents, const WSAEVENT* lphEvents, BOOL fWaitAll, DWORD dwTimeout,
                               BOOL fAlertable) {
  // Winsock's own limit and results: beyond 64 events an index could not be
  // told from WSA_WAIT_IO_COMPLETION (192) or WSA_WAIT_TIMEOUT (258).
  DWORD index = 0;
  const DWORD result =
      checkedWait(cEvents, lphEvents, WSA_MAXIMUM_WAIT_EVENTS, fWaitAll != 0, dwTimeout, fAlertable, index);
  return result == WSA_WAIT_EVENT_0 ? WSA_WAIT_EVENT_0 + index : result;
}

}  // namespace platform
