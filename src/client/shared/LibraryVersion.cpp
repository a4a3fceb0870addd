// The shared client library (libtelvane.so) is the client subsystem's archive linked
// whole; this unit gives it its one function of its own: the version of the library a
// client runs against, for its logs.
#include "telvane/telvane.h"

const char* telvane_version(void) { return TELVANE_VERSION; }
