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

// libcurl SSL-context callback for "https://" requests.
CURLcode SetUpSslContext(CURL* curl, void* sslctx, void* userdata);

// Frees the shares given up by GetCurlShare(true) that nobody uses any more.
void ReleaseAbandonedShares();

}  // namespace RequestInternal
}  // namespace Relay
}  // namespace ZEPA

#endif
