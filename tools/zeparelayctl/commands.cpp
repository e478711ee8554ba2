#include "commands.h"

#include <signal.h>
#include <time.h>

#include <cstdio>
#include <iostream>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

using namespace ZEPA::Relay;

namespace zeparelayctl {

namespace {

std::string ConfPath() { return Daemon::GetConfPath(); }

void SleepMs(long ms) {
    timespec ts{ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

// Asks a running daemon to re-read its configuration; says what happened.
int Reload(const char* what) {
    Daemon::LibInit();
    if (Daemon::Signal(SIGHUP) == 0) {
        printf("%s; the daemon reloads its configuration\n", what);
        return EXIT_OK;
    }
    printf("%s; the daemon does not run (it takes effect at the next start)\n", what);
    return EXIT_NOT_RUNNING;
}

int Status(const Args& args) {
    if (args.size() > 1 || (args.size() == 1 && args[0] != "--debug")) return EXIT_USAGE;
    const bool debug = args.size() == 1;
    const int ret = Daemon::Status(debug);
    if (ret != 0 || debug) return ret;
    // How the relay reaches the appliance: the daemon's own part of the file.
    Json::Value status;
    if (Daemon::GetStatus(status) != 0 || !status.isObject()) return ret;
    const Json::Value& connect = status["connect"];
    if (connect.isString() && !connect.asString().empty()) printf("connect: %s\n", connect.asCString());
    const Json::Value& tunnel = status["tunnel"];
    if (tunnel.isObject()) {
        printf("tunnel: %s, relay %s, peer %s, pid %d\n", tunnel.get("status", "").asString().c_str(),
               tunnel.get("relay_ip", "").asString().c_str(),
               tunnel.get("peer_ip", "").asString().empty() ? "--" : tunnel["peer_ip"].asCString(),
               tunnel.get("pid", -1).isInt() ? tunnel.get("pid", -1).asInt() : -1);
    }
    return ret;
}

int StartLog(const Args& args) {
    if (args.size() != 1) return EXIT_USAGE;
    if (VLIBRelaydLogStart(args[0].c_str()) != 0) {
        fprintf(stderr, "zeparelayctl: cannot update the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    printf("debug log to %s (level 7)\n", args[0].c_str());
    return EXIT_OK;
}

int StopLog(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    if (VLIBRelaydLogStop() != 0) {
        fprintf(stderr, "zeparelayctl: cannot update the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    printf("debug log stopped\n");
    return EXIT_OK;
}

int ServerId(const Args& args) {
    if (args.size() > 1) return EXIT_USAGE;
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

int UpdateAlias(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    const int ret = Daemon::UpdateAlias();
    if (ret == 0) printf("alias update requested\n");
    if (ret == 1) fprintf(stderr, "zeparelayctl: the daemon does not run\n");
    if (ret == 255) fprintf(stderr, "zeparelayctl: the status file is broken\n");
    return ret == 0 ? EXIT_OK : ret == 1 ? EXIT_NOT_RUNNING : EXIT_BROKEN;
}

int ReloadCmd(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    return Reload("configuration unchanged");
}

// Waits (bounded) until the process recorded in the status file is gone.
bool WaitGone(int seconds) {
    for (int i = 0; i < seconds * 20; ++i) {
        Json::Value status;
        if (Daemon::GetStatus(status) != 0) return true;
        SleepMs(50);
    }
    return false;
}

int Stop(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    Daemon::LibInit();
    if (Daemon::Kill() != 0) {
        fprintf(stderr, "zeparelayctl: the daemon does not run\n");
        return EXIT_NOT_RUNNING;
    }
    if (!WaitGone(10)) {
        fprintf(stderr, "zeparelayctl: the daemon did not stop within 10 s\n");
        return EXIT_BROKEN;
    }
    printf("daemon stopped\n");
    return EXIT_OK;
}

int Switch(bool on) {
    RelaydConf conf(ConfPath().c_str());
    if (!conf.SetEnableConf(on)) return EXIT_CONFIG;
    conf.GenServiceConf();
    if (!conf.WriteConfigFile()) {
        fprintf(stderr, "zeparelayctl: cannot write the configuration %s\n", ConfPath().c_str());
        return EXIT_CONFIG;
    }
    const int ret = Reload(on ? "relay enabled" : "relay disabled");
    // A switch that is stored counts as done even when no daemon runs.
    return ret == EXIT_NOT_RUNNING ? EXIT_OK : ret;
}

int Enable(const Args& args) { return args.empty() ? Switch(true) : EXIT_USAGE; }
int Disable(const Args& args) { return args.empty() ? Switch(false) : EXIT_USAGE; }

int Services(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    RelaydConf conf(ConfPath().c_str());
    printf("%-24s %-24s %6s %8s\n", "ID", "NAME", "PORT", "EXT_PORT");
    for (const ServiceConf& s : conf.services) {
        printf("%-24s %-24s %6d %8d\n", s.id.c_str(), s.name.c_str(), s.port, s.ext_port);
    }
    return EXIT_OK;
}

int ConfigCmd(const Args& args) {
    if (!args.empty()) return EXIT_USAGE;
    RelaydConf conf(ConfPath().c_str());
    Json::Value full;
    conf.Write(full, true);
    // "-" makes the JSON writer print the styled text on standard output.
    return RelaydConf::WriteJsonFile("-", full) ? EXIT_OK : EXIT_CONFIG;
}

}  // namespace

const Command kCommands[] = {
    {"status", "status [--debug]",
     "Prints the daemon's server id, state, alias and alias status (and the error\n"
     "when there is one). With --debug, asks the running daemon for its debug dump\n"
     "and prints it as one JSON line.\n"
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
    {"reload", "reload", "Asks the running daemon to re-read its configuration.\n", ReloadCmd},
    {"stop", "stop", "Stops the running daemon and waits (at most 10 s) until it is gone.\n", Stop},
    {"enable", "enable",
     "Switches the relay on (\"runrelayd\"), regenerates the service list, writes\n"
     "the configuration and asks the daemon to reload.\n",
     Enable},
    {"disable", "disable", "Switches the relay off, like enable otherwise.\n", Disable},
    {"services", "services", "Lists the relayed services of the configuration.\n", Services},
    {"config", "config", "Prints the whole configuration in its full form.\n", ConfigCmd},
    {nullptr, nullptr, nullptr, nullptr},
};

}  // namespace zeparelayctl
