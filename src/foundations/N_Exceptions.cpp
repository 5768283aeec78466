#include "N_Exceptions.h"

Q_MemoryException::Q_MemoryException() = default;
Q_MemoryException::~Q_MemoryException() = default;

Q_MemoryException_Allocation::Q_MemoryException_Allocation() { setError("%s", "Out of system memory resources"); }
Q_MemoryException_Allocation::~Q_MemoryException_Allocation() = default;

N_NetException::N_NetException() = default;
N_NetException::~N_NetException() = default;

N_NetException_Unavailable::N_NetException_Unavailable() { setError("%s", "WINSOCK: Network subsystem is unavailable"); }
N_NetException_Unavailable::~N_NetException_Unavailable() = default;

N_NetException_NotSupported::N_NetException_NotSupported() { setError("%s", "WINSOCK: DLL version out of range"); }
N_NetException_NotSupported::~N_NetException_NotSupported() = default;

N_NetException_ProcessLimit::N_NetException_ProcessLimit() { setError("%s", "WINSOCK: Too many processes"); }
N_NetException_ProcessLimit::~N_NetException_ProcessLimit() = default;

N_NetException_VersionFailure::N_NetException_VersionFailure() { setError("%s", "Winsock version 2.0 or newer required"); }
N_NetException_VersionFailure::~N_NetException_VersionFailure() = default;

N_NetException_NoTCP::N_NetException_NoTCP() { setError("%s", "TCP protocol not found"); }
N_NetException_NoTCP::~N_NetException_NoTCP() = default;

N_NetException_NoUDP::N_NetException_NoUDP() { setError("%s", "UDP protocol not found"); }
N_NetException_NoUDP::~N_NetException_NoUDP() = default;

N_NetException_IPNotResolved::N_NetException_IPNotResolved() { setError("%s", "IP address is not resolved yet"); }
N_NetException_IPNotResolved::~N_NetException_IPNotResolved() = default;

N_NetException_LocalAddressAlreadyInUse::N_NetException_LocalAddressAlreadyInUse() { setError("%s", "Local address is already bound to other socket"); }
N_NetException_LocalAddressAlreadyInUse::~N_NetException_LocalAddressAlreadyInUse() = default;

N_NetException_PacketTooBig::N_NetException_PacketTooBig() = default;
N_NetException_PacketTooBig::~N_NetException_PacketTooBig() = default;

N_NetException_PacketsStackingUp::N_NetException_PacketsStackingUp() = default;
N_NetException_PacketsStackingUp::~N_NetException_PacketsStackingUp() = default;
