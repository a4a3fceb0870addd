// The shared client library (libtelvane.so) is the client subsystem's archive linked
// whole; this unit gives it its one symbol of its own: the library's version, so that
// a client can log which library it runs against.
extern "C" const char* telvaneLibraryVersion() { return TELVANE_VERSION; }
