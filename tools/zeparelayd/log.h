// The daemon's own log lines go through the library's log, so they share its
// file, level filter and line format: "<source>:<line> <message>". Each file
// names its source with RLOG_SOURCE before including this header.
#ifndef ZEPARELAYD_TOOL_LOG_H
#define ZEPARELAYD_TOOL_LOG_H

#include <syslog.h>

#include <zeparelayd/daemon.h>

#define RLOG(level, fmt, ...) \
    ::ZEPA::Relay::Daemon::Log((level), "%s:%d " fmt, RLOG_SOURCE, __LINE__, ##__VA_ARGS__)

#endif
