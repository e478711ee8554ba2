// zeparelayd: the relay daemon. Exit statuses: exit_codes.h (shared with
// zeparelayctl); the parent of a forking start passes on the child's start-up
// word (0 started, 4 PID file not created, 255 no word).
#define RLOG_SOURCE "zeparelayd"

#include <curl/curl.h>
#include <getopt.h>
#include <libdaemon/dpid.h>
#include <libdaemon/dsignal.h>
#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zepasdk/sysroot.h>

#include "clock.h"
#include "config_check.h"
#include "event_loop.h"
#include "exit_codes.h"
#include "log.h"
#include "log_file_check.h"
#include "recovery.h"
#include "relay_daemon.h"
#include "relayd_protocol.h"

using namespace ZEPA::Relay;
using namespace zepatools;

namespace {

const char kUsage[] =
    "Usage: zeparelayd [OPTIONS]\n"
    "       zeparelayd [--root DIR] --check-config [FILE]\n"
    "Relay daemon: registers the appliance's services with the relay's control\n"
    "server and keeps its alias registered.\n"
    "\n"
    "  --root DIR            system root: every fixed path is taken below DIR\n"
    "  --ca-file FILE        also trust this CA for https (staging set-ups only)\n"
    "  -f, --foreground      do not daemonise; log to standard error\n"
    "  --check-config [FILE] check the configuration (by default the daemon's) and\n"
    "                        print what is wrong as FILE:LINE:COLUMN: message\n"
    "  -h, --help            this text\n"
    "  -V, --version         print the version\n"
    "\n"
    "Signals: TERM/INT/QUIT stop, HUP reloads the configuration (a broken file is\n"
    "refused and the last good configuration kept), USR1 writes the debug dump,\n"
    "RTMIN+1 updates the alias now, RTMIN+2 reopens the log file.\n"
    "\n";

struct Options {
    std::string root;
    std::string caFile;
    bool foreground = false;
    bool checkConfig = false;
    std::string checkFile;
};

// EXIT_OK parsed, -1 done (help/version printed), EXIT_USAGE bad usage.
int ParseOptions(int argc, char** argv, Options& opt) {
    enum { OPT_ROOT = 256, OPT_CA_FILE, OPT_CHECK };
    const option longOptions[] = {
        {"root", required_argument, nullptr, OPT_ROOT},
        {"ca-file", required_argument, nullptr, OPT_CA_FILE},
        {"foreground", no_argument, nullptr, 'f'},
        {"check-config", no_argument, nullptr, OPT_CHECK},
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {nullptr, 0, nullptr, 0},
    };
    int c;
    while ((c = getopt_long(argc, argv, "fhV", longOptions, nullptr)) != -1) {
        switch (c) {
            case OPT_ROOT:
                opt.root = optarg;
                break;
            case OPT_CA_FILE:
                opt.caFile = optarg;
                break;
            case OPT_CHECK:
                opt.checkConfig = true;
                break;
            case 'f':
                opt.foreground = true;
                break;
            case 'h':
                fputs(kUsage, stdout);
                fputs(kExitTable, stdout);
                return -1;
            case 'V':
                printf("zeparelayd %s\n", ZEPARELAYD_VERSION);
                return -1;
            default:  // getopt has named the option
                fputs("Try 'zeparelayd --help'.\n", stderr);
                return EXIT_USAGE;
        }
    }
    // --check-config takes one optional FILE; nothing else takes arguments.
    if (opt.checkConfig && optind < argc) opt.checkFile = argv[optind++];
    if (optind < argc) {
        fprintf(stderr, "zeparelayd: unexpected argument '%s'\nTry 'zeparelayd --help'.\n", argv[optind]);
        return EXIT_USAGE;
    }
    return EXIT_OK;
}

// libdaemon changes to "/" when it forks: relative names must be made
// absolute first. A name that does not resolve is reported with its cause.
bool Absolute(const char* option, std::string& path) {
    if (path.empty()) return true;
    char buf[PATH_MAX];
    if (realpath(path.c_str(), buf) == nullptr) {
        fprintf(stderr, "zeparelayd: %s %s: %s\n", option, path.c_str(), strerror(errno));
        return false;
    }
    path = buf;
    return true;
}

// A PID file naming a process that is not a zeparelayd (left by a crash, its
// number since reused) would make the start fail: it is removed instead.
void RemoveStalePidFile() {
    const PidFileState daemon = DaemonFromPidFile();
    if (!daemon.stale) return;
    const char* pidFile = Daemon::GetPidFile();
    if (unlink(pidFile) == 0) {
        fprintf(stderr, "zeparelayd: removed the stale PID file %s (it named no running zeparelayd)\n",
                pidFile);
    } else if (errno != ENOENT) {
        fprintf(stderr, "zeparelayd: cannot remove the stale PID file %s: %s\n", pidFile, strerror(errno));
    }
}

// --root and --ca-file: absolute, the system root taken, the extra CA trusted.
bool ApplyPathOptions(Options& opt) {
    if (!Absolute("--root", opt.root) || !Absolute("--ca-file", opt.caFile)) return false;
    if (!opt.root.empty() && ZEPASysRootSet(opt.root.c_str()) != 0) {
        fprintf(stderr, "zeparelayd: --root %s: not usable as the system root\n", opt.root.c_str());
        return false;
    }
    if (!opt.caFile.empty()) Request::SetExtraCaFile(opt.caFile);
    return true;
}

// A broken file would be set aside as ".bad" by the library and the daemon
// would run on defaults: the operator fixes it first.
bool ConfigurationUsable(const std::string& confPath) {
    if (access(confPath.c_str(), F_OK) != 0) return true;
    const ConfigCheck check = CheckConfigFile(confPath);
    if (check.ok()) return true;
    for (const std::string& e : check.errors) fprintf(stderr, "zeparelayd: %s\n", e.c_str());
    fprintf(stderr, "zeparelayd: not started: fix the configuration (zeparelayd --check-config)\n");
    return false;
}

// Log settings before forking, so that the child's standard error points at
// the configured file from its first line on. The child opens that file after
// the fork, too late to refuse the start: a link or FIFO there is refused
// here. EXIT_OK, or the exit status.
int ApplyEarlyLogSettings(const std::string& confPath, bool foreground) {
    RelaydConf early(confPath.c_str());
    zeparelayd::ApplyLogSettings(early);
    std::string why;
    if (!foreground && !LogFileUsable(Daemon::_strLogFile, why)) {
        fprintf(stderr, "zeparelayd: not started: the log file %s %s; remove it or choose another\n",
                Daemon::_strLogFile.c_str(), why.c_str());
        return EXIT_CONFIG;
    }
    return EXIT_OK;
}

// Tools signal the daemon as soon as its PID file exists. So the signals are
// held back from before the PID file is written, and their handlers
// (inherited across the fork) exist by then too; they are let through once
// the loop can answer them. EXIT_OK, or the exit status.
int HoldSignals(sigset_t& previous) {
    const sigset_t held = DaemonSignalSet();
    sigprocmask(SIG_BLOCK, &held, &previous);
    if (Daemon::InitSignalHandler() < 0 || daemon_signal_install(SignalOf(DaemonSignal::REOPEN_LOG)) < 0) {
        fprintf(stderr, "zeparelayd: cannot install the signal handlers\n");
        return EXIT_NO_LOOP;
    }
    return EXIT_OK;
}

// The fork (unless in the foreground) and the PID file. EXIT_OK in the
// daemon, or the exit status.
int BecomeDaemon(bool foreground) {
    if (Daemon::Init(!foreground)) return EXIT_OK;
    if (DaemonFromPidFile().pid > 0) {
        fprintf(stderr, "zeparelayd: not started: a zeparelayd already runs on the PID file %s\n",
                Daemon::GetPidFile());
        return EXIT_ALREADY_RUNNING;
    }
    fprintf(stderr, "zeparelayd: not started: cannot create the PID file %s\n", Daemon::GetPidFile());
    return EXIT_NO_PID_FILE;
}

// The loop until a stop signal; the final status written. The exit status.
int RunLoop(const std::string& confPath, const sigset_t& previous) {
    zeparelayd::MonotonicClock clock;
    zeparelayd::EventLoop loop(clock);
    zeparelayd::RelayDaemon relay(confPath, loop, clock);
    relay.ApplyLogSettings();
    if (!loop.IsReady()) {
        RLOG(LOG_ERR, "cannot set up the event loop");
        return EXIT_NO_LOOP;
    }
    loop.OnSignal([&relay](int sig) { relay.HandleSignal(sig); });
    loop.OnIdle([&relay] { relay.Idle(); });
    loop.OnClockSet([] { zeparelayd::RefreshLivenessStamps(); });
    // Before any tunnel: never two openvpn for one appliance.
    zeparelayd::RemoveLeftovers();
    const bool started = relay.Start();
    sigprocmask(SIG_SETMASK, &previous, nullptr);
    const int status = started && loop.Run() ? EXIT_OK : EXIT_NO_LOOP;
    relay.Shutdown();
    return status;
}

}  // namespace

