// The real daemon in a staging root against the local relay/alias server:
// start-up, states, signals, reload, alias cycle, server id notice, stop.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <regex>

#include "daemon_fixture.h"

using namespace ZEPA::Relay;
using namespace daemontest;
using zepatest::RunProgram;

TEST_F(DaemonProcess, StartsRegistersAndMapsItsAlias) {
    ASSERT_EQ(0, StartDaemon());
    pid_t pid = DaemonPid();
    ASSERT_TRUE(Alive(pid));
    ASSERT_TRUE(StatusHas("alias_status: good"));
    const std::string status = CtlStatus();
    EXPECT_NE(std::string::npos, status.find("state: connected")) << status;
    EXPECT_NE(std::string::npos, status.find("alias: it-box")) << status;
    EXPECT_EQ(0, Ctl({"status"}));
    Json::Value file = StatusFile();
    EXPECT_EQ(pid, file["pid"].asInt());
    EXPECT_EQ(5, file["state"].asInt());
    EXPECT_EQ(0, file["error"].asInt());
    EXPECT_FALSE(file["serverID"].asString().empty());
    // The registration carried the identity and the services.
    Json::Value regs = server.requests("/Serv.php");
    ASSERT_GE(regs.size(), 1u);
    Json::Value body = zepatest::ParseJson(zepatest::RecordedBody(regs[0]));
    EXPECT_EQ("register", body["command"].asString());
    ASSERT_EQ(2u, body["services"].size());
    EXPECT_EQ("nos", body["services"][0]["id"].asString());
    EXPECT_EQ(5000, body["services"][0]["port"].asInt());
    EXPECT_EQ("nos_https", file["service"][1]["id"].asString());
}

TEST_F(DaemonProcess, SecondStartIsRefused) {
    ASSERT_EQ(0, StartDaemon());
    pid_t pid = DaemonPid();
    EXPECT_EQ(7, StartDaemon());  // a daemon already runs
    EXPECT_TRUE(Alive(pid));
    EXPECT_EQ(pid, DaemonPid());
}

TEST_F(DaemonProcess, StateWordsFollowWhatTheDaemonDoes) {
    // A refused registration keeps the daemon logging in, with the reason.
    Json::Value plan;
    plan["path"] = "/Serv.php";
    plan["json"]["errno"] = 2;
    plan["count"] = 1;
    ASSERT_TRUE(server.scriptRaw(plan));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("error: err_auth"));
    EXPECT_NE(std::string::npos, CtlStatus().find("state: login"));

    EXPECT_EQ(0, Ctl({"reload"}));
    ASSERT_TRUE(StatusHas("state: connected"));

    EXPECT_EQ(0, Ctl({"disable"}));
    ASSERT_TRUE(StatusHas("state: logout"));
    EXPECT_EQ(0, Ctl({"enable"}));
    ASSERT_TRUE(StatusHas("state: connected"));

    EXPECT_EQ(0, Ctl({"stop"}));
    EXPECT_NE(std::string::npos, CtlStatus().find("state: not_running"));
    EXPECT_EQ(1, Ctl({"status"}));
}

TEST_F(DaemonProcess, DebugDumpAnswersWhileARequestHangs) {
    ASSERT_TRUE(server.hang("/Serv.php", 30));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: login"));
    ASSERT_TRUE(WaitUntil([&] { return Requests("/Serv.php") == 1; }));
    Daemon::LibInit();
    // A query that finds the machine too busy to let the daemon run within
    // the reader's few milliseconds answers 11; it may be asked again, but a
    // daemon that does not answer while its request hangs fails every time.
    int retries = 0;
    for (int i = 0; i < 200; ++i) {
        Json::Value dump;
        int ret = Daemon::DebugStatus(dump);
        for (int again = 0; ret == 11 && again < 20; ++again, ++retries) ret = Daemon::DebugStatus(dump);
        ASSERT_EQ(0, ret) << "query " << i;
        ASSERT_EQ(1u, dump["requests"].size()) << "query " << i;
        EXPECT_EQ("register", dump["requests"][0]["tag"].asString());
        EXPECT_EQ("async", dump["requests"][0]["mode"].asString());
    }
    RecordProperty("busy_retries", retries);
    // Credentials never show in the dump.
    Json::Value sent = zepatest::ParseJson(zepatest::RecordedBody(server.requests("/Serv.php")[0]));
    const std::string token = sent["identity"]["token"].asString();
    ASSERT_FALSE(token.empty());
    const std::string dumped = zepatest::ToJson(Dump());
    EXPECT_EQ(std::string::npos, dumped.find(token));
    EXPECT_NE(std::string::npos, dumped.find("***"));
}

