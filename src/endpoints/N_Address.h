/// @class N_Address
/// One IPv4 host: its name, its dotted number and its 32-bit identifier.
///
/// An address is made from one string, a host name or a dotted number. The half
/// that was given is there when construct() returns; a short-lived resolver
/// thread looks up the other half and writes it back, so no caller ever blocks
/// on the name service. Poll getIdentifier()/fullyResolved(), or wait() with a
/// time limit.
///
/// @code
///   N_Address server("game.example.org");
///   if (server.wait(2.0f)) { ... server.getIdentifier() ... }
/// @endcode
///
/// Sockets and clients need only the number (getIdentifier() not 0): made from
/// a dotted number, an address is usable at once, and made from a name, once
/// the lookup found it.
///
/// How the text is read: if any byte is neither '.' nor a digit it is a host
/// name (bytes from 0x80 up count as name characters); otherwise it is a dotted
/// number, the empty string included. A null text is taken as the empty string.
/// The shape is not checked: text that isn't a valid address gets the
/// identifier 0xFFFFFFFF (what inet_addr says), and "0.0.0.0" gets 0 and no
/// lookup at all.
///
/// @par Lifetime
/// Strings returned by the getters stay valid, and unchanged, until
/// the address is destructed or constructed again; they may be read without a
/// lock. An address made while the runtime (N_Initializer) is up is registered
/// with it, and the runtime's stop deletes every address still registered, so
/// such an address must come from new if it may outlive the runtime. An address
/// made while the runtime is down works the same but isn't registered.
///
/// @par Threads
/// All addresses share one lock, the mutex named "N_Address mutex",
/// which is held only to copy strings in and out, never across a lookup. It is
/// never held while the runtime's mutex is taken. The getters may be called
/// from any thread. One object has one owner: construct() and destruct() of
/// the same object must not run at once.
///
/// Not copyable: two objects would share one resolver block and one registry
/// entry, and both would free them.
#pragma once

#include "vardel_export.h"
#include "vardel_platform.h"

class N_Initializer;

class VARDEL_API N_Address {
 public:
  /// Unconstructed: getters answer null/0/false.
  N_Address();
  /// Constructed from `text`, as construct().
  /// @throws Q_MemoryException_Allocation* as construct().
  N_Address(const char* text);
  /// As destruct().
  ~N_Address();

  /// Not copyable (see the class).
  N_Address(const N_Address&) = delete;
  /// Not assignable (see the class).
  N_Address& operator=(const N_Address&) = delete;

  /// Takes the object down first, so it may be called again; starts the
  /// lookup of the other half and returns without waiting for it.
  /// @throws Q_MemoryException_Allocation* if memory runs out; the object is
  /// then unconstructed and nothing is left allocated.
  void construct(const char* text);
  /// Does nothing on an unconstructed object. Doesn't wait for the resolver:
  /// a lookup still running finds its owner gone and writes nothing.
  void destruct();

  /// The host name; null until known. The name stays the text the caller
  /// gave; a name from a reverse lookup is only filled in when a number was
  /// given.
  const volatile char* getStringName() const;
  /// The dotted number; null until known.
  const volatile char* getStringNumber() const;
  /// Network byte order, as inet_addr gives it; 0 until known, 0xFFFFFFFF for
  /// text that isn't an address.
  unsigned int getIdentifier() const;
  /// Both name and number are known.
  bool fullyResolved() const;
  /// Polls fullyResolved() for up to `seconds`, without sleeping. True if the
  /// address became fully resolved before the time ran out; false for a zero
  /// or negative time, even when it is resolved already.
  /// @warning Blocks the calling thread at full load for up to `seconds`. A
  /// dotted number whose reverse lookup finds no name never becomes fully
  /// resolved, so wait() spins the whole time and gives false, although
  /// getIdentifier() was usable from the start: check getIdentifier() when
  /// only the number matters.
  bool wait(float seconds) const;

  /// This host, as the runtime resolved it at its start (platform::setLocalHost
  /// chooses it); null while the runtime is down.
  static const N_Address* getLocalAddress();

 private:
  friend class N_Initializer;

  // The block shared with the resolver thread. It is separate from the object
  // so that a resolver can outlive the address that started it; whoever drops
  // the last reference frees it.
  struct SharedState {
    platform::HANDLE hMutex;  // this block's handle to "N_Address mutex"
    N_Address* pOwner;        // null once the owner is gone
    int iReferences;          // owner and resolver, while each holds the block
  };

  void initializeMembers();
  bool isConstructed() const;
  // True while a resolver still holds the block, that is, its lookup may
  // still write a result.
  bool lookupPending() const;

  static unsigned int threadHostByName(void* shared);
  static unsigned int threadHostByAddr(void* shared);
  // Drops one reference, with the block's mutex held by the caller; frees
  // the block (and releases and closes its mutex handle) on the last one.
  static void dropReference(SharedState* shared);

  bool m_bConstructed;
  volatile char* m_pName;    // owned, null until known
  volatile char* m_pNumber;  // owned, null until known
  volatile unsigned int m_uIdentifier;
  platform::CWinThread* m_pThread;  // the resolver while it runs; nothing reads it
  N_Address** m_pRegistryEntry;     // entry in the runtime's registry, or null
  SharedState* m_pShared;
};
