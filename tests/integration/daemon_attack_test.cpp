// The real daemon and control tool against a hostile local user and hostile
// servers: files that are not what they seem where the configuration, the
// status and the alias status belong, gigabyte answers, and a search of
// everything the daemon writes for the secrets it sends.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <map>
#include <set>

#include <zeparelayd/config.h>
#include <zeparelayd/errors.h>

#include "daemon_fixture.h"

using namespace ZEPA::Relay;
using namespace daemontest;
using zepatest::BoundedRun;
using zepatest::RunBounded;

namespace {

const char kConf[] = "/usr/zepa/etc/zeparelayd/zeparelayd.conf";
const char kStatus[] = "/tmp/.zeparelayd.status";
const char kAliasStatus[] = "/tmp/hopcloud_alias.status";
// A tool that still runs after this long blocks on what it reads.
const int kToolLimitMs = 10000;
const long kGigabyte = 1024L * 1024 * 1024;

#if defined(__SANITIZE_ADDRESS__)
// The sanitizers' own bookkeeping is part of every process's memory: only
// what the input adds is measured there.
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif
constexpr long kMemoryLimitKb = 32 * 1024;

// Under qemu-user every process's memory also holds the emulator's own (its
// code cache, the translator): what a process of ours may use is the limit
// on top of what an emulated program that only prints its usage takes.
long MemoryLimitKb() {
#if defined(ZEPA_TESTS_EMULATED)
    static const long emulator = RunBounded({kCtl, "--help"}, 60000).maxRssKb;
    return kMemoryLimitKb + emulator;
#else
    return kMemoryLimitKb;
#endif
}

const char* const kHostileKinds[] = {"fifo", "folder", "device", "huge", "nested"};

class DaemonUnderAttack : public DaemonProcess {
protected:
    BoundedRun CtlBounded(const std::vector<std::string>& args, std::string* out = nullptr,
                          std::string* err = nullptr) {
        std::vector<std::string> all = {kCtl, "--root", root.dir()};
        all.insert(all.end(), args.begin(), args.end());
        return RunBounded(all, kToolLimitMs, out, err);
    }

    // Started on the good configuration, registered (its server id stored),
    // its alias mapped. The alias status file may still be a former
    // daemon's: the state is this one's own.
    pid_t StartConnected() {
        EXPECT_EQ(0, StartDaemon());
        EXPECT_TRUE(StatusHas("state: connected"));
        EXPECT_TRUE(StatusHas("alias_status: good"));
        return DaemonPid();
    }

    // Alive, and its debug query answered by that very process.
    void ExpectAnswering(pid_t pid) {
        ASSERT_TRUE(Alive(pid));
        EXPECT_EQ(pid, Dump()["pid"].asInt());
    }

    // Handled: the request went out and the daemon waits for it no more.
    ::testing::AssertionResult Handled(const std::string& path, int count, const std::string& tag) {
        Json::Value dump;
        int ret = -1;
        const bool done = WaitUntil([&] {
            if (Requests(path) < count) return false;
            ret = Daemon::DebugStatus(dump);
            if (ret != 0) return false;
            for (const Json::Value& job : dump["requests"]) {
                if (job["tag"].asString() == tag) return false;
            }
            return true;
        });
        if (done) return ::testing::AssertionSuccess();
        return ::testing::AssertionFailure() << Requests(path) << " requests of " << path << ", debug query "
                                             << ret << ": " << zepatest::ToJson(dump["requests"]);
    }

