// A program outside the project: it includes installed headers and links the
// installed shared library. With the runtime's header installed it brings the
// network runtime up and down and prints the local address; before that it
// calls one exported function of the platform layer.
#include <cstdio>

#if __has_include(<vardel/N_Initializer.h>)
#include <vardel/N_Exceptions.h>
#include <vardel/N_Initializer.h>
#define CONSUMER_HAS_RUNTIME 1
#if __has_include(<vardel/N_Address.h>)
#include <vardel/N_Address.h>
#define CONSUMER_HAS_ADDRESS 1
#endif
#endif

// Also reachable without the vardel/ prefix.
#include <vardel_platform.h>

#if defined(VARDEL_CONSUMER_EXPECT_INITIALIZER) && !defined(CONSUMER_HAS_RUNTIME)
#error "the library has N_Initializer.h, but the installed package lacks it"
#endif

namespace {

#ifdef CONSUMER_HAS_ADDRESS
const char* text(const volatile char* s) { return s ? const_cast<const char*>(s) : "(not known)"; }
#endif

}  // namespace

int main() {
  platform::setLocalHost(nullptr);  // the machine's own host name
#ifdef CONSUMER_HAS_RUNTIME
  try {
    N_Initializer network;
#ifdef CONSUMER_HAS_ADDRESS
    const N_Address* local = N_Address::getLocalAddress();
    if (local == nullptr) {
      std::printf("vardel consumer: no local address\n");
      return 1;
    }
    std::printf("local host: name %s number %s identifier 0x%08X\n", text(local->getStringName()),
                text(local->getStringNumber()), local->getIdentifier());
#else
    std::printf("runtime up\n");
#endif
  } catch (Q_Exception* e) {
    std::printf("vardel consumer: the runtime failed: %s\n", e->getErrorMessage());
    return 1;
  }
  std::printf("runtime down\n");
#endif
  std::printf("vardel consumer: ok\n");
  return 0;
}
