// WSAStartup, WSACleanup and the provider catalogue.
#include <algorithm>
#include <cstring>

#include "internal.h"

namespace platform {
namespace {

std::atomic<int> g_startups{0};

WSAPROTOCOL_INFOA makeEntry(int family, int type, int protocol, DWORD flags, const char* name,
                            DWORD id) {
  WSAPROTOCOL_INFOA info{};
  info.dwServiceFlags1 = flags;
  info.dwCatalogEntryId = id;
  info.ProtocolChain.ChainLen = 1;
  info.iVersion = 2;
  info.iAddressFamily = family;
  info.iMaxSockAddr = family == AF_INET ? 16 : 28;
  info.iMinSockAddr = 16;
  info.iSocketType = type;
  info.iProtocol = protocol;
  info.iNetworkByteOrder = 0;
  info.dwMessageSize = type == SOCK_DGRAM ? 65507 : 0;
  std::strncpy(info.szProtocol, name, WSAPROTOCOL_LEN);
  return info;
}

// The providers this machine offers, described as Winsock's base providers
// describe themselves.
std::vector<WSAPROTOCOL_INFOA> defaultCatalogue() {
  constexpr DWORD tcp = XP1_GUARANTEED_DELIVERY | XP1_GUARANTEED_ORDER | XP1_GRACEFUL_CLOSE |
                        XP1_EXPEDITED_DATA | XP1_IFS_HANDLES;
  constexpr DWORD udp = XP1_CONNECTIONLESS | XP1_MESSAGE_ORIENTED | XP1_SUPPORT_BROADCAST |
                        XP1_SUPPORT_MULTIPOINT | XP1_IFS_HANDLES;
  return {makeEntry(AF_INET, SOCK_STREAM, IPPROTO_TCP, tcp, "Linux TCP/IP [TCP/IP]", 1001),
          makeEntry(AF_INET, SOCK_DGRAM, IPPROTO_UDP, udp, "Linux TCP/IP [UDP/IP]", 1002),
          makeEntry(AF_INET6, SOCK_STREAM, IPPROTO_TCP, tcp, "Linux TCP/IP [TCP/IPv6]", 1003),
          makeEntry(AF_INET6, SOCK_DGRAM, IPPROTO_UDP, udp, "Linux TCP/IP [UDP/IPv6]", 1004)};
}

}  // namespace

namespace detail {
bool winsockStarted() { return g_startups.load() > 0; }
}  // namespace detail

int WSAStartup(WORD wVersionRequested, WSADATA* lpWSAData) {
  int result = 0;
  if (fault::check(fault::Call::WSAStartup, result)) return result;
  if (lpWSAData == nullptr) return WSAEFAULT;
  if ((wVersionRequested & 0xFF) < 1) return WSAVERNOTSUPPORTED;
  std::memset(lpWSAData, 0, sizeof *lpWSAData);
  lpWSAData->wVersion = fault::agreedVersion();
  lpWSAData->wHighVersion = 0x0202;
  std::strncpy(lpWSAData->szDescription, "vardel sockets on Linux", WSADESCRIPTION_LEN);
  std::strncpy(lpWSAData->szSystemStatus, "Running", WSASYS_STATUS_LEN);
  g_startups.fetch_add(1);
  return 0;
}

// The last WSACleanup of the process closes every socket still open, as
// Winsock does; accepted connections that nobody claimed go with it.
int WSACleanup() {
  int now = g_startups.load();
  do {
    if (now <= 0) return detail::fail(WSANOTINITIALISED);
  } while (!g_startups.compare_exchange_weak(now, now - 1));
  if (now == 1) {
    for (auto& [handle, socket] : detail::socketTable().removeAll()) {
      (void)handle;
      detail::SocketGuard hold(*socket);
      detail::closeLocked(*socket);
    }
  }
  return 0;
}

int WSAEnumProtocolsA(int* lpiProtocols, WSAPROTOCOL_INFOA* lpProtocolBuffer,
                      DWORD* lpdwBufferLength) {
  int result = 0;
  if (fault::check(fault::Call::WSAEnumProtocolsA, result)) return detail::fail(result);
  if (lpdwBufferLength == nullptr) return detail::fail(WSAEFAULT);
  std::vector<WSAPROTOCOL_INFOA> catalogue;
  if (!fault::catalogueOverride(catalogue)) catalogue = defaultCatalogue();
  if (lpiProtocols != nullptr) {
    std::vector<WSAPROTOCOL_INFOA> wanted;
    for (const WSAPROTOCOL_INFOA& info : catalogue) {
      for (int* p = lpiProtocols; *p != 0; ++p) {
        if (*p == info.iProtocol) {
          wanted.push_back(info);
          break;
        }
      }
    }
    catalogue.swap(wanted);
  }
  DWORD needed = static_cast<DWORD>(catalogue.size() * sizeof(WSAPROTOCOL_INFOA));
  if (lpProtocolBuffer == nullptr || *lpdwBufferLength < needed) {
    *lpdwBufferLength = needed;
    if (needed == 0) return 0;
    return detail::fail(WSAENOBUFS);
  }
  std::copy(catalogue.begin(), catalogue.end(), lpProtocolBuffer);
  return static_cast<int>(catalogue.size());
}

}  // namespace platform
