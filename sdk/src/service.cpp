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

// Pointer ranges rather than strings: router rule files hold thousands of
// port lists, each parsed once per service looked up.
void TrimRange(const char*& b, const char*& e) {
    while (b < e && (*b == ' ' || *b == '\t')) ++b;
    while (e > b && (e[-1] == ' ' || e[-1] == '\t')) --e;
}

// A port of decimal digits only, 0 to 65535.
bool ParsePort(const char* b, const char* e, long& port) {
    TrimRange(b, e);
    if (b == e || e - b > 5) return false;
    long value = 0;
    for (const char* p = b; p < e; ++p) {
        if (!isdigit(static_cast<unsigned char>(*p))) return false;
        value = value * 10 + (*p - '0');
    }
    port = value;
    return port <= kPortMax;
}

// One item: "port" or "low-high".
bool ParseItem(const char* b, const char* e, long& low, long& high) {
    const char* dash = static_cast<const char*>(memchr(b, '-', static_cast<size_t>(e - b)));
    if (dash == nullptr) {
        if (!ParsePort(b, e, low)) return false;
        high = low;
        return true;
    }
    return ParsePort(b, dash, low) && ParsePort(dash + 1, e, high) && low <= high;
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
    const char* end = szPorts + strlen(szPorts);
    long count = 0;
    for (const char* start = szPorts;;) {
        const char* comma = static_cast<const char*>(memchr(start, ',', static_cast<size_t>(end - start)));
        if (comma == nullptr) comma = end;
        long low = 0, high = 0;
        if (!ParseItem(start, comma, low, high)) {
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
        if (comma == end) break;
        start = comma + 1;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return static_cast<int>(count);
}

}  // extern "C"
