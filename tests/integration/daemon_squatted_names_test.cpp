// Names the daemon needs, taken before it needs them: a link or a FIFO where
// its log file lives refuses the start at once with the reason (no PID file
// left, nothing written or emptied through the link); another user's folders
// at the status and alias status names and entries at the debug file's names
// give way, and the tools see the daemon as it is.
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "daemon_fixture.h"

namespace daemontest {
namespace {

const char kLog[] = "/var/log/zeparelayd.log";

TEST_F(DaemonProcess, ALinkOrFifoAtTheLogFileRefusesTheStart) {
    root.write("/etc/victim", "secret\n", 0600);
    for (const char* kind : {"link", "fifo"}) {
        SCOPED_TRACE(kind);
        zepatest::RemoveWithBad(root.path(kLog));
        if (std::string(kind) == "link") {
            ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), root.path(kLog).c_str()));
        } else {
            ASSERT_EQ(0, mkfifo(root.path(kLog).c_str(), 0666));
        }
        std::string out, err;
        const zepatest::BoundedRun run = zepatest::RunBounded(
            {kDaemon, "--root", root.dir(), "--ca-file", server.caFile()}, 30000, &out, &err);
        ASSERT_FALSE(run.timedOut) << "the start hung";
        EXPECT_EQ(5, run.status) << err;
        EXPECT_NE(std::string::npos, err.find("not started: the log file " + root.path(kLog))) << err;
        EXPECT_FALSE(root.exists("/var/run/zeparelayd.pid"));
        EXPECT_EQ("secret\n", root.read("/etc/victim"));
    }
    // A plain file there again, and the daemon starts.
    zepatest::RemoveWithBad(root.path(kLog));
    ASSERT_EQ(0, StartDaemon());
    EXPECT_TRUE(StatusHas("state: connected"));
}

TEST_F(DaemonProcess, SquattedStatusAndDebugNamesGiveWay) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to plant entries of another user";
    ASSERT_TRUE(zepatest::PlantHostile("foreign-folder", root.path("/tmp/.zeparelayd.status")));
    ASSERT_TRUE(zepatest::PlantHostile("foreign-folder", root.path("/tmp/hopcloud_alias.status")));
    ASSERT_EQ(0, StartDaemon());
    const pid_t pid = DaemonPid();
    ASSERT_TRUE(StatusHas("state: connected"));
    ASSERT_TRUE(StatusHas("alias_status: good"));
    std::string out, err;
    EXPECT_EQ(0, Ctl({"status"}, &out, &err)) << err;

    // The debug file's name and the daemon's temporary name for its dump.
    const std::string debug = root.path("/tmp/.zeparelayd." + std::to_string(pid) + ".debug");
    root.write("/etc/victim", "secret\n", 0600);
    ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), debug.c_str()));
    ASSERT_TRUE(zepatest::PlantHostile("foreign-folder", debug + ".tmp." + std::to_string(pid)));
    int code = 11;
    for (int i = 0; code == 11 && i < 20; ++i) code = Ctl({"status", "--debug"}, &out, &err);
    EXPECT_EQ(0, code) << out << err;
    EXPECT_EQ(pid, zepatest::ParseJson(out)["pid"].asInt()) << out;
    EXPECT_EQ("secret\n", root.read("/etc/victim"));
}

}  // namespace
}  // namespace daemontest
