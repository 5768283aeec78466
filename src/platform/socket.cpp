// Socket creation, naming, options, connecting, accepting and closing.
#include "internal.h"  // first: see the note there
#include "syscalls.h"

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace platform {
namespace detail {
namespace {

constexpr int kLargestDatagram = 65507;

bool toLinux(const sockaddr* name, int namelen, ::sockaddr_in& out) {
  if (name == nullptr || namelen < static_cast<int>(sizeof(platform::sockaddr_in))) return false;
  const auto* in = reinterpret_cast<const platform::sockaddr_in*>(name);
  if (in->sin_family != wsa::afInet) return false;
  std::memset(&out, 0, sizeof out);
  out.sin_family = AF_INET;
  out.sin_port = in->sin_port;
  out.sin_addr.s_addr = in->sin_addr.s_addr;
  return true;
}

int fromLinux(const ::sockaddr_in& in, sockaddr* name, int* namelen) {
  if (name == nullptr || namelen == nullptr || *namelen < static_cast<int>(sizeof(platform::sockaddr_in)))
    return fail(WSAEFAULT);
  auto* out = reinterpret_cast<platform::sockaddr_in*>(name);
  std::memset(out, 0, sizeof *out);
  out->sin_family = static_cast<std::uint16_t>(wsa::afInet);
  out->sin_port = in.sin_port;
  out->sin_addr.s_addr = in.sin_addr.s_addr;
  *namelen = sizeof(platform::sockaddr_in);
  return 0;
}

static_assert(sizeof(platform::sockaddr_in) == sizeof(::sockaddr_in), "same address layout");
static_assert(offsetof(platform::sockaddr_in, sin_port) == offsetof(::sockaddr_in, sin_port), "same layout");
static_assert(offsetof(platform::sockaddr_in, sin_addr) == offsetof(::sockaddr_in, sin_addr), "same layout");

int kernelInt(int fd, int level, int option) {
  int value = 0;
  socklen_t length = sizeof value;
  if (::getsockopt(fd, level, option, &value, &length) != 0) return -1;
  return value;
}

}  // namespace

void closeLocked(SocketState& socket) {
  if (socket.closed) return;
  // What was accepted for sending goes to the kernel if it fits without
  // blocking; whatever is left ends with WSA_OPERATION_ABORTED.
  if (!socket.sends.empty() && socket.fd >= 0) progressSends(socket);
  abortOperations(socket, WSA_OPERATION_ABORTED);
  socket.closed = true;
  if (socket.event) {
    std::lock_guard<std::mutex> hold(eventLock());
    if (socket.event->socket.lock().get() == &socket) {
      socket.event->socket.reset();
      relinkLocked(*socket.event);
    }
  }
  socket.event.reset();
  socket.selected = 0;
  // Out of every wait set's descriptor before the number can be reused; a
  // refusal doesn't matter, as the close below takes it out too.
  for (const SocketState::Watch& watch : socket.watches)
    if ((socket.interest != 0 || watch.refused) && socket.fd >= 0)
      watch.set->control(socket.fd, watch.id, watch.refused ? ~0u : socket.interest, 0);
  socket.watches.clear();
  socket.interest = 0;
  // A listening socket stops listening now: close alone would keep the port
  // bound while another process shares the descriptor (a child between its
  // fork and its exec), failing a new listener's bind.
  if (socket.phase == Phase::Listening && socket.fd >= 0) ::shutdown(socket.fd, SHUT_RDWR);
  if (socket.fd >= 0) ::close(socket.fd);
  socket.fd = -1;
}

}  // namespace detail

using detail::fail;
using detail::failFromErrno;

SOCKET WSASocketA(int af, int type, int protocol, const WSAPROTOCOL_INFOA* lpProtocolInfo, unsigned,
                  DWORD) {
  int result = 0;
  if (fault::check(fault::Call::WSASocketA, result)) {
    fail(result);
    return INVALID_SOCKET;
  }
  if (!detail::winsockStarted()) {
    fail(WSANOTINITIALISED);
    return INVALID_SOCKET;
  }
  if (af == FROM_PROTOCOL_INFO || type == FROM_PROTOCOL_INFO || protocol == FROM_PROTOCOL_INFO) {
    if (lpProtocolInfo == nullptr) {
      fail(WSAEINVAL);
      return INVALID_SOCKET;
    }
    if (af == FROM_PROTOCOL_INFO) af = lpProtocolInfo->iAddressFamily;
    if (type == FROM_PROTOCOL_INFO) type = lpProtocolInfo->iSocketType;
    if (protocol == FROM_PROTOCOL_INFO) protocol = lpProtocolInfo->iProtocol;
  }
  int linuxFamily;
  if (af == wsa::afInet) {
    linuxFamily = AF_INET;
  } else if (af == wsa::afInet6) {
    linuxFamily = AF_INET6;
  } else {
    fail(WSAEAFNOSUPPORT);
    return INVALID_SOCKET;
  }
  int linuxType;
  if (type == wsa::sockStream) {
    linuxType = SOCK_STREAM;
  } else if (type == wsa::sockDgram) {
    linuxType = SOCK_DGRAM;
  } else {
    fail(WSAESOCKTNOSUPPORT);
    return INVALID_SOCKET;
  }
  // Every socket is non-blocking: this layer offers the overlapped and
  // event-selected model only.
  int fd = sys::socket(linuxFamily, linuxType | SOCK_NONBLOCK | SOCK_CLOEXEC, protocol);
  if (fd < 0) {
    failFromErrno(errno);
    return INVALID_SOCKET;
  }
  auto state = std::make_shared<detail::SocketState>();
  state->fd = fd;
  state->type = type;
  state->writeEnabled = type == wsa::sockDgram;  // datagram sockets can send from the start
  return detail::socketTable().insert(std::move(state));
}

int closesocket(SOCKET s) {
  int result = 0;
  bool faulted = fault::check(fault::Call::closesocket, result);
  std::shared_ptr<detail::SocketState> socket = detail::socketTable().remove(s);
  if (!socket) return fail(WSAENOTSOCK);
  {
    detail::SocketGuard hold(*socket);
    detail::closeLocked(*socket);
  }
  // Like a failing close(2), a refused closesocket still releases the socket.
  return faulted ? fail(result) : 0;
}

int bind(SOCKET s, const sockaddr* name, int namelen) {
  int result = 0;
  if (fault::check(fault::Call::bind, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  ::sockaddr_in address;
  if (!detail::toLinux(name, namelen, address)) return fail(WSAEFAULT);
  detail::SocketGuard hold(*socket);
  if (::bind(socket->fd, reinterpret_cast<const ::sockaddr*>(&address), sizeof address) != 0)
    return failFromErrno(errno);
  return 0;
}

int listen(SOCKET s, int backlog) {
  int result = 0;
  if (fault::check(fault::Call::listen, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  detail::SocketGuard hold(*socket);
  if (socket->type != wsa::sockStream) return fail(WSAEOPNOTSUPP);
  if (::listen(socket->fd, backlog) != 0) return failFromErrno(errno);
  socket->phase = detail::Phase::Listening;
  socket->acceptEnabled = true;
  detail::refresh(*socket);
  return 0;
}

int getsockname(SOCKET s, sockaddr* name, int* namelen) {
  int result = 0;
  if (fault::check(fault::Call::getsockname, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  ::sockaddr_in address{};
  socklen_t length = sizeof address;
  detail::SocketGuard hold(*socket);
  if (::getsockname(socket->fd, reinterpret_cast<::sockaddr*>(&address), &length) != 0)
    return failFromErrno(errno);
  return detail::fromLinux(address, name, namelen);
}

int getpeername(SOCKET s, sockaddr* name, int* namelen) {
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  ::sockaddr_in address{};
  socklen_t length = sizeof address;
  detail::SocketGuard hold(*socket);
  if (::getpeername(socket->fd, reinterpret_cast<::sockaddr*>(&address), &length) != 0)
    return failFromErrno(errno);
  return detail::fromLinux(address, name, namelen);
}

int setsockopt(SOCKET s, int level, int optname, const char* optval, int optlen) {
  int result = 0;
  if (fault::check(fault::Call::setsockopt, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  if (optval == nullptr || optlen < static_cast<int>(sizeof(int))) return fail(WSAEFAULT);
  int value;
  std::memcpy(&value, optval, sizeof value);
  int linuxLevel;
  int linuxOption;
  if (level == wsa::solSocket) {
    linuxLevel = SOL_SOCKET;
    if (optname == wsa::soReuseAddr) {
      linuxOption = SO_REUSEADDR;
    } else if (optname == wsa::soKeepAlive) {
      linuxOption = SO_KEEPALIVE;
    } else if (optname == wsa::soSndBuf) {
      linuxOption = SO_SNDBUF;
    } else if (optname == wsa::soRcvBuf) {
      linuxOption = SO_RCVBUF;
    } else {
      return fail(WSAENOPROTOOPT);
    }
  } else if (level == wsa::ipprotoTcp && optname == wsa::tcpNoDelay) {
    linuxLevel = IPPROTO_TCP;
    linuxOption = TCP_NODELAY;
  } else {
    return fail(WSAENOPROTOOPT);
  }
  detail::SocketGuard hold(*socket);
  if (::setsockopt(socket->fd, linuxLevel, linuxOption, &value, sizeof value) != 0)
    return failFromErrno(errno);
  if (level == wsa::solSocket && optname == wsa::soSndBuf) socket->sendBuffer = value;
  if (level == wsa::solSocket && optname == wsa::soRcvBuf) socket->receiveBuffer = value;
  return 0;
}

int getsockopt(SOCKET s, int level, int optname, char* optval, int* optlen) {
  int result = 0;
  if (fault::check(fault::Call::getsockopt, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  if (optval == nullptr || optlen == nullptr || *optlen < static_cast<int>(sizeof(int))) return fail(WSAEFAULT);
  if (level != wsa::solSocket) return fail(WSAENOPROTOOPT);
  detail::SocketGuard hold(*socket);
  int value;
  if (optname == wsa::soSndBuf) {
    // Linux reports twice what was set (its bookkeeping overhead); Winsock
    // reports the value itself.
    value = socket->sendBuffer >= 0 ? socket->sendBuffer : detail::kernelInt(socket->fd, SOL_SOCKET, SO_SNDBUF) / 2;
  } else if (optname == wsa::soRcvBuf) {
    value = socket->receiveBuffer >= 0 ? socket->receiveBuffer
                                       : detail::kernelInt(socket->fd, SOL_SOCKET, SO_RCVBUF) / 2;
  } else if (optname == wsa::soMaxMsgSize) {
    if (socket->type != wsa::sockDgram) return fail(WSAENOPROTOOPT);
    value = detail::kLargestDatagram;
  } else if (optname == wsa::soReuseAddr) {
    value = detail::kernelInt(socket->fd, SOL_SOCKET, SO_REUSEADDR);
  } else if (optname == wsa::soKeepAlive) {
    value = detail::kernelInt(socket->fd, SOL_SOCKET, SO_KEEPALIVE);
  } else if (optname == wsa::soError) {
    int err = detail::kernelInt(socket->fd, SOL_SOCKET, SO_ERROR);
    value = err > 0 ? detail::wsaErrorFromErrno(err) : 0;
  } else if (optname == wsa::soType) {
    value = socket->type;
  } else {
    return fail(WSAENOPROTOOPT);
  }
  std::memcpy(optval, &value, sizeof value);
  *optlen = sizeof value;
  return 0;
}

int WSAConnect(SOCKET s, const sockaddr* name, int namelen, WSABUF*, WSABUF*, QOS*, QOS*) {
  int result = 0;
  if (fault::check(fault::Call::WSAConnect, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  ::sockaddr_in address;
  if (!detail::toLinux(name, namelen, address)) return fail(WSAEFAULT);
  detail::SocketGuard hold(*socket);
  int rc = ::connect(socket->fd, reinterpret_cast<const ::sockaddr*>(&address), sizeof address);
  int err = rc == 0 ? 0 : errno;
  if (socket->type == wsa::sockDgram) {
    if (rc != 0) return failFromErrno(err);
    socket->phase = detail::Phase::Connected;
    return 0;
  }
  if (socket->phase != detail::Phase::Fresh) return fail(socket->phase == detail::Phase::Connecting ? WSAEALREADY : WSAEISCONN);
  if (rc == 0 || err == EINPROGRESS) {
    // Even a connect that finished at once is reported through FD_CONNECT,
    // as Winsock does for non-blocking sockets.
    socket->phase = detail::Phase::Connecting;
    detail::refresh(*socket);
    return fail(WSAEWOULDBLOCK);
  }
  if (err == ECONNREFUSED || err == ENETUNREACH || err == EHOSTUNREACH || err == ETIMEDOUT) {
    socket->phase = detail::Phase::Failed;
    if (socket->selected & FD_CONNECT) {
      socket->recorded |= FD_CONNECT;
      socket->errors[FD_CONNECT_BIT] = detail::wsaErrorFromErrno(err);
      if (socket->event) {
        std::lock_guard<std::mutex> events(detail::eventLock());
        detail::signalLocked(*socket->event);
      }
    }
    return fail(WSAEWOULDBLOCK);
  }
  return failFromErrno(err);
}

SOCKET WSAAccept(SOCKET s, sockaddr* addr, int* addrlen, LPCONDITIONPROC lpfnCondition,
                 std::uintptr_t dwCallbackData) {
  std::shared_ptr<detail::SocketState> listener = detail::findSocket(s);
  if (!listener) {
    fail(WSAENOTSOCK);
    return INVALID_SOCKET;
  }
  int result = 0;
  bool faulted = fault::check(fault::Call::WSAAccept, result);
  detail::SocketGuard hold(*listener);
  // Any accept call re-enables FD_ACCEPT; a connection still waiting records
  // it again at the next look.
  listener->acceptEnabled = true;
  if (faulted) {
    fail(result);
    return INVALID_SOCKET;
  }
  ::sockaddr_in peer{};
  socklen_t length = sizeof peer;
  int fd = sys::accept4(listener->fd, reinterpret_cast<::sockaddr*>(&peer), &length, SOCK_NONBLOCK | SOCK_CLOEXEC);
  if (fd < 0) {
    failFromErrno(errno);
    return INVALID_SOCKET;
  }
  if (lpfnCondition != nullptr) {
    WSABUF caller{sizeof(platform::sockaddr_in), reinterpret_cast<char*>(&peer)};
    UINT group = 0;
    if (lpfnCondition(&caller, nullptr, nullptr, nullptr, nullptr, nullptr, &group, dwCallbackData) != CF_ACCEPT) {
      ::close(fd);
      fail(WSAECONNREFUSED);
      return INVALID_SOCKET;
    }
  }
  if (addr != nullptr && addrlen != nullptr) detail::fromLinux(peer, addr, addrlen);
  auto state = std::make_shared<detail::SocketState>();
  state->fd = fd;
  state->type = wsa::sockStream;
  state->phase = detail::Phase::Connected;
  state->writeEnabled = true;
  return detail::socketTable().insert(std::move(state));
}

int WSASendDisconnect(SOCKET s, WSABUF*) {
  int result = 0;
  if (fault::check(fault::Call::WSASendDisconnect, result)) return fail(result);
  std::shared_ptr<detail::SocketState> socket = detail::findSocket(s);
  if (!socket) return fail(WSAENOTSOCK);
  detail::SocketGuard hold(*socket);
  if (socket->type != wsa::sockStream || socket->phase != detail::Phase::Connected) return fail(WSAENOTCONN);
  socket->shutWrite = true;
  // Sends already accepted go out before the FIN: if some are still queued,
  // the shutdown happens when the last of them has gone to the kernel.
  if (!socket->sends.empty()) detail::progressSends(*socket);
  if (!socket->sends.empty()) {
    socket->shutdownPending = true;
    return 0;
  }
  if (::shutdown(socket->fd, SHUT_WR) != 0) return failFromErrno(errno);
  return 0;
}

}  // namespace platform
