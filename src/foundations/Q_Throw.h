// Internal to the library: how its exceptions are raised.
//
// Every throw raises a pointer to one static instance per class. The instance
// is made at the first throw of its class, lives until the process ends, and
// takes the text of each new failure, so throwing never allocates, not even
// when memory has run out. Classes that are never thrown get no instance.
//
// The text is written under a lock, so two threads that throw the same class
// at once are safe from each other. A handler that reads the text while
// another thread throws the same class may see either failure's text.
#pragma once

#include <concepts>

#include "N_Exceptions.h"

// The classes that carry one fixed text; the two others are raised below with
// the values of their failure.
template <class C>
concept Q_FixedTextException =
    std::same_as<C, Q_MemoryException_Allocation> || std::same_as<C, N_NetException_Unavailable> ||
    std::same_as<C, N_NetException_NotSupported> || std::same_as<C, N_NetException_ProcessLimit> ||
    std::same_as<C, N_NetException_VersionFailure> || std::same_as<C, N_NetException_NoTCP> ||
    std::same_as<C, N_NetException_NoUDP> || std::same_as<C, N_NetException_IPNotResolved> ||
    std::same_as<C, N_NetException_LocalAddressAlreadyInUse>;

// Raises C*, with C's fixed text.
template <class C>
  requires Q_FixedTextException<C>
[[noreturn]] void Q_Throw();

// Raises N_NetException_PacketTooBig*: "Packet <size> bytes exceeds <limit>
// byte limit when not using distributed packet mechanism".
[[noreturn]] void Q_ThrowPacketTooBig(int size, int limit);

// Raises N_NetException_PacketsStackingUp*. The text always reads 4.00
// seconds, whatever the queue holds.
[[noreturn]] void Q_ThrowPacketsStackingUp();

// Raises Q_MemoryException_Allocation*, "Out of system memory resources".
[[noreturn]] void Q_ThrowAllocation();
