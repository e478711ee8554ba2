/* The floor of the daemon's footprint: a minimal C daemon on the same libcurl
 * and OpenSSL that makes one HTTPS exchange (so TLS and the CA store are
 * loaded as in the real daemon), says "connected" and then idles in poll(). */
#include <curl/curl.h>
#include <poll.h>
#include <stdio.h>

static size_t discard(char* p, size_t s, size_t n, void* u) {
    (void)p;
    (void)u;
    return s * n;
}

int main(int argc, char** argv) {
    if (argc != 3) {
        fprintf(stderr, "usage: min_daemon URL CAFILE\n");
        return 64;
    }
    curl_global_init(CURL_GLOBAL_DEFAULT);
    CURL* c = curl_easy_init();
    curl_easy_setopt(c, CURLOPT_URL, argv[1]);
    curl_easy_setopt(c, CURLOPT_POSTFIELDS, "action=ping");
    curl_easy_setopt(c, CURLOPT_CAINFO, argv[2]);
    curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, discard);
    CURLcode rc = curl_easy_perform(c);
    printf("%s\n", rc == CURLE_OK ? "connected" : curl_easy_strerror(rc));
    fflush(stdout);
    for (;;) poll(NULL, 0, -1);
}
