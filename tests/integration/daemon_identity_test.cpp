// The real daemon as the tools and the library's readers see it whatever its
// process is called: named otherwise through its program name (SetName), or
// running under valgrind, where the process is valgrind's tool.
#include <signal.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "daemon_fixture.h"

namespace daemontest {
namespace {

// A daemon program whose name (argument zero, hence SetName and the PID file)
// is "vendor-relayd": the same binary through a link of that name.
TEST_F(DaemonProcess, ADaemonNamedOtherwiseIsRunningToTheReaders) {
    const std::string program = root.path("/usr/sbin/vendor-relayd");
    zepatest::MakeDirs(root.path("/usr/sbin"));
    ASSERT_EQ(0, symlink(kDaemon.c_str(), program.c_str()));
    ASSERT_EQ(0, RunProgram({program, "--root", root.dir(), "--ca-file", server.caFile()}));
    ASSERT_TRUE(root.exists("/var/run/vendor-relayd.pid"));
    const pid_t pid = atoi(root.read("/var/run/vendor-relayd.pid").c_str());
    ASSERT_TRUE(Alive(pid));
    EXPECT_EQ("vendor-relayd\n", zepatest::ReadFile("/proc/" + std::to_string(pid) + "/comm"));
    ASSERT_TRUE(StatusHas("state: connected"));

    Json::Value status;
    EXPECT_EQ(0, Daemon::GetStatus(status));
    EXPECT_EQ(pid, status["pid"].asInt());
    std::string id, state, error;
    ASSERT_TRUE(Daemon::GetStatus(id, state, error, nullptr));
    EXPECT_EQ("connected", state);
    EXPECT_EQ(0, Ctl({"status"}));
    const int updates = Requests("/alias_update.php");
    EXPECT_EQ(0, Daemon::UpdateAlias());
    EXPECT_TRUE(WaitUntil([&] { return Requests("/alias_update.php") > updates; }));

    kill(pid, SIGTERM);
    // Gone once it has been reaped, not merely once it has ended.
    EXPECT_TRUE(WaitUntil([&] { return Daemon::GetStatus(status) == 1; }));
    EXPECT_EQ(1, Ctl({"status"}));
}

TEST_F(DaemonProcess, ADaemonUnderValgrindIsStoppedQueriedAndAskedByTheTool) {
#if defined(__SANITIZE_ADDRESS__)
    GTEST_SKIP() << "a sanitizer build does not run under valgrind";
#endif
#if defined(ZEPA_TESTS_EMULATED)
    GTEST_SKIP() << "the machine's valgrind cannot run a daemon built for another processor";
#endif
    const std::string valgrind = zepatest::FindProgram("valgrind");
    if (valgrind.empty()) GTEST_SKIP() << "valgrind is not installed (scripts/install-deps.sh installs it)";
    ASSERT_EQ(0,
              RunProgram({valgrind, "--quiet", kDaemon, "--root", root.dir(), "--ca-file", server.caFile()}));
    const pid_t pid = DaemonPid();
    ASSERT_TRUE(Alive(pid));
    // The process is valgrind's tool, not a program called zeparelayd.
    EXPECT_NE("zeparelayd\n", zepatest::ReadFile("/proc/" + std::to_string(pid) + "/comm"));
    ASSERT_TRUE(StatusHas("state: connected", 60000));

    std::string out, err;
    EXPECT_EQ(0, Ctl({"status"}, &out, &err)) << out << err;
    EXPECT_NE(std::string::npos, out.find("state: connected")) << out;
    const int updates = Requests("/alias_update.php");
    EXPECT_EQ(0, Ctl({"update-alias"}, &out, &err)) << err;
    EXPECT_EQ("alias update requested\n", out);
    EXPECT_TRUE(WaitUntil([&] { return Requests("/alias_update.php") > updates; }, 60000));
    EXPECT_EQ(0, Ctl({"stop"}, &out, &err)) << err;
    EXPECT_EQ("daemon stopped\n", out);
    EXPECT_FALSE(Alive(pid));
    EXPECT_EQ(1, Ctl({"status"}));
}

}  // namespace
}  // namespace daemontest
