// The socket table. Sockets are named by handles, not descriptors, so that a
// stale handle can't reach a descriptor number that the kernel reused.
#include "internal.h"  // first: see the note there

namespace platform::detail {

HandleTable<SocketState>& socketTable() {
  static auto* table = new HandleTable<SocketState>(HandleKind::Socket);
  return *table;
}

std::shared_ptr<SocketState> findSocket(SOCKET s) { return socketTable().find(s); }

}  // namespace platform::detail
