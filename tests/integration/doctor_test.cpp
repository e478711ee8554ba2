// "zeparelayctl doctor" against the staged appliance and the local server: the
// good state, each failure an operator meets, the JSON form, and that it
// neither changes anything nor shows a secret.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <map>
#include <set>

#include "daemon_fixture.h"

using namespace daemontest;

namespace {

const char* const kCheckNames[] = {
    "config",      "config.switch",       "config.log",       "identity",
    "daemon",      "daemon.registration", "daemon.alias",     "control.dns",
    "control.tcp", "control.tls",         "control.http",     "alias.dns",
    "alias.tcp",   "alias.tls",           "alias.http",       "alias.mapping",
    "clock",       "tunnel.tun",          "tunnel.openvpn",   "tunnel.scripts",
    "tunnel.ca",   "tunnel.module_tool",  "tunnel.relay_tcp", "tunnel.relay_udp",
    "services"};

// The staged identity's credentials (scripts/stage_appliance.sh).
const char kToken[] = "5f0c2a9e8d7b41c3a6e0f9b2d4c8e1a7";
const char kApiKey[] = "3b8f1e6c0a9d47e2b5c1f8a04d7e9b2c6a1f3e8d0b4c7a92e5f1d8b3c6a0e4f7";

// A TCP port on loopback that accepts connections into its backlog and never
// reads: TLS handshakes and requests to it hang.
class SilentListener {
public:
    SilentListener() {
        _fd = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in sa{};
        sa.sin_family = AF_INET;
        sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(sa);
        if (_fd >= 0 && bind(_fd, reinterpret_cast<sockaddr*>(&sa), len) == 0 && listen(_fd, 16) == 0 &&
            getsockname(_fd, reinterpret_cast<sockaddr*>(&sa), &len) == 0)
            _port = ntohs(sa.sin_port);
    }
    ~SilentListener() {
        if (_fd >= 0) close(_fd);
    }
    int port() const { return _port; }

private:
    int _fd = -1;
    int _port = 0;
};

// A loopback port where nothing listens (bound once, then released).
int ClosedPort() {
    SilentListener once;
    return once.port();
}

class Doctor : public DaemonProcess {
protected:
    struct Run {
        int status = -1;
        std::string out, err;
        Json::Value report;
        long ms = 0;
    };

    Run RunDoctor(bool json, double timeoutSeconds = 1, const std::vector<std::string>& extra = {}) {
        std::vector<std::string> args = {kCtl, "--root", root.dir(), "--timeout",
                                         std::to_string(timeoutSeconds)};
        args.insert(args.end(), extra.begin(), extra.end());
        if (json) args.push_back("--json");
        args.push_back("doctor");
        Run run;
        const auto start = std::chrono::steady_clock::now();
        const zepatest::BoundedRun r = zepatest::RunBounded(args, 60000, &run.out, &run.err);
        run.ms = static_cast<long>(
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start)
                .count());
        EXPECT_FALSE(r.timedOut) << "doctor did not end";
        run.status = r.status;
        if (json) run.report = zepatest::ParseJson(run.out);
        return run;
    }

    static Json::Value Check(const Json::Value& report, const std::string& name) {
        for (const Json::Value& c : report["checks"]) {
            if (c["name"].asString() == name) return c;
        }
        ADD_FAILURE() << "no check " << name;
        return Json::Value();
    }

    static std::string Result(const Json::Value& report, const std::string& name) {
        return Check(report, name)["result"].asString();
    }

    // Control and alias server at host:port with the given scheme.
    void PointAt(const std::string& scheme, const std::string& host, int port) {
        std::ostringstream conf;
        conf << "{\n"
             << "  \"server_control\": {\"protocol\": \"" << scheme << "\", \"host\": \"" << host
             << "\", \"port\": " << port << "},\n"
             << "  \"server_alias\": {\"alias\": \"it-box\", \"url\": \"" << scheme << "://" << host << ":"
             << port << "\"},\n"
             << "  \"service\": [{\"id\": \"nos\"}, {\"id\": \"nos_https\"}],\n"
             << "  \"log_level\": 4,\n"
             << "  \"log_file\": \"/var/log/zeparelayd.log\"\n"
             << "}\n";
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());
    }

    void StartRegistered() {
        ASSERT_EQ(0, StartDaemon());
        ASSERT_TRUE(StatusHas("alias_status: good"));
        ASSERT_TRUE(WaitUntil([&] { return StatusFile()["alias_at"].isIntegral(); }));
    }

    static void ExpectNoSecret(const std::string& text) {
        for (const std::string& secret : {std::string(kToken), std::string(kApiKey)}) {
            // Not whole, and not in part either.
            for (size_t at = 0; at + 8 <= secret.size(); at += 8)
                EXPECT_EQ(std::string::npos, text.find(secret.substr(at, 8))) << "secret shown: " << text;
        }
    }
};

