// The doctor's probes against sockets of the test's own: URL parts, the TCP
// connection, the VPN handshake over UDP, and a program that never ends.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <signal.h>

#include <atomic>
#include <thread>

#include "probes.h"
#include "support/test_support.h"

using namespace zeparelayctl;

namespace {

// A bound loopback socket of the given type; port() is 0 on failure.
class Socket {
public:
    explicit Socket(int type) {
        _fd = socket(AF_INET, type, 0);
        sockaddr_in sa{};
        sa.sin_family = AF_INET;
        sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(sa);
        if (_fd >= 0 && bind(_fd, reinterpret_cast<sockaddr*>(&sa), len) == 0 &&
            getsockname(_fd, reinterpret_cast<sockaddr*>(&sa), &len) == 0)
            _port = ntohs(sa.sin_port);
    }
    ~Socket() { Close(); }
    void Close() {
        if (_fd >= 0) close(_fd);
        _fd = -1;
    }
    int fd() const { return _fd; }
    int port() const { return _port; }

private:
    int _fd = -1;
    int _port = 0;
};

TEST(Endpoint, SchemeHostAndPort) {
    Endpoint ep;
    ASSERT_TRUE(ParseEndpoint("https://relay.example.net:8443/Serv.php", ep));
    EXPECT_EQ("https", ep.scheme);
    EXPECT_EQ("relay.example.net", ep.host);
    EXPECT_EQ(8443, ep.port);
    ASSERT_TRUE(ParseEndpoint("HTTP://127.0.0.1", ep));
    EXPECT_EQ("http", ep.scheme);
    EXPECT_EQ(80, ep.port);
    ASSERT_TRUE(ParseEndpoint("https://[::1]:444/x", ep));
    EXPECT_EQ("::1", ep.host);
    EXPECT_EQ(444, ep.port);
    ASSERT_TRUE(ParseEndpoint("https://alias.example.net", ep));
    EXPECT_EQ(443, ep.port);
}

TEST(Endpoint, RefusesWhatIsNoServerUrl) {
    Endpoint ep;
    for (const char* bad : {"", "relay.example.net", "ftp://x", "https://", "https://h:0", "https://h:70000",
                            "https://h:12ab", "https://[::1"}) {
        EXPECT_FALSE(ParseEndpoint(bad, ep)) << bad;
    }
}

TEST(LookUp, AnAddressIsItsOwnAnswer) {
    const Lookup l = LookUp("127.0.0.1", 1000);
    ASSERT_TRUE(l.ok);
    ASSERT_EQ(1u, l.addresses.size());
    EXPECT_EQ("127.0.0.1", l.addresses[0]);
}

TEST(LookUp, LocalhostResolves) {
    const Lookup l = LookUp("localhost", 2000);
    ASSERT_TRUE(l.ok) << l.error;
    EXPECT_FALSE(l.addresses.empty());
}

TEST(Tcp, ConnectsOrSaysWhyNot) {
    Socket listening(SOCK_STREAM);
    ASSERT_GT(listening.port(), 0);
    ASSERT_EQ(0, listen(listening.fd(), 4));
    EXPECT_EQ("", ProbeTcp("127.0.0.1", listening.port(), 1000));
    const int port = listening.port();
    listening.Close();
    EXPECT_NE(std::string::npos, ProbeTcp("127.0.0.1", port, 1000).find("refused"));
    EXPECT_NE("", ProbeTcp("not-an-address", port, 1000));
}

// A responder that checks the client's first handshake packet and answers as
// a VPN server does, with its own hard reset.
TEST(VpnUdp, AServerAnsweringTheHandshake) {
    Socket server(SOCK_DGRAM);
    ASSERT_GT(server.port(), 0);
    std::atomic<int> seenOpcode{-1};
    std::atomic<int> seenLength{-1};
    std::thread responder([&] {
        unsigned char buf[512];
        sockaddr_in from{};
        socklen_t len = sizeof(from);
        const ssize_t n =
            recvfrom(server.fd(), buf, sizeof(buf), 0, reinterpret_cast<sockaddr*>(&from), &len);
        if (n <= 0) return;
        seenOpcode = buf[0];
        seenLength = static_cast<int>(n);
        unsigned char reply[26] = {0};
        reply[0] = 8 << 3;  // server hard reset, key id 0
        sendto(server.fd(), reply, sizeof(reply), 0, reinterpret_cast<sockaddr*>(&from), len);
    });
    const UdpVpnProbe p = ProbeVpnUdp("127.0.0.1", server.port(), 2000);
    responder.join();
    EXPECT_EQ(UdpVpnProbe::ANSWERED, p.outcome) << p.detail;
    EXPECT_EQ(7 << 3, seenOpcode.load());  // client hard reset v2, key id 0
    EXPECT_EQ(14, seenLength.load());
}

TEST(VpnUdp, SomethingElseAnswering) {
    Socket server(SOCK_DGRAM);
    std::thread responder([&] {
        unsigned char buf[512];
        sockaddr_in from{};
        socklen_t len = sizeof(from);
        if (recvfrom(server.fd(), buf, sizeof(buf), 0, reinterpret_cast<sockaddr*>(&from), &len) > 0)
            sendto(server.fd(), "hello", 5, 0, reinterpret_cast<sockaddr*>(&from), len);
    });
    const UdpVpnProbe p = ProbeVpnUdp("127.0.0.1", server.port(), 2000);
    responder.join();
    EXPECT_EQ(UdpVpnProbe::OTHER, p.outcome) << p.detail;
}

TEST(VpnUdp, NobodyListening) {
    Socket gone(SOCK_DGRAM);
    const int port = gone.port();
    gone.Close();
    EXPECT_EQ(UdpVpnProbe::REFUSED, ProbeVpnUdp("127.0.0.1", port, 1000).outcome);
}

TEST(VpnUdp, SilenceIsToldApart) {
    Socket quiet(SOCK_DGRAM);  // receives, never answers
    const UdpVpnProbe p = ProbeVpnUdp("127.0.0.1", quiet.port(), 300);
    EXPECT_EQ(UdpVpnProbe::SILENT, p.outcome);
    EXPECT_NE(std::string::npos, p.detail.find("no answer"));
}

TEST(FirstLine, OfAProgramThatAnswers) {
    zepatest::TempRoot root;
    root.write("/bin/tool", "#!/bin/sh\necho \"tool 1.2 $1\"\necho second\n", 0755);
    std::string line;
    ASSERT_TRUE(FirstLineOf(root.path("/bin/tool"), "--version", 2000, line));
    EXPECT_EQ("tool 1.2 --version", line);
    EXPECT_FALSE(FirstLineOf(root.path("/bin/missing"), "--version", 2000, line));
}

TEST(FirstLine, AProgramThatNeverEndsIsEndedAndReaped) {
    zepatest::TempRoot root;
    root.write("/bin/stuck", "#!/bin/sh\necho $$ > \"$(dirname \"$0\")/pid\"\nexec sleep 30\n", 0755);
    std::string line;
    EXPECT_FALSE(FirstLineOf(root.path("/bin/stuck"), "--version", 300, line));
    const pid_t pid = atoi(root.read("/bin/pid").c_str());
    ASSERT_GT(pid, 0);
    // Gone and reaped: not even a zombie is left.
    EXPECT_NE(0, kill(pid, 0));
}

}  // namespace
