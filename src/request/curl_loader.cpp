// libcurl and libssl, loaded on the first request rather than at program start.
//
// Loading libcurl pulls in its whole dependency tree (TLS, LDAP, Kerberos,
// SSH, IDN, HTTP/2 libraries, some forty objects and ten thousand symbol
// relocations). A process that only reads the daemon's status files pays for
// that before main() at every start. The library therefore defines, hidden
// inside itself, the few libcurl and libssl entry points it calls; each one
// loads the real library once, then forwards. A program that uses libcurl
// itself (the daemon's event loop) links it as usual and gets the same
// instance, so handles pass freely between the two.
#define ZEPA_LOG_SOURCE "request"

#include <curl/curl.h>
#include <dlfcn.h>
#include <openssl/ssl.h>

#include <cstdarg>

#include "common/log.h"

namespace {

const char kCurlLibrary[] = "libcurl.so.4";
const char kSslLibrary[] = "libssl.so.3";

void* Open(const char* name) {
    void* lib = dlopen(name, RTLD_NOW | RTLD_LOCAL);
    if (lib == nullptr) ZLOG(ZEPA_LOG_ERR, "load %s failed: %s", name, dlerror());
    return lib;
}

void* CurlSymbol(const char* name) {
    static void* lib = Open(kCurlLibrary);
    return lib == nullptr ? nullptr : dlsym(lib, name);
}

void* SslSymbol(const char* name) {
    static void* lib = Open(kSslLibrary);
    return lib == nullptr ? nullptr : dlsym(lib, name);
}

// The real function, looked up once per entry point.
#define ZEPA_REAL(loader, name) static const auto real = reinterpret_cast<decltype(&name)>(loader(#name))

}  // namespace

// The variadic entry points take libcurl's own signatures, whose last named
// parameter is an int-sized enum: va_start on it is well defined here.
#ifdef __clang__
#pragma clang diagnostic ignored "-Wvarargs"
#endif

extern "C" {

CURL* curl_easy_init(void) {
    ZEPA_REAL(CurlSymbol, curl_easy_init);
    return real == nullptr ? nullptr : real();
}

void curl_easy_cleanup(CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_easy_cleanup);
    if (real != nullptr) real(curl);
}

void curl_easy_reset(CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_easy_reset);
    if (real != nullptr) real(curl);
}

CURL* curl_easy_duphandle(CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_easy_duphandle);
    return real == nullptr ? nullptr : real(curl);
}

CURLcode curl_easy_perform(CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_easy_perform);
    return real == nullptr ? CURLE_FAILED_INIT : real(curl);
}

// The value's type follows from the option's number range, as libcurl reads it.
CURLcode curl_easy_setopt(CURL* curl, CURLoption option, ...) {
    ZEPA_REAL(CurlSymbol, curl_easy_setopt);
    if (real == nullptr) return CURLE_FAILED_INIT;
    va_list ap;
    va_start(ap, option);
    CURLcode rc;
    if (option < CURLOPTTYPE_OBJECTPOINT) {
        rc = real(curl, option, va_arg(ap, long));
    } else if (option < CURLOPTTYPE_FUNCTIONPOINT) {
        rc = real(curl, option, va_arg(ap, void*));
    } else if (option < CURLOPTTYPE_OFF_T) {
        rc = real(curl, option, va_arg(ap, void (*)(void)));
    } else if (option < CURLOPTTYPE_BLOB) {
        rc = real(curl, option, va_arg(ap, curl_off_t));
    } else {
        rc = real(curl, option, va_arg(ap, void*));
    }
    va_end(ap);
    return rc;
}

// Every information item is returned through a pointer.
CURLcode curl_easy_getinfo(CURL* curl, CURLINFO info, ...) {
    ZEPA_REAL(CurlSymbol, curl_easy_getinfo);
    if (real == nullptr) return CURLE_FAILED_INIT;
    va_list ap;
    va_start(ap, info);
    CURLcode rc = real(curl, info, va_arg(ap, void*));
    va_end(ap);
    return rc;
}

