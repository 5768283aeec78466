// The per-thread reactor: completion queue and wake-up descriptor.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace platform::detail {

Reactor::Reactor() { ready(); }

Reactor::~Reactor() {
  // Completions that were never run belong to a thread that has ended; their
  // records are owned by whoever issued them.
  if (wakeFd_ >= 0) ::close(wakeFd_);
}

bool Reactor::ready() {
  if (wakeFd_ >= 0) return true;
  wakeFd_ = sys::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  if (wakeFd_ >= 0) return true;
  fail(wsaErrorFromErrno(errno));
  return false;
}

namespace {
thread_local Reactor* t_self = nullptr;
}  // namespace

const std::shared_ptr<Reactor>& Reactor::current() {
  // The wait set lets go of its events and sockets on its own thread, as
  // that thread ends; the reactor itself may live on in operations that
  // still name it.
  thread_local struct Holder {
    std::shared_ptr<Reactor> reactor = [] {
      auto r = std::make_shared<Reactor>();
      t_self = r.get();
      return r;
    }();
    ~Holder() { reactor->waits.close(); }
  } holder;
  return holder.reactor;
}

void Reactor::post(const Completion& completion) {
  {
    std::lock_guard<std::mutex> hold(lock_);
    queue_.push_back(completion);
  }
  pending_.store(true);
  // The owner finds its completions before it sleeps (it looks after
  // beginSleep()); only other threads need to knock, and only while it may
  // sleep.
  if (t_self != this && sleepy_.load()) wake();
}

bool Reactor::hasCompletions() { return pending_.load(); }

void Reactor::adopt(const std::shared_ptr<SocketState>& socket) {
  if (t_self == this) {
    watch(socket);
    return;
  }
  {
    std::lock_guard<std::mutex> hold(lock_);
    adopted_.push_back(socket);
  }
  adoptedPending_.store(true);
  wake();
}

void Reactor::takeAdopted() {
  if (!adoptedPending_.load()) return;
  std::vector<std::shared_ptr<SocketState>> taken;
  {
    std::lock_guard<std::mutex> hold(lock_);
    taken.swap(adopted_);
    adoptedPending_.store(false);
  }
  for (const std::shared_ptr<SocketState>& socket : taken) watch(socket);
}

bool Reactor::runCompletions() {
  if (!pending_.load(std::memory_order_acquire)) return false;
  std::vector<Completion> batch;
  {
    std::lock_guard<std::mutex> hold(lock_);
    batch.swap(queue_);
    pending_.store(false);
  }
  // Routines may issue new operations, whose completions queue up for the
  // next alertable wait rather than running here.
  for (const Completion& c : batch) c.routine(c.error, c.bytes, c.overlapped, c.flags);
  return !batch.empty();
}

void Reactor::wake() {
  if (wakeFd_ < 0) return;  // its owner can't wait on the network until it has one
  std::uint64_t one = 1;
  ssize_t rc = ::write(wakeFd_, &one, sizeof one);
  (void)rc;  // a full counter already means "wake up"
}

void Reactor::drainWake() {
  if (wakeFd_ < 0) return;
  std::uint64_t count;
  ssize_t rc = ::read(wakeFd_, &count, sizeof count);
  (void)rc;
}

void Reactor::watch(const std::shared_ptr<SocketState>& socket) {
  auto same = [&](const IoSocket& mine) { return mine.socket == socket; };
  if (std::none_of(ioSockets.begin(), ioSockets.end(), same)) ioSockets.push_back({socket, false});
}

}  // namespace platform::detail
