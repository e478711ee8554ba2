// Whether the daemon's log file may be opened: the daemonising step opens it
// only after the fork, where a failure can no longer stop the start.
#ifndef ZEPARELAYD_TOOL_LOG_FILE_CHECK_H
#define ZEPARELAYD_TOOL_LOG_FILE_CHECK_H

#include <string>

namespace zepatools {

// True when nothing stands at path yet or a plain file with one name does;
// otherwise false with the reason in why ("is a symbolic link", ...).
bool LogFileUsable(const std::string& path, std::string& why);

}  // namespace zepatools

#endif
