// Careful file access for everything the library reads from or writes to
// places that other users may reach (/tmp above all): bounded reads that never
// block on FIFOs or devices, JSON parsing that never throws, and temporary
// files that nothing planted in advance is written through.
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

// The temporary name of a write to path: "<path>.tmp.<pid>".
std::string TemporaryName(const std::string& path);

// Opens the temporary name for writing. A regular file of this user with one
// link found there is ours (a leftover of an earlier write): truncated and
// used. Anything else there (a link, FIFO, device, folder, another user's
// file, a file with a second link) is removed and the name created
// exclusively (mode 0600); removedForeign tells that it happened. Returns the
// descriptor, or -1 with errno set.
int OpenTemporary(const std::string& name, bool& removedForeign);

// Removes path without following links: a file, link, FIFO, device, or a
// folder with everything below it. A folder of this user or root's is left
// alone unless ownFolders: at a fixed name it is a caller's mistake, never a
// plant. False when something was left.
bool RemoveEntry(const std::string& path, bool ownFolders);

// Renames tmp onto path. When another user's folder holds path, the two are
// exchanged in one step and the folder removed afterwards (removedForeign
// then true).
// Returns 0, or the errno of the failed rename.
int Publish(const std::string& tmp, const std::string& path, bool& removedForeign);

// Writes the whole buffer, retrying short writes and interruptions.
bool WriteAll(int fd, const char* data, size_t size);

// fsync of the folder holding path, so that a rename into it is durable.
bool SyncFolderOf(const std::string& path);

// Removes temporary files of path left by writers that died (or that have
// been at it longer than STALE_TEMPORARY_SECONDS). Only names of our own
// pattern, only regular files owned by this user.
void RemoveStaleTemporaries(const std::string& path);

}  // namespace FileIo
}  // namespace Relay
}  // namespace ZEPA

#endif