bool TunDevice() {
    struct stat st {};
    return stat("/dev/net/tun", &st) == 0 && S_ISCHR(st.st_mode);
}

TEST_F(Doctor, EveryCheckOkOnTheStagedAppliance) {
    if (!TunDevice()) GTEST_SKIP() << "this machine has no /dev/net/tun (the tun check would fail rightly)";
    StartRegistered();
    Run run = RunDoctor(true);
    printf("doctor, every server answering: %ld ms (its own count %d ms)\n", run.ms,
           run.report["time_ms"].asInt());
    EXPECT_EQ(0, run.status) << run.out;
    EXPECT_EQ("ok", run.report["result"].asString());
    for (const Json::Value& c : run.report["checks"]) {
        const std::string name = c["name"].asString();
        if (name == "tunnel.relay_tcp" || name == "tunnel.relay_udp") {
            // Registered directly: the daemon reports no relay to probe.
            EXPECT_EQ("skipped", c["result"].asString()) << name;
        } else {
            EXPECT_EQ("ok", c["result"].asString()) << name << ": " << c["detail"].asString();
        }
    }
    EXPECT_NE(std::string::npos,
              Check(run.report, "alias.mapping")["detail"].asString().find("this appliance"));
    EXPECT_NE(std::string::npos,
              Check(run.report, "daemon.registration")["detail"].asString().find("connected"));
    EXPECT_NE(std::string::npos,
              Check(run.report, "control.tls")["detail"].asString().find("accept any certificate"));
    ASSERT_EQ(2u, run.report["services"].size());
    EXPECT_EQ("nos", run.report["services"][0]["id"].asString());
    EXPECT_EQ(5000, run.report["services"][0]["port"].asInt());

    Run text = RunDoctor(false);
    EXPECT_EQ(0, text.status);
    EXPECT_NE(std::string::npos, text.out.find("ALL OK: 23 ok, 0 warnings, 0 failures, 2 skipped"))
        << text.out;
    EXPECT_NE(std::string::npos, text.out.find("nos_https")) << text.out;
    // Not a terminal: no colour codes.
    EXPECT_EQ(std::string::npos, text.out.find('\033'));
}

TEST_F(Doctor, StatusFileTellsWhenResultsCameAndWhatIsNext) {
    const Json::Value::Int64 before = time(nullptr);
    StartRegistered();
    // The keep-alive after the mapping is planned once the outcome is recorded.
    ASSERT_TRUE(WaitUntil([&] { return StatusFile()["alias_retry_at"].isIntegral(); }));
    const Json::Value file = StatusFile();
    EXPECT_GE(file["registration_at"].asInt64(), before);
    EXPECT_LE(file["registration_at"].asInt64(), file["alias_at"].asInt64());
    // Registered: no registration attempt is due.
    EXPECT_TRUE(file["registration_retry_at"].isNull());
    // The keep-alive comes after the polling time (8 hours at least).
    EXPECT_GE(file["alias_retry_at"].asInt64(), file["alias_at"].asInt64() + 28800);
    const Json::Value alias = Check(RunDoctor(true).report, "daemon.alias");
    EXPECT_NE(std::string::npos, alias["detail"].asString().find("next exchange in "))
        << alias["detail"].asString();

    // A refused registration: when it failed, and when the next attempt comes.
    Json::Value plan;
    plan["path"] = "/Serv.php";
    plan["status"] = 503;  // busy
    plan["body"] = "busy";
    plan["count"] = 5;
    ASSERT_TRUE(server.scriptRaw(plan));
    ASSERT_EQ(0, ReloadToRegisterAgain());
    ASSERT_TRUE(WaitUntil([&] { return StatusFile()["registration_retry_at"].isIntegral(); }));
    const Json::Value failed = StatusFile();
    EXPECT_EQ(3, failed["state"].asInt());
    EXPECT_GT(failed["registration_retry_at"].asInt64(), failed["registration_at"].asInt64());
    Run run = RunDoctor(true);
    const Json::Value reg = Check(run.report, "daemon.registration");
    EXPECT_EQ("fail", reg["result"].asString());
    EXPECT_NE(std::string::npos, reg["detail"].asString().find("next attempt in "))
        << reg["detail"].asString();
    EXPECT_NE(std::string::npos, reg["hint"].asString().find("busy")) << reg["hint"].asString();
}

