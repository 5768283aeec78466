// WSAEventSelect and WSAEnumNetworkEvents: turning readiness into Winsock's
// network-event record, with its re-enabling rules, and what a socket waits
// for under those rules.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

namespace platform {
namespace detail {
namespace {

int takeSocketError(int fd) {
  int value = 0;
  socklen_t length = sizeof value;
  if (::getsockopt(fd, SOL_SOCKET, SO_ERROR, &value, &length) != 0) return errno;
  return value;
}

bool bytesWaiting(int fd) {
  int count = 0;
  return ::ioctl(fd, FIONREAD, &count) == 0 && count > 0;
}

void record(SocketState& socket, long bit, int index, int error) {
  if (!(socket.selected & bit)) return;
  socket.recorded |= bit;
  socket.errors[index] = error;
}

void recordConnected(SocketState& socket, short revents) {
  bool hangup = revents & (POLLRDHUP | POLLHUP);
  bool data = (revents & POLLIN) && (!hangup || bytesWaiting(socket.fd));
  if (data && socket.readEnabled && socket.receives.empty() && (socket.selected & FD_READ)) {
    record(socket, FD_READ, FD_READ_BIT, 0);
    socket.readEnabled = false;
  }
  if (!socket.closeReported) {
    if (revents & POLLERR) {
      int err = takeSocketError(socket.fd);
      record(socket, FD_CLOSE, FD_CLOSE_BIT, wsaErrorFromErrno(err != 0 ? err : ECONNRESET));
      socket.closeReported = true;
    } else if (hangup && !data) {
      // An orderly close is reported once the data in front of it is read.
      record(socket, FD_CLOSE, FD_CLOSE_BIT, 0);
      socket.closeReported = true;
    }
  }
  if ((revents & POLLOUT) && socket.writeEnabled && !socket.closeReported && (socket.selected & FD_WRITE)) {
    record(socket, FD_WRITE, FD_WRITE_BIT, 0);
    socket.writeEnabled = false;
  }
}

}  // namespace

void recordReadiness(SocketState& socket, short revents) {
  if (socket.closed || revents == 0 || (revents & POLLNVAL)) return;
  long before = socket.recorded;
  if (socket.type == wsa::sockDgram) {
    // ICMP errors (port unreachable) are pending socket errors; clear them so
    // they neither wake every poll nor fail the next read.
    if (revents & POLLERR) takeSocketError(socket.fd);
    if ((revents & POLLIN) && socket.readEnabled && socket.receives.empty() && (socket.selected & FD_READ)) {
      record(socket, FD_READ, FD_READ_BIT, 0);
      socket.readEnabled = false;
    }
    if ((revents & POLLOUT) && socket.writeEnabled && (socket.selected & FD_WRITE)) {
      record(socket, FD_WRITE, FD_WRITE_BIT, 0);
      socket.writeEnabled = false;
    }
  } else {
    switch (socket.phase) {
      case Phase::Connecting:
        if (revents & (POLLOUT | POLLERR | POLLHUP)) {
          int err = takeSocketError(socket.fd);
          if (err == 0) {
            socket.phase = Phase::Connected;
            socket.writeEnabled = true;
            record(socket, FD_CONNECT, FD_CONNECT_BIT, 0);
            recordConnected(socket, revents);
          } else {
            socket.phase = Phase::Failed;
            record(socket, FD_CONNECT, FD_CONNECT_BIT, wsaErrorFromErrno(err));
          }
        }
        break;
      case Phase::Listening:
        if ((revents & POLLIN) && socket.acceptEnabled && (socket.selected & FD_ACCEPT)) {
          record(socket, FD_ACCEPT, FD_ACCEPT_BIT, 0);
          socket.acceptEnabled = false;
        }
        break;
      case Phase::Connected:
        recordConnected(socket, revents);
        break;
      case Phase::Fresh:
      case Phase::Failed:
        break;
    }
  }
  if (socket.recorded != before && socket.event) {
    std::lock_guard<std::mutex> hold(eventLock());
    signalLocked(*socket.event);
  }
}

short pollInterest(const SocketState& socket) {
  if (socket.closed || socket.fd < 0) return 0;
  short interest = 0;
  if (!socket.receives.empty()) interest |= POLLIN;
  if (!socket.sends.empty() && socket.sendBlocked) interest |= POLLOUT;
  bool operations = interest != 0;
  long selected = socket.event ? socket.selected : 0;
  if (socket.type == wsa::sockDgram) {
    if (socket.readEnabled && (selected & FD_READ)) interest |= POLLIN;
    if (socket.writeEnabled && (selected & FD_WRITE)) interest |= POLLOUT;
    return interest;
  }
  switch (socket.phase) {
    case Phase::Connecting:
      if (selected & (FD_CONNECT | FD_WRITE | FD_CLOSE)) interest |= POLLOUT;
      break;
    case Phase::Listening:
      if (socket.acceptEnabled && (selected & FD_ACCEPT)) interest |= POLLIN;
      break;
    case Phase::Connected:
      if (socket.closeReported && !operations) return 0;
      if (socket.readEnabled && (selected & FD_READ)) interest |= POLLIN | POLLRDHUP;
      if (!socket.closeReported && (selected & FD_CLOSE) && (socket.readEnabled || !(selected & FD_READ)))
        interest |= POLLRDHUP;
      if (socket.writeEnabled && !socket.closeReported && (selected & FD_WRITE)) interest |= POLLOUT;
      break;
    case Phase::Fresh:
    case Phase::Failed:
      // An unconnected stream socket reports POLLHUP all the time.
      if (!operations) return 0;
      break;
  }
  return interest;
}

void refresh(SocketState& socket) {
  if (socket.closed || socket.fd < 0 || !socket.event) return;
  if (socket.type == wsa::sockStream && (socket.phase == Phase::Fresh || socket.phase == Phase::Failed)) return;
  pollfd p{socket.fd, static_cast<short>(POLLIN | POLLOUT | POLLRDHUP), 0};
  if (sys::poll(&p, 1, 0) > 0) recordReadiness(socket, p.revents);
}

}  // namespace detail

int WSAEventSelect(SOCKET s, WSAEVENT hEventObject, long lNetworkEvents) {
  int result = 0;
  if (fault::check(fault::Call::WSAEventSelect, result)) return detail::fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return detail::fail(WSAENOTSOCK);
  std::shared_ptr<detail::EventObject> event;
  if (lNetworkEvents != 0) {
    event = detail::findEvent(hEventObject);
    if (!event) return detail::fail(WSA_INVALID_HANDLE);
  }
  detail::SocketGuard hold(*socket);
  if (socket->closed) return detail::fail(WSAENOTSOCK);
  {
    std::lock_guard<std::mutex> events(detail::eventLock());
    if (socket->event && socket->event->socket.lock() == socket) {
      socket->event->socket.reset();
      detail::relinkLocked(*socket->event);
    }
    if (event) {
      event->socket = socket;
      detail::relinkLocked(*event);
    }
  }
  // A new selection starts a new record.
  socket->event = event;
  socket->selected = lNetworkEvents;
  socket->recorded = 0;
  std::memset(socket->errors, 0, sizeof socket->errors);
  detail::refresh(*socket);
  return 0;
}

int WSAEnumNetworkEvents(SOCKET s, WSAEVENT hEventObject, WSANETWORKEVENTS* lpNetworkEvents) {
  int result = 0;
  if (fault::check(fault::Call::WSAEnumNetworkEvents, result)) return detail::fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return detail::fail(WSAENOTSOCK);
  if (lpNetworkEvents == nullptr) return detail::fail(WSAEFAULT);
  std::shared_ptr<detail::EventObject> event = hEventObject ? detail::findEvent(hEventObject) : nullptr;
  detail::SocketGuard hold(*socket);
  // The waits record what poll reports; look at the socket here only when
  // nothing is recorded yet (a caller that enumerates without waiting).
  if ((socket->recorded & socket->selected) == 0) detail::refresh(*socket);
  lpNetworkEvents->lNetworkEvents = socket->recorded & socket->selected;
  std::memcpy(lpNetworkEvents->iErrorCode, socket->errors, sizeof socket->errors);
  socket->recorded = 0;
  std::memset(socket->errors, 0, sizeof socket->errors);
  if (event) {
    std::lock_guard<std::mutex> events(detail::eventLock());
    event->signalled = false;
  }
  return 0;
}

}  // namespace platform