TEST_F(DaemonProcess, DebugDumpNeverWritesThroughALinkAtItsTemporaryName) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: connected"));
    const pid_t pid = DaemonPid();
    // Another user plants a link where the daemon's dump handler creates its
    // temporary file, aiming at a file of its victim.
    root.write("/etc/victim", "keep");
    chmod(root.path("/etc/victim").c_str(), 0600);
    const std::string dumpTmp =
        root.path("/tmp/.zeparelayd." + std::to_string(pid) + ".debug.tmp." + std::to_string(pid));
    ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), dumpTmp.c_str()));
    Daemon::LibInit();
    const Json::Value dump = Dump();
    EXPECT_EQ(pid, dump["pid"].asInt());
    EXPECT_EQ("keep", root.read("/etc/victim"));
    EXPECT_EQ(0600u, zepatest::FileMode(root.path("/etc/victim")) & 0777);
    struct stat st;
    EXPECT_NE(0, lstat(dumpTmp.c_str(), &st)) << "the planted link is gone, nothing is left at the name";
}

TEST_F(DaemonProcess, ADumpNoQueryCollectsIsRemoved) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: connected"));
    const pid_t pid = DaemonPid();
    // SIGUSR1 without a query, as when a query gave up before the dump came.
    const std::string dump = root.path("/tmp/.zeparelayd." + std::to_string(pid) + ".debug");
    ASSERT_EQ(0, kill(pid, SIGUSR1));
    ASSERT_TRUE(WaitUntil([&] { return access(dump.c_str(), F_OK) == 0; }));
    EXPECT_TRUE(WaitUntil([&] { return access(dump.c_str(), F_OK) != 0; }));
    // Queries still get their answer.
    Daemon::LibInit();
    EXPECT_EQ(pid, Dump()["pid"].asInt());
}

TEST_F(DaemonProcess, ReloadAppliesANewLogLevel) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: connected"));
    EXPECT_EQ(4, Dump()["log_level"].asInt());
    const std::string log = root.path("/var/log/zeparelayd.log");
    EXPECT_FALSE(zepatest::LogContains(zepatest::ReadFile(log), "log level 7"));
    WriteConfig(7);
    EXPECT_EQ(0, Ctl({"reload"}));
    ASSERT_TRUE(WaitUntil([&] { return zepatest::LogContains(zepatest::ReadFile(log), "log level 7"); }));
    EXPECT_TRUE(WaitUntil([&] { return Dump()["log_level"].asInt() == 7; }));
}

TEST_F(DaemonProcess, UpdateAliasSendsANewAliasRequest) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("alias_status: good"));
    const int before = Requests("/alias_update.php");
    EXPECT_EQ(0, Ctl({"update-alias"}));
    ASSERT_TRUE(WaitUntil([&] { return Requests("/alias_update.php") == before + 1; }));
    Json::Value last = server.requests("/alias_update.php")[before];
    EXPECT_NE(std::string::npos, zepatest::RecordedBody(last).find("alias=it-box"));
}

TEST_F(DaemonProcess, StopClassAnswerHaltsAliasRetriesUntilReload) {
    ASSERT_TRUE(server.script("/alias_update.php", 200, "badauth:token rejected\n"));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("alias_status: badauth"));
    Json::Value alias = Dump()["alias"];
    EXPECT_TRUE(alias["halted"].asBool());
    EXPECT_EQ(3, alias["retry_class"].asInt());
    EXPECT_EQ(-1, alias["next_in_ms"].asInt64());
    EXPECT_EQ(1, Requests("/alias_update.php"));

    EXPECT_EQ(0, Ctl({"reload"}));
    ASSERT_TRUE(StatusHas("alias_status: good"));
    EXPECT_EQ(2, Requests("/alias_update.php"));
    EXPECT_FALSE(Dump()["alias"]["halted"].asBool());
}

