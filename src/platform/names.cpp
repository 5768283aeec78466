// Host names and addresses: gethostname (with the process's chosen host),
// the blocking lookups with per-thread records, and the dotted-text helpers.
#include "internal.h"  // first: see the note there

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace platform {
namespace {

std::mutex g_hostLock;
std::string* g_localHost = new std::string;  // never destroyed: resolvers may outlive main

struct HostRecord {
  hostent entry;
  char name[NI_MAXHOST];
  char* aliases[1];
  char* addressList[17];
  std::uint32_t addresses[16];

  // The entry, pointing into this record, once name and addresses are in.
  hostent* finish() {
    entry.h_name = name;
    entry.h_aliases = aliases;
    entry.h_addrtype = wsa::afInet;
    entry.h_length = 4;
    entry.h_addr_list = addressList;
    return &entry;
  }
};

HostRecord& threadRecord() {
  thread_local HostRecord record;
  return record;
}

}  // namespace

void setLocalHost(const char* nameOrAddress) {
  std::lock_guard<std::mutex> hold(g_hostLock);
  g_localHost->assign(nameOrAddress != nullptr ? nameOrAddress : "");
}

int gethostname(char* name, int namelen) {
  if (name == nullptr || namelen <= 0) return detail::fail(WSAEFAULT);
  {
    std::lock_guard<std::mutex> hold(g_hostLock);
    if (!g_localHost->empty()) {
      if (static_cast<int>(g_localHost->size()) >= namelen) return detail::fail(WSAEFAULT);
      std::memcpy(name, g_localHost->c_str(), g_localHost->size() + 1);
      return 0;
    }
  }
  if (::gethostname(name, static_cast<std::size_t>(namelen)) != 0) return detail::failFromErrno(errno);
  name[namelen - 1] = '\0';
  return 0;
}

std::uint32_t inet_addr(const char* cp) {
  if (cp == nullptr) return INADDR_NONE;
  return ::inet_addr(cp);
}

char* inet_ntoa(in_addr in) {
  thread_local char text[INET_ADDRSTRLEN];
  ::in_addr address{};
  address.s_addr = in.s_addr;
  ::inet_ntop(AF_INET, &address, text, sizeof text);
  return text;
}

hostent* gethostbyname(const char* name) {
  int result = 0;
  if (fault::check(fault::Call::gethostbyname, result)) {
    detail::fail(result);
    return nullptr;
  }
  if (name == nullptr) {
    detail::fail(WSAEFAULT);
    return nullptr;
  }
  addrinfo hints{};
  hints.ai_family = AF_INET;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* list = nullptr;
  int rc = ::getaddrinfo(name, nullptr, &hints, &list);
  if (rc != 0 || list == nullptr) {
    detail::fail(rc == EAI_AGAIN ? WSATRY_AGAIN : WSAHOST_NOT_FOUND);
    return nullptr;
  }
  HostRecord& record = threadRecord();
  std::memset(&record, 0, sizeof record);
  std::strncpy(record.name, list->ai_canonname != nullptr ? list->ai_canonname : name,
               sizeof record.name - 1);
  int count = 0;
  for (addrinfo* a = list; a != nullptr && count < 16; a = a->ai_next) {
    if (a->ai_family != AF_INET) continue;
    record.addresses[count] = reinterpret_cast<const ::sockaddr_in*>(a->ai_addr)->sin_addr.s_addr;
    record.addressList[count] = reinterpret_cast<char*>(&record.addresses[count]);
    ++count;
  }
  ::freeaddrinfo(list);
  return record.finish();
}

hostent* gethostbyaddr(const char* addr, int len, int type) {
  int result = 0;
  if (fault::check(fault::Call::gethostbyaddr, result)) {
    detail::fail(result);
    return nullptr;
  }
  if (addr == nullptr || len != 4 || type != wsa::afInet) {
    detail::fail(WSAEAFNOSUPPORT);
    return nullptr;
  }
  ::sockaddr_in address{};
  address.sin_family = AF_INET;
  std::memcpy(&address.sin_addr.s_addr, addr, 4);
  HostRecord& record = threadRecord();
  std::memset(&record, 0, sizeof record);
  int rc = ::getnameinfo(reinterpret_cast<const ::sockaddr*>(&address), sizeof address, record.name,
                         sizeof record.name, nullptr, 0, NI_NAMEREQD);
  if (rc != 0) {
    detail::fail(rc == EAI_AGAIN ? WSATRY_AGAIN : WSAHOST_NOT_FOUND);
    return nullptr;
  }
  record.addresses[0] = address.sin_addr.s_addr;
  record.addressList[0] = reinterpret_cast<char*>(&record.addresses[0]);
  return record.finish();
}

}  // namespace platform
