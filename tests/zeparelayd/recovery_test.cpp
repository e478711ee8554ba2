// What an earlier instance left behind, found and removed at start: only the
// openvpn of this system root's tunnel, pass files, the tunnel info file and
// the debug dumps of instances that no longer run.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>
#include <zepasdk/sysroot.h>

#include "recovery.h"

using ZEPA::Relay::Daemon;
using ZEPA::Relay::Tunnel;

namespace {

class RecoveryTest : public ::testing::Test {
protected:
    void SetUp() override {
        char dir[] = "/tmp/zepa_recovery_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(dir));
        root = dir;
        ASSERT_EQ(0, ZEPASysRootSet(root.c_str()));
        for (const char* d : {"/tmp", "/usr", "/usr/sbin", "/var", "/var/run"}) {
            ASSERT_EQ(0, mkdir((root + d).c_str(), 0755));
        }
        // Stays a shell (its command name is the script's), as openvpn stays.
        Write("/usr/sbin/openvpn", "#!/bin/sh\nwhile :; do sleep 1; done\n");
        ASSERT_EQ(0, chmod((root + "/usr/sbin/openvpn").c_str(), 0755));
    }
    void TearDown() override {
        for (pid_t pid : started) kill(pid, SIGKILL);
        ZEPASysRootSet("/");
        const std::string cmd = "rm -rf '" + root + "'";
        EXPECT_EQ(0, system(cmd.c_str()));
    }

    void Write(const std::string& path, const std::string& text) {
        std::ofstream out(root + path);
        out << text;
    }
    bool Exists(const std::string& path) const { return access((root + path).c_str(), F_OK) == 0; }

    // An "openvpn" that is not our child (as after the daemon's death), with
    // the given pass file and daemon pid in its arguments.
    pid_t StartOrphan(const std::string& passFile, int daemonPid) {
        int fds[2];
        EXPECT_EQ(0, pipe(fds));
        const std::string program = root + "/usr/sbin/openvpn";
        const std::string up = root + "/up.sh " + std::to_string(daemonPid);
        const pid_t middle = fork();
        if (middle == 0) {
            const pid_t child = fork();
            if (child == 0) {
                execl(program.c_str(), "openvpn", "--client", "--auth-user-pass", passFile.c_str(),
                      "--route-up", up.c_str(), static_cast<char*>(nullptr));
                _exit(127);
            }
            (void)!write(fds[1], &child, sizeof(child));
            _exit(0);
        }
        pid_t child = -1;
        EXPECT_EQ(static_cast<ssize_t>(sizeof(child)), read(fds[0], &child, sizeof(child)));
        close(fds[0]);
        close(fds[1]);
        waitpid(middle, nullptr, 0);
        started.push_back(child);
        // Until it runs the script, its command name is not yet "openvpn"
        // (a loaded machine can take seconds to get there).
        std::string name;
        for (int i = 0; i < 1000 && name != "openvpn"; ++i) {
            std::ifstream comm("/proc/" + std::to_string(child) + "/comm");
            name.clear();
            comm >> name;
            if (name == "openvpn") break;
            struct timespec ts = {0, 10 * 1000000L};
            nanosleep(&ts, nullptr);
        }
        EXPECT_EQ("openvpn", name) << "the stand-in openvpn " << child << " did not start within 10 s";
        return child;
    }
    static bool Alive(pid_t pid) {
        if (kill(pid, 0) != 0) return false;
        // A zombie waiting for init counts as gone.
        std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
        std::string line;
        std::getline(stat, line);
        const size_t paren = line.rfind(')');
        return paren == std::string::npos || line.compare(paren + 2, 1, "Z") != 0;
    }