TEST_F(DaemonProcess, ServerIdChangeSendsExactlyOneNotice) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: connected"));
    std::string first;
    ASSERT_EQ(0, Ctl({"server-id"}, &first));
    ASSERT_TRUE(WaitUntil([&] { return Notices() == 1; }));  // the first id is a change from none

    Json::Value devices = zepatest::ParseJson(Http("GET", server.httpUrl("/relay/admin/devices")))["devices"];
    ASSERT_EQ(1u, devices.size());
    const std::string serial = devices.getMemberNames()[0];
    Json::Value moved = zepatest::ParseJson(
        Http("POST", server.httpUrl("/relay/admin/reassign"), "{\"serial\": \"" + serial + "\"}"));
    ASSERT_TRUE(moved["ok"].asBool());

    const int regs = Requests("/Serv.php");
    EXPECT_EQ(0, ReloadToRegisterAgain());
    std::string second;
    ASSERT_TRUE(WaitUntil([&] {
        Ctl({"server-id"}, &second);
        return second != first;
    }));
    EXPECT_TRUE(WaitUntil([&] { return Notices() == 2; }));
    EXPECT_EQ(0u, root.read("/var/log/zepanosnotify.log")
                      .find("@administrators relayservice:relayservice_serverid_change_title "
                            "relayservice:relayservice_serverid_change_msg\n"));

    // The same id again changes nothing: no further notice.
    EXPECT_EQ(0, ReloadToRegisterAgain());
    ASSERT_TRUE(WaitUntil([&] { return Requests("/Serv.php") == regs + 2; }));
    ASSERT_TRUE(StatusHas("state: connected"));
    EXPECT_EQ(2, Notices());
}

TEST_F(DaemonProcess, StopsCleanly) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: connected"));
    pid_t pid = DaemonPid();
    EXPECT_EQ(0, Ctl({"stop"}));
    EXPECT_FALSE(Alive(pid));
    EXPECT_FALSE(root.exists("/var/run/zeparelayd.pid"));
    Json::Value file = StatusFile();
    EXPECT_EQ(8, file["state"].asInt());
    EXPECT_EQ(pid, file["pid"].asInt());
    EXPECT_EQ(1, Ctl({"status"}));
    // Stopping what does not run is done already.
    std::string out;
    EXPECT_EQ(0, Ctl({"stop"}, &out));
    EXPECT_EQ("not running\n", out);
}

