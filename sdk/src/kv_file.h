// Parsed form of a key/value file, shared by the readers and writers.
#ifndef ZEPASDK_SRC_KV_FILE_H
#define ZEPASDK_SRC_KV_FILE_H

#include <string>
#include <vector>

namespace zepasdk {

struct KvLine {
    enum Kind { COMMENT, MALFORMED, SECTION, ENTRY } kind;
    std::string text;     // the line as read, kept for rewriting
    std::string section;  // SECTION: its name; ENTRY: the section it belongs to
    std::string key;
    std::string value;
};

// Splits one line into its kind, key and value.
KvLine ParseKvLine(const std::string& text, const std::string& currentSection);

// Reads a whole file; false when it cannot be opened.
bool ReadKvFile(const std::string& path, std::vector<KvLine>& lines);

// Replaces the file atomically with the given lines (temporary file, rename),
// keeping the old file's mode (0644 for a new file).
bool WriteKvFile(const std::string& path, const std::vector<KvLine>& lines);

// key="value" with \" and \\ escaped.
std::string FormatKvEntry(const std::string& key, const std::string& value);

}  // namespace zepasdk

#endif
