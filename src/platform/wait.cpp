// WSAWaitForMultipleEvents: the one place where a thread blocks on the
// network. It polls the wake descriptor of its reactor, the sockets whose
// events it waits on, and the sockets with its own operations under way.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <chrono>

namespace platform {
namespace detail {
namespace {

using Clock = std::chrono::steady_clock;

struct PollSet {
  std::vector<pollfd> fds;
  std::vector<std::shared_ptr<SocketState>> sockets;

  void clear() {
    fds.clear();
    sockets.clear();
  }
  void add(const std::shared_ptr<SocketState>& socket) {
    if (std::find(sockets.begin(), sockets.end(), socket) != sockets.end()) return;
    short interest;
    int fd;
    {
      std::lock_guard<std::mutex> hold(socket->lock);
      interest = pollInterest(*socket);
      fd = socket->fd;
    }
    if (interest == 0) return;
    fds.push_back(pollfd{fd, interest, 0});
    sockets.push_back(socket);
  }
};

// Hands queued sends of this thread to the kernel, and forgets sockets that
// have nothing under way any more.
void flushSends(Reactor& self) {
  auto& list = self.ioSockets;
  for (std::size_t i = 0; i < list.size();) {
    SocketState& socket = *list[i];
    bool keep;
    {
      std::lock_guard<std::mutex> hold(socket.lock);
      if (!socket.closed && !socket.sends.empty() && !socket.sendBlocked) progressSends(socket);
      keep = !socket.closed && (!socket.sends.empty() || !socket.receives.empty());
    }
    if (keep) {
      ++i;
    } else {
      list[i] = std::move(list.back());
      list.pop_back();
    }
  }
}

int remainingMilliseconds(bool infinite, Clock::time_point deadline) {
  if (infinite) return -1;
  auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left > 0 ? static_cast<int>(std::min<long long>(left, 1 << 30)) : 0;
}

}  // namespace

DWORD waitForEvents(DWORD count, const WSAEVENT* handles, DWORD milliseconds, bool alertable) {
  const std::shared_ptr<Reactor>& self = Reactor::current();
  if (!self->ready()) return WSA_WAIT_FAILED;
  std::shared_ptr<EventObject> events[WSA_MAXIMUM_WAIT_EVENTS];
  for (DWORD i = 0; i < count; ++i) {
    events[i] = findEvent(handles[i]);
    if (!events[i]) {
      fail(WSA_INVALID_HANDLE);
      return WSA_WAIT_FAILED;
    }
  }
  const bool infinite = milliseconds == WSA_INFINITE;
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(infinite ? 0 : milliseconds);
  thread_local PollSet set;
  for (;;) {
    if (alertable) {
      flushSends(*self);
      if (self->runCompletions()) return WSA_WAIT_IO_COMPLETION;
    }
    int signalled = -1;
    {
      std::lock_guard<std::mutex> hold(eventLock());
      for (DWORD i = 0; i < count && signalled < 0; ++i) {
        if (events[i]->signalled) signalled = static_cast<int>(i);
      }
      if (signalled < 0) {
        for (DWORD i = 0; i < count; ++i) events[i]->waiters.push_back(self.get());
      }
    }
    if (signalled >= 0) return WSA_WAIT_EVENT_0 + static_cast<DWORD>(signalled);

    set.clear();
    set.fds.push_back(pollfd{self->wakeFd(), POLLIN, 0});
    set.sockets.push_back(nullptr);
    for (DWORD i = 0; i < count; ++i) {
      std::shared_ptr<SocketState> socket;
      {
        std::lock_guard<std::mutex> hold(eventLock());
        socket = events[i]->socket.lock();
      }
      if (socket) set.add(socket);
    }
    if (alertable) {
      for (const auto& socket : self->ioSockets) set.add(socket);
    }
    // Completions posted by other threads, or an event set, after the checks
    // above have written the wake descriptor, so this poll returns at once.
    int timeout = (alertable && self->hasCompletions()) ? 0 : remainingMilliseconds(infinite, deadline);
    int ready = sys::poll(set.fds.data(), set.fds.size(), timeout);
    int pollError = ready < 0 ? errno : 0;
    {
      std::lock_guard<std::mutex> hold(eventLock());
      for (DWORD i = 0; i < count; ++i) {
        auto& waiters = events[i]->waiters;
        auto it = std::find(waiters.begin(), waiters.end(), self.get());
        if (it != waiters.end()) waiters.erase(it);
      }
    }
    if (ready < 0 && pollError != EINTR) {
      fail(wsaErrorFromErrno(pollError));
      return WSA_WAIT_FAILED;
    }
    if (ready > 0) {
      if (set.fds[0].revents != 0) self->drainWake();
      for (std::size_t j = 1; j < set.fds.size(); ++j) {
        short revents = set.fds[j].revents;
        if (revents == 0 || (revents & POLLNVAL)) continue;
        SocketState& socket = *set.sockets[j];
        std::lock_guard<std::mutex> hold(socket.lock);
        if (socket.closed || socket.fd != set.fds[j].fd) continue;
        // Pending reads take the data before it could count as FD_READ.
        if (!socket.receives.empty() && (revents & (POLLIN | POLLHUP | POLLERR | POLLRDHUP)))
          progressReceives(socket);
        if (!socket.sends.empty() && (revents & (POLLOUT | POLLHUP | POLLERR))) {
          socket.sendBlocked = false;
          progressSends(socket);
        }
        recordReadiness(socket, revents);
      }
    }
    if (ready == 0 && !infinite && Clock::now() >= deadline) {
      if (alertable && self->runCompletions()) return WSA_WAIT_IO_COMPLETION;
      std::lock_guard<std::mutex> hold(eventLock());
      for (DWORD i = 0; i < count; ++i) {
        if (events[i]->signalled) return WSA_WAIT_EVENT_0 + i;
      }
      return WSA_WAIT_TIMEOUT;
    }
  }
}

}  // namespace detail

DWORD WSAWaitForMultipleEvents(DWORD cEvents, const WSAEVENT* lphEvents, BOOL fWaitAll, DWORD dwTimeout,
                               BOOL fAlertable) {
  int result = 0;
  if (fault::check(fault::Call::WSAWaitForMultipleEvents, result)) {
    detail::fail(result);
    return WSA_WAIT_FAILED;
  }
  // Waiting for all events at once is not offered: nothing here needs it.
  if (cEvents == 0 || cEvents > WSA_MAXIMUM_WAIT_EVENTS || lphEvents == nullptr || fWaitAll) {
    detail::fail(WSA_INVALID_PARAMETER);
    return WSA_WAIT_FAILED;
  }
  return detail::waitForEvents(cEvents, lphEvents, dwTimeout, fAlertable != 0);
}

}  // namespace platform
