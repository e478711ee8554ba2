// The one mapping of libcurl codes to failure classes, and the results both
// last-error memories draw from it.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include "request/curl_class.h"

using namespace ZEPA::Relay;

TEST(CurlClass, SuccessIsNoFailure) { EXPECT_EQ(CurlFailure::NONE, ClassifyCurlCode(CURLE_OK)); }

TEST(CurlClass, UnresolvedHostIsResolve) {
    EXPECT_EQ(CurlFailure::RESOLVE, ClassifyCurlCode(CURLE_COULDNT_RESOLVE_HOST));
}

TEST(CurlClass, TransportFailuresAreNetwork) {
    for (CURLcode code : {CURLE_COULDNT_CONNECT, CURLE_OPERATION_TIMEDOUT, CURLE_SSL_CONNECT_ERROR,
                          CURLE_SEND_ERROR, CURLE_RECV_ERROR, CURLE_AGAIN}) {
        EXPECT_EQ(CurlFailure::NETWORK, ClassifyCurlCode(code)) << code;
    }
}

TEST(CurlClass, EverythingElseIsOther) {
    // A proxy that did not resolve is not the host: it stays "other".
    for (int code : {static_cast<int>(CURLE_COULDNT_RESOLVE_PROXY), static_cast<int>(CURLE_GOT_NOTHING),
                     static_cast<int>(CURLE_WRITE_ERROR), static_cast<int>(CURLE_PEER_FAILED_VERIFICATION),
                     static_cast<int>(CURLE_URL_MALFORMAT), -1, 100000}) {
        EXPECT_EQ(CurlFailure::OTHER, ClassifyCurlCode(code)) << code;
    }
}