    // Scripts the next answer of path: size bytes, streamed.
    bool StreamNext(const std::string& path, long size) {
        Json::Value plan;
        plan["path"] = path;
        plan["action"] = "stream";
        plan["size"] = static_cast<Json::Int64>(size);
        plan["body"] = "{\"errno\":0,\"pad\":\"0123456789abcdef";
        return server.scriptRaw(plan);
    }
};

void ExpectEndedOnItsOwn(const BoundedRun& run, const std::string& what) {
    EXPECT_FALSE(run.timedOut) << what << " blocked";
    EXPECT_EQ(0, run.signal) << what << " was killed by a signal";
}

// The operator's configuration replaced by what a careless or hostile hand
// leaves there: every tool refuses it at once, and the daemon told to reload
// keeps its last good configuration and still stops when asked.
TEST_F(DaemonUnderAttack, ConfigurationThatIsNoUsableFileNeverBlocksOrKills) {
    for (const char* kind : kHostileKinds) {
        SCOPED_TRACE(kind);
        const pid_t pid = StartConnected();
        ASSERT_TRUE(Alive(pid));
        ASSERT_TRUE(zepatest::PlantHostile(kind, root.path(kConf)));
        for (const char* cmd : {"check-config", "config", "services", "server-id", "reload", "enable"}) {
            std::string out, err;
            const BoundedRun run = CtlBounded({cmd}, &out, &err);
            ExpectEndedOnItsOwn(run, cmd);
            EXPECT_EQ(5, run.status) << cmd << ": " << out << err;
            EXPECT_NE(std::string::npos, err.find(root.path(kConf))) << cmd << ": " << err;
            if (kSanitized) continue;
            EXPECT_LT(run.maxRssKb, MemoryLimitKb()) << cmd;
        }
        EXPECT_EQ(0, kill(pid, SIGHUP));
        ASSERT_TRUE(StatusHas("error: err_config"));
        ExpectAnswering(pid);
        EXPECT_EQ("it-box", Dump()["config"]["server_alias"]["alias"].asString());
        if (!kSanitized) {
            EXPECT_LT(zepatest::PeakMemoryKb(pid), MemoryLimitKb());
        }
        // Nothing set aside or written in its place.
        EXPECT_FALSE(root.exists(std::string(kConf) + ".bad"));
        if (std::string(kind) == "device") {
            char target[PATH_MAX] = {0};
            EXPECT_GT(readlink(root.path(kConf).c_str(), target, sizeof(target) - 1), 0);
            EXPECT_STREQ("/dev/zero", target);
        }
        std::string out;
        const BoundedRun stop = CtlBounded({"stop"}, &out);
        ExpectEndedOnItsOwn(stop, "stop");
        EXPECT_EQ(0, stop.status) << out;
        EXPECT_FALSE(Alive(pid));
        // A new daemon does not start on it.
        const BoundedRun start =
            RunBounded({kDaemon, "--root", root.dir(), "--ca-file", server.caFile()}, kToolLimitMs);
        ExpectEndedOnItsOwn(start, "zeparelayd");
        EXPECT_EQ(5, start.status);
        EXPECT_FALSE(root.exists("/var/run/zeparelayd.pid"));
        zepatest::RemoveWithBad(root.path(kConf));
        WriteConfig(4);
    }
}

// The check the tools make before a reload refuses exactly what the daemon's
// reader would refuse: nesting is limited to the same depth on both sides.
TEST_F(DaemonUnderAttack, ToolsAndDaemonDrawTheNestingLimitAtTheSameDepth) {
    const std::string good = root.read(kConf);
    auto nested = [&](int depth) {
        std::string text = good;
        const size_t close = text.rfind('}');
        text.insert(close, ",\n  \"x\": " + std::string(depth, '[') + std::string(depth, ']') + "\n");
        return text;
    };
    // The object itself is the first level.
    const int deepest = JSON_FILE_MAX_DEPTH - 1;
    root.write(kConf, nested(deepest));
    std::string out, err;
    EXPECT_EQ(0, Ctl({"check-config"}, &out, &err)) << err;
    EXPECT_EQ(0, Ctl({"services"}, &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("nos")) << out;

    root.write(kConf, nested(deepest + 1));
    EXPECT_EQ(5, Ctl({"check-config"}, &out, &err));
    EXPECT_NE(std::string::npos, err.find("nested deeper than 64 levels")) << err;
    EXPECT_EQ(5, Ctl({"services"}, &out, &err));
    // The library's own reader, as the daemon uses it, draws the line there too.
    Json::Value read;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(root.path(kConf), read));
    EXPECT_TRUE(read.isNull());
    root.write(kConf, nested(deepest));
    EXPECT_TRUE(RelaydConf::ReadJsonFile(root.path(kConf), read));
    EXPECT_TRUE(read.isObject());
}

// What stands at the alias status file's name is never read as a status and
// never kills the daemon, which goes on mapping its alias.
TEST_F(DaemonUnderAttack, AliasStatusThatIsNoUsableFileNeverKillsTheDaemon) {
    const pid_t pid = StartConnected();
    ASSERT_TRUE(Alive(pid));
    root.write("/etc/victim", "keep");
    chmod(root.path("/etc/victim").c_str(), 0600);
    std::vector<std::string> kinds(std::begin(kHostileKinds), std::end(kHostileKinds));
    kinds.push_back("link");
    for (const std::string& kind : kinds) {
        SCOPED_TRACE(kind);
        if (kind == "link") {
            zepatest::RemoveWithBad(root.path(kAliasStatus));
            ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), root.path(kAliasStatus).c_str()));
        } else {
            ASSERT_TRUE(zepatest::PlantHostile(kind, root.path(kAliasStatus)));
        }
        const int before = Requests("/alias_update.php");
        std::string out, err;
        const BoundedRun run = CtlBounded({"update-alias"}, &out, &err);
        ExpectEndedOnItsOwn(run, "update-alias");
        EXPECT_EQ(0, run.status) << err;
        ASSERT_TRUE(Handled("/alias_update.php", before + 1, "alias"))
            << "no alias request after update-alias";
        ExpectAnswering(pid);
        const BoundedRun status = CtlBounded({"status"}, &out);
        ExpectEndedOnItsOwn(status, "status");
        EXPECT_EQ(0, status.status) << out;
        EXPECT_NE(std::string::npos, out.find("alias: it-box")) << out;
        if (!kSanitized) {
            EXPECT_LT(zepatest::PeakMemoryKb(pid), MemoryLimitKb());
        }
    }
    EXPECT_EQ("keep", root.read("/etc/victim"));
    EXPECT_EQ(0600u, zepatest::FileMode(root.path("/etc/victim")) & 0777);
}

