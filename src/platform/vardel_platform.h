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

namespace platform {

using BYTE = std::uint8_t;
using WORD = std::uint16_t;
using DWORD = std::uint32_t;
using BOOL = int;
using UINT = unsigned int;
constexpr BOOL FALSE = 0;
constexpr BOOL TRUE = 1;

// Handles are opaque values that name entries of the layer's handle tables.
// They are never dereferenced, and a stale handle is detected, not followed.
using HANDLE = void*;
using WSAEVENT = HANDLE;
using SOCKET = std::uintptr_t;

constexpr SOCKET INVALID_SOCKET = ~SOCKET(0);
constexpr int SOCKET_ERROR = -1;

struct in_addr {
  std::uint32_t s_addr;  // network byte order
};

// Same layout as Winsock's and Linux's sockaddr_in: 16 bytes.
struct sockaddr_in {
  std::uint16_t sin_family;
  std::uint16_t sin_port;  // network byte order
  in_addr sin_addr;
  char sin_zero[8];
};

struct sockaddr {
  std::uint16_t sa_family;
  char sa_data[14];
};

struct WSABUF {
  std::uint32_t len;
  char* buf;
};

struct WSAOVERLAPPED {
  std::uintptr_t Internal;
  std::uintptr_t InternalHigh;
  DWORD Offset;
  DWORD OffsetHigh;
  // With a completion routine the caller owns hEvent; this library keeps a
  // pointer to its own record here.
  void* hEvent;
};
using OVERLAPPED = WSAOVERLAPPED;

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

// Chooses the host name or dotted address that this process reports as its
// own (gethostname), before its runtime starts. One machine can then play
// several hosts, each process on its own loopback address such as 127.0.0.2.
// Null or an empty string goes back to the machine's own host name.
VARDEL_API void setLocalHost(const char* nameOrAddress);

}  // namespace platform
