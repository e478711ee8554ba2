// The device identity, kept in key/value files under the system root.
#include "zepasdk/identity.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <net/if_arp.h>
#include <netpacket/packet.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <string>

#include "sdk_util.h"

using zepasdk::CopyIfFits;
using zepasdk::FailWith;
using zepasdk::RootPath;

namespace {

const char HUBTOKEN_CONF[] = "/etc/zepa/hubtoken.conf";
const char HUBTOKEN_SECRET[] = "/etc/zepa/hubtoken.secret";
const char CLOUD_CONF[] = "/etc/zepa/cloudservice.conf";
const size_t SECRET_BYTES = 32;
const size_t API_KEY_BYTES = 32;
const size_t TOKEN_DIGITS = 32;

// Reads key of file into value; ZEPA_ERR_NONE or the error to report.
int ReadKey(const std::string& file, const char* key, std::string& value) {
    char buf[1024];
    int n = VLIBCFileGetKeyValue(file.c_str(), key, buf, sizeof(buf));
    if (n < 0) return VLIBCErrGet();
    if (n == 0) return ZEPA_ERR_KEY_NOT_FOUND;
    value = buf;
    return ZEPA_ERR_NONE;
}

bool RandomHex(size_t bytes, std::string& out) {
    unsigned char raw[64];
    if (bytes > sizeof(raw) || RAND_bytes(raw, static_cast<int>(bytes)) != 1) return false;
    out = zepasdk::HexOf(raw, bytes);
    return true;
}

bool ReadSecret(const std::string& path, std::string& secret) {
    FILE* f = fopen(path.c_str(), "r");
    if (f == nullptr) return false;
    char line[256] = {0};
    bool ok = fgets(line, sizeof(line), f) != nullptr;
    fclose(f);
    if (!ok) return false;
    line[strcspn(line, "\r\n")] = '\0';
    secret = line;
    return !secret.empty();
}

// Creates the secret once, complete or not at all: written to a temporary
// file, then linked to its name, so a concurrent creator wins and a crash
// leaves no empty secret behind.
bool CreateSecret(const std::string& path) {
    std::string secret;
    if (!RandomHex(SECRET_BYTES, secret) || !zepasdk::MakeParentDirs(path)) return false;
    std::string tmp = path + ".tmp." + std::to_string(getpid());
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return false;
    secret += "\n";
    bool ok = write(fd, secret.data(), secret.size()) == static_cast<ssize_t>(secret.size());
    if (fsync(fd) != 0 || close(fd) != 0) ok = false;
    if (ok && link(tmp.c_str(), path.c_str()) != 0 && errno != EEXIST) ok = false;
    unlink(tmp.c_str());
    return ok;
}

bool DeviceSecret(std::string& secret) {
    std::string path = RootPath(HUBTOKEN_SECRET);
    if (path.empty()) return false;
    if (ReadSecret(path, secret)) return true;
    return CreateSecret(path) && ReadSecret(path, secret);
}

// The wireless extensions' name query (linux/wireless.h clashes with net/if.h).
const unsigned long WIRELESS_GET_NAME = 0x8B01;

bool IsWireless(int sock, const char* name) {
    struct ifreq req;
    memset(&req, 0, sizeof(req));
    strncpy(req.ifr_name, name, IFNAMSIZ - 1);
    return ioctl(sock, WIRELESS_GET_NAME, &req) == 0;
}

bool IsWiredCandidate(const struct ifaddrs* ifa) {
    if (ifa->ifa_addr == nullptr || ifa->ifa_addr->sa_family != AF_PACKET) return false;
    if (ifa->ifa_flags & IFF_LOOPBACK) return false;
    const struct sockaddr_ll* ll = reinterpret_cast<const struct sockaddr_ll*>(ifa->ifa_addr);
    if (ll->sll_hatype != ARPHRD_ETHER || ll->sll_halen != 6) return false;
    for (int i = 0; i < 6; ++i)
        if (ll->sll_addr[i] != 0) return true;
    return false;
}

std::string MacText(const struct sockaddr_ll* ll) {
    char text[ZEPA_CLOUD_MAC_SIZE];
    snprintf(text, sizeof(text), "%02x:%02x:%02x:%02x:%02x:%02x", ll->sll_addr[0], ll->sll_addr[1],
             ll->sll_addr[2], ll->sll_addr[3], ll->sll_addr[4], ll->sll_addr[5]);
    return text;
}

int StoreApiKey(const std::string& key) {
    std::string path = RootPath(CLOUD_CONF);
    if (path.empty() || !zepasdk::MakeParentDirs(path)) return ZEPA_ERR_IO;
    if (VLIBCFileSetKeyValue(path.c_str(), "api_key", key.c_str()) < 0) return ZEPA_ERR_IO;
    return ZEPA_ERR_NONE;
}

}  // namespace

