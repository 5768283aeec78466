// The Winsock 2 surface that the library is written against, emulated on
// Linux sockets. Upper layers include this header (and win32.h) and nothing
// from Linux. Names, constants and return conventions are Winsock's.
//
// What is reproduced, and what deliberately is not:
//  - Sockets are non-blocking. WSAConnect on TCP answers WSAEWOULDBLOCK and
//    ends in FD_CONNECT; a connect refused at once is reported the same way.
//  - WSAEventSelect records FD_CONNECT once with its error, FD_READ when data
//    waits and again only after a read was posted (WSARecv), FD_WRITE after a
//    connect or accept and again after a send was refused with WSAEWOULDBLOCK,
//    FD_ACCEPT once per waiting connection (again after WSAAccept), FD_CLOSE
//    once when the peer closed or reset. Network events are noticed by the
//    waits and by WSAEnumNetworkEvents; there is no hidden thread.
//  - Overlapped WSASend/WSARecv take a completion routine. The routine runs
//    exactly once for every call that returned 0 or WSA_IO_PENDING, on the
//    thread that issued the call, inside one of its alertable waits, in the
//    order of completion (for one socket: the order of posting).
//  - WSASend does not write at once: like Winsock's own buffering it takes the
//    buffer (which must stay valid until the completion) and answers 0 while
//    the socket holds less than 64 MiB not yet taken by the kernel, otherwise
//    WSA_IO_PENDING. The bytes go to the kernel at the issuing thread's next
//    alertable wait, in one gathered write per socket. A thread that issues
//    sends must therefore wait alertably, as the network thread does.
//    WSASendFor with WSAFlushSends (below) writes on the calling thread.
//  - WSARecv reads at once when data waits (answer 0), else it stays pending.
//    A zero-byte completion on a stream is the peer's orderly close.
//  - closesocket hands sends already accepted to the kernel if it can without
//    blocking, and ends every other outstanding operation through its
//    completion with WSA_OPERATION_ABORTED.
//  - ICMP errors on datagram sockets (port unreachable) are swallowed: Linux
//    reports them on the next call, Winsock optionally; nothing here needs
//    them.
//  - Socket options read back what was set (Linux reports SO_SNDBUF doubled).
//    SO_MAX_MSG_SIZE answers 65507 on datagram sockets, the largest UDP/IPv4
//    payload.
#pragma once

#include "vardel_platform.h"

