// Careful file access for everything the library reads from or writes to
// places that other users may reach (/tmp above all): bounded reads that never
// block on FIFOs or devices, JSON parsing that never throws, and temporary
// files that cannot be planted in advance.
#ifndef ZEPARELAYD_SRC_COMMON_FILE_IO_H
#define ZEPARELAYD_SRC_COMMON_FILE_IO_H

#include <json/value.h>
#include <sys/types.h>

#include <zeparelayd/config_base.h>

#include <cstddef>
#include <string>

namespace ZEPA {
namespace Relay {
namespace FileIo {

// The largest file the library reads: configuration, permission, region,
// status, alias status and debug dump files are a few kilobytes at most.
constexpr size_t MAX_FILE_BYTES = JSON_FILE_MAX_BYTES;
// The largest HTTP answer kept in memory; a longer one fails the transfer.
constexpr size_t MAX_ANSWER_BYTES = 1024 * 1024;
// Deepest JSON nesting accepted; our own documents stay below 8.
constexpr int MAX_JSON_DEPTH = JSON_FILE_MAX_DEPTH;
// How much of a body a log line shows.
constexpr size_t MAX_LOGGED_BODY = 512;
// A temporary file whose writer still lives is left alone up to this age.
constexpr int STALE_TEMPORARY_SECONDS = 600;

enum class ReadResult {
    OK,           // out holds the whole file
    MISSING,      // could not be opened (missing, no access, a link when not followed)
    NOT_REGULAR,  // a FIFO, device, socket or directory
    TOO_LARGE,    // longer than the limit
    FAILED,       // a read error
};

// Reads a whole regular file of at most limit bytes. The open never blocks
// (O_NONBLOCK) and anything but a regular file is refused before reading.
// With followLinks false a symbolic link at path counts as MISSING.
ReadResult ReadRegular(const std::string& path, size_t limit, std::string& out, bool followLinks = true);

// Parses JSON text (comments allowed, not kept), nesting limited to
// MAX_JSON_DEPTH. Never throws: a parser limit or an allocation failure is a
// parse failure. On a syntax error out holds what the parser built; past a
// limit it is null.
bool ParseJson(const std::string& text, Json::Value& out);

// text cut to MAX_LOGGED_BODY bytes, with a note of the full length.
std::string ClipForLog(const std::string& text);

// Creates "<path>.tmp.<pid>.<random>" exclusively (O_CREAT|O_EXCL|O_NOFOLLOW,
// mode 0600). Returns the descriptor, or -1 with errno set; name holds the
// created (or last attempted) name.
int CreateTemporary(const std::string& path, std::string& name);

// Writes the whole buffer, retrying short writes and interruptions.
bool WriteAll(int fd, const char* data, size_t size);

// fsync of the folder holding path, so that a rename into it is durable.
bool SyncFolderOf(const std::string& path);

// Removes temporary files of path left by writers that died (or that have
// been at it longer than STALE_TEMPORARY_SECONDS). Only names of our own
// pattern, only regular files owned by this user.
void RemoveStaleTemporaries(const std::string& path);

// True when pid > 0 names a live process whose command or executable name is
// the daemon's (Daemon::SetName, "zeparelayd" by default). Stops the status
// readers from trusting a pid that a planted or stale file names.
bool IsDaemonProcess(pid_t pid);

}  // namespace FileIo
}  // namespace Relay
}  // namespace ZEPA

#endif