TEST_F(Doctor, JsonFollowsItsSchema) {
    StartRegistered();
    Run run = RunDoctor(true);
    const Json::Value& r = run.report;
    ASSERT_TRUE(r.isObject()) << run.out;
    const std::set<std::string> top = {"schema",     "result", "exit_status", "time_ms",
                                       "timeout_ms", "checks", "services"};
    const Json::Value::Members topNames = r.getMemberNames();
    EXPECT_EQ(top, std::set<std::string>(topNames.begin(), topNames.end()));
    EXPECT_EQ(1, r["schema"].asInt());
    EXPECT_TRUE(r["time_ms"].isIntegral());
    EXPECT_EQ(1000, r["timeout_ms"].asInt());
    EXPECT_EQ(run.status, r["exit_status"].asInt());
    const char* const words[] = {"ok", "warn", "fail"};
    ASSERT_TRUE(r["exit_status"].asInt() >= 0 && r["exit_status"].asInt() <= 2);
    EXPECT_EQ(words[r["exit_status"].asInt()], r["result"].asString());
    ASSERT_TRUE(r["checks"].isArray());
    ASSERT_EQ(sizeof(kCheckNames) / sizeof(kCheckNames[0]), r["checks"].size());
    const std::set<std::string> results = {"ok", "warn", "fail", "skipped"};
    const std::set<std::string> keys = {"name", "result", "time_ms", "detail", "hint"};
    int worst = 0;
    for (Json::ArrayIndex i = 0; i < r["checks"].size(); ++i) {
        const Json::Value& c = r["checks"][i];
        ASSERT_TRUE(c.isObject());
        const Json::Value::Members names = c.getMemberNames();
        EXPECT_EQ(keys, std::set<std::string>(names.begin(), names.end()));
        EXPECT_EQ(kCheckNames[i], c["name"].asString());
        EXPECT_EQ(1u, results.count(c["result"].asString())) << c["result"].asString();
        EXPECT_TRUE(c["time_ms"].isIntegral() && c["time_ms"].asInt64() >= 0);
        EXPECT_TRUE(c["detail"].isString() && !c["detail"].asString().empty()) << c["name"].asString();
        ASSERT_TRUE(c["hint"].isString());
        const bool wrong = c["result"] == "warn" || c["result"] == "fail";
        EXPECT_EQ(wrong, !c["hint"].asString().empty()) << c["name"].asString();
        if (c["result"] == "warn") worst = std::max(worst, 1);
        if (c["result"] == "fail") worst = 2;
    }
    EXPECT_EQ(worst, r["exit_status"].asInt());
    ASSERT_TRUE(r["services"].isArray());
    for (const Json::Value& s : r["services"]) {
        EXPECT_TRUE(s["id"].isString());
        EXPECT_TRUE(s["name"].isString());
        EXPECT_TRUE(s["port"].isInt() || s["port"].isNull());
        EXPECT_TRUE(s["ext_port"].isInt() || s["ext_port"].isNull());
    }
}

TEST_F(Doctor, DaemonNotRunning) {
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value daemon = Check(run.report, "daemon");
    EXPECT_EQ("fail", daemon["result"].asString());
    EXPECT_NE(std::string::npos, daemon["detail"].asString().find("not running"));
    EXPECT_NE(std::string::npos, daemon["hint"].asString().find("start it"));
    EXPECT_EQ("skipped", Result(run.report, "daemon.registration"));
    EXPECT_EQ("skipped", Result(run.report, "daemon.alias"));
    // The servers are still checked; the alias is not mapped by anyone yet.
    EXPECT_EQ("ok", Result(run.report, "control.http"));
    EXPECT_EQ("fail", Result(run.report, "alias.mapping"));
    EXPECT_NE(std::string::npos,
              Check(run.report, "alias.mapping")["detail"].asString().find("alias_not_found"));

    Run text = RunDoctor(false);
    EXPECT_EQ(2, text.status);
    EXPECT_NE(std::string::npos, text.out.find("FAIL  daemon ")) << text.out;
    EXPECT_NE(std::string::npos, text.out.find("-> start it")) << text.out;
    EXPECT_NE(std::string::npos, text.out.find("FAILED: ")) << text.out;
}

TEST_F(Doctor, RelaySwitchedOff) {
    root.write("/etc/zepainfo.conf", "runrelayd=\"no\"\ntimezone=\"Europe/Berlin\"\n");
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value sw = Check(run.report, "config.switch");
    EXPECT_EQ("fail", sw["result"].asString());
    EXPECT_NE(std::string::npos, sw["hint"].asString().find("zeparelayctl enable"));
}

