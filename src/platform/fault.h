// Fault injection for tests. Every emulated call named below can be made to
// answer a chosen Winsock result, and the library's Nth allocation can be made
// to give nothing. Unused, it costs one relaxed atomic load per call.
//
// A plan fires after `countdown` - 1 calls pass (countdown 1: the next call),
// and with `persist` it keeps firing on every call after that. What "answering
// `result`" means per call:
//  - WSAStartup returns `result` itself (and fills nothing).
//  - Calls that return SOCKET_ERROR / INVALID_SOCKET / null / FALSE return that
//    and set WSAGetLastError to `result`.
//  - WSASend / WSARecv answering WSA_IO_PENDING really go pending: the data is
//    moved later in an alertable wait and the completion comes then.
//  - WSASend answering WSAEWOULDBLOCK arms FD_WRITE as a real refusal would.
//  - WSAWaitForMultipleEvents returns WSA_WAIT_FAILED with `result` as error.
#pragma once

#include <string_view>

#include "vardel_platform.h"

namespace platform::fault {

#define PLATFORM_FAULT_CALLS(X) \
  X(WSAStartup)                 \
  X(WSAEnumProtocolsA)          \
  X(WSASocketA)                 \
  X(bind)                       \
  X(listen)                     \
  X(getsockname)                \
  X(setsockopt)                 \
  X(getsockopt)                 \
  X(WSAConnect)                 \
  X(WSAAccept)                  \
  X(WSASendDisconnect)          \
  X(WSAEventSelect)             \
  X(WSAEnumNetworkEvents)       \
  X(WSASend)                    \
  X(WSARecv)                    \
  X(closesocket)                \
  X(WSACreateEvent)             \
  X(WSAWaitForMultipleEvents)   \
  X(gethostbyname)              \
  X(gethostbyaddr)              \
  X(CreateMutexA)               \
  X(AfxBeginThread)

enum class Call {
#define PLATFORM_FAULT_ENUM(name) name,
  PLATFORM_FAULT_CALLS(PLATFORM_FAULT_ENUM)
#undef PLATFORM_FAULT_ENUM
      Count
};

struct Plan {
  int countdown = 1;
  bool persist = false;
  int result = 0;
};

void arm(Call call, Plan plan);
void disarm(Call call);
void disarmAll();  // also clears the allocation fault and catalogue/version overrides
// How many times the call's plan fired since it was armed.
int fired(Call call);
std::string_view name(Call call);

// The Nth allocation from now gives nothing (1: the next one); with persist,
// every allocation from then on.
void failAllocation(int nth, bool persist = false);
// Allocations that the fault made give nothing, since it was armed.
int allocationsFailed();

// Replaces the provider catalogue that WSAEnumProtocolsA reports, until
// disarmAll. An empty catalogue makes it answer 0 entries.
void setCatalogue(const WSAPROTOCOL_INFOA* entries, int count);
// The version WSAStartup agrees on (default 0x0002, that is 2.0).
void setAgreedVersion(WORD version);

// Used by the layer itself and by the library's allocation helpers.
// True when the armed plan for `call` fires now; `result` receives its value.
bool check(Call call, int& result);
bool allocationShouldFail();

}  // namespace platform::fault
