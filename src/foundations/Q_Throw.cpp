#include "Q_Throw.h"

#include <mutex>

namespace {

// One lock for all classes: throws are rare and the copy is short. std::mutex
// has a constant initialiser, so a throw during static initialisation of
// another file still finds it ready.
std::mutex g_assignLock;

template <class C>
[[noreturn]] void throwInstance(const C& local) {
  // A function-local static: made by the first throw of C (the compiler
  // guards that against a second thread), destroyed when the process exits.
  static C instance;
  {
    std::lock_guard<std::mutex> hold(g_assignLock);
    instance = local;
  }
  throw &instance;
}

}  // namespace

template <class C>
  requires Q_FixedTextException<C>
void Q_Throw() {
  C local;
  throwInstance(local);
}

template void Q_Throw<Q_MemoryException_Allocation>();
template void Q_Throw<N_NetException_Unavailable>();
template void Q_Throw<N_NetException_NotSupported>();
template void Q_Throw<N_NetException_ProcessLimit>();
template void Q_Throw<N_NetException_VersionFailure>();
template void Q_Throw<N_NetException_NoTCP>();
template void Q_Throw<N_NetException_NoUDP>();
template void Q_Throw<N_NetException_IPNotResolved>();
template void Q_Throw<N_NetException_LocalAddressAlreadyInUse>();

void Q_ThrowPacketTooBig(int size, int limit) {
  N_NetException_PacketTooBig local;
  local.setError("Packet %i bytes exceeds %i byte limit when not using distributed packet mechanism", size, limit);
  throwInstance(local);
}

void Q_ThrowPacketsStackingUp() {
  N_NetException_PacketsStackingUp local;
  local.setError("Packets are stacking up. Already %2.2f seconds of data waiting in queue", 4.0);
  throwInstance(local);
}

void Q_ThrowAllocation() { Q_Throw<Q_MemoryException_Allocation>(); }
