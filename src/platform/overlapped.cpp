// Overlapped WSASend and WSARecv with completion routines.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <sys/socket.h>
#include <sys/uio.h>

#include <cerrno>
#include <algorithm>
#include <cstring>
#include <memory>
#include <new>

namespace platform {
namespace detail {
namespace {

// Sends taken but not yet handed to the kernel, per socket, before WSASend
// answers WSA_IO_PENDING instead of success.
constexpr std::size_t kDeferLimit = 64u << 20;
constexpr int kMaxGather = 1024;  // IOV_MAX on Linux

void finish(Operation* op, DWORD error, DWORD bytes) {
  op->owner->post(Completion{op->routine, error, bytes, op->overlapped, 0});
  delete op;
}

// Fills `iov` with what is left of `op`, from byte `op->done` on.
int gather(const Operation& op, iovec* iov, int room) {
  int n = 0;
  std::size_t skip = op.done;
  for (DWORD i = 0; i < op.count && n < room; ++i) {
    std::size_t len = op.buffers[i].len;
    if (skip >= len) {
      skip -= len;
      continue;
    }
    iov[n].iov_base = op.buffers[i].buf + skip;
    iov[n].iov_len = len - skip;
    skip = 0;
    ++n;
  }
  return n;
}

// One non-blocking gathered send of `count` pieces; -1 with errno on failure.
ssize_t sendGathered(int fd, iovec* iov, int count) {
  msghdr message{};
  message.msg_iov = iov;
  message.msg_iovlen = static_cast<std::size_t>(count);
  return sys::sendmsg(fd, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
}

void failSends(SocketState& socket, int err) {
  DWORD code = static_cast<DWORD>(wsaErrorFromErrno(err));
  while (!socket.sends.empty()) {
    Operation* op = socket.sends.front();
    socket.sends.pop_front();
    finish(op, code, static_cast<DWORD>(op->done));
  }
  socket.unflushed = 0;
}

// Many small pieces cost the kernel more to walk than to copy here: they go
// out of one staging buffer per thread, in one piece.
constexpr std::size_t kStageSize = 64u << 10;
constexpr std::size_t kStageBelow = 512;  // average piece size that is staged

// Copies the first bytes of iov[0..n), up to kStageSize, into the staging
// buffer and makes it iov[0]; the new byte count.
std::size_t stage(iovec* iov, int& n) {
  thread_local std::unique_ptr<char[]> buffer;
  if (!buffer) buffer.reset(new (std::nothrow) char[kStageSize]);
  if (!buffer) return 0;
  std::size_t staged = 0;
  for (int i = 0; i < n && staged < kStageSize; ++i) {
    const std::size_t take = std::min(iov[i].iov_len, kStageSize - staged);
    std::memcpy(buffer.get() + staged, iov[i].iov_base, take);
    staged += take;
  }
  iov[0].iov_base = buffer.get();
  iov[0].iov_len = staged;
  n = 1;
  return staged;
}

void progressStreamSends(SocketState& socket) {
  iovec iov[kMaxGather];
  while (!socket.sends.empty()) {
    int n = 0;
    std::size_t offered = 0;
    for (Operation* op : socket.sends) {
      if (n == kMaxGather) break;
      int added = gather(*op, iov + n, kMaxGather - n);
      for (int i = n; i < n + added; ++i) offered += iov[i].iov_len;
      n += added;
    }
    if (n >= 4 && offered < kStageBelow * static_cast<std::size_t>(n)) {
      const std::size_t staged = stage(iov, n);
      if (staged > 0) offered = staged;
    }
    ssize_t written = sendGathered(socket.fd, iov, n);
    if (written < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) {
        socket.sendBlocked = true;
        return;
      }
      socket.streamError = errno;
      failSends(socket, errno);
      return;
    }
    socket.sendBlocked = false;
    std::size_t left = static_cast<std::size_t>(written);
    socket.unflushed -= left;
    while (left > 0) {
      Operation* op = socket.sends.front();
      std::size_t take = std::min(left, op->total - op->done);
      op->done += take;
      left -= take;
      if (op->done < op->total) break;
      socket.sends.pop_front();
      finish(op, 0, static_cast<DWORD>(op->total));
    }
    // Empty sends complete as soon as everything before them has gone.
    while (!socket.sends.empty() && socket.sends.front()->done == socket.sends.front()->total) {
      Operation* op = socket.sends.front();
      socket.sends.pop_front();
      finish(op, 0, static_cast<DWORD>(op->total));
    }
    if (static_cast<std::size_t>(written) < offered) {
      socket.sendBlocked = true;
      return;
    }
  }
}

void progressDatagramSends(SocketState& socket) {
  iovec iov[8];
  int refusals = 0;
  while (!socket.sends.empty()) {
    Operation* op = socket.sends.front();
    int n = gather(*op, iov, 8);
    ssize_t written = sendGathered(socket.fd, iov, n);
    if (written < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) {
        socket.sendBlocked = true;
        return;
      }
      // A port-unreachable report from an earlier datagram surfaces here;
      // it says nothing about this one, so send it again.
      if (errno == ECONNREFUSED && ++refusals < 8) continue;
      int err = errno;
      socket.sends.pop_front();
      socket.unflushed -= op->total;
      finish(op, static_cast<DWORD>(wsaErrorFromErrno(err)), 0);
      continue;
    }
    socket.sendBlocked = false;
    socket.sends.pop_front();
    socket.unflushed -= op->total;
    finish(op, 0, static_cast<DWORD>(written));
  }
}

// One read into the operation's buffers. Returns bytes, or -1 with errno.
ssize_t readInto(SocketState& socket, Operation& op) {
  iovec iov[8];
  int n = gather(op, iov, 8);
  msghdr message{};
  message.msg_iov = iov;
  message.msg_iovlen = static_cast<std::size_t>(n);
  for (int refusals = 0;;) {
    ssize_t got = sys::recvmsg(socket.fd, &message, MSG_DONTWAIT);
    if (got >= 0) return got;
    if (errno == EINTR) continue;
    // ICMP noise on datagram sockets: drop it and look again.
    if (errno == ECONNREFUSED && socket.type == wsa::sockDgram && ++refusals < 8) continue;
    if (errno == ECONNREFUSED && socket.type == wsa::sockDgram) errno = EAGAIN;
    return -1;
  }
}

Operation* makeOperation(bool isSend, WSABUF* buffers, DWORD count, WSAOVERLAPPED* overlapped,
                         LPWSAOVERLAPPED_COMPLETION_ROUTINE routine, std::shared_ptr<Reactor> owner = nullptr) {
  auto* op = new Operation{};
  op->isSend = isSend;
  op->count = count;
  op->total = 0;
  for (DWORD i = 0; i < count; ++i) {
    op->buffers[i] = buffers[i];
    op->total += buffers[i].len;
  }
  op->overlapped = overlapped;
  op->routine = routine;
  op->owner = owner ? std::move(owner) : Reactor::current();
  return op;
}

}  // namespace

void progressSends(SocketState& socket) {
  if (socket.fd < 0) return;
  if (socket.type == wsa::sockDgram) {
    progressDatagramSends(socket);
  } else {
    progressStreamSends(socket);
  }
  if (socket.sends.empty() && socket.shutdownPending) {
    socket.shutdownPending = false;
    ::shutdown(socket.fd, SHUT_WR);
  }
}

void progressReceives(SocketState& socket) {
  if (socket.fd < 0) return;
  while (!socket.receives.empty()) {
    Operation* op = socket.receives.front();
    ssize_t got = readInto(socket, *op);
    if (got < 0) {
      if (errno == EAGAIN || errno == EWOULDBLOCK) return;
      int err = errno;
      socket.receives.pop_front();
      finish(op, static_cast<DWORD>(wsaErrorFromErrno(err)), 0);
      continue;
    }
    socket.receives.pop_front();
    finish(op, 0, static_cast<DWORD>(got));
  }
}

void abortOperations(SocketState& socket, DWORD error) {
  while (!socket.sends.empty()) {
    Operation* op = socket.sends.front();
    socket.sends.pop_front();
    finish(op, error, 0);
  }
  while (!socket.receives.empty()) {
    Operation* op = socket.receives.front();
    socket.receives.pop_front();
    finish(op, error, 0);
  }
  socket.unflushed = 0;
}

}  // namespace detail

