// TELVANE_EXPORT marks what libtelvane.so exports: the public classes and functions
// of these headers. The library is built with hidden visibility by default, so
// anything not marked stays inside it.
#pragma once

#if defined(__GNUC__) || defined(__clang__)
#define TELVANE_EXPORT __attribute__((visibility("default")))
// For a class nested in an exported class that belongs to the library's inside.
#define TELVANE_HIDDEN __attribute__((visibility("hidden")))
#else
#define TELVANE_EXPORT
#define TELVANE_HIDDEN
#endif
