// What a failed libcurl transfer means to a caller: the host name did not
// resolve, the network failed on the way, or something else went wrong.
// Both last-error memories (Request::GetError and the alias client) map these
// classes to their own results.
#ifndef ZEPARELAYD_SRC_REQUEST_CURL_CLASS_H
#define ZEPARELAYD_SRC_REQUEST_CURL_CLASS_H

#include <curl/curl.h>

namespace ZEPA {
namespace Relay {

enum class CurlFailure {
    NONE,     // CURLE_OK
    RESOLVE,  // the host name did not resolve
    NETWORK,  // connect, time-out, TLS handshake, send or receive failure
    OTHER,    // every other code
};

// Inline, so that the library's sources and the unit tests share the one
// definition without exporting it.
inline CurlFailure ClassifyCurlCode(int code) {
    switch (code) {
        case CURLE_OK:
            return CurlFailure::NONE;
        case CURLE_COULDNT_RESOLVE_HOST:
            return CurlFailure::RESOLVE;
        case CURLE_COULDNT_CONNECT:
        case CURLE_OPERATION_TIMEDOUT:
        case CURLE_SSL_CONNECT_ERROR:
        case CURLE_SEND_ERROR:
        case CURLE_RECV_ERROR:
        case CURLE_AGAIN:
            return CurlFailure::NETWORK;
        default:
            return CurlFailure::OTHER;
    }
}

// libcurl's text for a code kept as an int (HTTPResponse takes any int): a
// number outside CURLcode never becomes one, and gets libcurl's own words for
// a code it does not know.
inline const char* CurlCodeText(int code) {
    if (code < CURLE_OK || code >= CURL_LAST) return "Unknown error";
    return curl_easy_strerror(static_cast<CURLcode>(code));
}

}  // namespace Relay
}  // namespace ZEPA

#endif
