// The names of the Winsock codes, one table from errno to them, and the
// per-thread last error.
#include "internal.h"  // first: see the note there

#include <cerrno>

namespace platform {
namespace {
thread_local int t_lastError = 0;
}  // namespace

// x86-64 is little-endian; network order is big-endian.
std::uint16_t htons(std::uint16_t v) { return __builtin_bswap16(v); }
std::uint16_t ntohs(std::uint16_t v) { return __builtin_bswap16(v); }
std::uint32_t htonl(std::uint32_t v) { return __builtin_bswap32(v); }
std::uint32_t ntohl(std::uint32_t v) { return __builtin_bswap32(v); }

int WSAGetLastError() { return t_lastError; }
void WSASetLastError(int iError) { t_lastError = iError; }

const char* wsaErrorName(int code) {
  switch (code) {
#define PLATFORM_WSA_NAME(name, value, named) \
  case value:                                 \
    return named ? #name : nullptr;
    PLATFORM_WSA_ERRORS(PLATFORM_WSA_NAME)
#undef PLATFORM_WSA_NAME
    default:
      return nullptr;
  }
}

namespace detail {

#define PLATFORM_ERRNO_MAP(X)          \
  X(EAGAIN, WSAEWOULDBLOCK)            \
  X(EINPROGRESS, WSAEWOULDBLOCK)       \
  X(EINTR, WSAEINTR)                   \
  X(EBADF, WSAENOTSOCK)                \
  X(EACCES, WSAEACCES)                 \
  X(EPERM, WSAEACCES)                  \
  X(EFAULT, WSAEFAULT)                 \
  X(EINVAL, WSAEINVAL)                 \
  X(EMFILE, WSAEMFILE)                 \
  X(ENFILE, WSAEMFILE)                 \
  X(EALREADY, WSAEALREADY)             \
  X(ENOTSOCK, WSAENOTSOCK)             \
  X(EDESTADDRREQ, WSAEDESTADDRREQ)     \
  X(EMSGSIZE, WSAEMSGSIZE)             \
  X(EPROTOTYPE, WSAEPROTOTYPE)         \
  X(ENOPROTOOPT, WSAENOPROTOOPT)       \
  X(EPROTONOSUPPORT, WSAEPROTONOSUPPORT) \
  X(ESOCKTNOSUPPORT, WSAESOCKTNOSUPPORT) \
  X(EOPNOTSUPP, WSAEOPNOTSUPP)         \
  X(EPFNOSUPPORT, WSAEPFNOSUPPORT)     \
  X(EAFNOSUPPORT, WSAEAFNOSUPPORT)     \
  X(EADDRINUSE, WSAEADDRINUSE)         \
  X(EADDRNOTAVAIL, WSAEADDRNOTAVAIL)   \
  X(ENETDOWN, WSAENETDOWN)             \
  X(ENETUNREACH, WSAENETUNREACH)       \
  X(ENETRESET, WSAENETRESET)           \
  X(ECONNABORTED, WSAECONNABORTED)     \
  X(ECONNRESET, WSAECONNRESET)         \
  X(EPIPE, WSAECONNRESET)              \
  X(ENOBUFS, WSAENOBUFS)               \
  X(ENOMEM, WSAENOBUFS)                \
  X(ENOSPC, WSAENOBUFS)                \
  X(EISCONN, WSAEISCONN)               \
  X(ENOTCONN, WSAENOTCONN)             \
  X(ESHUTDOWN, WSAESHUTDOWN)           \
  X(ETIMEDOUT, WSAETIMEDOUT)           \
  X(ECONNREFUSED, WSAECONNREFUSED)     \
  X(EHOSTDOWN, WSAEHOSTDOWN)           \
  X(EHOSTUNREACH, WSAEHOSTUNREACH)

int wsaErrorFromErrno(int err) {
  switch (err) {
#define PLATFORM_ERRNO_CASE(e, w) \
  case e:                         \
    return w;
    PLATFORM_ERRNO_MAP(PLATFORM_ERRNO_CASE)
#undef PLATFORM_ERRNO_CASE
    default:
      return WSASYSCALLFAILURE;
  }
}

int fail(int wsaError) {
  WSASetLastError(wsaError);
  return SOCKET_ERROR;
}

int failFromErrno(int err) { return fail(wsaErrorFromErrno(err)); }

}  // namespace detail
}  // namespace platform
