// Request: construction, handle set-up and the transfer itself.
#define ZEPA_LOG_SOURCE "request"

#include <zeparelayd/request.h>
#include <zepasdk/hubinfo.h>

#include <cstring>

#include "common/log.h"
#include "request/curl_class.h"
#include "request/request_internal.h"

// Sets one option; on failure logs "set <OPTION>to curl handle failed" (no
// blank: the message is matched as it stands), frees the handle, returns false.
#define REQUEST_SETOPT_OR_FAIL(option, value)                           \
    do {                                                                \
        if (curl_easy_setopt(_curl, option, value) != CURLE_OK) {       \
            ZLOG(ZEPA_LOG_ERR, "set " #option "to curl handle failed"); \
            FreeHandle();                                               \
            return false;                                               \
        }                                                               \
    } while (0)

namespace ZEPA {
namespace Relay {

namespace {

const char kUserAgentProduct[] = "Farlink";
const char kDefaultUserAgent[] = "Velmora Relayd 1.0-5055";
const long kConnectTimeout = 60;
const long kTransferTimeout = 90;

// Last libcurl code that GetError logged; 0 after a success.
int g_lastLoggedCurlError = 0;

}  // namespace

Request::Request(const char* url, const char* data, bool post) {
    Reset();
    if (url == nullptr) return;
    Set(std::string(url), std::string(data == nullptr ? "" : data), post);
}

Request::Request(const std::string& url, const Json::Value& data, bool post) {
    Reset();
    Set(url, data, post);
}

Request::Request(const Request& other) : _url(other._url), _data(other._data) {
    Reset();
    AdoptHandleOf(other);
    InitSend();
}

Request& Request::operator=(const Request& other) {
    if (this == &other) return *this;
    _url = other._url;
    _data = other._data;
    // Deliberately no clean-up of the handle held before: callers only assign
    // to a request without one.
    _curl = nullptr;
    AdoptHandleOf(other);
    _async = false;
    InitSend();
    return *this;
}

Request::~Request() { FreeHandle(); }

void Request::Reset() {
    _curl = nullptr;
    _curlResult = CURLE_OK;
    memset(_errorBuffer, 0, sizeof(_errorBuffer));
    _async = false;
    _done = false;
    _httpStatus = 0;
    _postBody = false;
}

void Request::FreeHandle() {
    if (_curl == nullptr) return;
    curl_easy_cleanup(_curl);
    _curl = nullptr;
    _postBody = false;
    // This may have been the last user of a share given up earlier.
    RequestInternal::ReleaseAbandonedShares();
}

// Gives this request a duplicate of other's handle. The duplicate would still
// point at other's error buffer and body, and libcurl does not carry the share
// over: re-point all three at this request's own.
bool Request::AdoptHandleOf(const Request& other) {
    _curl = other._curl == nullptr ? nullptr : curl_easy_duphandle(other._curl);
    _postBody = false;
    if (_curl == nullptr) return false;
    CURLSH* share = GetCurlShare(false);
    if (share != nullptr) curl_easy_setopt(_curl, CURLOPT_SHARE, share);
    curl_easy_setopt(_curl, CURLOPT_COOKIEFILE, "");
    curl_easy_setopt(_curl, CURLOPT_ERRORBUFFER, _errorBuffer);
    if (other._postBody) {
        curl_easy_setopt(_curl, CURLOPT_POSTFIELDS, _data.c_str());
        _postBody = true;
    }
    return true;
}

bool Request::operator==(const void* handle) const { return handle == _curl; }

bool Request::operator!=(const void* handle) const { return !(*this == handle); }

bool Request::IsValid() const { return _curl != nullptr && !_url.empty(); }

const std::string& Request::GetUrl() const { return _url; }

const std::string& Request::GetData() const { return _data; }

CURLcode Request::GetCurlResult() const { return _curlResult; }

CURL* Request::GetCurlHandle() const { return _curl; }

bool Request::Set(const std::string& url, const std::string& data, bool post) {
    if (url.empty()) return false;
    _url = url;
    if (_curl == nullptr) {
        _curl = curl_easy_init();
        if (_curl == nullptr) return false;
    } else {
        // curl_easy_reset does not free the cookie-file list: drop it first.
        curl_easy_setopt(_curl, CURLOPT_COOKIEFILE, static_cast<char*>(nullptr));
        curl_easy_reset(_curl);
    }
    _postBody = false;

    CURLSH* share = GetCurlShare(false);
    if (share == nullptr) return false;
    REQUEST_SETOPT_OR_FAIL(CURLOPT_SHARE, share);
    // The share's store holds the cookies, but this libcurl only reads and
    // stores them once the cookie engine is on; "" turns it on, reading no file.
    REQUEST_SETOPT_OR_FAIL(CURLOPT_COOKIEFILE, "");
    if (!InitSend()) {
        ZLOG(ZEPA_LOG_ERR, "init send failed");
        return false;
    }
    REQUEST_SETOPT_OR_FAIL(CURLOPT_URL, _url.c_str());
    SetData(data, post);
    return SetUpHandle();
}

// Steps after the payload: identity, time-outs, callbacks, TLS and cookie.
bool Request::SetUpHandle() {
    char userAgent[1024];
    memset(userAgent, 0, sizeof(userAgent));
    if (VLIBHubinfoUserAgentGet(kUserAgentProduct, userAgent, sizeof(userAgent)) != 0) {
        strncpy(userAgent, kDefaultUserAgent, sizeof(userAgent) - 1);
    }
    REQUEST_SETOPT_OR_FAIL(CURLOPT_USERAGENT, userAgent);
    REQUEST_SETOPT_OR_FAIL(CURLOPT_CONNECTTIMEOUT, kConnectTimeout);
    REQUEST_SETOPT_OR_FAIL(CURLOPT_TIMEOUT, kTransferTimeout);
    // Always: every transfer gets a fresh connection.
    REQUEST_SETOPT_OR_FAIL(CURLOPT_FORBID_REUSE, 1L);
    REQUEST_SETOPT_OR_FAIL(CURLOPT_WRITEFUNCTION, RequestInternal::WriteResponse);
    memset(_errorBuffer, 0, sizeof(_errorBuffer));
    REQUEST_SETOPT_OR_FAIL(CURLOPT_ERRORBUFFER, _errorBuffer);
    if (_url.compare(0, 8, "https://") == 0 && !SetUpHttps()) return false;
    if (!_strCookie.empty()) REQUEST_SETOPT_OR_FAIL(CURLOPT_COOKIE, _strCookie.c_str());
    return true;
}

// Peer and host verification are asked of libcurl, while the SSL context's
// own verify callback accepts every chain; both settings are kept as they are.
bool Request::SetUpHttps() {
    REQUEST_SETOPT_OR_FAIL(CURLOPT_SSL_CTX_FUNCTION, RequestInternal::SetUpSslContext);
    // The same trust anchors, parsed once per process instead of per connection.
    if (void* mark = RequestInternal::SharedTrustStoreMark()) {
        REQUEST_SETOPT_OR_FAIL(CURLOPT_SSL_CTX_DATA, mark);
        REQUEST_SETOPT_OR_FAIL(CURLOPT_CAINFO, static_cast<char*>(nullptr));
        REQUEST_SETOPT_OR_FAIL(CURLOPT_CAPATH, static_cast<char*>(nullptr));
    }
    curl_easy_setopt(_curl, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(_curl, CURLOPT_SSL_VERIFYHOST, 2L);
    return true;
}

bool Request::InitSend() {
    _httpStatus = 0;
    _done = false;
    _response.clear();
    if (_curl == nullptr) return true;
    REQUEST_SETOPT_OR_FAIL(CURLOPT_WRITEDATA, &_response);
    return true;
}

bool Request::Send() {
    if (!IsValid() || _async || !InitSend()) return false;
    _curlResult = curl_easy_perform(_curl);
    if (_curlResult != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "curl_easy_perform failed (%d): [%s]", _curlResult, _url.c_str());
        return false;
    }
    _done = true;
    _httpStatus = GetHttpStatus();
    return _httpStatus == 200;
}

bool Request::JobAdd(void* multi) {
    if (!IsValid() || multi == nullptr || !InitSend()) return false;
    CURLM* m = static_cast<CURLM*>(multi);
    if (curl_multi_add_handle(m, _curl) != CURLM_OK) {
        ZLOG(ZEPA_LOG_ERR, "curl_multi_add_handle() failed");
        return false;
    }
    int running = 0;
    CURLMcode rc = curl_multi_socket_action(m, CURL_SOCKET_TIMEOUT, 0, &running);
    if (rc != CURLM_OK && rc != CURLM_CALL_MULTI_PERFORM) {
        ZLOG(ZEPA_LOG_ERR, "curl_multi_socket_action failed");
        return false;
    }
    _async = true;
    return true;
}

bool Request::JobDone(CURLcode code) {
    _done = true;
    _httpStatus = GetHttpStatus();
    _curlResult = code;
    return true;
}

bool Request::JobRemove(void* multi) {
    if (multi == nullptr) return false;
    if (curl_multi_remove_handle(static_cast<CURLM*>(multi), _curl) != CURLM_OK) {
        ZLOG(ZEPA_LOG_ERR, "curl_multi_remove_handle() failed");
        return false;
    }
    _async = false;
    FreeHandle();
    return true;
}

int Request::GetHttpStatus() {
    if (_httpStatus != 0) return static_cast<int>(_httpStatus);
    if (!IsValid() || !_done) return -1;
    long status = 0;
    CURLcode rc = curl_easy_getinfo(_curl, CURLINFO_RESPONSE_CODE, &status);
    if (rc != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "Fail to get curl http info: %d, %s", rc, curl_easy_strerror(rc));
        return -1;
    }
    SaveCookies();
    return static_cast<int>(status);
}

std::string Request::GetResponse() const {
    if (_done && _httpStatus == 200) return _response;
    return "";
}

RELAYD_RET Request::GetError() const {
    if (_curlResult == CURLE_OK) {
        g_lastLoggedCurlError = 0;
        if (_httpStatus == 200) return RELAYD_SUCCESS;
        ZLOG(ZEPA_LOG_INFO, "http status: %d", static_cast<int>(_httpStatus));
        if (_httpStatus >= 400 && _httpStatus <= 499) return RELAYD_ERR_NETWORK;
        if (_httpStatus >= 500 && _httpStatus <= 599) return RELAYD_ERR_SERVER_BUSY;
        return RELAYD_ERR_UNKNOWN;
    }
    if (_curlResult != g_lastLoggedCurlError) {
        ZLOG(ZEPA_LOG_ERR, "curl error: %d, %s", _curlResult, curl_easy_strerror(_curlResult));
        g_lastLoggedCurlError = _curlResult;
    }
    switch (ClassifyCurlCode(_curlResult)) {
        case CurlFailure::RESOLVE:
            return RELAYD_ERR_RESOLV;
        case CurlFailure::NETWORK:
            return RELAYD_ERR_NETWORK;
        default:
            // 2 has no member of its own among the results.
            return static_cast<RELAYD_RET>(RELAYD_RESULT_UNAVAILABLE);
    }
}

bool Request::SetTcpKeepAlive(int seconds) {
    const long s = seconds;
    if (curl_easy_setopt(_curl, CURLOPT_TCP_KEEPALIVE, 1L) != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURLOPT_TCP_KEEPALIVEto curl handle failed");
    } else if (curl_easy_setopt(_curl, CURLOPT_TCP_KEEPIDLE, s) != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURLOPT_TCP_KEEPIDLEto curl handle failed");
    } else if (curl_easy_setopt(_curl, CURLOPT_TCP_KEEPINTVL, s) != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURLOPT_TCP_KEEPINTVLto curl handle failed");
    } else if (curl_easy_setopt(_curl, CURLOPT_TIMEOUT, 0L) != CURLE_OK) {
        // No transfer limit: a long-poll request must not be cut.
        ZLOG(ZEPA_LOG_ERR, "set CURLOPT_TIMEOUTto curl handle failed");
    }
    // Deliberately true: a request whose keep-alive could not be set is still sent.
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
