// The debug dump file. A querying process creates the file, sends SIGUSR1 and
// gives up after about 3 ms; the loop can be busy longer than that (a TLS
// handshake loads the CA store inside curl). So the loop renders the dump
// after every event, and the SIGUSR1 handler itself only copies the rendered
// text into the file with async-signal-safe calls (temporary file, rename),
// whatever the loop is doing at that moment.
#ifndef ZEPARELAYD_TOOL_DEBUG_DUMP_H
#define ZEPARELAYD_TOOL_DEBUG_DUMP_H

#include <string>

namespace zeparelayd {

// Takes over SIGUSR1 for the dump at path (already resolved). False when the
// handler could not be installed.
bool InstallDebugDump(const std::string& path);
// Makes text the dump that the next SIGUSR1 writes.
void PublishDebugDump(const std::string& text);
// On the way out: SIGUSR1 is ignored from now on.
void RemoveDebugDump();

}  // namespace zeparelayd

#endif
