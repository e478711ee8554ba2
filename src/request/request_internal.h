// Pieces of Request shared between its source files.
#ifndef ZEPARELAYD_SRC_REQUEST_REQUEST_INTERNAL_H
#define ZEPARELAYD_SRC_REQUEST_REQUEST_INTERNAL_H

#include <curl/curl.h>

#include <cstddef>

namespace ZEPA {
namespace Relay {
namespace RequestInternal {

// libcurl write callback: appends the bytes to the std::string user pointer.
size_t WriteResponse(char* ptr, size_t size, size_t count, void* userdata);

// libcurl SSL-context callback for "https://" requests. userdata is the mark
// below when the handle leaves the trust store to it, else null.
CURLcode SetUpSslContext(CURL* curl, void* sslctx, void* userdata);

// Non-null when the process-wide trust store can be built: the handle then
// loads no CA file of its own (CURLOPT_CAINFO, CURLOPT_CAPATH null) and
// passes this mark as CURLOPT_SSL_CTX_DATA.
void* SharedTrustStoreMark();

// Frees the shares given up by GetCurlShare(true) that nobody uses any more.
void ReleaseAbandonedShares();

}  // namespace RequestInternal
}  // namespace Relay
}  // namespace ZEPA

#endif
