#include "N_Address.h"

#include <atomic>
#include <cstring>

#include "N_Initializer.h"
#include "Q_New.h"
#include "Q_Timer.h"
#include "RuntimeLock.h"
#include "win32.h"
#include "winsock.h"

// The name service calls below are written with their namespace: the C
// library's functions of the same names may be visible through standard
// headers.

namespace {

// Resolver threads running now, against N_Limits::uMaximumLookups: a flood
// of accepted connections must not become a flood of blocked threads.
std::atomic<unsigned> g_uLookups{0};

const char kAddressMutexName[] = "N_Address mutex";

// A counted copy of exactly strlen + 1 bytes.
char* copyString(const char* text) {
  std::size_t size = std::strlen(text) + 1;
  char* copy = Q_NewArray<char>(size);
  std::memcpy(copy, text, size);
  return copy;
}

void freeString(volatile char*& text) {
  Q_DeleteArray(const_cast<char*>(text));
  text = nullptr;
}

// The classification is by characters only: digits and dots make a number,
// anything else a name. Shape is inet_addr's business.
bool isNumberText(const char* text) {
  for (const char* c = text; *c != '\0'; ++c) {
    if (*c != '.' && (*c < '0' || *c > '9')) return false;
  }
  return true;
}

}  // namespace

N_Address::N_Address() { initializeMembers(); }

N_Address::N_Address(const char* text) {
  initializeMembers();
  construct(text);
}

N_Address::~N_Address() { destruct(); }

void N_Address::initializeMembers() {
  m_bConstructed = false;
  m_pName = nullptr;
  m_pNumber = nullptr;
  m_uIdentifier = 0;
  m_pThread = nullptr;
  m_pRegistryEntry = nullptr;
  m_pShared = nullptr;
}

bool N_Address::isConstructed() const { return m_bConstructed; }

void N_Address::construct(const char* text) {
  destruct();
  if (text == nullptr) text = "";
  try {
    m_bConstructed = true;
    // No other thread can see the block until its resolver starts, so it is
    // filled without the lock.
    m_pShared = Q_New<SharedState>();
    m_pShared->hMutex = platform::CreateMutexA(nullptr, platform::FALSE, kAddressMutexName);
    m_pShared->iReferences = 1;
    m_pShared->pOwner = this;
    m_pName = nullptr;
    m_pNumber = nullptr;
    m_uIdentifier = 0;
    m_pThread = nullptr;

    platform::AFX_THREADPROC resolver;
    if (isNumberText(text)) {
      m_pNumber = copyString(text);
      m_uIdentifier = platform::inet_addr(text);
      resolver = threadHostByAddr;
    } else {
      m_pName = copyString(text);
      resolver = threadHostByName;
    }
    // Without its mutex the block can't be shared safely; the address then
    // keeps what it was given, as if its lookup had failed.
    // Past the limit of lookups under way it keeps what it was given the
    // same way.
    const unsigned maximumLookups = N_Initializer::getLimits().uMaximumLookups;
    if (m_pShared->hMutex != nullptr && (maximumLookups == 0 || g_uLookups.load() < maximumLookups)) {
      ++m_pShared->iReferences;
      ++g_uLookups;
      platform::CWinThread* thread = platform::AfxBeginThread(resolver, m_pShared, 0, 0, 0, nullptr);
      if (thread == nullptr) {
        --g_uLookups;
        --m_pShared->iReferences;  // no resolver to drop it
      } else {
        // The resolver may be done already; it clears m_pThread under the
        // lock, so only a resolver that still runs is remembered.
        MutexHold hold(m_pShared->hMutex);
        if (m_pShared->iReferences > 1) m_pThread = thread;
      }
    }

    // The runtime's lists exist only while it is up; a stop deletes every
    // registered address, so an entry never outlives its list.
    if (Runtime::addresses() != nullptr) {
      RuntimeLock lock;
      m_pRegistryEntry = Runtime::enroll(Runtime::addresses(), this);
    }
  } catch (...) {
    destruct();
    throw;
  }
}

