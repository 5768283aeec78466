// Internals of the platform layer, shared by its .cpp files only. Nothing
// outside src/platform includes this header.
//
// Include it before any Linux header: Linux defines macros named like several
// Winsock constants (SOL_SOCKET, SO_SNDBUF, AF_INET6, SOMAXCONN ...) with other
// values. The aliases in platform::wsa are fixed here, before those macros
// exist, and are what the layer's .cpp files use for Winsock values.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "fault.h"
#include "win32.h"
#include "winsock.h"

namespace platform::wsa {
constexpr int afInet = AF_INET;
constexpr int afInet6 = AF_INET6;
constexpr int solSocket = SOL_SOCKET;
constexpr int soReuseAddr = SO_REUSEADDR;
constexpr int soKeepAlive = SO_KEEPALIVE;
constexpr int soSndBuf = SO_SNDBUF;
constexpr int soRcvBuf = SO_RCVBUF;
constexpr int soError = SO_ERROR;
constexpr int soType = SO_TYPE;
constexpr int soMaxMsgSize = SO_MAX_MSG_SIZE;
constexpr int sockStream = SOCK_STREAM;
constexpr int sockDgram = SOCK_DGRAM;
constexpr int ipprotoTcp = IPPROTO_TCP;
constexpr int tcpNoDelay = 0x0001;
}  // namespace platform::wsa

namespace platform::detail {

// ---- Errors ---------------------------------------------------------------

// Maps a Linux errno value to the Winsock code with the same meaning.
int wsaErrorFromErrno(int err);
// Sets this thread's Winsock error and returns SOCKET_ERROR, so call sites end
// with `return fail(WSAEINVAL);`.
int fail(int wsaError);
int failFromErrno(int err);

// ---- Handle tables --------------------------------------------------------

// Handles name slots of a table, with a generation so that a stale handle is
// recognised instead of naming whatever took its slot later. The top byte
// tags the kind of object, so CloseHandle can tell a mutex from an event.
enum class HandleKind : std::uint64_t { Socket = 1, Event = 2, Mutex = 3 };

template <class T>
class HandleTable {
 public:
  explicit HandleTable(HandleKind kind) : kind_(static_cast<std::uint64_t>(kind)) {}

  std::uint64_t insert(std::shared_ptr<T> object) {
    std::lock_guard<std::mutex> hold(lock_);
    std::uint32_t index;
    if (!free_.empty()) {
      index = free_.back();
      free_.pop_back();
    } else {
      index = static_cast<std::uint32_t>(slots_.size());
      slots_.push_back({});
    }
    Slot& slot = slots_[index];
    slot.object = std::move(object);
    return encode(index, slot.generation);
  }

  std::shared_ptr<T> find(std::uint64_t handle) const {
    std::uint32_t index;
    std::uint32_t generation;
    if (!decode(handle, index, generation)) return nullptr;
    std::lock_guard<std::mutex> hold(lock_);
    if (index >= slots_.size() || slots_[index].generation != generation) return nullptr;
    return slots_[index].object;
  }

  std::shared_ptr<T> remove(std::uint64_t handle) {
    std::uint32_t index;
    std::uint32_t generation;
    if (!decode(handle, index, generation)) return nullptr;
    std::lock_guard<std::mutex> hold(lock_);
    if (index >= slots_.size() || slots_[index].generation != generation) return nullptr;
    std::shared_ptr<T> object = std::move(slots_[index].object);
    if (!object) return nullptr;
    slots_[index].generation = (slots_[index].generation + 1) & kGenerationMask;
    free_.push_back(index);
    return object;
  }

  // Every live object with its handle, taken out of the table.
  std::vector<std::pair<std::uint64_t, std::shared_ptr<T>>> removeAll() {
    std::vector<std::pair<std::uint64_t, std::shared_ptr<T>>> all;
    std::lock_guard<std::mutex> hold(lock_);
    for (std::uint32_t i = 0; i < slots_.size(); ++i) {
      if (!slots_[i].object) continue;
      all.emplace_back(encode(i, slots_[i].generation), std::move(slots_[i].object));
      slots_[i].generation = (slots_[i].generation + 1) & kGenerationMask;
      free_.push_back(i);
    }
    return all;
  }

 private:
  static constexpr std::uint32_t kGenerationMask = 0xFFFFFFu;
  struct Slot {
    std::shared_ptr<T> object;
    std::uint32_t generation = 0;
  };

