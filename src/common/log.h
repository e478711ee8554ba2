// Internal logging macros. Every message starts with "<source>:<line> "; each
// source file defines ZEPA_LOG_SOURCE ("config", "request", ...) before including.
#ifndef ZEPARELAYD_SRC_COMMON_LOG_H
#define ZEPARELAYD_SRC_COMMON_LOG_H

#include <zeparelayd/daemon.h>

#include "common/syslog.h"

#define ZEPA_LOG_ERR 3
#define ZEPA_LOG_WARNING 4
#define ZEPA_LOG_NOTICE 5
#define ZEPA_LOG_INFO 6
#define ZEPA_LOG_DEBUG 7

// Library log: standard error or the log file, filtered by Daemon::_logLevel.
#define ZLOG(level, fmt, ...) \
    ::ZEPA::Relay::Daemon::Log((level), "%s:%d " fmt, ZEPA_LOG_SOURCE, __LINE__, ##__VA_ARGS__)

// System log, for code that runs in other processes than the daemon.
#define ZSYSLOG(priority, fmt, ...) \
    ::ZEPA::Relay::SystemLog((priority), "%s:%d " fmt, ZEPA_LOG_SOURCE, __LINE__, ##__VA_ARGS__)

#endif
