#include "quvaidx/version.h"

// QUVAIDX_VERSION_STRING comes from the build (the project version).
const char* QuvaidxVersion(void) { return QUVAIDX_VERSION_STRING; }
