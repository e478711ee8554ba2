// zeparelayd: the relay daemon.
//
// Exit statuses: 0 started (the parent reports the child's start-up word:
// 0 started, 4 PID file not created, 255 no word) or stopped cleanly;
// 1 a daemon already runs on the PID file; 2 bad usage; 3 the event loop
// could not be set up.
#define RLOG_SOURCE "zeparelayd"

#include <curl/curl.h>
#include <libdaemon/dpid.h>
#include <libdaemon/dsignal.h>
#include <limits.h>
#include <signal.h>
#include <stdlib.h>

#include <cstdio>
#include <cstring>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zepasdk/sysroot.h>

#include "clock.h"
#include "event_loop.h"
#include "log.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;

namespace {

const char kUsage[] =
    "Usage: zeparelayd [OPTIONS]\n"
    "Relay daemon: registers the appliance's services with the relay's control\n"
    "server and keeps its alias registered.\n"
    "\n"
    "  --root DIR       system root: every fixed path is taken below DIR\n"
    "  --ca-file FILE   also trust this CA for https (staging set-ups only)\n"
    "  -f, --foreground do not daemonise; log to standard error\n"
    "  -h, --help       this text\n"
    "  -V, --version    print the version\n"
    "\n"
    "Signals: TERM/INT/QUIT stop, HUP reloads the configuration, USR1 writes the\n"
    "debug dump, RTMIN+1 updates the alias now.\n"
    "Exit status: 0 started, 1 already running, 2 bad usage, 3 no event loop,\n"
    "4 PID file not created, 255 the daemon gave no start-up word.\n";

struct Options {
    std::string root;
    std::string caFile;
    bool foreground = false;
};

// 0 parsed, 1 done (help/version printed), 2 bad usage.
int ParseOptions(int argc, char** argv, Options& opt) {
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "-h" || arg == "--help") {
            fputs(kUsage, stdout);
            return 1;
        }
        if (arg == "-V" || arg == "--version") {
            printf("zeparelayd %s\n", ZEPARELAYD_VERSION);
            return 1;
        }
        if (arg == "-f" || arg == "--foreground") {
            opt.foreground = true;
        } else if ((arg == "--root" || arg == "--ca-file") && i + 1 < argc) {
            (arg == "--root" ? opt.root : opt.caFile) = argv[++i];
        } else {
            fprintf(stderr, "zeparelayd: unknown or incomplete option '%s'\n%s", arg.c_str(), kUsage);
            return 2;
        }
    }
    return 0;
}

// libdaemon changes to "/" when it forks: relative names must be made absolute first.
bool Absolute(std::string& path) {
    if (path.empty()) return true;
    char buf[PATH_MAX];
    if (realpath(path.c_str(), buf) == nullptr) return false;
    path = buf;
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    Options opt;
    const int parsed = ParseOptions(argc, argv, opt);
    if (parsed != 0) return parsed == 1 ? 0 : 2;
    if (!Absolute(opt.root) || !Absolute(opt.caFile)) {
        fprintf(stderr, "zeparelayd: no such directory or file: %s\n", strerror(errno));
        return 2;
    }
    if (!opt.root.empty() && ZEPASysRootSet(opt.root.c_str()) != 0) {
        fprintf(stderr, "zeparelayd: bad root '%s'\n", opt.root.c_str());
        return 2;
    }
    if (!opt.caFile.empty()) Request::SetExtraCaFile(opt.caFile);

    Daemon::SetName(argv[0]);
    const std::string confPath = Daemon::GetConfPath();
    {
        // Log settings before forking, so that the child's standard error
        // points at the configured file from its first line on.
        RelaydConf early(confPath.c_str());
        zeparelayd::ApplyLogSettings(early);
    }
    // Tools signal the daemon as soon as its PID file exists. So the signals
    // are held back from before the PID file is written, and their handlers
    // (inherited across the fork) exist by then too; they are let through
    // once the loop can answer them.
    sigset_t held;
    sigemptyset(&held);
    for (int sig : {SIGINT, SIGTERM, SIGQUIT, SIGPIPE, SIGHUP, SIGCHLD, SIGALRM, SIGUSR1, SIGUSR2,
                    SIGRTMIN + 1, SIGRTMIN + 5}) {
        sigaddset(&held, sig);
    }
    sigset_t previous;
    sigprocmask(SIG_BLOCK, &held, &previous);
    if (Daemon::InitSignalHandler() < 0) {
        fprintf(stderr, "zeparelayd: cannot install the signal handlers\n");
        return 3;
    }
    if (!Daemon::Init(!opt.foreground)) return 1;

    curl_global_init(CURL_GLOBAL_DEFAULT);
    int status = 0;
    {
        zeparelayd::MonotonicClock clock;
        zeparelayd::EventLoop loop(clock);
        zeparelayd::RelayDaemon relay(confPath, loop, clock);
        relay.ApplyLogSettings();
        if (!loop.IsReady()) {
            RLOG(LOG_ERR, "cannot set up the event loop");
            status = 3;
        } else {
            loop.OnSignal([&relay](int sig) { relay.HandleSignal(sig); });
            loop.OnIdle([&relay] { relay.Idle(); });
            const bool started = relay.Start();
            sigprocmask(SIG_SETMASK, &previous, nullptr);
            if (!started || !loop.Run()) status = 3;
            relay.Shutdown();
        }
    }
    daemon_signal_done();
    daemon_pid_file_remove();
    curl_global_cleanup();
    return status;
}
