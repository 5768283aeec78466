// Internal to the library: a trace of an exception that the library catches
// and doesn't pass on (on the network thread nothing may leave; an override
// of the application must not break the runtime). Call it inside the
// handler: it names `where` and the exception's text in a diagnostic line.
#pragma once

void traceSwallowed(const char* where);
