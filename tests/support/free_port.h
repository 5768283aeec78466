// Ports on 127.0.0.1 for tests.
#pragma once

#include <cstdint>

// A port that is free on 127.0.0.1 for both TCP and UDP right now, chosen at
// random in 20000..49999 so that tests running at once rarely meet; 0 if none
// was found. With `withNext`, port + 1 is free for both as well (a data port
// and its datagram port). Nothing holds the port afterwards: bind it soon.
std::uint16_t pickFreePort(bool withNext = false);

// Nobody listens on TCP `port` and nobody holds UDP `port`, on 127.0.0.1 or
// on all addresses: shows that a listener or a datagram socket was closed.
// (Closed TCP connections may linger in TIME_WAIT; they don't count.)
bool portIsFree(std::uint16_t port);
