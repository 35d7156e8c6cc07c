// libquvaidx: the whole public interface.
#ifndef QUVAIDX_QUVAIDX_H_
#define QUVAIDX_QUVAIDX_H_

#include "quvaidx/daemon.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/ipc.h"
#include "quvaidx/lifecycle.h"
#include "quvaidx/log.h"
#include "quvaidx/system.h"
#include "quvaidx/task_queue.h"

#endif  // QUVAIDX_QUVAIDX_H_