extern "C" {

int ZEPAHubtokenGetToken(char* serial, int serialSize, char* token, int tokenSize) {
    if (serial == nullptr || token == nullptr || serialSize < 1 || tokenSize < 1)
        return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    serial[0] = '\0';
    token[0] = '\0';
    std::string file = RootPath(HUBTOKEN_CONF);
    std::string s, t;
    int err = ReadKey(file, "serial", s);
    if (err == ZEPA_ERR_NONE) err = ReadKey(file, "token", t);
    if (err != ZEPA_ERR_NONE) return FailWith(err);
    if (!CopyIfFits(s, serial, serialSize) || !CopyIfFits(t, token, tokenSize)) {
        serial[0] = '\0';
        token[0] = '\0';
        return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPAHubtokenGenerateToken(const char* serial, char* token, int tokenSize) {
    if (token != nullptr && tokenSize > 0) token[0] = '\0';
    if (serial == nullptr || serial[0] == '\0' || token == nullptr) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    if (tokenSize < ZEPA_HUBTOKEN_TOKEN_SIZE) return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    std::string secret;
    if (!DeviceSecret(secret)) return FailWith(ZEPA_ERR_IO);
    unsigned char mac[EVP_MAX_MD_SIZE];
    unsigned int macLen = 0;
    if (HMAC(EVP_sha256(), secret.data(), static_cast<int>(secret.size()),
             reinterpret_cast<const unsigned char*>(serial), strlen(serial), mac, &macLen) == nullptr)
        return FailWith(ZEPA_ERR_IO);
    std::string hex = zepasdk::HexOf(mac, macLen).substr(0, TOKEN_DIGITS);
    CopyIfFits(hex, token, tokenSize);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPACloudServiceGetMacAddress(char* buf, int size) {
    if (buf == nullptr || size < 1) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    buf[0] = '\0';
    if (size < ZEPA_CLOUD_MAC_SIZE) return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    struct ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return FailWith(ZEPA_ERR_IO);
    int sock = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const struct sockaddr_ll* best = nullptr;
    for (const struct ifaddrs* ifa = list; ifa != nullptr; ifa = ifa->ifa_next) {
        if (!IsWiredCandidate(ifa) || (sock >= 0 && IsWireless(sock, ifa->ifa_name))) continue;
        const struct sockaddr_ll* ll = reinterpret_cast<const struct sockaddr_ll*>(ifa->ifa_addr);
        if (best == nullptr || ll->sll_ifindex < best->sll_ifindex) best = ll;
    }
    std::string mac = best != nullptr ? MacText(best) : std::string();
    if (sock >= 0) close(sock);
    freeifaddrs(list);
    if (mac.empty()) return FailWith(ZEPA_ERR_NOT_FOUND);
    CopyIfFits(mac, buf, size);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPACloudServiceGetApiKey(char* key, int flags) {
    if (key == nullptr) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    key[0] = '\0';
    std::string value;
    int err = ReadKey(RootPath(CLOUD_CONF), "api_key", value);
    if (err != ZEPA_ERR_NONE) {
        if (flags & ZEPA_CLOUD_KEY_REGISTER) return ZEPACloudServiceRegisterApiKey(key, ZEPA_CLOUD_KEY_SIZE);
        return FailWith(err);
    }
    if (!CopyIfFits(value, key, ZEPA_CLOUD_KEY_SIZE)) return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return static_cast<int>(value.size());
}

int ZEPACloudServiceRegisterApiKey(char* key, int size) {
    if (key == nullptr || size < 1) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    key[0] = '\0';
    if (static_cast<size_t>(size) < API_KEY_BYTES * 2 + 1) return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    std::string fresh;
    if (!RandomHex(API_KEY_BYTES, fresh)) return FailWith(ZEPA_ERR_IO);
    int err = StoreApiKey(fresh);
    if (err != ZEPA_ERR_NONE) return FailWith(err);
    CopyIfFits(fresh, key, size);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return static_cast<int>(fresh.size());
}

}  // extern "C"
