// Test seam of the debug status query: the pause between reads of the dump.
#ifndef ZEPARELAYD_SRC_DAEMON_STATUS_SEAM_H
#define ZEPARELAYD_SRC_DAEMON_STATUS_SEAM_H

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {
// Sleeps the given microseconds (usleep by default).
ZEPARELAYD_API extern void (*g_statusSleep)(unsigned int usec);
}  // namespace Relay
}  // namespace ZEPA

#endif
