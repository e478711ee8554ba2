#include "zepasdk/service.h"

#include <sys/stat.h>

#include <cctype>
#include <cstring>
#include <string>

namespace {

constexpr long kPortMax = 65535;

bool IsServiceName(const char* name) {
    if (name == nullptr || name[0] == '\0' || strchr(name, '/') != nullptr) return false;
    return strcmp(name, ".") != 0 && strcmp(name, "..") != 0;
}

std::string Trim(const std::string& s) {
    size_t b = s.find_first_not_of(" \t");
    if (b == std::string::npos) return "";
    size_t e = s.find_last_not_of(" \t");
    return s.substr(b, e - b + 1);
}

// A port of decimal digits only, 0 to 65535.
bool ParsePort(const std::string& text, long& port) {
    std::string t = Trim(text);
    if (t.empty() || t.size() > 5) return false;
    for (char c : t)
        if (!isdigit(static_cast<unsigned char>(c))) return false;
    port = strtol(t.c_str(), nullptr, 10);
    return port <= kPortMax;
}

// One item: "port" or "low-high".
bool ParseItem(const std::string& item, long& low, long& high) {
    size_t dash = item.find('-');
    if (dash == std::string::npos) {
        if (!ParsePort(item, low)) return false;
        high = low;
        return true;
    }
    return ParsePort(item.substr(0, dash), low) && ParsePort(item.substr(dash + 1), high) && low <= high;
}

}  // namespace

extern "C" {

int VLIBServiceIsEnabled(const char* szService) {
    if (!IsServiceName(szService)) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    std::string marker = std::string(ZEPA_SERVICE_MARKER_DIR) + "/" + szService + ".enabled";
    char path[4096];
    if (ZEPASysRootPath(marker.c_str(), path, sizeof(path)) < 0) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    struct stat st;
    return (stat(path, &st) == 0 && !S_ISDIR(st.st_mode)) ? 1 : 0;
}

int VLIBServiceRouterBasepathGet(char* szBuf, int size) {
    if (szBuf == nullptr || size <= 0) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    int len = ZEPASysRootPath(ZEPA_ROUTER_BASE_DIR, szBuf, static_cast<size_t>(size));
    VLIBCErrSet(len < 0 ? ZEPA_ERR_BUFFER_TOO_SMALL : ZEPA_ERR_NONE);
    return len;
}

int VLibParsePorts(const char* szPorts, int* piPorts, int nMax) {
    if (szPorts == nullptr) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    std::string text = szPorts;
    long count = 0;
    size_t start = 0;
    while (start <= text.size()) {
        size_t comma = text.find(',', start);
        if (comma == std::string::npos) comma = text.size();
        long low = 0, high = 0;
        if (!ParseItem(text.substr(start, comma - start), low, high)) {
            VLIBCErrSet(ZEPA_ERR_PARSE);
            return -1;
        }
        for (long port = low; port <= high; ++port, ++count) {
            if (piPorts == nullptr) continue;
            if (count >= nMax) {
                VLIBCErrSet(ZEPA_ERR_BUFFER_TOO_SMALL);
                return -1;
            }
            piPorts[count] = static_cast<int>(port);
        }
        start = comma + 1;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return static_cast<int>(count);
}

}  // extern "C"
