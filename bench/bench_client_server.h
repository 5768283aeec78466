// Client and server figures: payload round trip and a 20-client server.
#pragma once

void benchClientServer(bool quick);
