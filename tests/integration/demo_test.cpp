// scripts/demo.sh under Ctrl-C: the terminal sends SIGINT to the demo's whole
// process group; the demo must end at once, say so, and leave no process.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>

#include "support/test_support.h"

namespace {

const std::string kDemo = ZEPA_SOURCE_DIR "/scripts/demo.sh";

bool WaitFor(const std::function<bool()>& cond, int ms) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    while (std::chrono::steady_clock::now() < end) {
        if (cond()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return cond();
}

bool Alive(pid_t pid) { return pid > 0 && kill(pid, 0) == 0; }

class DemoInterrupt : public zepatest::RootTest {
protected:
    void TearDown() override {
        // Whatever a failed assertion left behind.
        if (group > 0 && kill(-group, 0) == 0) kill(-group, SIGKILL);
        if (group > 0) waitpid(group, nullptr, 0);
        const pid_t daemon = Pid("/demo/var/run/zeparelayd.pid");
        if (Alive(daemon)) kill(daemon, SIGKILL);
        RootTest::TearDown();
    }

    // Starts the demo on the programs of this build, in a process group of
    // its own, as a shell started from a terminal would run it.
    void Start() {
        const std::string out = root.path("/demo.out");
        group = fork();
        if (group == 0) {
            setpgid(0, 0);
            FILE* f = freopen(out.c_str(), "w", stdout);
            if (f == nullptr || dup2(fileno(stdout), 2) < 0) _exit(127);
            setenv("ZEPA_DEMO_BUILD", ZEPA_BINARY_DIR, 1);
            setenv("ZEPA_DEMO_PREBUILT", "1", 1);
            setenv("ZEPA_DEMO_STAGE", root.path("/demo").c_str(), 1);
            execl("/bin/bash", "bash", kDemo.c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        ASSERT_GT(group, 0);
        setpgid(group, group);  // whichever of the two runs first
    }

    std::string Output() { return zepatest::ReadFile(root.path("/demo.out")); }

    pid_t Pid(const std::string& file) {
        if (!root.exists(file)) return -1;
        return atoi(root.read(file).c_str());
    }

    // The local server's pid, from its ready file.
    pid_t ServerPid() {
        if (!root.exists("/demo/tmp/server.json")) return -1;
        Json::Value ready = zepatest::ParseJson(root.read("/demo/tmp/server.json"));
        return ready["pid"].isInt() ? ready["pid"].asInt() : -1;
    }

    // Ctrl-C, then: gone within seconds with status 130, "interrupted", no
    // traceback, and nothing of it still running.
    void InterruptAndCheck() {
        const pid_t daemon = Pid("/demo/var/run/zeparelayd.pid");
        const pid_t server = ServerPid();
        ASSERT_EQ(0, kill(-group, SIGINT));
        int status = 0;
        pid_t done = 0;
        ASSERT_TRUE(WaitFor(
            [&] {
                done = waitpid(group, &status, WNOHANG);
                return done == group;
            },
            10000))
            << Output();
        const pid_t leader = group;
        group = -1;
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 130) << status << "\n" << Output();
        const std::string out = Output();
        EXPECT_NE(std::string::npos, out.find("interrupted")) << out;
        EXPECT_EQ(std::string::npos, out.find("Traceback")) << out;
        // Nothing of the group, nor the daemon it started, is left.
        EXPECT_TRUE(WaitFor([&] { return kill(-leader, 0) != 0; }, 5000));
        EXPECT_FALSE(Alive(daemon)) << daemon;
        EXPECT_FALSE(Alive(server)) << server;
    }

    pid_t group = -1;
};

TEST_F(DemoInterrupt, CtrlCWhileTheDaemonRunsStopsEverything) {
    Start();
    ASSERT_TRUE(WaitFor([&] { return Output().find("==> 7.") != std::string::npos; }, 60000)) << Output();
    ASSERT_TRUE(Alive(Pid("/demo/var/run/zeparelayd.pid")));
    ASSERT_TRUE(Alive(ServerPid()));
    InterruptAndCheck();
}

TEST_F(DemoInterrupt, CtrlCWhileTheServerStartsStopsEverything) {
    Start();
    ASSERT_TRUE(WaitFor([&] { return Output().find("==> 4.") != std::string::npos; }, 60000)) << Output();
    InterruptAndCheck();
}

}  // namespace
