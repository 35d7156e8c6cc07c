// libquvaidx: the whole public interface.
#ifndef QUVAIDX_QUVAIDX_H_
#define QUVAIDX_QUVAIDX_H_

#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"

#endif  // QUVAIDX_QUVAIDX_H_