const char* curl_easy_strerror(CURLcode code) {
    ZEPA_REAL(CurlSymbol, curl_easy_strerror);
    return real == nullptr ? "libcurl not loaded" : real(code);
}

char* curl_easy_escape(CURL* curl, const char* string, int length) {
    ZEPA_REAL(CurlSymbol, curl_easy_escape);
    return real == nullptr ? nullptr : real(curl, string, length);
}

void curl_free(void* p) {
    ZEPA_REAL(CurlSymbol, curl_free);
    if (real != nullptr) real(p);
}

void curl_slist_free_all(struct curl_slist* list) {
    ZEPA_REAL(CurlSymbol, curl_slist_free_all);
    if (real != nullptr) real(list);
}

curl_version_info_data* curl_version_info(CURLversion age) {
    ZEPA_REAL(CurlSymbol, curl_version_info);
    return real == nullptr ? nullptr : real(age);
}

CURLMcode curl_multi_add_handle(CURLM* multi, CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_multi_add_handle);
    return real == nullptr ? CURLM_INTERNAL_ERROR : real(multi, curl);
}

CURLMcode curl_multi_remove_handle(CURLM* multi, CURL* curl) {
    ZEPA_REAL(CurlSymbol, curl_multi_remove_handle);
    return real == nullptr ? CURLM_INTERNAL_ERROR : real(multi, curl);
}

CURLMcode curl_multi_socket_action(CURLM* multi, curl_socket_t s, int mask, int* running) {
    ZEPA_REAL(CurlSymbol, curl_multi_socket_action);
    return real == nullptr ? CURLM_INTERNAL_ERROR : real(multi, s, mask, running);
}

CURLSH* curl_share_init(void) {
    ZEPA_REAL(CurlSymbol, curl_share_init);
    return real == nullptr ? nullptr : real();
}

CURLSHcode curl_share_cleanup(CURLSH* share) {
    ZEPA_REAL(CurlSymbol, curl_share_cleanup);
    return real == nullptr ? CURLSHE_NOT_BUILT_IN : real(share);
}

// CURLSHOPT_SHARE and CURLSHOPT_UNSHARE take an int; the others a pointer.
CURLSHcode curl_share_setopt(CURLSH* share, CURLSHoption option, ...) {
    ZEPA_REAL(CurlSymbol, curl_share_setopt);
    if (real == nullptr) return CURLSHE_NOT_BUILT_IN;
    va_list ap;
    va_start(ap, option);
    CURLSHcode rc;
    if (option == CURLSHOPT_SHARE || option == CURLSHOPT_UNSHARE) {
        rc = real(share, option, va_arg(ap, int));
    } else if (option == CURLSHOPT_LOCKFUNC || option == CURLSHOPT_UNLOCKFUNC) {
        rc = real(share, option, va_arg(ap, void (*)(void)));
    } else {
        rc = real(share, option, va_arg(ap, void*));
    }
    va_end(ap);
    return rc;
}

const char* curl_share_strerror(CURLSHcode code) {
    ZEPA_REAL(CurlSymbol, curl_share_strerror);
    return real == nullptr ? "libcurl not loaded" : real(code);
}

// Called from libcurl's SSL-context callback, when libcurl (and with it
// libssl) is loaded already.
void SSL_CTX_set_verify(SSL_CTX* ctx, int mode, SSL_verify_cb callback) {
    ZEPA_REAL(SslSymbol, SSL_CTX_set_verify);
    if (real != nullptr) real(ctx, mode, callback);
}

int SSL_CTX_load_verify_locations(SSL_CTX* ctx, const char* file, const char* path) {
    ZEPA_REAL(SslSymbol, SSL_CTX_load_verify_locations);
    return real == nullptr ? 0 : real(ctx, file, path);
}

void SSL_CTX_set1_cert_store(SSL_CTX* ctx, X509_STORE* store) {
    ZEPA_REAL(SslSymbol, SSL_CTX_set1_cert_store);
    if (real != nullptr) real(ctx, store);
}

}  // extern "C"