int main(int argc, char** argv) {
    Options opt;
    const int parsed = ParseOptions(argc, argv, opt);
    if (parsed != EXIT_OK) return parsed < 0 ? EXIT_OK : parsed;
    if (!ApplyPathOptions(opt)) return EXIT_USAGE;

    Daemon::SetName(argv[0]);
    const std::string confPath = Daemon::GetConfPath();
    if (opt.checkConfig) {
        Daemon::_logLevel = -1;  // the check speaks for itself, on standard error
        return ReportConfigCheck("zeparelayd", opt.checkFile.empty() ? confPath : opt.checkFile)
                   ? EXIT_OK
                   : EXIT_CONFIG;
    }
    if (!ConfigurationUsable(confPath)) return EXIT_CONFIG;
    RemoveStalePidFile();
    int status = ApplyEarlyLogSettings(confPath, opt.foreground);
    if (status != EXIT_OK) return status;
    sigset_t previous;
    status = HoldSignals(previous);
    if (status != EXIT_OK) return status;
    status = BecomeDaemon(opt.foreground);
    if (status != EXIT_OK) return status;

    curl_global_init(CURL_GLOBAL_DEFAULT);
    status = RunLoop(confPath, previous);
    daemon_signal_done();
    daemon_pid_file_remove();
    curl_global_cleanup();
    return status;
}