namespace {

// WSASend, with its completion for `owner` (null: the calling thread). Sent
// for another thread, the write waits for WSAFlushSends.
int sendFor(const std::shared_ptr<detail::Reactor>& owner, SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount,
            DWORD* lpNumberOfBytesSent, WSAOVERLAPPED* lpOverlapped,
            LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine) {
  int result = 0;
  bool forcePending = false;
  bool faulted = fault::check(fault::Call::WSASend, result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return detail::fail(WSAENOTSOCK);
  if (faulted) {
    if (result == WSAEWOULDBLOCK) {
      // A refused send arms FD_WRITE, as a full send buffer would.
      detail::SocketGuard hold(*socket);
      socket->writeEnabled = true;
      detail::refresh(*socket);
      return detail::fail(WSAEWOULDBLOCK);
    }
    if (result != WSA_IO_PENDING) return detail::fail(result);
    forcePending = true;
  }
  if (lpBuffers == nullptr || dwBufferCount == 0 || dwBufferCount > 8) return detail::fail(WSAEINVAL);
  if (lpOverlapped == nullptr || lpCompletionRoutine == nullptr) return detail::fail(WSAEINVAL);
  // Completions come back through the owner's reactor.
  detail::Reactor& reactor = owner ? *owner : *detail::Reactor::current();
  if (!reactor.ready()) return SOCKET_ERROR;
  {
    detail::SocketGuard hold(*socket);
    if (socket->closed) return detail::fail(WSAENOTSOCK);
    if (socket->type == wsa::sockStream) {
      if (socket->phase == detail::Phase::Connecting) detail::refresh(*socket);
      if (socket->phase != detail::Phase::Connected) return detail::fail(WSAENOTCONN);
      if (socket->shutWrite) return detail::fail(WSAESHUTDOWN);
      if (socket->streamError != 0) return detail::failFromErrno(socket->streamError);
    }
    detail::Operation* op =
        detail::makeOperation(true, lpBuffers, dwBufferCount, lpOverlapped, lpCompletionRoutine, owner);
    socket->sends.push_back(op);
    socket->unflushed += op->total;
    if (!owner) reactor.watch(socket);
    if (forcePending || socket->unflushed > detail::kDeferLimit) return detail::fail(WSA_IO_PENDING);
    if (lpNumberOfBytesSent != nullptr) *lpNumberOfBytesSent = static_cast<DWORD>(op->total);
  }
  return 0;
}

}  // namespace

int WSASend(SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesSent, DWORD,
            WSAOVERLAPPED* lpOverlapped, LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine) {
  return sendFor(nullptr, s, lpBuffers, dwBufferCount, lpNumberOfBytesSent, lpOverlapped, lpCompletionRoutine);
}

void* WSAGetCompletionQueue() {
  try {
    return new std::shared_ptr<detail::Reactor>(detail::Reactor::current());
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

void WSAFlushSends(SOCKET s) {
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return;
  std::shared_ptr<detail::Reactor> owner;
  {
    detail::SocketGuard hold(*socket);
    if (socket->closed || socket->sends.empty()) return;
    if (!socket->sendBlocked) detail::progressSends(*socket);
    // What is left goes on in the waits of the thread that its completions
    // belong to (the library's sends have one).
    if (!socket->sends.empty()) owner = socket->sends.front()->owner;
  }
  if (owner) owner->adopt(socket);
}

void WSACloseCompletionQueue(void* queue) { delete static_cast<std::shared_ptr<detail::Reactor>*>(queue); }

int WSASendFor(void* queue, SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesSent, DWORD,
               WSAOVERLAPPED* lpOverlapped, LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine) {
  if (queue == nullptr) return detail::fail(WSAEINVAL);
  return sendFor(*static_cast<std::shared_ptr<detail::Reactor>*>(queue), s, lpBuffers, dwBufferCount,
                 lpNumberOfBytesSent, lpOverlapped, lpCompletionRoutine);
}

int WSARecv(SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesRecvd, DWORD* lpFlags,
            WSAOVERLAPPED* lpOverlapped, LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine) {
  int result = 0;
  bool faulted = fault::check(fault::Call::WSARecv, result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return detail::fail(WSAENOTSOCK);
  if (lpBuffers == nullptr || dwBufferCount == 0 || dwBufferCount > 8) return detail::fail(WSAEINVAL);
  if (lpOverlapped == nullptr || lpCompletionRoutine == nullptr) return detail::fail(WSAEINVAL);
  // Completions come back through this thread's reactor.
  if (!detail::Reactor::current()->ready()) return SOCKET_ERROR;
  detail::SocketGuard hold(*socket);
  if (socket->closed) return detail::fail(WSAENOTSOCK);
  // Posting a read re-enables FD_READ, whatever comes of it.
  socket->readEnabled = true;
  if (faulted && result != WSA_IO_PENDING) return detail::fail(result);
  detail::Operation* op = detail::makeOperation(false, lpBuffers, dwBufferCount, lpOverlapped, lpCompletionRoutine);
  if (!faulted && socket->receives.empty()) {
    ssize_t got = detail::readInto(*socket, *op);
    if (got >= 0) {
      if (lpNumberOfBytesRecvd != nullptr) *lpNumberOfBytesRecvd = static_cast<DWORD>(got);
      if (lpFlags != nullptr) *lpFlags = 0;
      detail::finish(op, 0, static_cast<DWORD>(got));
      return 0;
    }
    if (errno != EAGAIN && errno != EWOULDBLOCK) {
      int err = errno;
      delete op;
      return detail::failFromErrno(err);
    }
  }
  socket->receives.push_back(op);
  detail::Reactor::current()->watch(socket);
  return detail::fail(WSA_IO_PENDING);
}

}  // namespace platform
