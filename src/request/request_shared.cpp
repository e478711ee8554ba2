// Request: process-wide share handle, DNS-cache reset, cookies and the TLS
// context set-up.
#define ZEPA_LOG_SOURCE "request"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <openssl/x509_vfy.h>
#include <resolv.h>
#include <sys/stat.h>
#include <zeparelayd/request.h>

#include <cstdio>
#include <cstring>
#include <exception>
#include <vector>

#include "common/file_io.h"
#include "common/log.h"
#include "request/request_internal.h"

namespace ZEPA {
namespace Relay {

std::string Request::_strCookie;
CURLSH* Request::_share = nullptr;
bool Request::blForbidConnReuse = false;

namespace {

std::string g_extraCaFile;

// Shares given up while requests still used them, freed once their last
// user is gone. Held by a pointer that is never freed, so that they stay
// reachable when requests outlive the static destructors.
std::vector<CURLSH*>& AbandonedShares() {
    static std::vector<CURLSH*>* shares = new std::vector<CURLSH*>();
    return *shares;
}

void DiscardShare() {
    RequestInternal::ReleaseAbandonedShares();
    if (Request::_share != nullptr) {
        CURLSHcode rc = curl_share_cleanup(Request::_share);
        if (rc != CURLSHE_OK) {
            ZLOG(ZEPA_LOG_NOTICE, "curl_share_cleanup failed. [%d:%s]", rc, curl_share_strerror(rc));
            AbandonedShares().push_back(Request::_share);
        }
    }
    Request::_share = nullptr;
    Request::blForbidConnReuse = true;
}

CURLSH* MakeShare() {
    CURLSH* share = curl_share_init();
    if (share == nullptr) {
        ZLOG(ZEPA_LOG_ERR, "curl_share_init failed");
        return nullptr;
    }
    if (curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_COOKIE) != CURLSHE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURL_LOCK_DATA_COOKIE failed");
        curl_share_cleanup(share);
        return nullptr;
    }
    if (curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_DNS) != CURLSHE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURL_LOCK_DATA_DNS failed");
        curl_share_cleanup(share);
        return nullptr;
    }
    return share;
}

// The host of a URL as the cookie lines name it: the text two characters after
// the first "/", at most 127 characters, cut at a port or the path.
std::string CookieHostOf(const std::string& url) {
    size_t slash = url.find('/');
    if (slash == std::string::npos || slash + 2 > url.size()) return "";
    char host[128];
    snprintf(host, sizeof(host), "%s", url.c_str() + slash + 2);
    char* end = strchr(host, ':');
    if (end == nullptr) end = strchr(host, '/');
    if (end != nullptr) *end = '\0';
    return host;
}

int AcceptEveryCertificate(int /*preverified*/, X509_STORE_CTX* /*ctx*/) { return 1; }

// What a trust file was when it was loaded; a change of any field reloads it.
struct FileStamp {
    bool exists = false;
    dev_t dev = 0;
    ino_t ino = 0;
    off_t size = 0;
    struct timespec mtime = {0, 0};
    struct timespec ctime = {0, 0};

    static FileStamp Of(const std::string& path) {
        FileStamp stamp;
        struct stat st;
        if (path.empty() || stat(path.c_str(), &st) != 0) return stamp;
        stamp.exists = true;
        stamp.dev = st.st_dev;
        stamp.ino = st.st_ino;
        stamp.size = st.st_size;
        stamp.mtime = st.st_mtim;
        stamp.ctime = st.st_ctim;
        return stamp;
    }
    bool operator==(const FileStamp& o) const {
        return exists == o.exists && dev == o.dev && ino == o.ino && size == o.size &&
               mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec &&
               ctime.tv_sec == o.ctime.tv_sec && ctime.tv_nsec == o.ctime.tv_nsec;
    }
};

// The trust store of every "https://" connection: libcurl's default bundle
// and folder plus the extra CA file. Parsing the system bundle costs far more
// than a loopback exchange, so it is loaded once and shared by the SSL
// contexts (reference counted), and reloaded when a file changes.
struct TrustStore {
    X509_STORE* store = nullptr;
    bool extraFailed = false;
    std::string bundle;
    std::string folder;
    std::string extra;
    FileStamp bundleStamp;
    FileStamp extraStamp;
};

TrustStore g_trust;

void DefaultTrustLocations(std::string& bundle, std::string& folder) {
    const curl_version_info_data* info = curl_version_info(CURLVERSION_NOW);
    bundle = info != nullptr && info->cainfo != nullptr ? info->cainfo : "";
    folder = info != nullptr && info->capath != nullptr ? info->capath : "";
}

// Builds the store as libcurl would for a verifying connection; null when the
// bundle cannot be loaded (the caller then leaves libcurl to report it).
X509_STORE* BuildTrustStore(const std::string& bundle, const std::string& folder, const std::string& extra,
                            bool& extraFailed) {
    X509_STORE* store = X509_STORE_new();
    if (store == nullptr) return nullptr;
    if ((!bundle.empty() && X509_STORE_load_file(store, bundle.c_str()) != 1) ||
        (!folder.empty() && X509_STORE_load_path(store, folder.c_str()) != 1)) {
        X509_STORE_free(store);
        return nullptr;
    }
    X509_STORE_set_flags(store, X509_V_FLAG_TRUSTED_FIRST | X509_V_FLAG_PARTIAL_CHAIN);
    extraFailed = !extra.empty() && X509_STORE_load_file(store, extra.c_str()) != 1;
    return store;
}

// The current shared store, reloaded when a trust file changed; null when it
// cannot be built.
X509_STORE* CurrentTrustStore() {
    std::string bundle, folder;
    DefaultTrustLocations(bundle, folder);
    FileStamp bundleStamp = FileStamp::Of(bundle);
    FileStamp extraStamp = FileStamp::Of(g_extraCaFile);
    TrustStore& t = g_trust;
    if (t.store != nullptr && t.bundle == bundle && t.folder == folder && t.extra == g_extraCaFile &&
        t.bundleStamp == bundleStamp && t.extraStamp == extraStamp)
        return t.store;
    X509_STORE_free(t.store);
    t.store = BuildTrustStore(bundle, folder, g_extraCaFile, t.extraFailed);
    t.bundle = bundle;
    t.folder = folder;
    t.extra = g_extraCaFile;
    t.bundleStamp = bundleStamp;
    t.extraStamp = extraStamp;
    return t.store;
}

}  // namespace