// Another user's file at the status file's name: the tools say it is broken
// or that no daemon runs, and never block, die or signal anybody.
TEST_F(DaemonUnderAttack, StatusFileThatIsNoUsableFileNeverBlocksOrKillsTheTools) {
    for (const char* kind : kHostileKinds) {
        SCOPED_TRACE(kind);
        ASSERT_TRUE(zepatest::PlantHostile(kind, root.path(kStatus)));
        std::string out, err;
        BoundedRun run = CtlBounded({"status"}, &out, &err);
        ExpectEndedOnItsOwn(run, "status");
        EXPECT_EQ(2, run.status) << out << err;
        EXPECT_NE(std::string::npos, err.find("status file")) << err;
        run = CtlBounded({"status", "--json"}, &out, &err);
        ExpectEndedOnItsOwn(run, "status --json");
        EXPECT_EQ(2, run.status);
        EXPECT_TRUE(zepatest::ParseJson(out)["state"].isNull()) << out;
        for (const char* cmd : {"update-alias", "reload"}) {
            run = CtlBounded({cmd}, &out, &err);
            ExpectEndedOnItsOwn(run, cmd);
            EXPECT_EQ(1, run.status) << cmd << ": " << err;
        }
        run = CtlBounded({"status", "--debug"}, &out, &err);
        ExpectEndedOnItsOwn(run, "status --debug");
        EXPECT_EQ(1, run.status);
        if (!kSanitized) {
            EXPECT_LT(run.maxRssKb, MemoryLimitKb());
        }
    }
}

// A control or alias server that answers with a gigabyte: the daemon keeps
// at most its answer limit of it, logs a clipped line even at debug level,
// and lives on answering.
TEST_F(DaemonUnderAttack, GigabyteAnswersCostNeitherMemoryNorLog) {
    WriteConfig(7);
    const pid_t pid = StartConnected();
    ASSERT_TRUE(Alive(pid));
    const long before = zepatest::PeakMemoryKb(pid);
    ASSERT_GT(before, 0);

    ASSERT_TRUE(StreamNext("/alias_update.php", kGigabyte));
    const int aliases = Requests("/alias_update.php");
    ASSERT_EQ(0, Ctl({"update-alias"}));
    ASSERT_TRUE(Handled("/alias_update.php", aliases + 1, "alias"));
    ExpectAnswering(pid);

    ASSERT_TRUE(StreamNext("/Serv.php", kGigabyte));
    const int regs = Requests("/Serv.php");
    ASSERT_EQ(0, ReloadToRegisterAgain());
    ASSERT_TRUE(Handled("/Serv.php", regs + 1, "register"));
    ExpectAnswering(pid);
    EXPECT_EQ(0, Ctl({"status"}));

    const long peak = zepatest::PeakMemoryKb(pid);
    RecordProperty("peak_memory_kb", static_cast<int>(peak));
    if (kSanitized) {
        EXPECT_LT(peak - before, kMemoryLimitKb) << "grew from " << before << " KiB";
    } else {
        EXPECT_LT(peak, MemoryLimitKb());
    }
    const std::string log = root.read("/var/log/zeparelayd.log");
    EXPECT_LT(log.size(), 256u * 1024) << "the log took in the answers";
    EXPECT_TRUE(zepatest::LogContains(log, "longer than 1048576 bytes")) << log.substr(0, 4096);
}

