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

// Whether the handler has written a dump since the last call (loop only).
bool TakeDumpWritten();
// A query that gave up (after its few milliseconds) has deleted the file
// already when the dump arrives, and nobody would remove it. So the loop
// removes a dump at path once it is minAgeMs old and no query holds its
// lock. 0 removed or none there, 1 still in use or too young (try again
// later), -1 not a regular file or not removable (left alone).
int RemoveGivenUpDump(const std::string& path, int minAgeMs);

}  // namespace zeparelayd

#endif
