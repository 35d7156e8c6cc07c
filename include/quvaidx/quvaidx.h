// libquvaidx: the whole public interface.
#ifndef QUVAIDX_QUVAIDX_H_
#define QUVAIDX_QUVAIDX_H_

#include "quvaidx/codec_names.h"
#include "quvaidx/daemon.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/ea_file.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "quvaidx/lifecycle.h"
#include "quvaidx/log.h"
#include "quvaidx/media_type.h"
#include "quvaidx/mediainfo.h"
#include "quvaidx/path_rules.h"
#include "quvaidx/paths.h"
#include "quvaidx/share_folder.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"
#include "quvaidx/task_queue.h"
#include "quvaidx/text.h"
#include "quvaidx/version.h"

#endif  // QUVAIDX_QUVAIDX_H_
