#include "commands.h"

#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>

#include <json/writer.h>

#include <zeparelayd/config.h>
#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>

#include "config_check.h"
#include "doctor.h"
#include "relayd_protocol.h"

using namespace ZEPA::Relay;
namespace key = zepatools::status_key;

namespace zeparelayctl {

namespace {

std::string ConfPath() { return Daemon::GetConfPath(); }

void SleepMs(long ms) {
    timespec ts{ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

// "not running", with the reason when a PID file names another process.
void SayNotRunning(const PidFileState& daemon, FILE* out) {
    fprintf(out, "%s\n", daemon.stale ? "not running (stale PID file)" : "not running");
}

// A signal for the daemon, only when the PID file names a live zeparelayd.
int SignalDaemon(DaemonSignal request, PidFileState& daemon) {
    daemon = DaemonFromPidFile();
    if (daemon.pid <= 0) return EXIT_NOT_RUNNING;
    return kill(daemon.pid, SignalOf(request)) == 0 ? EXIT_OK : EXIT_NOT_RUNNING;
}

// The configuration as the daemon would read it; a broken one is named with
// line and column, and nothing is sent.
bool ConfigUsable(const std::string& path) {
    const ConfigCheck check = CheckConfigFile(path);
    for (const std::string& e : check.errors) fprintf(stderr, "zeparelayctl: %s\n", e.c_str());
    if (!check.ok()) {
        fprintf(stderr,
                "zeparelayctl: configuration not valid; fix it and try again (check-config shows it)\n");
    }
    return check.ok();
}

// Asks a running daemon to re-read its configuration; says what happened.
int Reload(const char* what) {
    PidFileState daemon;
    if (SignalDaemon(DaemonSignal::RELOAD, daemon) == EXIT_OK) {
        printf("%s; the daemon reloads its configuration\n", what);
        return EXIT_OK;
    }
    printf("%s; the daemon is %s (it takes effect at the next start)\n", what,
           daemon.stale ? "not running (stale PID file)" : "not running");
    return EXIT_NOT_RUNNING;
}

// A configuration that exists but is broken must not reach the library's
// readers: they would set it aside as ".bad".
bool ConfigReadable() { return access(ConfPath().c_str(), F_OK) != 0 || ConfigUsable(ConfPath()); }

// What "status" shows, from the status file and, for the alias, the
// configuration and the alias status file.
struct StatusView {
    int result = EXIT_OK;  // EXIT_OK, EXIT_NOT_RUNNING or EXIT_BROKEN_STATUS
    std::string serverId, state, error, aliasName, aliasStatus;
    Json::Value file;  // the status file while the daemon runs, else null
};

// The status file is read once; its words are those of the library's word
// form (Daemon::GetStatus without a service id).
StatusView ReadStatus() {
    StatusView view;
    Json::Value file;
    const int probe = Daemon::GetStatus(file);
    if (probe != RELAYD_RESULT_OK && probe != RELAYD_RESULT_NOT_RUNNING) {
        view.result = EXIT_BROKEN_STATUS;
        return view;
    }
    if (file.isObject() && file[key::kServerId].isString()) view.serverId = file[key::kServerId].asString();
    int state = 1;
    int error = 0;
    if (probe == RELAYD_RESULT_OK) {
        if (file[key::kState].isInt()) state = file[key::kState].asInt();
        if (file[key::kError].isInt()) error = file[key::kError].asInt();
    }
    view.state = GetStateStr(static_cast<RELAYD_STATE>(state));
    view.error = GetErrorStr(static_cast<RELAYD_RET>(error));
    view.result = view.state == "not_running" ? EXIT_NOT_RUNNING : EXIT_OK;
    if (view.result == EXIT_OK) view.file = file;
    // The alias the configuration names (its alias section only); when that
    // file is broken, the one the daemon last reported.
    Json::Value conf;
    if (CheckConfigFile(ConfPath()).ok() && RelaydConf::ReadJsonFile(ConfPath(), conf) && conf.isObject()) {
        AliasConf alias;
        if (conf.isMember("server_alias")) alias.Overwrite(conf["server_alias"]);
        view.aliasName = alias.GetAliasName();
    } else if (file.isObject() && file[key::kAlias].isString()) {
        view.aliasName = file[key::kAlias].asString();
    }
    AliasStatus aliasStatus;
    std::string extra;
    aliasStatus.GetStatus(view.aliasName, view.aliasStatus, extra);
    return view;
}

// How the relay reaches the appliance: the daemon's own part of the file.
void PrintConnection(const Json::Value& file) {
    const Json::Value& connect = file[key::kConnect];
    if (connect.isString() && !connect.asString().empty()) printf("connect: %s\n", connect.asCString());
    const Json::Value& tunnel = file[key::kTunnel];
    if (tunnel.isObject()) {
        const std::string peer = tunnel.get(key::kTunnelPeerIp, "").asString();
        printf("tunnel: %s, relay %s, peer %s, pid %d\n",
               tunnel.get(key::kTunnelStatus, "").asString().c_str(),
               tunnel.get(key::kTunnelRelayIp, "").asString().c_str(), peer.empty() ? "--" : peer.c_str(),
               tunnel.get(key::kTunnelPid, -1).isInt() ? tunnel.get(key::kTunnelPid, -1).asInt() : -1);
    }
}

int StatusText() {
    const StatusView view = ReadStatus();
    if (view.result == EXIT_BROKEN_STATUS) {
        printf("get status failed\n");
        fprintf(stderr, "zeparelayctl: the status file %s is broken\n", Daemon::GetStatusPath().c_str());
        return view.result;
    }
    printf("serverID: %s\nstate: %s\nalias: %s\nalias_status: %s\n", view.serverId.c_str(),
           view.state.c_str(), view.aliasName.c_str(), view.aliasStatus.c_str());
    if (view.error != "success") printf("error: %s\n", view.error.c_str());
    if (view.file[key::kConfigError].isString())
        printf("config_error: %s\n", view.file[key::kConfigError].asCString());
    PrintConnection(view.file);
    return view.result;
}

// The status as one JSON object:
//   {"state", "error", "serverID", "alias", "alias_status", "services", "pid"
//    [, "connect"] [, "tunnel"] [, "config_error"]}
// "state" and "error" are the words of the status readers ("connected",
// "err_auth", ...), null when the status file is broken; "services" lists the
// relayed service ids; "pid" is the daemon's process id or null; "connect",
// "tunnel" and "config_error" are copied from the status file when the daemon writes them.
int StatusJson() {
    const StatusView view = ReadStatus();
    const bool broken = view.result == EXIT_BROKEN_STATUS;
    Json::Value out(Json::objectValue);
    out["state"] = broken ? Json::Value() : Json::Value(view.state);
    out["error"] = broken ? Json::Value() : Json::Value(view.error);
    out["serverID"] = view.serverId;
    out["alias"] = view.aliasName;
    out["alias_status"] = view.aliasStatus;
    out["services"] = Json::Value(Json::arrayValue);
    out["pid"] = Json::Value();
    if (view.file.isObject()) {
        for (const Json::Value& s : view.file[key::kService]) {
            if (s.isObject() && s[key::kServiceId].isString()) out["services"].append(s[key::kServiceId]);
        }
        out["pid"] = view.file[key::kPid];
        for (const char* copied : {key::kConnect, key::kTunnel, key::kConfigError}) {
            if (view.file.isMember(copied)) out[copied] = view.file[copied];
        }
    }
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "";
    printf("%s\n", Json::writeString(writer, out).c_str());
    return view.result;
}

int Status(const Args& args, const Options& opt) {
    if (!args.empty() || (opt.json && opt.debug)) return EXIT_USAGE;
    if (opt.json) return StatusJson();
    if (!opt.debug) return StatusText();
    // The debug query signals the PID file's process: only ours.
    const PidFileState daemon = DaemonFromPidFile();
    if (daemon.pid <= 0) {
        SayNotRunning(daemon, stderr);
        return EXIT_NOT_RUNNING;
    }
    return Daemon::Status(true);
}

int StartLog(const Args& args, const Options&) {
    if (args.size() != 1) return EXIT_USAGE;
    if (!ConfigReadable()) return EXIT_CONFIG;
    if (VLIBRelaydLogStart(args[0].c_str()) != 0) {
        fprintf(stderr, "zeparelayctl: cannot update the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    printf("debug log to %s (level 7)\n", args[0].c_str());
    return EXIT_OK;
}

int StopLog(const Args& args, const Options&) {
    if (!args.empty()) return EXIT_USAGE;
    if (!ConfigReadable()) return EXIT_CONFIG;
    if (VLIBRelaydLogStop() != 0) {
        fprintf(stderr, "zeparelayctl: cannot update the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    printf("debug log stopped\n");
    return EXIT_OK;
}

int ServerId(const Args& args, const Options&) {
    if (args.size() > 1) return EXIT_USAGE;
    if (!ConfigReadable()) return EXIT_CONFIG;
    char buf[256];
    const int ret = VLIBRelaydGetServerId(args.empty() ? nullptr : args[0].c_str(), buf, sizeof(buf));
    if (ret < 0) {
        fprintf(stderr, "zeparelayctl: cannot read the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    if (ret == 0) {
        if (buf[0] == '\0') {
            printf("--\n");
            fprintf(stderr, "zeparelayctl: no server id yet\n");
        } else {
            printf("--\n");
            fprintf(stderr, "zeparelayctl: service %s is not relayed\n", args[0].c_str());
        }
        return EXIT_NOT_FOUND;
    }
    printf("%s\n", buf);
    return EXIT_OK;
}

// A signal that asks the running daemon for one thing; says it was sent.
int Ask(DaemonSignal request, const char* done) {
    PidFileState daemon;
    if (SignalDaemon(request, daemon) != EXIT_OK) {
        SayNotRunning(daemon, stderr);
        return EXIT_NOT_RUNNING;
    }
    printf("%s\n", done);
    return EXIT_OK;
}

int UpdateAlias(const Args& args, const Options&) {
    return args.empty() ? Ask(DaemonSignal::UPDATE_ALIAS, "alias update requested") : EXIT_USAGE;
}

int ReloadCmd(const Args& args, const Options&) {
    if (!args.empty()) return EXIT_USAGE;
    const PidFileState daemon = DaemonFromPidFile();
    if (daemon.pid <= 0) {
        SayNotRunning(daemon, stderr);
        return EXIT_NOT_RUNNING;
    }
    if (!ConfigUsable(ConfPath())) return EXIT_CONFIG;
    return Reload("configuration checked");
}

int ReopenLog(const Args& args, const Options&) {
    return args.empty() ? Ask(DaemonSignal::REOPEN_LOG, "the daemon reopens its log file") : EXIT_USAGE;
}

int CheckConfig(const Args& args, const Options&) {
    if (args.size() > 1) return EXIT_USAGE;
    return ReportConfigCheck("zeparelayctl", args.empty() ? ConfPath() : args[0]) ? EXIT_OK : EXIT_CONFIG;
}

// Waits (bounded) until the process is gone: the daemon removes its PID
// file a little before it ends.
bool WaitGone(pid_t pid, int seconds) {
    for (int i = 0; i < seconds * 20; ++i) {
        if (kill(pid, 0) != 0 && errno == ESRCH) return true;
        SleepMs(50);
    }
    return false;
}

int Stop(const Args& args, const Options&) {
    if (!args.empty()) return EXIT_USAGE;
    PidFileState daemon;
    if (SignalDaemon(DaemonSignal::STOP, daemon) != EXIT_OK) {
        // Stopping what does not run is done already.
        SayNotRunning(daemon, stdout);
        return EXIT_OK;
    }
    if (!WaitGone(daemon.pid, 10)) {
        fprintf(stderr, "zeparelayctl: the daemon (pid %d) did not stop within 10 s\n",
                static_cast<int>(daemon.pid));
        return EXIT_BROKEN;
    }
    printf("daemon stopped\n");
    return EXIT_OK;
}

int Switch(bool on) {
    // Reading a broken file would make the library set it aside as ".bad"
    // and this write replace it: the operator's configuration would be lost.
    if (!ConfigReadable()) return EXIT_CONFIG;
    RelaydConf conf(ConfPath().c_str());
    if (!conf.SetEnableConf(on)) {
        fprintf(stderr, "zeparelayctl: cannot store \"runrelayd\" in the system settings\n");
        return EXIT_CONFIG;
    }
    conf.GenServiceConf();
    if (!conf.WriteConfigFile()) {
        fprintf(stderr, "zeparelayctl: cannot write the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    const int ret = Reload(on ? "relay enabled" : "relay disabled");
    // A switch that is stored counts as done even when no daemon runs.
    return ret == EXIT_NOT_RUNNING ? EXIT_OK : ret;
}

int Enable(const Args& args, const Options&) { return args.empty() ? Switch(true) : EXIT_USAGE; }
int Disable(const Args& args, const Options&) { return args.empty() ? Switch(false) : EXIT_USAGE; }

int Services(const Args& args, const Options&) {
    if (!args.empty()) return EXIT_USAGE;
    if (!ConfigReadable()) return EXIT_CONFIG;
    RelaydConf conf(ConfPath().c_str());
    printf("%-24s %-24s %6s %8s\n", "ID", "NAME", "PORT", "EXT_PORT");
    for (const ServiceConf& s : conf.services) {
        // -1 means absent: shown as "-".
        const std::string port = s.port < 0 ? "-" : std::to_string(s.port);
        const std::string ext = s.ext_port < 0 ? "-" : std::to_string(s.ext_port);
        printf("%-24s %-24s %6s %8s\n", s.id.c_str(), s.name.c_str(), port.c_str(), ext.c_str());
    }
    return EXIT_OK;
}

int ConfigCmd(const Args& args, const Options&) {
    if (!args.empty()) return EXIT_USAGE;
    if (!ConfigReadable()) return EXIT_CONFIG;
    RelaydConf conf(ConfPath().c_str());
    Json::Value full;
    conf.Write(full, true);
    // The full form carries the writing process's id, here this tool's:
    // not the daemon's, so it is left out.
    full.removeMember("pid");
    // "-" makes the JSON writer print the styled text on standard output.
    return RelaydConf::WriteJsonFile("-", full) ? EXIT_OK : EXIT_CONFIG;
}

int DoctorCmd(const Args& args, const Options& opt) {
    if (!args.empty() || opt.debug) return EXIT_USAGE;
    const DoctorReport report = RunDoctor(opt.timeoutMs > 0 ? opt.timeoutMs : DOCTOR_DEFAULT_TIMEOUT_MS);
    if (opt.json) {
        Json::StreamWriterBuilder writer;
        writer["indentation"] = "";
        printf("%s\n", Json::writeString(writer, report.ToJson()).c_str());
    } else {
        // Colour only for a person at a terminal.
        const char* term = getenv("TERM");
        const bool colour = isatty(STDOUT_FILENO) && getenv("NO_COLOR") == nullptr && term != nullptr &&
                            strcmp(term, "dumb") != 0;
        fputs(report.ToText(colour).c_str(), stdout);
    }
    fflush(stdout);
    return report.ExitStatus();
}

}  // namespace

const Command kCommands[] = {
    {"status", "status [--debug | --json]",
     "Prints the daemon's server id, state, alias and alias status (and the error\n"
     "when there is one). With --debug, asks the running daemon for its debug dump\n"
     "and prints it as one JSON line. With --json, prints one JSON object:\n"
     "  {\"state\": WORD|null, \"error\": WORD|null, \"serverID\": STRING,\n"
     "   \"alias\": STRING, \"alias_status\": WORD, \"services\": [ID, ...],\n"
     "   \"pid\": INT|null, \"tunnel\": OBJECT (only when the daemon reports one)}\n"
     "Exit status: 0 running, 1 not running, 2 broken status file; with --debug\n"
     "0, 1, 11 (busy or no dump) or 255 (broken files).\n",
     Status},
    {"start-log", "start-log FILE",
     "Stores log level 7 and the log file FILE (an appliance path, taken below the\n"
     "root) in the configuration and asks the daemon to reload.\n",
     StartLog},
    {"stop-log", "stop-log",
     "Removes the log settings from the configuration and asks the daemon to reload.\n", StopLog},
    {"server-id", "server-id [SERVICE]",
     "Prints the appliance's server id from the configuration. With SERVICE, prints\n"
     "it only when that service is relayed, else \"--\" (exit status 6).\n",
     ServerId},
    {"update-alias", "update-alias", "Asks the running daemon to register the alias now.\n", UpdateAlias},
    {"reload", "reload",
     "Checks the configuration, then asks the running daemon to re-read it. A\n"
     "broken file is named with line and column and not sent (exit status 5).\n",
     ReloadCmd},
    {"reopen-log", "reopen-log",
     "Asks the running daemon to reopen its log file (after log rotation), without\n"
     "reloading anything else (SIGRTMIN+2).\n",
     ReopenLog},
    {"check-config", "check-config [FILE]",
     "Checks a relay configuration file (by default the daemon's) and prints what is\n"
     "wrong as FILE:LINE:COLUMN: message. Exit status 0 usable, 5 broken.\n",
     CheckConfig},
    {"stop", "stop",
     "Stops the running daemon and waits (at most 10 s) until it is gone. A daemon\n"
     "that does not run counts as stopped (exit status 0).\n",
     Stop},
    {"enable", "enable",
     "Switches the relay on (\"runrelayd\"), regenerates the service list, writes\n"
     "the configuration and asks the daemon to reload. A broken configuration is\n"
     "left as it is (exit status 5).\n",
     Enable},
    {"disable", "disable", "Switches the relay off, like enable otherwise.\n", Disable},
    {"services", "services", "Lists the relayed services of the configuration.\n", Services},
    {"config", "config", "Prints the whole configuration in its full form.\n", ConfigCmd},
    {"doctor", "doctor [--json] [--timeout SECONDS]",
     "Checks, in order, everything the relay needs and says for each check ok, warn,\n"
     "fail or skipped, with its time and, when something is wrong, what to do: the\n"
     "configuration and relay switch, the identity, the daemon, the control and\n"
     "alias servers (name lookup, TCP, TLS, HTTP, the alias's mapping), the clock,\n"
     "the tunnel's prerequisites and the relayed services. Changes nothing: no\n"
     "registration, no alias change, no file written, no signal sent. Each network\n"
     "step gives up after SECONDS (default 5). Secrets are never shown.\n"
     "With --json, prints one object:\n"
     "  {\"schema\": 1, \"result\": \"ok\"|\"warn\"|\"fail\", \"exit_status\": 0|1|2,\n"
     "   \"time_ms\": INT, \"timeout_ms\": INT, \"checks\": [{\"name\", \"result\":\n"
     "   \"ok\"|\"warn\"|\"fail\"|\"skipped\", \"time_ms\", \"detail\", \"hint\"}, ...],\n"
     "   \"services\": [{\"id\", \"name\", \"port\", \"ext_port\"}, ...]}\n"
     "Exit status: 0 every check ok, 1 warnings only, 2 at least one failure.\n",
     DoctorCmd},
    {nullptr, nullptr, nullptr, nullptr},
};

}  // namespace zeparelayctl
