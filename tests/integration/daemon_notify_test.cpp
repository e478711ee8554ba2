// The daemon started the way systemd starts a Type=notify service: in the
// foreground, with NOTIFY_SOCKET naming a datagram socket that this test owns
// in place of the service manager.
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <sstream>
#include <string>
#include <vector>

#include "support/local_server.h"
#include "support/test_support.h"

namespace {

const std::string kDaemon = ZEPA_BINARY_DIR "/tools/zeparelayd/zeparelayd";
const std::string kStage = ZEPA_SOURCE_DIR "/scripts/stage_appliance.sh";

class DaemonNotify : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        ASSERT_EQ(0, system(("/bin/bash '" + kStage + "' '" + root.dir() + "' >/dev/null").c_str()));
        std::ostringstream conf;
        conf << "{\"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
             << server.httpsPort() << "},\n"
             << " \"server_alias\": {\"alias\": \"notify-box\", \"url\": \"" << server.httpsUrl() << "\"},\n"
             << " \"service\": [{\"id\": \"nos\"}]}\n";
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());

        socketPath = root.path("/notify.sock");
        sockaddr_un addr{};
        ASSERT_LT(socketPath.size(), sizeof(addr.sun_path)) << socketPath;
        addr.sun_family = AF_UNIX;
        socketPath.copy(addr.sun_path, socketPath.size());
        sock = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        ASSERT_GE(sock, 0);
        ASSERT_EQ(0, bind(sock, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
    }

    void TearDown() override {
        if (daemon > 0 && waitpid(daemon, nullptr, WNOHANG) == 0) {
            kill(daemon, SIGKILL);
            waitpid(daemon, nullptr, 0);
        }
        if (sock >= 0) close(sock);
        RootTest::TearDown();
    }

    void StartForeground() {
        daemon = fork();
        if (daemon == 0) {
            setenv("NOTIFY_SOCKET", socketPath.c_str(), 1);
            execl(kDaemon.c_str(), kDaemon.c_str(), "--foreground", "--root", root.dir().c_str(), "--ca-file",
                  server.caFile().c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
    }

    // Collects datagrams until one contains the text or the time is up.
    bool ReceiveUntil(const std::string& text, int ms = 20000) {
        const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
        while (std::chrono::steady_clock::now() < end) {
            pollfd pfd{sock, POLLIN, 0};
            if (poll(&pfd, 1, 100) <= 0) continue;
            char buf[4096];
            const ssize_t n = recv(sock, buf, sizeof(buf), 0);
            if (n <= 0) continue;
            messages.emplace_back(buf, static_cast<size_t>(n));
            if (messages.back().find(text) != std::string::npos) return true;
        }
        return false;
    }

    std::string All() const {
        std::string all;
        for (const std::string& m : messages) all += "[" + m + "]\n";
        return all;
    }

    zepatest::LocalServer server;
    std::string socketPath;
    int sock = -1;
    pid_t daemon = -1;
    std::vector<std::string> messages;
};

TEST_F(DaemonNotify, ReportsReadinessThenConnectionAndAliasThenStopping) {
    StartForeground();
    ASSERT_TRUE(ReceiveUntil("READY=1")) << All();
    // Readiness carries a status line, and comes from the process systemd
    // started: the daemon did not fork away from it.
    EXPECT_NE(std::string::npos, messages.back().find("\nSTATUS=")) << All();
    EXPECT_EQ(std::to_string(daemon) + "\n", root.read("/var/run/zeparelayd.pid"));

    ASSERT_TRUE(ReceiveUntil("STATUS=connected, alias good")) << All();
    EXPECT_EQ(1u, server.requests("/Serv.php").size());

    ASSERT_EQ(0, kill(daemon, SIGTERM));
    ASSERT_TRUE(ReceiveUntil("STOPPING=1", 10000)) << All();
    int status = 0;
    ASSERT_EQ(daemon, waitpid(daemon, &status, 0));
    daemon = -1;
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST_F(DaemonNotify, StatusLineNamesTheErrorWhileTheServerRefuses) {
    ASSERT_TRUE(server.script("/Serv.php", 500, "broken", 100));
    StartForeground();
    ASSERT_TRUE(ReceiveUntil("READY=1")) << All();
    ASSERT_TRUE(ReceiveUntil("STATUS=login (err_")) << All();
    EXPECT_EQ(std::string::npos, All().find("STATUS=connected")) << All();
}

TEST_F(DaemonNotify, NothingIsSentWithoutANotifySocket) {
    daemon = fork();
    if (daemon == 0) {
        unsetenv("NOTIFY_SOCKET");
        execl(kDaemon.c_str(), kDaemon.c_str(), "--foreground", "--root", root.dir().c_str(), "--ca-file",
              server.caFile().c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    // The daemon runs and connects, but our socket hears nothing.
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    bool connected = false;
    while (!connected && std::chrono::steady_clock::now() < end) {
        connected = root.exists("/tmp/.zeparelayd.status") &&
                    zepatest::ParseJson(root.read("/tmp/.zeparelayd.status"))["state"].asInt() == 5;
        if (!connected) usleep(20000);
    }
    ASSERT_TRUE(connected);
    EXPECT_FALSE(ReceiveUntil("=", 200)) << All();
}

}  // namespace
