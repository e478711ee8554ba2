// Test seam of the logger: the time-stamp conversion it calls.
#ifndef ZEPARELAYD_SRC_DAEMON_LOG_SEAM_H
#define ZEPARELAYD_SRC_DAEMON_LOG_SEAM_H

#include <ctime>

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {
ZEPARELAYD_API extern char* (*g_logCtime)(const time_t*, char*);
}
}  // namespace ZEPA

#endif