  std::uint64_t encode(std::uint32_t index, std::uint32_t generation) const {
    return (kind_ << 56) | (std::uint64_t(generation) << 32) | (std::uint64_t(index) + 1);
  }
  bool decode(std::uint64_t handle, std::uint32_t& index, std::uint32_t& generation) const {
    if ((handle >> 56) != kind_) return false;
    std::uint64_t low = handle & 0xFFFFFFFFu;
    if (low == 0) return false;
    index = static_cast<std::uint32_t>(low - 1);
    generation = static_cast<std::uint32_t>((handle >> 32) & kGenerationMask);
    return true;
  }

  const std::uint64_t kind_;
  mutable std::mutex lock_;
  std::vector<Slot> slots_;
  std::vector<std::uint32_t> free_;
};

inline std::uint64_t handleValue(const void* h) { return reinterpret_cast<std::uintptr_t>(h); }
inline HANDLE toHandle(std::uint64_t v) { return reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(v)); }

// ---- Completions and the per-thread reactor -------------------------------

struct Completion {
  LPWSAOVERLAPPED_COMPLETION_ROUTINE routine;
  DWORD error;
  DWORD bytes;
  WSAOVERLAPPED* overlapped;
  DWORD flags;
};

struct EventObject;
struct SocketState;
class Reactor;
class WaitSet;

// A socket with operations of the thread under way, registered with its wait
// set while they last.
struct IoSocket {
  std::shared_ptr<SocketState> socket;
  bool registered = false;
};

// One distinct event of a thread's last wait. Other threads reach it through
// EventObject::waiters, and touch its flags under the event lock only.
struct WaitEntry {
  WaitSet* set;
  std::shared_ptr<EventObject> event;
  WaitEntry* prevWaiter = nullptr;  // the event's other waiters (event lock)
  WaitEntry* nextWaiter = nullptr;
  bool linked = false;     // among the event's waiters
  bool candidate = false;  // on the set's list of events signalled since it looked
  bool relink = false;     // on the set's list of events whose socket changed
  // Owner only.
  DWORD index = 0;  // the lowest index of the event in the wait's array
  DWORD nextIndex = 0;
  unsigned epoch = 0;                   // the last array that named it
  std::shared_ptr<SocketState> socket;  // the linked socket it keeps registered
};

// What a thread's waits keep from one wait to the next, so that a wait over
// the same handles as the last one costs nothing in their number: the last
// array and its events (each knowing this set as a waiter), and an epoll
// descriptor with the sockets of those events and of the thread's own
// operations registered, each with what it waits for now. A socket changes
// its registration itself when what it waits for changes (syncInterest), and
// a signalled event puts itself on a short list, so a wait looks at what
// changed only. Owner thread only, but where noted.
class WaitSet {
 public:
  explicit WaitSet(Reactor& owner) : owner_(owner) {}
  ~WaitSet() { close(); }
  WaitSet(const WaitSet&) = delete;
  WaitSet& operator=(const WaitSet&) = delete;

  // The epoll descriptor, made if it doesn't exist yet; false (the Winsock
  // error set) while the system refuses one.
  bool ready();
  // Makes `handles` the events of the waits from now on; nothing to do when
  // they are the last wait's. False (the Winsock error set) on a closed
  // handle or when memory runs out; the set is then as it was.
  bool use(DWORD count, const WSAEVENT* handles);
  // Follows what changed since the last look: sockets linked to or unlinked
  // from the events, the thread's own operations, registrations that the
  // system refused. False (the Winsock error set) if it still refuses one.
  bool settle(std::vector<IoSocket>& io);
  // Hands the queued sends of the thread's operations to the kernel, and
  // lets go of sockets that have nothing under way any more.
  void flush(std::vector<IoSocket>& io);
  // The lowest index of a signalled event, or -1 when there is none and the
  // thread may sleep, or kSettle when something changed since settle().
  static constexpr long kSettle = -2;
  long arm(bool events);
  // The lowest index of a signalled event, -1 if none (event lock held).
  long lowestSignalled();
  // Sleeps in epoll_wait for at most `timeout` ms (-1: no limit) and serves
  // what it reports; false with errno set if the wait failed.
  bool sleep(int timeout);
  // Drops every registration and the descriptor (the thread ends).
  void close();
  // Whether a wait of this set's descriptor was made before this process
  // forked: a child must never change a descriptor it shares with its parent.
  bool inherited() const;
  // Changes the socket's registration with `id` from the events `had` to
  // `want`; false if the system refused.
  bool control(int fd, std::uint64_t id, std::uint32_t had, std::uint32_t want);

