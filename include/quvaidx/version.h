// The version of libquvaidx.
//
// The build's one version number (the project version) is compiled into the
// library; QuvaidxVersion reports the version of the library that is
// actually loaded, which is what a program linked against an older or newer
// libquvaidx.so.0 needs to know. The pkg-config file and the CMake package
// carry the same number.
//
// Threads: may be called from any thread. Exported with C linkage.
#ifndef QUVAIDX_VERSION_H_
#define QUVAIDX_VERSION_H_

#include "quvaidx/export.h"

extern "C" {

// The library's version as "MAJOR.MINOR.PATCH", e.g. "0.2.0". The text is
// static: never freed, never changed.
QUVAIDX_API const char* QuvaidxVersion(void);

}  // extern "C"

#endif  // QUVAIDX_VERSION_H_
