// The Linux calls under the platform layer where the system may answer
// short, late or not at all, as one table of entry points (as SQLite's OS
// layer keeps its own): each is the real call until a test puts another in
// its place, to make sendmsg write half, recvmsg answer EINTR or EAGAIN,
// epoll_wait wake with nothing, epoll_ctl refuse a registration, or socket,
// eventfd and epoll_create1 fail with EMFILE. No Linux header here, so a test
// can include it beside the Winsock-shaped headers.
#pragma once

#include <atomic>

struct epoll_event;
struct msghdr;
struct pollfd;
struct sockaddr;

namespace platform::sys {

struct Calls {
  std::atomic<int (*)(int, int, int)> socket;
  std::atomic<int (*)(int, ::sockaddr*, unsigned int*, int)> accept4;
  std::atomic<long (*)(int, const ::msghdr*, int)> sendmsg;
  std::atomic<long (*)(int, ::msghdr*, int)> recvmsg;
  std::atomic<int (*)(::pollfd*, unsigned long, int)> poll;
  std::atomic<int (*)(unsigned int, int)> eventfd;
  std::atomic<int (*)(int)> epoll_create1;
  std::atomic<int (*)(int, int, int, ::epoll_event*)> epoll_ctl;
  std::atomic<int (*)(int, ::epoll_event*, int, int)> epoll_wait;
};

// The table the layer calls through; any thread may swap an entry.
Calls& calls();
// Every entry back to the real call.
void restore();

inline int socket(int domain, int type, int protocol) {
  return calls().socket.load(std::memory_order_relaxed)(domain, type, protocol);
}
inline int accept4(int fd, ::sockaddr* address, unsigned int* length, int flags) {
  return calls().accept4.load(std::memory_order_relaxed)(fd, address, length, flags);
}
inline long sendmsg(int fd, const ::msghdr* message, int flags) {
  return calls().sendmsg.load(std::memory_order_relaxed)(fd, message, flags);
}
inline long recvmsg(int fd, ::msghdr* message, int flags) {
  return calls().recvmsg.load(std::memory_order_relaxed)(fd, message, flags);
}
inline int poll(::pollfd* fds, unsigned long count, int timeout) {
  return calls().poll.load(std::memory_order_relaxed)(fds, count, timeout);
}
inline int eventfd(unsigned int initial, int flags) {
  return calls().eventfd.load(std::memory_order_relaxed)(initial, flags);
}

inline int epoll_create1(int flags) { return calls().epoll_create1.load(std::memory_order_relaxed)(flags); }
inline int epoll_ctl(int epfd, int op, int fd, ::epoll_event* event) {
  return calls().epoll_ctl.load(std::memory_order_relaxed)(epfd, op, fd, event);
}
inline int epoll_wait(int epfd, ::epoll_event* events, int count, int timeout) {
  return calls().epoll_wait.load(std::memory_order_relaxed)(epfd, events, count, timeout);
}

}  // namespace platform::sys