  // Any thread, event lock held.
  void noteSignalled(WaitEntry& entry);
  void noteRelink(WaitEntry& entry);
  void noteClosed() { stale_ = true; }
  void noteRefused();  // the socket's Watch says which registration

 private:
  struct Registration {
    std::shared_ptr<SocketState> socket;
    std::uint64_t id;
    int refs;  // events linked to it, and the thread's operations
  };
  bool ref(const std::shared_ptr<SocketState>& socket);
  void unref(SocketState* socket);
  // Lets go of every event and socket, without a word to the kernel.
  void forget();

  Reactor& owner_;
  int epoll_ = -1;
  unsigned generation_ = 0;  // the process's fork count when epoll_ was made
  std::vector<WSAEVENT> handles_;
  std::unordered_map<std::uint64_t, std::unique_ptr<WaitEntry>> entries_;  // by handle
  std::unordered_map<SocketState*, Registration> sockets_;
  std::unordered_map<std::uint64_t, SocketState*> ids_;  // what epoll names
  std::uint64_t nextId_ = 1;                             // 0 names the wake-up descriptor
  unsigned epoch_ = 0;
  std::vector<SocketState*> released_;
  // Guarded by the event lock.
  std::vector<WaitEntry*> signalled_;
  std::vector<WaitEntry*> relinks_;
  bool sleeping_ = false;
  std::atomic<bool> stale_{false};    // an event of the last wait was closed: resolve anew
  std::atomic<bool> refused_{false};  // a registration was refused: apply it again
};

// Every thread that issues overlapped I/O or waits owns one reactor: its queue
// of finished operations, an eventfd that other threads write to wake its
// wait, and the wait's registrations. Completion routines run only from the
// owner's alertable waits.
class Reactor : public std::enable_shared_from_this<Reactor> {
 public:
  Reactor();
  ~Reactor();
  Reactor(const Reactor&) = delete;
  Reactor& operator=(const Reactor&) = delete;

  static const std::shared_ptr<Reactor>& current();
  // Owner only. Whether the wake-up descriptor exists, making it if it
  // doesn't yet; false (the Winsock error set) while the system refuses one,
  // and then nothing may wait on the network on this thread.
  bool ready();

  // Any thread. Queues a finished operation for the owner and wakes it.
  void post(const Completion& completion);
  // Owner only. Runs every queued completion in order; true if any ran.
  bool runCompletions();
  bool hasCompletions();
  // Any thread: make the owner's current or next wait return.
  void wake();
  // Owner only: clears pending wake-ups after a wait.
  void drainWake();
  int wakeFd() const { return wakeFd_; }

  // Sockets on which this thread has operations under way (owner only).
  std::vector<IoSocket> ioSockets;
  void watch(const std::shared_ptr<SocketState>& socket);
  // Any thread: a socket with operations of the owner that another thread
  // issued and that still wait for the kernel; the owner's next alertable
  // wait takes it among its own.
  void adopt(const std::shared_ptr<SocketState>& socket);
  // Owner only: takes what adopt() handed over.
  void takeAdopted();
  // Owner only: between these the owner may block in an alertable wait, and
  // a completion posted by another thread must knock.
  void beginSleep() { sleepy_.store(true); }
  void endSleep() { sleepy_.store(false, std::memory_order_relaxed); }
  WaitSet waits{*this};

 private:
  std::atomic<int> wakeFd_{-1};
  std::mutex lock_;
  std::vector<Completion> queue_;
  std::vector<std::shared_ptr<SocketState>> adopted_;
  std::atomic<bool> pending_{false};
  std::atomic<bool> adoptedPending_{false};
  std::atomic<bool> sleepy_{false};
};

// ---- Events ---------------------------------------------------------------

// A manual-reset event. Its state and its waiters are guarded by the one
// global event lock; lock order is socket lock, then event lock.
struct EventObject {
  bool signalled = false;
  WaitEntry* waiters = nullptr;       // of the wait sets that hold it, linked through the entries
  std::weak_ptr<SocketState> socket;  // set by WSAEventSelect
};

