/// @file
/// The library's exceptions. Each class carries nothing but its text, held by
/// Q_Exception.
///
/// A throw raises a pointer to the one static instance of the thrown class, so
/// catch by pointer and never delete what you caught:
///
/// @code
///   try { ... } catch (N_NetException* e) { puts(e->getErrorMessage()); }
/// @endcode
///
/// Handlers for the class itself, for any base up to Q_Exception*, CException*
/// and CObject*, and void* all match.
///
/// @warning A handler by value or by reference (`catch (Q_Exception&)`) never
/// matches, and `delete e` frees a static object. The caught pointer stays
/// valid for the life of the process, but its text changes at the next throw
/// of that class, from whatever thread: copy the text if it must last.
#pragma once

#include "Q_Exception.h"

/// Failures to get memory. Never thrown itself: catch it to take any of them.
class VARDEL_API Q_MemoryException : public Q_Exception {
 public:
  Q_MemoryException();            ///< Runs only as the base of a thrown class.
  ~Q_MemoryException() override;  ///< Runs only as the base of a thrown class.
};

/// "Out of system memory resources": an allocation of the library failed.
class VARDEL_API Q_MemoryException_Allocation : public Q_MemoryException {
 public:
  Q_MemoryException_Allocation();            ///< The library makes the one instance, at the first throw.
  ~Q_MemoryException_Allocation() override;  ///< At the end of the process; never delete a caught pointer.
};

/// Failures of the network layer. Never thrown itself: catch it to take any of them.
class VARDEL_API N_NetException : public Q_Exception {
 public:
  N_NetException();            ///< Runs only as the base of a thrown class.
  ~N_NetException() override;  ///< Runs only as the base of a thrown class.
};

/// "WINSOCK: Network subsystem is unavailable", from the first N_Initializer.
class VARDEL_API N_NetException_Unavailable : public N_NetException {
 public:
  N_NetException_Unavailable();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_Unavailable() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "WINSOCK: DLL version out of range", from the first N_Initializer.
class VARDEL_API N_NetException_NotSupported : public N_NetException {
 public:
  N_NetException_NotSupported();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_NotSupported() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "WINSOCK: Too many processes", from the first N_Initializer.
class VARDEL_API N_NetException_ProcessLimit : public N_NetException {
 public:
  N_NetException_ProcessLimit();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_ProcessLimit() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "Winsock version 2.0 or newer required", from the first N_Initializer.
class VARDEL_API N_NetException_VersionFailure : public N_NetException {
 public:
  N_NetException_VersionFailure();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_VersionFailure() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "TCP protocol not found", from the first N_Initializer.
class VARDEL_API N_NetException_NoTCP : public N_NetException {
 public:
  N_NetException_NoTCP();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_NoTCP() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "UDP protocol not found", from the first N_Initializer.
class VARDEL_API N_NetException_NoUDP : public N_NetException {
 public:
  N_NetException_NoUDP();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_NoUDP() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "IP address is not resolved yet": a socket or client was made from an
/// N_Address without its number, or the runtime's start couldn't resolve the
/// local host.
class VARDEL_API N_NetException_IPNotResolved : public N_NetException {
 public:
  N_NetException_IPNotResolved();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_IPNotResolved() override;  ///< At the end of the process; never delete a caught pointer.
};

/// "Local address is already bound to other socket", from an outgoing
/// N_Socket (and so from an N_Client) whose local port is taken.
class VARDEL_API N_NetException_LocalAddressAlreadyInUse : public N_NetException {
 public:
  N_NetException_LocalAddressAlreadyInUse();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_LocalAddressAlreadyInUse() override;  ///< At the end of the process; never delete a caught pointer.
};

/// A message too big for one send without the package mechanism
/// (N_Socket::send), or an unreliable payload above
/// N_Client::getLargestUnreliablePacketSize(). Text given at the throw: the
/// message size, then the limit.
class VARDEL_API N_NetException_PacketTooBig : public N_NetException {
 public:
  N_NetException_PacketTooBig();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_PacketTooBig() override;  ///< At the end of the process; never delete a caught pointer.
};

/// A payload queue of N_Client would pass four seconds of data at the
/// bandwidth in force; nothing was queued. Text given at the throw: the
/// seconds of data that fill the queue (always 4.00).
class VARDEL_API N_NetException_PacketsStackingUp : public N_NetException {
 public:
  N_NetException_PacketsStackingUp();            ///< The library makes the one instance, at the first throw.
  ~N_NetException_PacketsStackingUp() override;  ///< At the end of the process; never delete a caught pointer.
};
