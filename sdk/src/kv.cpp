// Key/value files: readers and writers over the parsed form of kv_file.h.
#include <strings.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "kv_file.h"
#include "zepasdk/kv.h"

using zepasdk::KvLine;

namespace {

int Fail(int code) {
    VLIBCErrSet(code);
    return -1;
}

// Copies value into buf (cut to fit); returns the length written.
int CopyOut(const std::string& value, char* buf, int size) {
    size_t n = value.size();
    if (n > static_cast<size_t>(size - 1)) n = static_cast<size_t>(size - 1);
    memcpy(buf, value.data(), n);
    buf[n] = '\0';
    return static_cast<int>(n);
}

int GetValue(const char* file, const char* section, const char* key, char* buf, int size) {
    if (file == nullptr || key == nullptr || buf == nullptr || size < 1) return Fail(ZEPA_ERR_BAD_PARAMETERS);
    buf[0] = '\0';
    std::shared_ptr<const zepasdk::KvFile> parsed = zepasdk::LoadKvFile(file);
    if (!parsed) return Fail(ZEPA_ERR_FILE_NOT_FOUND);
    std::string value;
    int found = parsed->Lookup(section, key, value);
    if (found < 0) return Fail(ZEPA_ERR_SECTION_NOT_FOUND);
    if (found == 0) {
        VLIBCErrSet(ZEPA_ERR_KEY_NOT_FOUND);
        return 0;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return CopyOut(value, buf, size);
}

int SetValue(const char* file, const char* section, const char* key, const char* value) {
    if (file == nullptr || key == nullptr || value == nullptr || key[0] == '\0' || strchr(key, '=') ||
        strchr(key, '\n') || strchr(value, '\n'))
        return Fail(ZEPA_ERR_BAD_PARAMETERS);
    std::vector<KvLine> lines;
    zepasdk::ReadKvFile(file, lines);  // a missing file starts empty
    const std::string entry = zepasdk::FormatKvEntry(key, value);

    // Replace the first occurrence, or insert at the end of the section (the
    // top-level keys end where the first section begins).
    size_t insertAt = std::string::npos;
    bool inSection = section[0] == '\0';
    for (size_t i = 0; i < lines.size(); ++i) {
        KvLine& l = lines[i];
        if (l.kind == KvLine::ENTRY && l.section == section && l.key == key) {
            l.text = entry;
            l.value = value;
            if (!zepasdk::WriteKvFile(file, lines)) return Fail(ZEPA_ERR_IO);
            VLIBCErrSet(ZEPA_ERR_NONE);
            return 0;
        }
        if (l.kind == KvLine::SECTION) {
            if (inSection && insertAt == std::string::npos) insertAt = i;
            inSection = l.section == section;
        }
    }
    KvLine added{KvLine::ENTRY, entry, section, key, value};
    if (insertAt != std::string::npos) {
        // Keep blank and comment lines that close the section where they are.
        while (insertAt > 0 && lines[insertAt - 1].kind == KvLine::COMMENT &&
               lines[insertAt - 1].text.find_first_not_of(" \t\r") == std::string::npos)
            --insertAt;
        lines.insert(lines.begin() + static_cast<long>(insertAt), added);
    } else if (inSection) {
        lines.push_back(added);
    } else {
        lines.push_back(KvLine{KvLine::SECTION, std::string("[") + section + "]", section, "", ""});
        lines.push_back(added);
    }
    if (!zepasdk::WriteKvFile(file, lines)) return Fail(ZEPA_ERR_IO);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

}  // namespace

extern "C" {

int VLIBCFileGetKeyValue(const char* file, const char* key, char* buf, int size) {
    return GetValue(file, "", key, buf, size);
}

int VLIBCFileGetSectionValue(const char* file, const char* section, const char* key, char* buf, int size) {
    if (section == nullptr) return Fail(ZEPA_ERR_BAD_PARAMETERS);
    return GetValue(file, section, key, buf, size);
}

int VLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int opt) {
    if (file == nullptr || key == nullptr || value == nullptr) return Fail(ZEPA_ERR_BAD_PARAMETERS);
    std::shared_ptr<const zepasdk::KvFile> parsed = zepasdk::LoadKvFile(file);
    std::string current;
    bool found = parsed && parsed->Lookup("", key, current) == 1;
    if (!found) {
        VLIBCErrSet(ZEPA_ERR_KEY_NOT_FOUND);
        return (opt & 1) ? 1 : 0;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return strcasecmp(current.c_str(), value) == 0 ? 1 : 0;
}

int VLIBCFileSetKeyValue(const char* file, const char* key, const char* value) {
    return SetValue(file, "", key, value);
}

int VLIBCFileSetSectionValue(const char* file, const char* section, const char* key, const char* value) {
    if (section == nullptr || section[0] == '\0' || strchr(section, ']') || strchr(section, '\n'))
        return Fail(ZEPA_ERR_BAD_PARAMETERS);
    return SetValue(file, section, key, value);
}

int VLIBCINFOSetKeyValue(const char* key, const char* value) {
    char path[4096];
    if (ZEPASysRootPath("/etc/zepainfo.conf", path, sizeof(path)) < 0) return Fail(ZEPA_ERR_BAD_PARAMETERS);
    return SetValue(path, "", key, value);
}

int VLIBCFileEnumSection(const char* file, PVLIBCSzList* list) {
    if (file == nullptr || list == nullptr || *list == nullptr) return Fail(ZEPA_ERR_BAD_PARAMETERS);
    std::shared_ptr<const zepasdk::KvFile> parsed = zepasdk::LoadKvFile(file);
    if (!parsed) return Fail(ZEPA_ERR_FILE_NOT_FOUND);
    int count = 0;
    for (const KvLine& l : parsed->lines) {
        if (l.kind != KvLine::SECTION) continue;
        if (VLIBCSzListPush(list, l.section.c_str()) != 0) return -1;
        ++count;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return count;
}

}  // extern "C"
