// A link or a FIFO where the daemon's log file lives: the start is refused at
// once with the reason, no PID file is left, and nothing is written or
// emptied through the link.
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

}  // namespace
}  // namespace daemontest