// Tools signal the daemon as soon as its PID file appears ("reload",
// "enable" and "disable" send SIGHUP, "status --debug" SIGUSR1); none of
// those signals may kill it, however early it comes.
void DaemonProcess::SignalAsThePidFileAppears(int sig, int rounds) {
    const std::string pidFile = root.path("/var/run/zeparelayd.pid");
    for (int round = 0; round < rounds; ++round) {
        pid_t starter = fork();
        if (starter == 0) {
            execl(kDaemon.c_str(), kDaemon.c_str(), "--root", root.dir().c_str(), "--ca-file",
                  server.caFile().c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        ASSERT_GT(starter, 0);
        // No pause between looks: the window right after the file appears is
        // the one that matters.
        pid_t pid = -1;
        const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(15);
        while (pid <= 0 && std::chrono::steady_clock::now() < end) {
            const int fd = open(pidFile.c_str(), O_RDONLY | O_CLOEXEC);
            if (fd < 0) continue;
            char buf[32] = {0};
            const ssize_t n = read(fd, buf, sizeof(buf) - 1);
            close(fd);
            if (n > 0) pid = atoi(buf);
        }
        ASSERT_GT(pid, 0) << "round " << round << ": no PID file";
        ASSERT_EQ(0, kill(pid, sig)) << "round " << round;
        int status = 0;
        ASSERT_EQ(starter, waitpid(starter, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "round " << round << ": " << status;
        ASSERT_TRUE(Alive(pid)) << "round " << round << ": signal " << sig << " killed the daemon";
        ASSERT_TRUE(WaitUntil([&] { return Ctl({"status"}) == 0; })) << "round " << round;
        kill(pid, SIGTERM);
        ASSERT_TRUE(WaitUntil([&] { return !Alive(pid) && !root.exists("/var/run/zeparelayd.pid"); }))
            << "round " << round;
    }
}

TEST_F(DaemonProcess, HangupAsThePidFileAppearsNeverKills) { SignalAsThePidFileAppears(SIGHUP, 20); }

TEST_F(DaemonProcess, DebugQueryAsThePidFileAppearsNeverKills) { SignalAsThePidFileAppears(SIGUSR1, 10); }

// Registration answers of a broken or hostile control server: each is an
// answer without what the daemon looks for, and it carries on.
TEST_F(DaemonProcess, MisshapenRegistrationAnswersDoNotKillTheDaemon) {
    const std::string deep = std::string(1000, '[') + std::string(1000, ']');
    const std::string deeper = std::string(100000, '[') + std::string(100000, ']');
    const std::string deepObject = [] {
        std::string text;
        for (int i = 0; i < 1000; ++i) text += "{\"serverID\":";
        text += "0";
        for (int i = 0; i < 1000; ++i) text += "}";
        return text;
    }();
    const std::vector<std::string> answers = {R"([{"errno":0}])",
                                              R"([{"errno":0.}])",
                                              R"([{"errno":00}])",
                                              R"({"errno":0,"serverID":["x"]})",
                                              deep,
                                              deeper,
                                              deepObject};
    bool started = false;
    pid_t pid = -1;
    for (size_t i = 0; i < answers.size(); ++i) {
        SCOPED_TRACE("answer " + std::to_string(i));
        ASSERT_TRUE(server.script("/Serv.php", 200, answers[i]));
        const int before = Requests("/Serv.php");
        if (!started) {
            ASSERT_EQ(0, StartDaemon());
            pid = DaemonPid();
            started = true;
        } else {
            ASSERT_EQ(0, ReloadToRegisterAgain());
        }
        // Handled: the server has answered and the daemon no longer waits for it.
        ASSERT_TRUE(WaitUntil([&] {
            if (Requests("/Serv.php") != before + 1) return false;
            // A busy answer tells nothing about the request yet: ask again.
            Json::Value dump;
            if (Daemon::DebugStatus(dump) != 0) return false;
            for (const Json::Value& job : dump["requests"]) {
                if (job["tag"].asString() == "register") return false;
            }
            return true;
        }));
        // It took the answer for a success without a server id, or for an
        // unreadable one to be retried.
        const std::string status = CtlStatus();
        EXPECT_TRUE(status.find("state: connected") != std::string::npos ||
                    status.find("error: err_unknown") != std::string::npos)
            << status;
        ASSERT_TRUE(Alive(pid));
        EXPECT_EQ(pid, StatusFile()["pid"].asInt());
        EXPECT_EQ(0, Ctl({"status"}));
    }
}

// A control server that keeps sending the daemon to a new host: the first
// move is followed at once, the next ones wait like failed attempts.
TEST_F(DaemonProcess, AControlServerThatKeepsMovingIsFollowedWithBackoff) {
    Json::Value plan;
    plan["path"] = "/Serv.php";
    plan["json"]["errno"] = 13;
    plan["json"]["control_host"] = "127.0.0.1";
    plan["count"] = 1000;
    ASSERT_TRUE(server.scriptRaw(plan));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("error: err_server_changed"));
    Json::Value reg;
    ASSERT_TRUE(WaitUntil([&] {
        reg = Dump()["registration"];
        return reg["moves"].asInt() == 2;
    }));
    EXPECT_GE(reg["retry_in_ms"].asInt64(), 20000);
    EXPECT_EQ(2, Requests("/Serv.php"));
    EXPECT_TRUE(Alive(DaemonPid()));

    // A reload starts afresh: the next move is followed at once again.
    EXPECT_EQ(0, Ctl({"reload"}));
    ASSERT_TRUE(WaitUntil([&] { return Requests("/Serv.php") == 4; }));
    ASSERT_TRUE(WaitUntil([&] { return Dump()["registration"]["moves"].asInt() == 2; }));
    EXPECT_EQ(4, Requests("/Serv.php"));
}

TEST_F(ControlTool, HelpOnEveryLevel) {
    std::string out;
    EXPECT_EQ(0, RunProgram({kCtl, "--help"}, &out));
    EXPECT_NE(std::string::npos, out.find("update-alias"));
    for (const char* cmd : {"status", "start-log", "stop-log", "server-id", "update-alias", "reload", "stop",
                            "enable", "disable", "services", "config"}) {
        EXPECT_EQ(0, Ctl({cmd, "--help"}, &out)) << cmd;
        EXPECT_EQ(0u, out.find(std::string("Usage: zeparelayctl [--root DIR] ") + cmd)) << out;
    }
    EXPECT_EQ(0, RunProgram({kDaemon, "--help"}, &out));
    EXPECT_NE(std::string::npos, out.find("--root DIR"));
}

TEST_F(ControlTool, BadUsageExits64) {
    EXPECT_EQ(64, RunProgram({kCtl}));
    EXPECT_EQ(64, Ctl({"frobnicate"}));
    EXPECT_EQ(64, Ctl({"status", "--bogus"}));
    EXPECT_EQ(64, Ctl({"reload", "--json"}));
    EXPECT_EQ(64, Ctl({"start-log"}));
    EXPECT_EQ(64, RunProgram({kCtl, "--root", "relative/dir", "status"}));
    // One code for bad usage in both programs.
    EXPECT_EQ(64, RunProgram({kDaemon, "--bogus"}));
    EXPECT_EQ(64, RunProgram({kDaemon, "extra"}));
}

TEST_F(ControlTool, WithoutADaemon) {
    std::string out;
    EXPECT_EQ(1, Ctl({"status"}, &out));
    EXPECT_NE(std::string::npos, out.find("state: not_running"));
    EXPECT_EQ(1, Ctl({"status", "--debug"}, &out));
    EXPECT_EQ(1, Ctl({"update-alias"}));
    EXPECT_EQ(0, Ctl({"stop"}));
    EXPECT_EQ(1, Ctl({"reload"}));
    // No configuration file: nothing to read the server id from.
    EXPECT_EQ(5, Ctl({"server-id"}));
    root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf",
               "{\"serverID\": \"ZR9\", \"service\": [{\"id\": \"nos\"}]}");
    EXPECT_EQ(0, Ctl({"server-id"}, &out));
    EXPECT_EQ("ZR9\n", out);
    EXPECT_EQ(0, Ctl({"server-id", "nos"}, &out));
    EXPECT_EQ(6, Ctl({"server-id", "photo_http"}, &out));
    EXPECT_EQ("--\n", out);
}

namespace {

// A process that is not ours, for PID files left behind by a crash.
class Bystander {
public:
    Bystander() {
        pid = fork();
        if (pid == 0) {
            execl("/bin/sleep", "sleep", "100", static_cast<char*>(nullptr));
            _exit(127);
        }
    }
    ~Bystander() {
        if (pid > 0) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }
    pid_t pid;
};

// Neither tool signals a process that took the pid of a stale PID file; the
// daemon starts over such a file.
TEST_F(DaemonProcess, AStalePidFileNamingAnotherProcessIsLeftAlone) {
    Bystander sleeper;
    ASSERT_GT(sleeper.pid, 0);
    ASSERT_TRUE(WaitUntil(
        [&] { return zepatest::ReadFile("/proc/" + std::to_string(sleeper.pid) + "/comm") == "sleep\n"; }));
    // Left by a daemon that crashed an hour ago; the sleeper has its pid since.
    root.write("/var/run/zeparelayd.pid", std::to_string(sleeper.pid) + "\n");
    ASSERT_TRUE(zepatest::SetAge(root.path("/var/run/zeparelayd.pid"), 3600));

    std::string out, err;
    EXPECT_EQ(1, Ctl({"status"}, &out));
    EXPECT_NE(std::string::npos, out.find("state: not_running")) << out;
    EXPECT_EQ(0, Ctl({"stop"}, &out));
    EXPECT_EQ("not running (stale PID file)\n", out);
    EXPECT_EQ(1, Ctl({"reload"}, &out, &err));
    EXPECT_NE(std::string::npos, err.find("not running (stale PID file)")) << err;
    EXPECT_EQ(1, Ctl({"update-alias"}, &out, &err));
    EXPECT_EQ(1, Ctl({"reopen-log"}, &out, &err));
    EXPECT_EQ(1, Ctl({"status", "--debug"}, &out, &err));
    EXPECT_TRUE(Alive(sleeper.pid));

    ASSERT_EQ(0, StartDaemon());
    const pid_t pid = DaemonPid();
    EXPECT_NE(sleeper.pid, pid);
    EXPECT_TRUE(Alive(pid));
    ASSERT_TRUE(StatusHas("state: connected"));
    EXPECT_EQ(0, Ctl({"stop"}, &out));
    EXPECT_EQ("daemon stopped\n", out);
    EXPECT_FALSE(Alive(pid));
    EXPECT_TRUE(Alive(sleeper.pid));
}

const char kConfPath[] = "/usr/zepa/etc/zeparelayd/zeparelayd.conf";

// "FILE:LINE:COLUMN: " for the configuration file, where its parse failed.
bool NamesLineAndColumn(const std::string& text) {
    return std::regex_search(text, std::regex("zeparelayd\\.conf:[0-9]+:[0-9]+: [A-Z]"));
}

// A typo in the configuration: the tools name it and send nothing, and a
// daemon that is told to reload anyway keeps its last good configuration
// and the operator's file.
TEST_F(DaemonProcess, ABrokenConfigurationIsRefusedAndTheLastGoodOneKept) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("alias_status: good"));
    const pid_t pid = DaemonPid();
    const int regs = Requests("/Serv.php");
    std::string good = root.read(kConfPath);
    // The alias loses its closing quote.
    std::string broken = good;
    const size_t cut = broken.find("\"it-box\"");
    ASSERT_NE(std::string::npos, cut);
    broken.replace(cut, 8, "\"it-box");
    root.write(kConfPath, broken);

    std::string out, err;
    EXPECT_EQ(5, Ctl({"check-config"}, &out, &err));
    EXPECT_TRUE(NamesLineAndColumn(err)) << err;
    EXPECT_EQ(5, RunProgram({kDaemon, "--root", root.dir(), "--check-config"}, &out, &err));
    EXPECT_TRUE(NamesLineAndColumn(err)) << err;
    for (const char* cmd : {"reload", "enable", "disable"}) {
        EXPECT_EQ(5, Ctl({cmd}, &out, &err)) << cmd;
        EXPECT_TRUE(NamesLineAndColumn(err)) << cmd << ": " << err;
        EXPECT_EQ(broken, root.read(kConfPath)) << cmd;
    }
    // The daemon itself, told directly.
    ASSERT_EQ(0, kill(pid, SIGHUP));
    ASSERT_TRUE(StatusHas("error: err_config"));
    EXPECT_EQ(broken, root.read(kConfPath));
    EXPECT_FALSE(root.exists(std::string(kConfPath) + ".bad"));
    const std::string status = CtlStatus();
    EXPECT_NE(std::string::npos, status.find("alias: it-box")) << status;
    EXPECT_TRUE(NamesLineAndColumn(status)) << status;
    EXPECT_TRUE(NamesLineAndColumn(StatusFile()["config_error"].asString()));
    EXPECT_EQ("it-box", Dump()["config"]["server_alias"]["alias"].asString());
    EXPECT_TRUE(Alive(pid));
    EXPECT_EQ(regs, Requests("/Serv.php"));  // nothing was re-registered

    // Fixed: the reload goes through and the error is gone.
    root.write(kConfPath, good);
    EXPECT_EQ(0, Ctl({"check-config"}, &out));
    EXPECT_EQ(0, Ctl({"reload"}));
    ASSERT_TRUE(WaitUntil([&] { return !StatusFile().isMember("config_error"); }));
    ASSERT_TRUE(StatusHas("state: connected"));
}

TEST_F(DaemonProcess, ADaemonDoesNotStartOnABrokenConfiguration) {
    root.write(kConfPath, "{\n  \"serverID\": 12,\n  \"service\": [}\n");
    std::string out, err;
    EXPECT_EQ(5, RunProgram({kDaemon, "--root", root.dir()}, &out, &err));
    EXPECT_NE(std::string::npos, err.find(root.path(kConfPath) + ":3:")) << err;
    EXPECT_FALSE(root.exists("/var/run/zeparelayd.pid"));
    EXPECT_TRUE(root.exists(kConfPath));
    // Valid JSON with a key of the wrong type is named at that key.
    root.write(kConfPath, "{\n  \"serverID\": 12\n}\n");
    EXPECT_EQ(5, Ctl({"check-config"}, &out, &err));
    EXPECT_NE(std::string::npos, err.find(":2:15: \"serverID\" must be a string")) << err;
}

// Reopening the log after rotation touches nothing else: no new registration.
TEST_F(DaemonProcess, ReopenLogStartsANewFileWithoutReRegistering) {
    WriteConfig(6);  // the reopening is logged at info level
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("alias_status: good"));
    const std::string log = root.path("/var/log/zeparelayd.log");
    const int regs = Requests("/Serv.php");
    const int aliases = Requests("/alias_update.php");
    ASSERT_EQ(0, rename(log.c_str(), (log + ".1").c_str()));
    std::string out;
    EXPECT_EQ(0, Ctl({"reopen-log"}, &out));
    ASSERT_TRUE(
        WaitUntil([&] { return zepatest::LogContains(zepatest::ReadFile(log), "log file reopened"); }));
    EXPECT_FALSE(zepatest::LogContains(zepatest::ReadFile(log), "reloading configuration"));
    EXPECT_EQ(regs, Requests("/Serv.php"));
    EXPECT_EQ(aliases, Requests("/alias_update.php"));
    EXPECT_NE(std::string::npos, CtlStatus().find("state: connected"));
}