namespace platform {

// Error codes: Winsock's name and value, and whether the library's error
// names know it (a row of 0 has a constant but no name).
#define PLATFORM_WSA_ERRORS(X) \
  X(WSA_INVALID_HANDLE, 6, 1) \
  X(WSA_NOT_ENOUGH_MEMORY, 8, 1) \
  X(WSA_INVALID_PARAMETER, 87, 1) \
  X(WSA_OPERATION_ABORTED, 995, 1) \
  X(WSA_IO_INCOMPLETE, 996, 1) \
  X(WSA_IO_PENDING, 997, 1) \
  X(WSAEINTR, 10004, 1) \
  X(WSAEBADF, 10009, 0) \
  X(WSAEACCES, 10013, 1) \
  X(WSAEFAULT, 10014, 1) \
  X(WSAEINVAL, 10022, 1) \
  X(WSAEMFILE, 10024, 1) \
  X(WSAEWOULDBLOCK, 10035, 1) \
  X(WSAEINPROGRESS, 10036, 1) \
  X(WSAEALREADY, 10037, 1) \
  X(WSAENOTSOCK, 10038, 1) \
  X(WSAEDESTADDRREQ, 10039, 1) \
  X(WSAEMSGSIZE, 10040, 1) \
  X(WSAEPROTOTYPE, 10041, 1) \
  X(WSAENOPROTOOPT, 10042, 1) \
  X(WSAEPROTONOSUPPORT, 10043, 1) \
  X(WSAESOCKTNOSUPPORT, 10044, 1) \
  X(WSAEOPNOTSUPP, 10045, 1) \
  X(WSAEPFNOSUPPORT, 10046, 1) \
  X(WSAEAFNOSUPPORT, 10047, 1) \
  X(WSAEADDRINUSE, 10048, 1) \
  X(WSAEADDRNOTAVAIL, 10049, 1) \
  X(WSAENETDOWN, 10050, 1) \
  X(WSAENETUNREACH, 10051, 1) \
  X(WSAENETRESET, 10052, 1) \
  X(WSAECONNABORTED, 10053, 1) \
  X(WSAECONNRESET, 10054, 1) \
  X(WSAENOBUFS, 10055, 1) \
  X(WSAEISCONN, 10056, 1) \
  X(WSAENOTCONN, 10057, 1) \
  X(WSAESHUTDOWN, 10058, 1) \
  X(WSAETIMEDOUT, 10060, 1) \
  X(WSAECONNREFUSED, 10061, 1) \
  X(WSAEHOSTDOWN, 10064, 1) \
  X(WSAEHOSTUNREACH, 10065, 1) \
  X(WSAEPROCLIM, 10067, 1) \
  X(WSASYSNOTREADY, 10091, 1) \
  X(WSAVERNOTSUPPORTED, 10092, 1) \
  X(WSANOTINITIALISED, 10093, 1) \
  X(WSAEDISCON, 10101, 1) \
  X(WSAEINVALIDPROCTABLE, 10104, 1) \
  X(WSAEINVALIDPROVIDER, 10105, 1) \
  X(WSAEPROVIDERFAILEDINIT, 10106, 1) \
  X(WSASYSCALLFAILURE, 10107, 1) \
  X(WSAHOST_NOT_FOUND, 11001, 1) \
  X(WSATRY_AGAIN, 11002, 1) \
  X(WSANO_RECOVERY, 11003, 1) \
  X(WSANO_DATA, 11004, 1)

#define PLATFORM_WSA_CONSTANT(name, value, named) constexpr int name = value;
PLATFORM_WSA_ERRORS(PLATFORM_WSA_CONSTANT)
#undef PLATFORM_WSA_CONSTANT

// The constant's name of a named error code; nullptr for any other value.
const char* wsaErrorName(int code);

// Address families, socket types, protocols (Winsock's values).
constexpr int AF_UNSPEC = 0;
constexpr int AF_INET = 2;
constexpr int AF_INET6 = 23;
constexpr int SOCK_STREAM = 1;
constexpr int SOCK_DGRAM = 2;
constexpr int IPPROTO_TCP = 6;
constexpr int IPPROTO_UDP = 17;
constexpr int FROM_PROTOCOL_INFO = -1;
constexpr DWORD WSA_FLAG_OVERLAPPED = 0x01;
constexpr std::uint32_t INADDR_ANY = 0;
constexpr std::uint32_t INADDR_NONE = 0xFFFFFFFFu;
constexpr int SOMAXCONN = 0x7FFFFFFF;

// Socket options.
constexpr int SOL_SOCKET = 0xFFFF;
constexpr int SO_REUSEADDR = 0x0004;
constexpr int SO_KEEPALIVE = 0x0008;
constexpr int SO_SNDBUF = 0x1001;
constexpr int SO_RCVBUF = 0x1002;
constexpr int SO_ERROR = 0x1007;
constexpr int SO_TYPE = 0x1008;
constexpr int SO_MAX_MSG_SIZE = 0x2003;

// Service flags of the provider catalogue.
constexpr DWORD XP1_CONNECTIONLESS = 0x00000001;
constexpr DWORD XP1_GUARANTEED_DELIVERY = 0x00000002;
constexpr DWORD XP1_GUARANTEED_ORDER = 0x00000004;
constexpr DWORD XP1_MESSAGE_ORIENTED = 0x00000008;
constexpr DWORD XP1_PSEUDO_STREAM = 0x00000010;
constexpr DWORD XP1_GRACEFUL_CLOSE = 0x00000020;
constexpr DWORD XP1_EXPEDITED_DATA = 0x00000040;
constexpr DWORD XP1_SUPPORT_BROADCAST = 0x00000200;
constexpr DWORD XP1_SUPPORT_MULTIPOINT = 0x00000400;
constexpr DWORD XP1_IFS_HANDLES = 0x00020000;

// Network events.
constexpr int FD_READ_BIT = 0;
constexpr int FD_WRITE_BIT = 1;
constexpr int FD_OOB_BIT = 2;
constexpr int FD_ACCEPT_BIT = 3;
constexpr int FD_CONNECT_BIT = 4;
constexpr int FD_CLOSE_BIT = 5;
constexpr long FD_READ = 1 << FD_READ_BIT;
constexpr long FD_WRITE = 1 << FD_WRITE_BIT;
constexpr long FD_OOB = 1 << FD_OOB_BIT;
constexpr long FD_ACCEPT = 1 << FD_ACCEPT_BIT;
constexpr long FD_CONNECT = 1 << FD_CONNECT_BIT;
constexpr long FD_CLOSE = 1 << FD_CLOSE_BIT;

// Waits.
constexpr DWORD WSA_MAXIMUM_WAIT_EVENTS = 64;
constexpr DWORD LARGEST_WAIT_EVENTS = 65536;  // of waitForAnyEvent
constexpr DWORD WSA_INFINITE = 0xFFFFFFFFu;
constexpr DWORD WSA_WAIT_EVENT_0 = 0;
constexpr DWORD WSA_WAIT_IO_COMPLETION = 192;
constexpr DWORD WSA_WAIT_TIMEOUT = 258;
constexpr DWORD WSA_WAIT_FAILED = 0xFFFFFFFFu;
constexpr WSAEVENT WSA_INVALID_EVENT = nullptr;

constexpr int CF_ACCEPT = 0;
constexpr int CF_REJECT = 1;

using LPCONDITIONPROC = int (*)(WSABUF*, WSABUF*, QOS*, QOS*, WSABUF*, WSABUF*, UINT*,
                                std::uintptr_t);

struct hostent {
  char* h_name;
  char** h_aliases;
  short h_addrtype;
  short h_length;
  char** h_addr_list;
};

// Start and catalogue.
int WSAStartup(WORD wVersionRequested, WSADATA* lpWSAData);
int WSACleanup();
int WSAEnumProtocolsA(int* lpiProtocols, WSAPROTOCOL_INFOA* lpProtocolBuffer,
                      DWORD* lpdwBufferLength);
int WSAGetLastError();
void WSASetLastError(int iError);

// Events.
WSAEVENT WSACreateEvent();
BOOL WSACloseEvent(WSAEVENT hEvent);
BOOL WSASetEvent(WSAEVENT hEvent);
BOOL WSAResetEvent(WSAEVENT hEvent);
DWORD WSAWaitForMultipleEvents(DWORD cEvents, const WSAEVENT* lphEvents, BOOL fWaitAll,
                               DWORD dwTimeout, BOOL fAlertable);
// Not Winsock's: WSAWaitForMultipleEvents without its limit of 64 events (up
// to LARGEST_WAIT_EVENTS), for any one of them. A signalled event gives
// WSA_WAIT_EVENT_0 with the lowest signalled index in *lpdwIndex, since an
// index of 192 or 258 could not be told from WSA_WAIT_IO_COMPLETION or
// WSA_WAIT_TIMEOUT; the other results are those of WSAWaitForMultipleEvents.
// A wait over the same events as the thread's last one costs nothing in
// their number.
DWORD waitForAnyEvent(DWORD cEvents, const WSAEVENT* lphEvents, DWORD dwTimeout, BOOL fAlertable,
                      DWORD* lpdwIndex);

// Sockets.
SOCKET WSASocketA(int af, int type, int protocol, const WSAPROTOCOL_INFOA* lpProtocolInfo,
                  unsigned g, DWORD dwFlags);
int closesocket(SOCKET s);
int bind(SOCKET s, const sockaddr* name, int namelen);
int listen(SOCKET s, int backlog);
int getsockname(SOCKET s, sockaddr* name, int* namelen);
int getpeername(SOCKET s, sockaddr* name, int* namelen);
int setsockopt(SOCKET s, int level, int optname, const char* optval, int optlen);
int getsockopt(SOCKET s, int level, int optname, char* optval, int* optlen);
int WSAConnect(SOCKET s, const sockaddr* name, int namelen, WSABUF* lpCallerData,
               WSABUF* lpCalleeData, QOS* lpSQOS, QOS* lpGQOS);
SOCKET WSAAccept(SOCKET s, sockaddr* addr, int* addrlen, LPCONDITIONPROC lpfnCondition,
                 std::uintptr_t dwCallbackData);
int WSASendDisconnect(SOCKET s, WSABUF* lpOutboundDisconnectData);
int WSAEventSelect(SOCKET s, WSAEVENT hEventObject, long lNetworkEvents);
int WSAEnumNetworkEvents(SOCKET s, WSAEVENT hEventObject, WSANETWORKEVENTS* lpNetworkEvents);
int WSASend(SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesSent,
            DWORD dwFlags, WSAOVERLAPPED* lpOverlapped,
            LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine);
// Not Winsock: sends for another thread. WSAGetCompletionQueue names the
// calling thread's queue of completions (null when memory runs out), until
// WSACloseCompletionQueue. WSASendFor is WSASend whose completion routine
// runs in an alertable wait of that queue's thread instead of the caller's,
// and whose bytes wait for WSAFlushSends: it writes, on the calling thread,
// what the kernel takes of the socket's sends at once, and hands the rest to
// the thread of the first one's completion, whose alertable waits carry on
// with it.
void* WSAGetCompletionQueue();
void WSACloseCompletionQueue(void* queue);
int WSASendFor(void* queue, SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesSent,
               DWORD dwFlags, WSAOVERLAPPED* lpOverlapped, LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine);
void WSAFlushSends(SOCKET s);
int WSARecv(SOCKET s, WSABUF* lpBuffers, DWORD dwBufferCount, DWORD* lpNumberOfBytesRecvd,
            DWORD* lpFlags, WSAOVERLAPPED* lpOverlapped,
            LPWSAOVERLAPPED_COMPLETION_ROUTINE lpCompletionRoutine);

// Byte order and names.
std::uint16_t htons(std::uint16_t v);
std::uint16_t ntohs(std::uint16_t v);
std::uint32_t htonl(std::uint32_t v);
std::uint32_t ntohl(std::uint32_t v);
std::uint32_t inet_addr(const char* cp);
// Dotted text in a per-thread buffer, valid until this thread's next call.
char* inet_ntoa(in_addr in);
int gethostname(char* name, int namelen);
// Blocking lookups. The record is per-thread storage, valid for this thread
// until its next gethostbyname or gethostbyaddr.
hostent* gethostbyname(const char* name);
hostent* gethostbyaddr(const char* addr, int len, int type);

}  // namespace platform