TEST_F(Doctor, BrokenConfigurationIsNamedAndLeftAsItIs) {
    const std::string broken = "{\n  \"server_control\": {\"host\": \"127.0.0.1\",,}\n}\n";
    root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", broken);
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value conf = Check(run.report, "config");
    EXPECT_EQ("fail", conf["result"].asString());
    EXPECT_NE(std::string::npos, conf["detail"].asString().find("zeparelayd.conf:2:"))
        << conf["detail"].asString();
    EXPECT_NE(std::string::npos, conf["hint"].asString().find("check-config"));
    EXPECT_EQ("skipped", Result(run.report, "control.dns"));
    EXPECT_EQ("skipped", Result(run.report, "services"));
    // Read, never repaired nor set aside.
    EXPECT_EQ(broken, root.read("/usr/zepa/etc/zeparelayd/zeparelayd.conf"));
    EXPECT_FALSE(root.exists("/usr/zepa/etc/zeparelayd/zeparelayd.conf.bad"));
}

TEST_F(Doctor, NameLookupFailing) {
    // ".invalid" never resolves; without a name server the look-up times out.
    PointAt("https", "relay-doctor-test.invalid", 443);
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value dns = Check(run.report, "control.dns");
    EXPECT_EQ("fail", dns["result"].asString());
    EXPECT_NE(std::string::npos, dns["detail"].asString().find("relay-doctor-test.invalid"));
    EXPECT_NE(std::string::npos, dns["hint"].asString().find("DNS"));
    EXPECT_EQ("skipped", Result(run.report, "control.tcp"));
    EXPECT_EQ("fail", Result(run.report, "alias.dns"));
}

TEST_F(Doctor, ConnectionRefused) {
    PointAt("https", "127.0.0.1", ClosedPort());
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    EXPECT_EQ("ok", Result(run.report, "control.dns"));
    const Json::Value tcp = Check(run.report, "control.tcp");
    EXPECT_EQ("fail", tcp["result"].asString());
    EXPECT_NE(std::string::npos, tcp["hint"].asString().find("nothing accepts connections"));
    EXPECT_EQ("skipped", Result(run.report, "control.tls"));
    EXPECT_EQ("fail", Result(run.report, "alias.tcp"));
}

TEST_F(Doctor, TlsHandshakeBroken) {
    // The plain HTTP port answers the TLS greeting with HTTP.
    PointAt("https", "127.0.0.1", server.httpPort());
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    EXPECT_EQ("ok", Result(run.report, "control.tcp"));
    const Json::Value tls = Check(run.report, "control.tls");
    EXPECT_EQ("fail", tls["result"].asString());
    EXPECT_NE(std::string::npos, tls["detail"].asString().find("TLS handshake")) << tls["detail"].asString();
    EXPECT_NE(std::string::npos, tls["hint"].asString().find("does not speak TLS"));
    EXPECT_EQ("skipped", Result(run.report, "control.http"));
}

TEST_F(Doctor, HangingServersEndWithinTheirTimeOuts) {
    // Control server: accepts, never speaks (the TLS handshake hangs).
    SilentListener silent;
    ASSERT_GT(silent.port(), 0);
    std::ostringstream conf;
    conf << "{\n"
         << "  \"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
         << silent.port() << "},\n"
         << "  \"server_alias\": {\"alias\": \"it-box\", \"url\": \"" << server.httpsUrl() << "\"},\n"
         << "  \"service\": [{\"id\": \"nos\"}],\n"
         << "  \"log_level\": 4\n"
         << "}\n";
    root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());
    // Alias server: its root request hangs after the handshake.
    ASSERT_TRUE(server.hang("/", 10, 5));
    Run run = RunDoctor(true, 1);
    printf("doctor with two hanging servers, 1 s time-out: %ld ms\n", run.ms);
    EXPECT_EQ(2, run.status);
    const Json::Value tls = Check(run.report, "control.tls");
    EXPECT_EQ("fail", tls["result"].asString());
    EXPECT_NE(std::string::npos, tls["detail"].asString().find("no answer within 1000 ms"))
        << tls["detail"].asString();
    EXPECT_NE(std::string::npos, tls["hint"].asString().find("hangs"));
    const Json::Value http = Check(run.report, "alias.http");
    EXPECT_EQ("fail", http["result"].asString());
    EXPECT_NE(std::string::npos, http["detail"].asString().find("no answer within 1000 ms"))
        << http["detail"].asString();
    EXPECT_EQ("ok", Result(run.report, "alias.tls"));
    EXPECT_EQ("skipped", Result(run.report, "alias.mapping"));
}