void N_Address::destruct() {
  if (!m_bConstructed) return;

  // The registry step comes first and on its own: the runtime's mutex is
  // never taken while the N_Address mutex is held, because the socket path
  // takes them the other way round.
  if (m_pRegistryEntry != nullptr) {
    RuntimeLock lock;
    Runtime::withdraw(Runtime::addresses(), m_pRegistryEntry);
  }

  if (m_pShared != nullptr) {
    SharedState* shared = m_pShared;
    platform::WaitForSingleObject(shared->hMutex, platform::INFINITE);
    freeString(m_pName);
    freeString(m_pNumber);
    shared->pOwner = nullptr;
    dropReference(shared);
  } else {
    // construct() failed before the block existed.
    freeString(m_pName);
    freeString(m_pNumber);
  }
  initializeMembers();
}

void N_Address::dropReference(SharedState* shared) {
  platform::HANDLE mutex = shared->hMutex;
  if (--shared->iReferences == 0) {
    platform::ReleaseMutex(mutex);
    if (mutex != nullptr) platform::CloseHandle(mutex);
    Q_Delete(shared);
  } else {
    platform::ReleaseMutex(mutex);
  }
}

const volatile char* N_Address::getStringName() const {
  if (!m_bConstructed) return nullptr;
  MutexHold hold(m_pShared->hMutex);
  return m_pName;
}

const volatile char* N_Address::getStringNumber() const {
  if (!m_bConstructed) return nullptr;
  MutexHold hold(m_pShared->hMutex);
  return m_pNumber;
}

unsigned int N_Address::getIdentifier() const {
  if (!m_bConstructed) return 0;
  MutexHold hold(m_pShared->hMutex);
  return m_uIdentifier;
}

bool N_Address::fullyResolved() const {
  if (!m_bConstructed) return false;
  return getStringName() != nullptr && getStringNumber() != nullptr;
}

bool N_Address::lookupPending() const {
  if (!m_bConstructed) return false;
  MutexHold hold(m_pShared->hMutex);
  return m_pShared->iReferences > 1;
}

bool N_Address::wait(float seconds) const {
  Q_Timer timer;
  while (timer.getAge() < seconds) {
    if (fullyResolved()) break;
  }
  return timer.getAge() < seconds;
}

const N_Address* N_Address::getLocalAddress() { return Runtime::localAddress(); }

unsigned int N_Address::threadHostByName(void* parameter) {
  SharedState* shared = static_cast<SharedState*>(parameter);
  char* name = nullptr;
  {
    MutexHold hold(shared->hMutex);
    if (shared->pOwner != nullptr) {
      // Nothing may leave a thread: without a copy there is just no lookup.
      try {
        name = copyString(const_cast<const char*>(shared->pOwner->m_pName));
      } catch (...) {
        name = nullptr;
      }
    }
  }

  platform::hostent* host = name != nullptr ? platform::gethostbyname(name) : nullptr;

  platform::WaitForSingleObject(shared->hMutex, platform::INFINITE);
  N_Address* owner = shared->pOwner;
  if (owner != nullptr) {
    if (host != nullptr && host->h_addr_list != nullptr && host->h_addr_list[0] != nullptr) {
      platform::in_addr address;
      std::memcpy(&address.s_addr, host->h_addr_list[0], sizeof address.s_addr);
      try {
        char* number = copyString(platform::inet_ntoa(address));
        owner->m_pNumber = number;
        owner->m_uIdentifier = platform::inet_addr(number);
      } catch (...) {
        // Left unresolved, as if the name had no address.
      }
    }
    owner->m_pThread = nullptr;
  }
  dropReference(shared);
  Q_DeleteArray(name);
  --g_uLookups;
  return 0;
}

unsigned int N_Address::threadHostByAddr(void* parameter) {
  SharedState* shared = static_cast<SharedState*>(parameter);
  unsigned int identifier = 0;
  {
    MutexHold hold(shared->hMutex);
    if (shared->pOwner != nullptr) identifier = shared->pOwner->m_uIdentifier;
  }

  platform::hostent* host = identifier != 0 ? platform::gethostbyaddr(reinterpret_cast<const char*>(&identifier),
                                                                      sizeof identifier, platform::AF_INET)
                                            : nullptr;

  platform::WaitForSingleObject(shared->hMutex, platform::INFINITE);
  N_Address* owner = shared->pOwner;
  if (owner != nullptr) {
    if (host != nullptr && host->h_name != nullptr && owner->m_pName == nullptr) {
      try {
        owner->m_pName = copyString(host->h_name);
      } catch (...) {
        // Left without a name, as if there were no reverse entry.
      }
    }
    owner->m_pThread = nullptr;
  }
  dropReference(shared);
  --g_uLookups;
  return 0;
}
