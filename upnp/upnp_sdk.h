// The libupnp and ixml headers, included in one place. libupnp's list.h
// defines the macros bool, true and offsetof for C; they are taken back here
// so that C++ code after this header sees the language's own.
#ifndef TARN_UPNP_SDK_H
#define TARN_UPNP_SDK_H

#include <cstddef>

#include <ixml.h>
#include <upnp.h>
#include <upnptools.h>

#undef bool
#undef true
#undef offsetof
#define offsetof(type, member) __builtin_offsetof(type, member)

#endif