namespace RequestInternal {

void ReleaseAbandonedShares() {
    std::vector<CURLSH*>& shares = AbandonedShares();
    if (shares.empty()) return;
    std::vector<CURLSH*> stillUsed;
    for (CURLSH* share : shares) {
        if (curl_share_cleanup(share) != CURLSHE_OK) stillUsed.push_back(share);
    }
    shares.swap(stillUsed);
}

size_t WriteResponse(char* ptr, size_t size, size_t count, void* userdata) {
    size_t bytes = size * count;
    if (bytes == 0) return 0;
    std::string* answer = static_cast<std::string*>(userdata);
    // A longer answer is no answer of ours: taking fewer bytes than offered
    // ends the transfer with CURLE_WRITE_ERROR, and memory stays bounded.
    if (bytes > FileIo::MAX_ANSWER_BYTES - answer->size()) {
        ZLOG(ZEPA_LOG_ERR, "answer longer than %zu bytes refused", FileIo::MAX_ANSWER_BYTES);
        return 0;
    }
    try {
        answer->append(ptr, bytes);
    } catch (const std::exception&) {
        return 0;
    }
    return bytes;
}

void* SharedTrustStoreMark() { return CurrentTrustStore() != nullptr ? &g_trust : nullptr; }

CURLcode SetUpSslContext(CURL* /*curl*/, void* sslctx, void* userdata) {
    SSL_CTX* ctx = static_cast<SSL_CTX*>(sslctx);
    SSL_CTX_set_verify(ctx, SSL_VERIFY_CLIENT_ONCE, AcceptEveryCertificate);
    if (userdata == &g_trust) {
        X509_STORE* store = CurrentTrustStore();
        if (store == nullptr) return CURLE_SSL_CACERT_BADFILE;
        SSL_CTX_set1_cert_store(ctx, store);
        if (g_trust.extraFailed)
            ZLOG(ZEPA_LOG_WARNING, "load extra CA file [%s] failed", g_extraCaFile.c_str());
        return CURLE_OK;
    }
    if (!g_extraCaFile.empty() && SSL_CTX_load_verify_locations(ctx, g_extraCaFile.c_str(), nullptr) != 1) {
        ZLOG(ZEPA_LOG_WARNING, "load extra CA file [%s] failed", g_extraCaFile.c_str());
    }
    return CURLE_OK;
}

}  // namespace RequestInternal

CURLSH* Request::GetCurlShare(bool renew) {
    if (renew) {
        DiscardShare();
    } else if (_share != nullptr) {
        return _share;
    }
    _share = MakeShare();
    return _share;
}

bool Request::CleanDnsCache() {
    res_init();
    GetCurlShare(true);
    return true;
}

std::string& Request::GetCookie() { return _strCookie; }

bool Request::SetCookie(const std::string& cookie) {
    _strCookie = cookie;
    return true;
}

void Request::SetExtraCaFile(const std::string& path) { g_extraCaFile = path; }

const std::string& Request::GetExtraCaFile() { return g_extraCaFile; }

bool Request::GetCookies(std::list<std::string>& out) const {
    if (_cookies.empty()) return false;
    out = _cookies;
    return true;
}

bool Request::SaveCookies() {
    struct curl_slist* list = nullptr;
    CURLcode rc = curl_easy_getinfo(_curl, CURLINFO_COOKIELIST, &list);
    if (rc != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "curl_easy_getinfo failed: %d", rc);
        curl_slist_free_all(list);
        return false;
    }
    // An empty host (a URL without "//host") matches no cookie.
    std::string host = CookieHostOf(_url);
    for (struct curl_slist* item = list; item != nullptr && !host.empty(); item = item->next) {
        if (strncmp(item->data, host.c_str(), host.size()) == 0) _cookies.push_back(item->data);
    }
    curl_slist_free_all(list);
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
