// Parsed form of a key/value file, shared by the readers and writers.
#ifndef ZEPASDK_SRC_KV_FILE_H
#define ZEPASDK_SRC_KV_FILE_H

#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace zepasdk {

struct KvLine {
    enum Kind { COMMENT, MALFORMED, SECTION, ENTRY } kind;
    std::string text;     // the line as read, kept for rewriting
    std::string section;  // SECTION: its name; ENTRY: the section it belongs to
    std::string key;
    std::string value;
};

// A whole file, with an index so that a look-up does not walk every line.
struct KvFile {
    std::vector<KvLine> lines;
    // section -> key -> line of its first entry; every section seen has a slot
    std::unordered_map<std::string, std::unordered_map<std::string, size_t>> index;

    // Finds key in section ("" = before any section). -1: section missing;
    // 0: key missing; 1: found (the first occurrence).
    int Lookup(const std::string& section, const std::string& key, std::string& value) const;
};

// Splits one line into its kind, key and value.
KvLine ParseKvLine(const std::string& text, const std::string& currentSection);

// Parses file content into lines and index.
void ParseKvContent(const std::string& content, KvFile& file);

// The parsed file; null when it cannot be opened or is no regular file.
// Parsed files are kept by path and re-read when the file's identity (device,
// inode, size, modification and change times) differs, or its content does
// while its time stamps are too recent to tell a rewrite apart.
std::shared_ptr<const KvFile> LoadKvFile(const std::string& path);

// Drops what is kept of path (after this process rewrote it).
void ForgetKvFile(const std::string& path);

// Reads a whole file; false when it cannot be opened.
bool ReadKvFile(const std::string& path, std::vector<KvLine>& lines);

// Replaces the file atomically with the given lines (temporary file, rename),
// keeping the old file's mode (0644 for a new file).
bool WriteKvFile(const std::string& path, const std::vector<KvLine>& lines);

// key="value" with \" and \\ escaped.
std::string FormatKvEntry(const std::string& key, const std::string& value);

}  // namespace zepasdk

#endif
