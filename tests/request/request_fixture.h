// Fixture of the request tests: a private system root and a fresh local
// HTTP/HTTPS server whose throwaway CA the requests trust.
#ifndef ZEPARELAYD_TESTS_REQUEST_REQUEST_FIXTURE_H
#define ZEPARELAYD_TESTS_REQUEST_REQUEST_FIXTURE_H

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include <zeparelayd/request.h>

#include "support/local_server.h"
#include "support/test_support.h"

namespace requesttest {

class ServerTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        ZEPA::Relay::Request::SetExtraCaFile(server.caFile());
        ZEPA::Relay::Request::SetCookie("");
    }

    // The one request the server recorded for path.
    Json::Value OnlyRecord(const std::string& path) {
        Json::Value records = server.requests(path);
        EXPECT_EQ(1u, records.size()) << zepatest::ToJson(records);
        return records.size() == 1 ? records[0] : Json::Value();
    }

    zepatest::LocalServer server;
};

// A loopback port with nobody listening: bound once by the kernel, then closed.
inline int ClosedLoopbackPort() {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    struct sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = 0;
    bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr));
    socklen_t len = sizeof(addr);
    getsockname(fd, reinterpret_cast<struct sockaddr*>(&addr), &len);
    close(fd);
    return ntohs(addr.sin_port);
}

// A host name that fails to resolve at once and without any query leaving the
// machine: a label longer than 63 characters cannot be put into a DNS query,
// so the resolver gives up locally.
inline std::string UnresolvableHost() { return std::string(64, 'a') + ".invalid"; }

const char kFallbackUserAgent[] = "Velmora Relayd 1.0-5055";

}  // namespace requesttest

#endif
