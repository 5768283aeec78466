#include "free_port.h"

#include "raw_socket.h"

std::uint16_t pickFreePort(bool withNext) { return raw::freePort(withNext); }
