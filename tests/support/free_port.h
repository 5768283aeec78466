// A port that is free on 127.0.0.1 for both TCP and UDP right now, chosen at
// random in 20000..49999 so that tests running at once rarely meet; 0 if none
// was found. With `withNext`, port + 1 is free for both as well (a data port
// and its datagram port). Nothing holds the port afterwards: bind it soon.
#pragma once

#include <cstdint>

std::uint16_t pickFreePort(bool withNext = false);
