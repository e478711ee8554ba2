#include "zepasdk/fw.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "kv_file.h"

namespace {

constexpr int kValueMax = 1024;

bool EndsWith(const std::string& s, const std::string& tail) {
    return s.size() > tail.size() && s.compare(s.size() - tail.size(), tail.size(), tail) == 0;
}

std::string Trim(const std::string& s) {
    size_t b = s.find_first_not_of(" \t");
    if (b == std::string::npos) return "";
    size_t e = s.find_last_not_of(" \t");
    return s.substr(b, e - b + 1);
}

// The definition files of the folder, in byte order of their names.
bool ListDefinitionFiles(const std::string& dir, std::vector<std::string>& files) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) return false;
    while (struct dirent* ent = readdir(d)) {
        std::string name = ent->d_name;
        if (!EndsWith(name, ".conf")) continue;
        std::string full = dir + "/" + name;
        struct stat st;
        if (ent->d_type != DT_REG && (stat(full.c_str(), &st) != 0 || !S_ISREG(st.st_mode))) continue;
        files.push_back(full);
    }
    closedir(d);
    std::sort(files.begin(), files.end());
    return true;
}

// A top-level value as VLIBCFileGetKeyValue gives it (cut to kValueMax - 1).
std::string ReadKey(const zepasdk::KvFile& file, const char* key) {
    std::string value;
    if (file.Lookup("", key, value) != 1) return "";
    if (value.size() >= static_cast<size_t>(kValueMax)) value.resize(kValueMax - 1);
    return value.c_str();
}

// Copies text into a fixed array; false when it does not fit.
template <size_t N>
bool CopyField(char (&field)[N], const std::string& text) {
    if (text.size() >= N) return false;
    memcpy(field, text.c_str(), text.size() + 1);
    return true;
}

// Splits the "ports" text into trimmed, non-empty items; NULL when none.
bool ReadPorts(const std::string& text, PVLIBCSzList* ports) {
    *ports = nullptr;
    size_t start = 0;
    while (start <= text.size()) {
        size_t comma = text.find(',', start);
        if (comma == std::string::npos) comma = text.size();
        std::string item = Trim(text.substr(start, comma - start));
        start = comma + 1;
        if (item.empty()) continue;
        if (*ports == nullptr && (*ports = VLIBCSzListAlloc(4)) == nullptr) return false;
        if (VLIBCSzListPush(ports, item.c_str()) != 0) return false;
    }
    return true;
}

// One definition file as a record; NULL when it is no definition or on memory
// shortage (outOfMemory tells which).
PZEPAFwService ReadDefinition(const std::string& path, bool& outOfMemory) {
    outOfMemory = false;
    // One parse per file, not one per key.
    std::shared_ptr<const zepasdk::KvFile> parsed = zepasdk::LoadKvFile(path);
    if (!parsed) return nullptr;
    const zepasdk::KvFile& file = *parsed;
    std::string name = ReadKey(file, "name");
    if (name.empty()) return nullptr;
    PZEPAFwService rec = static_cast<PZEPAFwService>(calloc(1, sizeof(ZEPAFwService)));
    if (rec == nullptr) {
        outOfMemory = true;
        return nullptr;
    }
    std::string protocol = ReadKey(file, "protocol");
    bool ok = CopyField(rec->szName, name) && CopyField(rec->szTitle, ReadKey(file, "title")) &&
              CopyField(rec->szSubTitle, ReadKey(file, "subtitle")) &&
              CopyField(rec->szAltTitle, ReadKey(file, "alt_title"));
    if (!ok) {
        free(rec);
        return nullptr;
    }
    rec->dwTcp = (protocol == "tcp" || protocol == "all") ? 1 : 0;
    rec->dwUdp = (protocol == "udp" || protocol == "all") ? 1 : 0;
    if (!ReadPorts(ReadKey(file, "ports"), &rec->pPorts)) {
        ZEPAFwServiceFree(rec);
        outOfMemory = true;
        return nullptr;
    }
    return rec;
}

}  // namespace

extern "C" {

int ZEPAFwServiceEnum(PZEPAFwService* ppList) {
    if (ppList == nullptr) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    *ppList = nullptr;
    char dir[4096];
    std::vector<std::string> files;
    if (ZEPASysRootPath(ZEPA_FW_SERVICE_DIR, dir, sizeof(dir)) < 0 || !ListDefinitionFiles(dir, files)) {
        VLIBCErrSet(ZEPA_ERR_FILE_NOT_FOUND);
        return -1;
    }
    PZEPAFwService head = nullptr;
    PZEPAFwService* tail = &head;
    int count = 0;
    for (const std::string& file : files) {
        bool outOfMemory = false;
        PZEPAFwService rec = ReadDefinition(file, outOfMemory);
        if (outOfMemory) {
            ZEPAFwServiceFree(head);
            VLIBCErrSet(ZEPA_ERR_OUT_OF_MEMORY);
            return -1;
        }
        if (rec == nullptr) continue;
        *tail = rec;
        tail = &rec->pNext;
        ++count;
    }
    if (count == 0) {
        VLIBCErrSet(ZEPA_ERR_NOT_FOUND);
        return 0;
    }
    *ppList = head;
    VLIBCErrSet(ZEPA_ERR_NONE);
    return count;
}

PZEPAFwService ZEPAFWServiceFind(PZEPAFwService pList, const char* szName) {
    if (pList == nullptr || szName == nullptr) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return nullptr;
    }
    for (PZEPAFwService rec = pList; rec != nullptr; rec = rec->pNext) {
        if (strcmp(rec->szName, szName) == 0) {
            VLIBCErrSet(ZEPA_ERR_NONE);
            return rec;
        }
    }
    VLIBCErrSet(ZEPA_ERR_NOT_FOUND);
    return nullptr;
}

void ZEPAFwServiceFree(PZEPAFwService pList) {
    while (pList != nullptr) {
        PZEPAFwService next = pList->pNext;
        VLIBCSzListFree(pList->pPorts);
        free(pList);
        pList = next;
    }
}

}  // extern "C"