// status --json: one object with the documented members and the exit
// statuses of "status"; options may follow the command.
TEST_F(DaemonProcess, StatusAsJsonForScripts) {
    std::string out;
    EXPECT_EQ(1, RunProgram({kCtl, "status", "--json", "--root", root.dir()}, &out));
    Json::Value stopped = zepatest::ParseJson(out);
    EXPECT_EQ("not_running", stopped["state"].asString());
    EXPECT_TRUE(stopped["pid"].isNull());
    EXPECT_EQ("it-box", stopped["alias"].asString());

    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("alias_status: good"));
    EXPECT_EQ(0, RunProgram({kCtl, "status", "--root", root.dir(), "--json"}, &out));
    Json::Value running = zepatest::ParseJson(out);
    EXPECT_EQ("connected", running["state"].asString());
    EXPECT_EQ("success", running["error"].asString());
    EXPECT_EQ(StatusFile()["serverID"].asString(), running["serverID"].asString());
    EXPECT_FALSE(running["serverID"].asString().empty());
    EXPECT_EQ("it-box", running["alias"].asString());
    EXPECT_EQ("good", running["alias_status"].asString());
    EXPECT_EQ(DaemonPid(), running["pid"].asInt());
    ASSERT_EQ(2u, running["services"].size());
    EXPECT_EQ("nos", running["services"][0].asString());
    EXPECT_EQ(0, RunProgram({kCtl, "status", "--quiet", "--root", root.dir()}, &out));
    EXPECT_EQ("", out);

    root.write("/tmp/.zeparelayd.status", "{broken");
    EXPECT_EQ(2, Ctl({"status", "--json"}, &out));
    EXPECT_TRUE(zepatest::ParseJson(out)["state"].isNull());
}

}  // namespace

