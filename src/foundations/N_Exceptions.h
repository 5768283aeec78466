// The library's exceptions. Each class carries nothing but its text, held by
// Q_Exception.
//
// A throw raises a pointer to the one static instance of the thrown class, so
// catch by pointer and never delete what you caught:
//
//   try { ... } catch (N_NetException* e) { puts(e->getErrorMessage()); }
//
// Handlers for the class itself, for any base up to Q_Exception*, CException*
// and CObject*, and void* all match. The caught pointer stays valid for the
// life of the process, but its text changes at the next throw of that class,
// from whatever thread.
#pragma once

#include "Q_Exception.h"

// Failures to get memory. Never thrown itself: catch it to take any of them.
class VARDEL_API Q_MemoryException : public Q_Exception {
 public:
  Q_MemoryException();
  ~Q_MemoryException() override;
};

// "Out of system memory resources"
class VARDEL_API Q_MemoryException_Allocation : public Q_MemoryException {
 public:
  Q_MemoryException_Allocation();
  ~Q_MemoryException_Allocation() override;
};

// Failures of the network layer. Never thrown itself: catch it to take any of them.
class VARDEL_API N_NetException : public Q_Exception {
 public:
  N_NetException();
  ~N_NetException() override;
};

// "WINSOCK: Network subsystem is unavailable"
class VARDEL_API N_NetException_Unavailable : public N_NetException {
 public:
  N_NetException_Unavailable();
  ~N_NetException_Unavailable() override;
};

// "WINSOCK: DLL version out of range"
class VARDEL_API N_NetException_NotSupported : public N_NetException {
 public:
  N_NetException_NotSupported();
  ~N_NetException_NotSupported() override;
};

// "WINSOCK: Too many processes"
class VARDEL_API N_NetException_ProcessLimit : public N_NetException {
 public:
  N_NetException_ProcessLimit();
  ~N_NetException_ProcessLimit() override;
};

// "Winsock version 2.0 or newer required"
class VARDEL_API N_NetException_VersionFailure : public N_NetException {
 public:
  N_NetException_VersionFailure();
  ~N_NetException_VersionFailure() override;
};

// "TCP protocol not found"
class VARDEL_API N_NetException_NoTCP : public N_NetException {
 public:
  N_NetException_NoTCP();
  ~N_NetException_NoTCP() override;
};

// "UDP protocol not found"
class VARDEL_API N_NetException_NoUDP : public N_NetException {
 public:
  N_NetException_NoUDP();
  ~N_NetException_NoUDP() override;
};

// "IP address is not resolved yet"
class VARDEL_API N_NetException_IPNotResolved : public N_NetException {
 public:
  N_NetException_IPNotResolved();
  ~N_NetException_IPNotResolved() override;
};

// "Local address is already bound to other socket"
class VARDEL_API N_NetException_LocalAddressAlreadyInUse : public N_NetException {
 public:
  N_NetException_LocalAddressAlreadyInUse();
  ~N_NetException_LocalAddressAlreadyInUse() override;
};

// Text given at the throw: the message size, then the limit.
class VARDEL_API N_NetException_PacketTooBig : public N_NetException {
 public:
  N_NetException_PacketTooBig();
  ~N_NetException_PacketTooBig() override;
};

// Text given at the throw: how many seconds of data wait in the queue.
class VARDEL_API N_NetException_PacketsStackingUp : public N_NetException {
 public:
  N_NetException_PacketsStackingUp();
  ~N_NetException_PacketsStackingUp() override;
};
