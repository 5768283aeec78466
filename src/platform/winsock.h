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

// Error codes, Winsock's values.
constexpr int WSA_INVALID_HANDLE = 6;
constexpr int WSA_NOT_ENOUGH_MEMORY = 8;
constexpr int WSA_INVALID_PARAMETER = 87;
constexpr int WSA_OPERATION_ABORTED = 995;
constexpr int WSA_IO_INCOMPLETE = 996;
constexpr int WSA_IO_PENDING = 997;
constexpr int WSAEINTR = 10004;
constexpr int WSAEBADF = 10009;
constexpr int WSAEACCES = 10013;
constexpr int WSAEFAULT = 10014;
constexpr int WSAEINVAL = 10022;
constexpr int WSAEMFILE = 10024;
constexpr int WSAEWOULDBLOCK = 10035;
constexpr int WSAEINPROGRESS = 10036;
constexpr int WSAEALREADY = 10037;
constexpr int WSAENOTSOCK = 10038;
constexpr int WSAEDESTADDRREQ = 10039;
constexpr int WSAEMSGSIZE = 10040;
constexpr int WSAEPROTOTYPE = 10041;
constexpr int WSAENOPROTOOPT = 10042;
constexpr int WSAEPROTONOSUPPORT = 10043;
constexpr int WSAESOCKTNOSUPPORT = 10044;
constexpr int WSAEOPNOTSUPP = 10045;
constexpr int WSAEPFNOSUPPORT = 10046;
constexpr int WSAEAFNOSUPPORT = 10047;
constexpr int WSAEADDRINUSE = 10048;
constexpr int WSAEADDRNOTAVAIL = 10049;
constexpr int WSAENETDOWN = 10050;
constexpr int WSAENETUNREACH = 10051;
constexpr int WSAENETRESET = 10052;
constexpr int WSAECONNABORTED = 10053;
constexpr int WSAECONNRESET = 10054;
constexpr int WSAENOBUFS = 10055;
constexpr int WSAEISCONN = 10056;
constexpr int WSAENOTCONN = 10057;
constexpr int WSAESHUTDOWN = 10058;
constexpr int WSAETIMEDOUT = 10060;
constexpr int WSAECONNREFUSED = 10061;
constexpr int WSAEHOSTDOWN = 10064;
constexpr int WSAEHOSTUNREACH = 10065;
constexpr int WSAEPROCLIM = 10067;
constexpr int WSASYSNOTREADY = 10091;
constexpr int WSAVERNOTSUPPORTED = 10092;
constexpr int WSANOTINITIALISED = 10093;
constexpr int WSAEDISCON = 10101;
constexpr int WSAEINVALIDPROCTABLE = 10104;
constexpr int WSAEINVALIDPROVIDER = 10105;
constexpr int WSAEPROVIDERFAILEDINIT = 10106;
constexpr int WSASYSCALLFAILURE = 10107;
constexpr int WSAHOST_NOT_FOUND = 11001;
constexpr int WSATRY_AGAIN = 11002;
constexpr int WSANO_RECOVERY = 11003;
constexpr int WSANO_DATA = 11004;

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