std::mutex& eventLock();
std::shared_ptr<EventObject> findEvent(WSAEVENT handle);
// Signals with the event lock held by the caller.
void signalLocked(EventObject& event);
// Tells the event's waiters that its socket changed (event lock held).
void relinkLocked(EventObject& event);

// ---- Sockets ----------------------------------------------------------------

struct Operation {
  bool isSend;
  WSABUF buffers[8];
  DWORD count;
  std::size_t total;
  std::size_t done;
  WSAOVERLAPPED* overlapped;
  LPWSAOVERLAPPED_COMPLETION_ROUTINE routine;
  std::shared_ptr<Reactor> owner;
};

enum class Phase { Fresh, Connecting, Connected, Listening, Failed };

struct SocketState {
  std::mutex lock;
  int fd = -1;
  int type = 0;  // SOCK_STREAM or SOCK_DGRAM (Winsock values)
  Phase phase = Phase::Fresh;
  bool closed = false;
  bool shutWrite = false;        // no new sends are taken
  bool shutdownPending = false;  // shut the write side once `sends` drains
  int streamError = 0;  // a reset or broken pipe seen by a send

  // Event selection and the record of network events.
  std::shared_ptr<EventObject> event;
  long selected = 0;
  long recorded = 0;
  int errors[FD_MAX_EVENTS] = {};
  bool readEnabled = true;
  bool writeEnabled = false;
  bool acceptEnabled = true;
  bool closeReported = false;

  // Values set through setsockopt, read back as set.
  int sendBuffer = -1;
  int receiveBuffer = -1;

  std::deque<Operation*> sends;
  std::deque<Operation*> receives;
  std::size_t unflushed = 0;  // bytes of `sends` not yet taken by the kernel
  bool sendBlocked = false;   // the kernel refused; wait for POLLOUT

  // The wait sets that hold the socket registered, each under its own id,
  // and the epoll events registered with all of them: what pollInterest gave
  // at the last release of `lock` (0: left out of their descriptors).
  struct Watch {
    WaitSet* set;
    std::uint64_t id;
    bool refused;  // the set's descriptor refused the last change
  };
  std::vector<Watch> watches;
  std::uint32_t interest = 0;
};

// Brings the socket's registration in every wait set in line with what it
// waits for now (socket lock held).
void syncInterest(SocketState& socket);

// Holds a socket's lock; every change of the socket's state is made under
// it, and its release follows the change in the wait sets.
class SocketGuard {
 public:
  explicit SocketGuard(SocketState& socket) : socket_(socket) { socket_.lock.lock(); }
  ~SocketGuard() {
    syncInterest(socket_);
    socket_.lock.unlock();
  }
  SocketGuard(const SocketGuard&) = delete;
  SocketGuard& operator=(const SocketGuard&) = delete;

 private:
  SocketState& socket_;
};

std::shared_ptr<SocketState> findSocket(SOCKET s);
HandleTable<SocketState>& socketTable();
bool winsockStarted();

// Records network events from poll's revents (socket lock held) and signals
// the linked event when a selected one is recorded.
void recordReadiness(SocketState& socket, short revents);
// What poll should watch on this socket for its event selection and its
// operations; 0 means leave it out of the poll set.
short pollInterest(const SocketState& socket);
// Moves data for queued operations (socket lock held). Finished operations are
// posted to their owners' reactors.
void progressSends(SocketState& socket);
void progressReceives(SocketState& socket);
// Ends every queued operation with `error` (socket lock held).
void abortOperations(SocketState& socket, DWORD error);
// Flushes what the kernel takes without blocking, aborts the rest, takes the
// socket out of the wait sets and closes the descriptor (socket lock held).
void closeLocked(SocketState& socket);
// A zero-timeout poll of one socket, then recordReadiness (socket lock held).
void refresh(SocketState& socket);

// ---- Waiting ----------------------------------------------------------------

// The wait behind waitForAnyEvent, WSAWaitForMultipleEvents and SleepEx: with
// no events, it waits for completions only. A signalled event gives
// WSA_WAIT_EVENT_0 and its lowest index in `index`.
DWORD waitForEvents(DWORD count, const WSAEVENT* events, DWORD milliseconds, bool alertable, DWORD& index);

}  // namespace platform::detail

namespace platform::fault {
bool catalogueOverride(std::vector<WSAPROTOCOL_INFOA>& out);
WORD agreedVersion();
}  // namespace platform::fault
