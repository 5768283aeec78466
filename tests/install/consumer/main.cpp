// A program outside the project: it includes installed headers, links the
// installed shared library, brings the network runtime up and down and prints
// the local address.
#include <vardel/N_Address.h>
#include <vardel/N_Exceptions.h>
#include <vardel/N_Initializer.h>
#include <vardel_platform.h>  // also reachable without the vardel/ prefix

#include <cstdio>

static const char* text(const volatile char* s) { return s ? const_cast<const char*>(s) : "(not known)"; }

int main() {
  platform::setLocalHost(nullptr);  // the machine's own host name
  try {
    N_Initializer network;
    const N_Address* local = N_Address::getLocalAddress();
    if (local == nullptr) return std::printf("vardel consumer: no local address\n"), 1;
    std::printf("local host: name %s number %s identifier 0x%08X\n", text(local->getStringName()),
                text(local->getStringNumber()), local->getIdentifier());
  } catch (Q_Exception* e) {
    return std::printf("vardel consumer: the runtime failed: %s\n", e->getErrorMessage()), 1;
  }
  std::printf("runtime down\nvardel consumer: ok\n");
  return 0;
}