// What the tool prints is its own: no library log lines, no pid of its own
// passed off as the daemon's, paths named in messages.
TEST_F(ControlTool, OutputIsTheToolsOwn) {
    std::string out, err;
    // No configuration: the library logs that it keeps its defaults.
    EXPECT_EQ(0, Ctl({"services"}, &out, &err));
    EXPECT_EQ(std::string::npos, err.find("config:")) << err;
    EXPECT_EQ(std::string::npos, out.find("config:")) << out;
    EXPECT_EQ(0, Ctl({"config"}, &out, &err));
    EXPECT_FALSE(zepatest::ParseJson(out).isMember("pid")) << out;
    EXPECT_EQ(std::string::npos, err.find("config:")) << err;

    EXPECT_EQ(64, RunProgram({kDaemon, "--root", "/nonexistent-zepa-root"}, &out, &err));
    EXPECT_NE(std::string::npos, err.find("/nonexistent-zepa-root: No such file or directory")) << err;
    // Both programs print the same exit status table.
    std::string ctlHelp, daemonHelp;
    EXPECT_EQ(0, RunProgram({kCtl, "--help"}, &ctlHelp));
    EXPECT_EQ(0, RunProgram({kDaemon, "--help"}, &daemonHelp));
    const size_t table = ctlHelp.find("Exit status (zeparelayd and zeparelayctl):");
    ASSERT_NE(std::string::npos, table);
    EXPECT_NE(std::string::npos, daemonHelp.find(ctlHelp.substr(table)));
}

TEST_F(ControlTool, CheckConfigOfAGoodFile) {
    root.write("/etc/relay-ok.conf", "{\"serverID\": \"ZR1\", \"log_level\": 4}\n");
    std::string out;
    EXPECT_EQ(0, Ctl({"check-config", root.path("/etc/relay-ok.conf")}, &out));
    EXPECT_NE(std::string::npos, out.find("configuration OK"));
    EXPECT_EQ(0, RunProgram({kDaemon, "--check-config", root.path("/etc/relay-ok.conf")}, &out));
    EXPECT_EQ(5, Ctl({"check-config", root.path("/etc/missing.conf")}, &out));
}