    std::string root;
    std::vector<pid_t> started;
};

TEST_F(RecoveryTest, EndsOnlyTheOpenvpnOfThisRootAndRemovesTheLeftFiles) {
    const std::string pass = Tunnel::GetPassFilePath("zr1");
    ASSERT_EQ(root + "/tmp/.tunnel.zr1", pass);
    Write("/tmp/.tunnel.zr1", "zr1\nsecret");
    Write("/tmp/.zepa_farlink_tunnel_info", "peer_ip=\"10.214.0.1\"\n");
    // A dump of an instance that is gone is a leftover; this process's own
    // is kept.
    const std::string goneDump = Daemon::GetDebugPath(999999999);
    ASSERT_EQ(0u, goneDump.find(root + "/tmp/"));
    std::ofstream(goneDump) << "{}";
    std::ofstream(goneDump + ".tmp.5") << "{";
    const std::string ownDump = Daemon::GetDebugPath(static_cast<int>(getpid()));
    std::ofstream(ownDump) << "{}";
    Write("/tmp/unrelated", "x");

    const pid_t ours = StartOrphan(pass, 999999999);
    // Another appliance root's tunnel is not ours.
    const pid_t theirs = StartOrphan("/elsewhere/tmp/.tunnel.zr1", 999999999);
    ASSERT_TRUE(Alive(ours));
    ASSERT_TRUE(Alive(theirs));

    const std::vector<pid_t> found = zeparelayd::FindLeftoverOpenvpn();
    EXPECT_EQ(std::vector<pid_t>{ours}, found);

    const zeparelayd::Leftovers left = zeparelayd::RemoveLeftovers(3000);
    EXPECT_EQ(std::vector<pid_t>{ours}, left.openvpn);
    for (int i = 0; i < 200 && Alive(ours); ++i) {
        struct timespec ts = {0, 10 * 1000000L};
        nanosleep(&ts, nullptr);
    }
    EXPECT_FALSE(Alive(ours));
    EXPECT_TRUE(Alive(theirs));
    EXPECT_FALSE(Exists("/tmp/.tunnel.zr1"));
    EXPECT_FALSE(Exists("/tmp/.zepa_farlink_tunnel_info"));
    EXPECT_NE(0, access(goneDump.c_str(), F_OK));
    EXPECT_NE(0, access((goneDump + ".tmp.5").c_str(), F_OK));
    EXPECT_EQ(0, access(ownDump.c_str(), F_OK));
    EXPECT_TRUE(Exists("/tmp/unrelated"));
    EXPECT_EQ(4u, left.files.size());
}

TEST_F(RecoveryTest, PlantedLinkAtAPassFileNameIsLeftAlone) {
    Write("/tmp/target", "keep");
    ASSERT_EQ(0, symlink((root + "/tmp/target").c_str(), (root + "/tmp/.tunnel.zr2").c_str()));
    const zeparelayd::Leftovers left = zeparelayd::RemoveLeftovers(100);
    EXPECT_TRUE(left.files.empty());
    EXPECT_TRUE(Exists("/tmp/.tunnel.zr2"));
    EXPECT_TRUE(Exists("/tmp/target"));
}

// The wall clock set forward after the daemon wrote its files: they would read
// as written before their process started, i.e. stale, until stamped anew.
TEST_F(RecoveryTest, FilesStampedAnewReadAsTheRunningProcessAgain) {
    const std::string pidFile = root + "/var/run/zeparelayd.pid";
    ASSERT_TRUE(Daemon::SetPidFile(pidFile.c_str()));
    Write("/var/run/zeparelayd.pid", std::to_string(getpid()) + "\n");
    const std::string status = Daemon::GetStatusPath();
    ASSERT_EQ(0u, status.find(root + "/"));
    std::ofstream(status) << "{\"pid\": " << getpid() << "}";
    const time_t hourAgo = time(nullptr) - 3600;
    const struct timespec stamps[2] = {{hourAgo, 0}, {hourAgo, 0}};
    for (const std::string& path : {pidFile, status})
        ASSERT_EQ(0, utimensat(AT_FDCWD, path.c_str(), stamps, 0));
    ASSERT_EQ(1, Daemon::ProbeFilePid(pidFile, getpid()));
    ASSERT_EQ(1, Daemon::ProbeFilePid(status, getpid()));

    zeparelayd::RefreshLivenessStamps();

    EXPECT_EQ(0, Daemon::ProbeFilePid(pidFile, getpid()));
    EXPECT_EQ(0, Daemon::ProbeFilePid(status, getpid()));

    // A link planted at one of the names is not followed.
    Write("/tmp/target", "keep");
    ASSERT_EQ(0, utimensat(AT_FDCWD, (root + "/tmp/target").c_str(), stamps, 0));
    ASSERT_EQ(0, unlink(status.c_str()));
    ASSERT_EQ(0, symlink((root + "/tmp/target").c_str(), status.c_str()));
    zeparelayd::RefreshLivenessStamps();
    struct stat st;
    ASSERT_EQ(0, stat((root + "/tmp/target").c_str(), &st));
    EXPECT_EQ(hourAgo, st.st_mtime);
}

TEST_F(RecoveryTest, NothingLeftIsNothingDone) {
    const zeparelayd::Leftovers left = zeparelayd::RemoveLeftovers(100);
    EXPECT_TRUE(left.openvpn.empty());
    EXPECT_TRUE(left.files.empty());
}

}  // namespace
