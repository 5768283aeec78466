// Client and server figures: payload round trip and a 20-client server.
#pragma once

void benchClientServer(bool quick);

// The body of one client process of the 20-client measurement.
int clientPeer(const char* host, int port, double seconds);