TEST_F(Doctor, WrongClock) {
    zepatest::LocalServer::Options opts;
    opts.extraArgs = {"--clock-offset", "3600"};
    zepatest::LocalServer ahead(opts);
    ASSERT_TRUE(ahead.ok()) << ahead.error();
    PointAt("https", "127.0.0.1", ahead.httpsPort());
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value clock = Check(run.report, "clock");
    EXPECT_EQ("fail", clock["result"].asString());
    // The Date header counts whole seconds: the offset is known to within one.
    const std::string detail = clock["detail"].asString();
    ASSERT_EQ(0u, detail.find("offset +")) << detail;
    const long offset = atol(detail.c_str() + 8);
    EXPECT_TRUE(offset >= 3599 && offset <= 3601) << detail;
    EXPECT_NE(std::string::npos, clock["hint"].asString().find("behind"));

    // The servers' own clock, unshifted: no clock failure.
    WriteConfig(4);
    EXPECT_EQ("ok", Result(RunDoctor(true).report, "clock"));
}

TEST_F(Doctor, MissingOpenvpn) {
    ASSERT_EQ(0, unlink(root.path("/usr/sbin/openvpn").c_str()));
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value vpn = Check(run.report, "tunnel.openvpn");
    EXPECT_EQ("fail", vpn["result"].asString());
    EXPECT_NE(std::string::npos, vpn["detail"].asString().find("missing"));
    EXPECT_NE(std::string::npos, vpn["hint"].asString().find("install"));
}

TEST_F(Doctor, NoTunDevice) {
    ASSERT_EQ(0, unlink(root.path("/dev/net/tun").c_str()));
    Run run = RunDoctor(true);
    EXPECT_EQ(2, run.status);
    const Json::Value tun = Check(run.report, "tunnel.tun");
    EXPECT_EQ("fail", tun["result"].asString());
    EXPECT_NE(std::string::npos, tun["hint"].asString().find("modprobe tun"));

    // A plain file where the device belongs is no device either.
    root.write("/dev/net/tun", "");
    EXPECT_EQ("fail", Result(RunDoctor(true).report, "tunnel.tun"));
}

TEST_F(Doctor, WarningsOnlyExitOne) {
    if (!TunDevice()) GTEST_SKIP() << "this machine has no /dev/net/tun";
    WriteConfig(7);  // debug logging: a warning, nothing broken
    StartRegistered();
    Run run = RunDoctor(true);
    EXPECT_EQ(1, run.status) << run.out;
    EXPECT_EQ("warn", run.report["result"].asString());
    EXPECT_EQ("warn", Result(run.report, "config.log"));
    EXPECT_NE(std::string::npos, Check(run.report, "config.log")["hint"].asString().find("stop-log"));
}

TEST_F(Doctor, NoSecretInAnyOutput) {
    StartRegistered();
    for (bool json : {true, false}) {
        Run run = RunDoctor(json, 1, {"--verbose"});
        ExpectNoSecret(run.out);
        ExpectNoSecret(run.err);
    }
    // Also when things fail and more is said.
    PointAt("https", "127.0.0.1", server.httpPort());
    for (bool json : {true, false}) {
        Run run = RunDoctor(json, 1, {"--verbose"});
        ExpectNoSecret(run.out);
        ExpectNoSecret(run.err);
    }
}

// Every file below the root with its size and modification time.
std::map<std::string, std::string> Snapshot(const std::string& dir) {
    std::string listing;
    zepatest::RunProgram({"/usr/bin/find", dir, "-printf", "%p %s %T@ %m\\n"}, &listing);
    std::map<std::string, std::string> files;
    std::istringstream in(listing);
    std::string line;
    while (std::getline(in, line)) files[line.substr(0, line.find(' '))] = line;
    return files;
}

TEST_F(Doctor, ChangesNothing) {
    // Without a daemon: not one file below the root changes.
    const auto before = Snapshot(root.dir());
    RunDoctor(true);
    RunDoctor(false);
    EXPECT_EQ(before, Snapshot(root.dir()));

    // With one: no registration and no alias change reaches the servers.
    StartRegistered();
    const int registrations = Requests("/Serv.php");
    const int updates = Requests("/alias_update.php");
    const pid_t pid = DaemonPid();
    Run run = RunDoctor(true);
    EXPECT_EQ(0, Check(run.report, "daemon")["result"].asString().compare("ok"));
    EXPECT_EQ(registrations, Requests("/Serv.php"));
    EXPECT_EQ(updates, Requests("/alias_update.php"));
    EXPECT_GE(Requests("/alias_query.php"), 1);
    EXPECT_EQ(pid, DaemonPid());
    EXPECT_TRUE(Alive(pid));
}

}  // namespace
