// Data types of the platform layer that public class layouts name.
//
// The library was designed against Winsock 2 and Win32. On Linux the layer in
// src/platform stands in for those calls; this header carries only the plain
// data types (handles, addresses, buffers) so that public headers can hold
// them by value. No Linux header is included here and no function of the
// layer is declared here, except setLocalHost, which applications call.
#pragma once

#include <cstddef>
#include <cstdint>

#include "vardel_export.h"

/// The Winsock 2 and Win32 stand-ins on Linux. Applications use
/// setLocalHost() and meet the data types in the public classes' records.
namespace platform {

using BYTE = std::uint8_t;    ///< Windows' 8-bit unsigned integer.
using WORD = std::uint16_t;   ///< Windows' 16-bit unsigned integer.
using DWORD = std::uint32_t;  ///< Windows' 32-bit unsigned integer.
using BOOL = int;             ///< Windows' truth value: FALSE or TRUE.
using UINT = unsigned int;    ///< Windows' unsigned int.
/// The BOOL that CException::GetErrorMessage gives for "no text".
constexpr BOOL FALSE = 0;
/// The BOOL that CException::GetErrorMessage gives for "a text".
constexpr BOOL TRUE = 1;

// Handles are opaque values that name entries of the layer's handle tables.
// They are never dereferenced, and a stale handle is detected, not followed.
using HANDLE = void*;           ///< An opaque handle of the layer's tables.
using WSAEVENT = HANDLE;        ///< A handle of an event object.
using SOCKET = std::uintptr_t;  ///< An opaque socket handle.

/// A SOCKET that names nothing, as in an N_Socket::ConnectData whose accept
/// failed.
constexpr SOCKET INVALID_SOCKET = ~SOCKET(0);
/// What a failed socket call gives.
constexpr int SOCKET_ERROR = -1;

/// An IPv4 address.
struct in_addr {
  std::uint32_t s_addr;  ///< Network byte order, as N_Address::getIdentifier().
};

/// Same layout as Winsock's and Linux's sockaddr_in: 16 bytes.
struct sockaddr_in {
  std::uint16_t sin_family;  ///< AF_INET (2).
  std::uint16_t sin_port;    ///< Network byte order.
  in_addr sin_addr;          ///< The IPv4 address.
  char sin_zero[8];          ///< Zeros.
};

/// The generic socket address that sockaddr_in is passed as.
struct sockaddr {
  std::uint16_t sa_family;  ///< AF_INET (2) for a sockaddr_in.
  char sa_data[14];         ///< The rest of the address.
};

/// One buffer of a scattered send or receive.
struct WSABUF {
  std::uint32_t len;  ///< Bytes in the buffer.
  char* buf;          ///< Its first byte.
};

/// The record of an overlapped (background) send or receive.
struct WSAOVERLAPPED {
  std::uintptr_t Internal;      ///< The layer's own.
  std::uintptr_t InternalHigh;  ///< The layer's own.
  DWORD Offset;                 ///< Unused on sockets.
  DWORD OffsetHigh;             ///< Unused on sockets.
  /// With a completion routine the caller owns hEvent; this library keeps a
  /// pointer to its own record here.
  void* hEvent;
};
/// Win32's name for WSAOVERLAPPED.
using OVERLAPPED = WSAOVERLAPPED;

/// @cond VARDEL_INTERNAL
// The records below serve the runtime's start and the network thread only; no
// public member shows them, so the API reference leaves them out.

using LPWSAOVERLAPPED_COMPLETION_ROUTINE = void (*)(DWORD dwError, DWORD cbTransferred,
                                                    WSAOVERLAPPED* lpOverlapped, DWORD dwFlags);

constexpr int FD_MAX_EVENTS = 10;
struct WSANETWORKEVENTS {
  long lNetworkEvents;
  int iErrorCode[FD_MAX_EVENTS];
};

constexpr int WSADESCRIPTION_LEN = 256;
constexpr int WSASYS_STATUS_LEN = 128;
struct WSADATA {
  WORD wVersion;
  WORD wHighVersion;
  char szDescription[WSADESCRIPTION_LEN + 1];
  char szSystemStatus[WSASYS_STATUS_LEN + 1];
  unsigned short iMaxSockets;
  unsigned short iMaxUdpDg;
  char* lpVendorInfo;
};

constexpr int WSAPROTOCOL_LEN = 255;
struct WSAPROTOCOLCHAIN {
  int ChainLen;
  DWORD ChainEntries[7];
};
struct GUID {
  std::uint32_t Data1;
  std::uint16_t Data2;
  std::uint16_t Data3;
  std::uint8_t Data4[8];
};
struct WSAPROTOCOL_INFOA {
  DWORD dwServiceFlags1;
  DWORD dwServiceFlags2;
  DWORD dwServiceFlags3;
  DWORD dwServiceFlags4;
  DWORD dwProviderFlags;
  GUID ProviderId;
  DWORD dwCatalogEntryId;
  WSAPROTOCOLCHAIN ProtocolChain;
  int iVersion;
  int iAddressFamily;
  int iMaxSockAddr;
  int iMinSockAddr;
  int iSocketType;
  int iProtocol;
  int iProtocolMaxOffset;
  int iNetworkByteOrder;
  int iSecurityScheme;
  DWORD dwMessageSize;
  DWORD dwProviderReserved;
  char szProtocol[WSAPROTOCOL_LEN + 1];
};

struct QOS;  // quality of service records are never filled in by this layer
using _QualityOfService = QOS;

// A thread started by AfxBeginThread. Opaque: nothing reads it, and it frees
// itself when its thread ends.
class CWinThread;
/// @endcond

/// Chooses the host name or dotted address that this process reports as its
/// own (gethostname), before its runtime starts. One machine can then play
/// several hosts, each process on its own loopback address such as 127.0.0.2.
/// Null or an empty string goes back to the machine's own host name.
///
/// The local address (N_Address::getLocalAddress) is fixed when the first
/// N_Initializer starts the runtime: call this before. It matters on one
/// machine only: a server tells its clients apart by IPv4 address, and both
/// ends of a connection bind UDP port P + 1 of their own host, so a server and
/// each client need an address of their own. Any thread; the value is
/// process-wide.
VARDEL_API void setLocalHost(const char* nameOrAddress);

}  // namespace platform
