// The runtime comes up, shows this host, resolves a name and a dotted number
// in the background with their progress, and goes down again.
#include <chrono>
#include <cstdio>
#include <string>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "demo.h"
#include "vardel_platform.h"

namespace demo {
namespace {

const char* text(const volatile char* s) { return s ? const_cast<const char*>(s) : "(not yet known)"; }

void show(const char* label, const N_Address& a) {
  unsigned id = a.getIdentifier();
  std::printf("  %-8s name %-28s number %-16s identifier 0x%08X%s\n", label, text(a.getStringName()),
              text(a.getStringNumber()), id, a.fullyResolved() ? "  (fully resolved)" : "");
}

}  // namespace

int runResolve(const Options& options) {
  if (!options.host.empty()) platform::setLocalHost(options.host.c_str());
  std::string name = options.args.size() > 0 ? options.args[0] : "localhost";
  std::string number = options.args.size() > 1 ? options.args[1] : "127.0.0.1";
  try {
    auto start = std::chrono::steady_clock::now();
    N_Initializer network;
    double up = std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    std::printf("Runtime up in %.1f ms\n", up);
    show("this host", *N_Address::getLocalAddress());
    N_Address byName(name.c_str());
    N_Address byNumber(number.c_str());
    std::printf("Resolving \"%s\" and \"%s\" in the background:\n", name.c_str(), number.c_str());
    show("name", byName);
    show("number", byNumber);
    bool a = byName.wait(3.0f);
    bool b = byNumber.wait(3.0f);
    std::printf("After waiting (up to 3 s each): %s, %s\n", a ? "name resolved" : "name not fully resolved",
                b ? "number resolved" : "number not fully resolved");
    show("name", byName);
    show("number", byNumber);
    start = std::chrono::steady_clock::now();
  } catch (Q_Exception* e) {
    std::printf("failed: %s\n", e->getErrorMessage());
    return 1;
  }
  std::printf("Runtime down\n");
  return 0;
}

}  // namespace demo