// Values sent under a credential's name, in a JSON body or in a form.
void CollectSecrets(const Json::Value& value, std::set<std::string>& out) {
    if (value.isObject()) {
        for (const std::string& key : value.getMemberNames()) {
            if (IsSecretKey(key) && value[key].isString()) out.insert(value[key].asString());
            CollectSecrets(value[key], out);
        }
    } else if (value.isArray()) {
        for (const Json::Value& item : value) CollectSecrets(item, out);
    }
}

std::string FormDecode(const std::string& text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] == '+') {
            out += ' ';
        } else if (text[i] == '%' && i + 2 < text.size()) {
            out += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16));
            i += 2;
        } else {
            out += text[i];
        }
    }
    return out;
}

void CollectFormSecrets(const std::string& body, std::set<std::string>& out) {
    size_t start = 0;
    while (start <= body.size()) {
        size_t end = body.find('&', start);
        if (end == std::string::npos) end = body.size();
        const std::string field = body.substr(start, end - start);
        const size_t eq = field.find('=');
        if (eq != std::string::npos && IsSecretKey(FormDecode(field.substr(0, eq)))) {
            out.insert(FormDecode(field.substr(eq + 1)));
        }
        start = end + 1;
    }
}

// At the most talkative log level, no credential the daemon sends shows in
// its log, status file, debug dump or anything the control tool prints.
TEST_F(DaemonUnderAttack, NoSecretReachesLogStatusDumpOrTools) {
    WriteConfig(7);
    const pid_t pid = StartConnected();
    ASSERT_TRUE(Alive(pid));
    const int aliases = Requests("/alias_update.php");
    ASSERT_EQ(0, Ctl({"update-alias"}));
    ASSERT_TRUE(Handled("/alias_update.php", aliases + 1, "alias"));

    std::set<std::string> secrets;
    for (const Json::Value& reg : server.requests("/Serv.php")) {
        CollectSecrets(zepatest::ParseJson(zepatest::RecordedBody(reg)), secrets);
    }
    for (const Json::Value& alias : server.requests("/alias_update.php")) {
        CollectFormSecrets(zepatest::RecordedBody(alias), secrets);
    }
    for (auto it = secrets.begin(); it != secrets.end();) {
        it = it->size() < 6 ? secrets.erase(it) : std::next(it);  // too short to search for
    }
    ASSERT_GE(secrets.size(), 2u) << "the daemon sent no token and no key";

    std::map<std::string, std::string> written;
    written["log"] = root.read("/var/log/zeparelayd.log");
    written["status file"] = root.read(kStatus);
    written["alias status file"] = root.read(kAliasStatus);
    written["debug dump"] = zepatest::ToJson(Dump());
    for (const std::vector<std::string>& cmd : std::vector<std::vector<std::string>>{
             {"status"}, {"status", "--json"}, {"status", "--debug"}, {"config"}, {"services"}}) {
        std::string out, err;
        Ctl(cmd, &out, &err);
        written["zeparelayctl " + cmd[0] + (cmd.size() > 1 ? " " + cmd[1] : "")] = out + err;
    }
    EXPECT_TRUE(zepatest::LogContains(written["log"], "alias")) << "nothing logged at debug level";
    for (const auto& [where, text] : written) {
        for (const std::string& secret : secrets) {
            EXPECT_EQ(std::string::npos, text.find(secret)) << "a credential in the " << where;
        }
    }
}

}  // namespace
