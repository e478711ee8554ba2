// Figures of the relay end to end, with the real openvpn in network
// namespaces: tunnel set-up over UDP, over TCP and with the TCP fall-back
// after blocked UDP; an HTTP GET through the tunnel against the same GET to
// the appliance's own address (latency and throughput, as ratios); and the
// daemon's start to the first byte of the appliance's page through the relay.
//
//   build/plain/bench/relay/bench_relay [rounds]      (root; prints "skipped" otherwise)
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <zeparelayd/tunnel.h>

#include "support/relay_harness.h"
#include "support/test_support.h"

using ZEPA::Relay::Tunnel;
using Clock = std::chrono::steady_clock;

namespace {

double Ms(Clock::time_point a, Clock::time_point b) {
    return std::chrono::duration<double, std::milli>(b - a).count();
}

double Median(std::vector<double> v) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

void Print(const char* what, const std::vector<double>& ms) {
    if (ms.empty()) {
        printf("  %-44s failed\n", what);
        return;
    }
    printf("  %-44s median %8.1f ms  min %8.1f ms  (%zu runs)\n", what, Median(ms),
           *std::min_element(ms.begin(), ms.end()), ms.size());
}

// One tunnel start; the time until Create returns, or -1.
double OneTunnel(zepatest::RelayHarness& relay, const Json::Value& grant, bool tryUdp, Tunnel& keep) {
    Tunnel tunnel(grant);
    const auto t0 = Clock::now();
    const bool ok = tunnel.Create(tryUdp);
    const auto t1 = Clock::now();
    (void)relay;
    if (!ok) return -1;
    keep = tunnel;
    return Ms(t0, t1);
}

void Stop(Tunnel& tunnel) {
    const int pid = tunnel.pid;
    tunnel.Destroy();
    if (pid > 0) waitpid(pid, nullptr, 0);
}

bool Get(const zepatest::RelayHarness& relay, const std::string& path, size_t* bytes = nullptr) {
    std::string body;
    long status = 0;
    const bool ok = relay.HttpsGet(path, body, status, 60) && status == 200;
    if (bytes != nullptr) *bytes = body.size();
    return ok;
}

// ZEPA_BENCH_DAEMON / ZEPA_BENCH_CTL measure another build (an earlier one,
// for before/after figures).
std::string Program(const char* env, const std::string& built) {
    const char* other = getenv(env);
    return other != nullptr && *other != '\0' ? other : built;
}
const std::string kDaemon = Program("ZEPA_BENCH_DAEMON", ZEPA_BINARY_DIR "/tools/zeparelayd/zeparelayd");
const std::string kCtl = Program("ZEPA_BENCH_CTL", ZEPA_BINARY_DIR "/tools/zeparelayctl/zeparelayctl");

size_t Count(const std::string& text, const std::string& needle) {
    size_t n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) ++n;
    return n;
}

// Milliseconds until cond holds (polled every 2 ms), -1 after maxMs.
template <typename Cond>
double MsUntil(Clock::time_point t0, Cond cond, int maxMs) {
    while (Ms(t0, Clock::now()) < maxMs) {
        if (cond()) return Ms(t0, Clock::now());
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return -1;
}

void Goal(const char* what, double worstMs, double goalMs) {
    if (worstMs < 0) {
        printf("  %-52s no answer          (goal <= %.0f ms)  MISSED\n", what, goalMs);
        return;
    }
    printf("  %-52s %8.1f ms  (goal <= %.0f ms)  %s\n", what, worstMs, goalMs,
           worstMs <= goalMs ? "met" : "MISSED");
}

struct DaemonRun {
    zepatest::TempRoot& root;
    zepatest::RelayHarness& relay;
    std::string alias;

    int Ctl(const std::vector<std::string>& args) {
        std::vector<std::string> all = {kCtl, "--root", root.dir()};
        all.insert(all.end(), args.begin(), args.end());
        std::string out;
        return zepatest::RunProgram(all, &out);
    }
    std::string Log() const { return root.read("/var/log/zeparelayd.log"); }
    std::string Status() const { return root.read("/tmp/.zeparelayd.status"); }
    pid_t Pid() const {
        return root.exists("/var/run/zeparelayd.pid") ? atoi(root.read("/var/run/zeparelayd.pid").c_str())
                                                      : -1;
    }
    bool Ready(pid_t notPid) const {
        const std::string st = Status();
        return st.find("\"state\" : 6") != std::string::npos && Pid() != notPid &&
               st.find("\"pid\" : " + std::to_string(Pid())) != std::string::npos;
    }
    bool Page() const {
        std::string body;
        long status = 0;
        return relay.HttpsGet("/" + alias + "/", body, status, 2) && status == 200;
    }
    int Start() {
        return zepatest::RunProgram({kDaemon, "--root", root.dir(), "--ca-file", relay.server().caFile()});
    }
    void Stop() {
        const pid_t pid = Pid();
        Ctl({"stop"});
        for (int i = 0; pid > 0 && i < 500 && kill(pid, 0) == 0; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
};

}  // namespace

int main(int argc, char** argv) {
    const int rounds = argc > 1 ? std::max(1, atoi(argv[1])) : 5;
    const std::string why = zepatest::RelayHarness::Unavailable();
    if (!why.empty()) {
        printf("bench_relay: skipped: %s\n", why.c_str());
        return 0;
    }
    zepatest::TempRoot root;
    zepatest::RelayHarness relay;
    printf("bench_relay: starting the relay (namespaces, openvpn servers, web service)...\n");
    fflush(stdout);
    const auto r0 = Clock::now();
    if (!relay.Start(root)) {
        fprintf(stderr, "bench_relay: the relay did not start: %s\n", relay.error().c_str());
        return 1;
    }
    printf("  %-44s %8.1f ms\n", "relay side start (incl. local server)", Ms(r0, Clock::now()));
    zepatest::InstallTunnelSignalHandlers();
    const std::string user = "zrbench" + std::to_string(getpid());
    const std::string alias = "bench" + std::to_string(getpid());
    const std::string direct = "direct" + std::to_string(getpid());
    const Json::Value grant = relay.Grant(user, alias);
    Json::Value directGrant;
    directGrant["alias"] = direct;
    directGrant["direct"] = true;
    relay.Admin("POST", "/relay/admin/grant", directGrant);

    printf("\nTunnel set-up (Tunnel::Create until the up script's signal):\n");
    std::vector<double> udp, tcp;
    Tunnel tunnel;
    for (int i = 0; i < rounds; ++i) {
        const double ms = OneTunnel(relay, grant, true, tunnel);
        if (ms >= 0) udp.push_back(ms);
        Stop(tunnel);
    }
    Print("UDP", udp);
    for (int i = 0; i < rounds; ++i) {
        const double ms = OneTunnel(relay, grant, false, tunnel);
        if (ms >= 0) tcp.push_back(ms);
        Stop(tunnel);
    }
    Print("TCP only (Create(false))", tcp);
    relay.BlockUdp(true);
    std::vector<double> fallback;
    const double fb = OneTunnel(relay, grant, true, tunnel);
    if (fb >= 0) fallback.push_back(fb);
    Stop(tunnel);
    relay.BlockUdp(false);
    Print("UDP blocked, TCP fall-back (one run)", fallback);

    printf("\nHTTP GET through the relay's proxy: tunnel (UDP) vs the appliance's own address:\n");
    if (OneTunnel(relay, grant, true, tunnel) < 0) {
        fprintf(stderr, "bench_relay: no tunnel for the GET figures\n");
        return 1;
    }
    // Warm both paths once.
    Get(relay, "/" + alias + "/");
    Get(relay, "/" + direct + "/");
    std::vector<double> viaTunnel, viaDirect;
    const int gets = rounds * 6;
    for (int i = 0; i < gets; ++i) {
        auto t0 = Clock::now();
        if (Get(relay, "/" + alias + "/")) viaTunnel.push_back(Ms(t0, Clock::now()));
        t0 = Clock::now();
        if (Get(relay, "/" + direct + "/")) viaDirect.push_back(Ms(t0, Clock::now()));
    }
    Print("GET / through the tunnel", viaTunnel);
    Print("GET / direct", viaDirect);
    if (!viaTunnel.empty() && !viaDirect.empty()) {
        printf("  %-44s %8.2f\n", "latency ratio tunnel/direct", Median(viaTunnel) / Median(viaDirect));
    }
    const size_t big = 16u << 20;
    const std::string bigPath = "/big?size=" + std::to_string(big);
    double tunnelMBs = 0, directMBs = 0;
    for (int i = 0; i < 2; ++i) {
        size_t bytes = 0;
        auto t0 = Clock::now();
        if (Get(relay, "/" + alias + bigPath, &bytes) && bytes == big) {
            tunnelMBs = std::max(tunnelMBs, big / 1048576.0 / (Ms(t0, Clock::now()) / 1000));
        }
        t0 = Clock::now();
        if (Get(relay, "/" + direct + bigPath, &bytes) && bytes == big) {
            directMBs = std::max(directMBs, big / 1048576.0 / (Ms(t0, Clock::now()) / 1000));
        }
    }
    printf("  %-44s %8.1f MiB/s\n", "16 MiB through the tunnel (best of 2)", tunnelMBs);
    printf("  %-44s %8.1f MiB/s\n", "16 MiB direct (best of 2)", directMBs);
    if (tunnelMBs > 0 && directMBs > 0) {
        printf("  %-44s %8.2f\n", "throughput ratio tunnel/direct", tunnelMBs / directMBs);
    }
    Stop(tunnel);

    printf("\nDaemon start to the first byte of the appliance's page through the relay:\n");
    std::ostringstream conf;
    conf << "{\"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
         << relay.server().httpsPort() << "}, \"server_alias\": {\"alias\": \"daemon" << getpid()
         << "\", \"url\": \"" << relay.server().httpsUrl() << "\"}, \"service\": [{\"id\": \"nos\"}]}\n";
    root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());
    const std::string daemonPath = kDaemon;
    const auto d0 = Clock::now();
    const int started =
        zepatest::RunProgram({daemonPath, "--root", root.dir(), "--ca-file", relay.server().caFile()});
    double firstByte = -1;
    if (started == 0) {
        for (int i = 0; i < 3000 && firstByte < 0; ++i) {
            if (Get(relay, "/daemon" + std::to_string(getpid()) + "/")) firstByte = Ms(d0, Clock::now());
            if (firstByte < 0) std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
    }
    if (firstByte >= 0) {
        printf("  %-44s %8.1f ms\n", "zeparelayd exec to first relayed byte", firstByte);
    } else {
        printf("  %-44s failed (daemon start %d)\n", "zeparelayd exec to first relayed byte", started);
    }
    if (root.exists("/var/run/zeparelayd.pid")) {
        const pid_t pid = atoi(root.read("/var/run/zeparelayd.pid").c_str());
        if (pid > 0 && kill(pid, SIGTERM) == 0) {
            for (int i = 0; i < 500 && kill(pid, 0) == 0; ++i)
                std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
    }
    // ---- the daemon's answers and its restart, with goals ----------------
    printf("\nThe daemon (goals):\n");
    {
        DaemonRun d{root, relay, "daemon" + std::to_string(getpid())};
        std::ostringstream c2;
        c2 << "{\"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
           << relay.server().httpsPort() << "}, \"server_alias\": {\"alias\": \"" << d.alias
           << "\", \"url\": \"" << relay.server().httpsUrl()
           << "\"}, \"service\": [{\"id\": \"nos\"}], \"log_level\": 7, \"log_file\": "
              "\"/var/log/zeparelayd.log\"}\n";
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", c2.str());
        if (d.Start() != 0 || MsUntil(
                                  Clock::now(), [&] { return d.Ready(-1) && d.Page(); }, 60000) < 0) {
            printf("  the daemon did not come up: %s\n", d.Status().c_str());
            d.Stop();
            return 1;
        }
        // Page interruption across a reload with nothing changed.
        double worstGap = 0;
        int failed = 0;
        auto lastOk = Clock::now();
        d.Ctl({"reload"});
        const auto r0 = Clock::now();
        while (Ms(r0, Clock::now()) < 4000) {
            if (d.Page()) {
                worstGap = std::max(worstGap, Ms(lastOk, Clock::now()) - 100);
                lastOk = Clock::now();
            } else {
                ++failed;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
        printf("  %-52s %d failed GETs, longest gap %.0f ms  (goal: none)  %s\n",
               "page across a reload with nothing changed", failed, std::max(0.0, worstGap),
               failed == 0 ? "met" : "MISSED");

        // Restart after kill -9 with the tunnel up.
        std::vector<double> restart;
        for (int i = 0; i < std::min(rounds, 3); ++i) {
            const pid_t old = d.Pid();
            kill(old, SIGKILL);
            for (int j = 0; j < 500 && kill(old, 0) == 0; ++j)
                std::this_thread::sleep_for(std::chrono::milliseconds(10));
            const auto k0 = Clock::now();
            if (d.Start() != 0) break;
            const double ms = MsUntil(
                k0, [&] { return d.Ready(old) && d.Page(); }, 60000);
            if (ms < 0) break;
            restart.push_back(ms);
        }
        Goal("kill -9, start, READY and the page (worst)",
             restart.empty() ? -1 : *std::max_element(restart.begin(), restart.end()), 5000);
        printf("  %-52s %zu\n", "openvpn processes of this root afterwards",
               static_cast<size_t>(zepatest::RelayHarness::CountProcesses(root.dir() + "/tmp/.tunnel.")));
        d.Stop();

        // Every control command during a tunnel start against a silent relay.
        relay.Silence(true);
        if (d.Start() != 0 || MsUntil(
                                  Clock::now(),
                                  [&] {
                                      const std::string st = d.Status();
                                      return st.find("\"state\" : 5") != std::string::npos &&
                                             st.find("\"tunnel\"") != std::string::npos;
                                  },
                                  30000) < 0) {
            printf("  no tunnel start against the silent relay: %s\n", d.Status().c_str());
        } else {
            double status = 0, debug = 0, alias = 0, reload = 0;
            int debugFailed = 0;
            const auto s0 = Clock::now();
            int n = 0;
            while (Ms(s0, Clock::now()) < 12000 * std::max(1, rounds / 5)) {
                auto t0 = Clock::now();
                d.Ctl({"status"});
                status = std::max(status, Ms(t0, Clock::now()));
                t0 = Clock::now();
                if (d.Ctl({"status", "--debug"}) != 0) ++debugFailed;
                debug = std::max(debug, Ms(t0, Clock::now()));
                std::string log = d.Log();
                size_t before = Count(log, "alias update requested");
                t0 = Clock::now();
                d.Ctl({"update-alias"});
                const double a = MsUntil(
                    t0, [&] { return Count(d.Log(), "alias update requested") > before; }, 5000);
                alias = a < 0 || alias < 0 ? -1 : std::max(alias, a);
                log = d.Log();
                before = Count(log, "reloading configuration");
                t0 = Clock::now();
                d.Ctl({"reload"});
                const double r = MsUntil(
                    t0, [&] { return Count(d.Log(), "reloading configuration") > before; }, 5000);
                reload = r < 0 || reload < 0 ? -1 : std::max(reload, r);
                ++n;
                std::this_thread::sleep_for(std::chrono::milliseconds(200));
            }
            const bool ready = d.Status().find("READY") != std::string::npos;
            printf("  silent relay: %d rounds over %.0f s of one tunnel start, READY shown: %s\n", n,
                   Ms(s0, Clock::now()) / 1000, ready ? "yes (wrong)" : "no");
            Goal("status (worst)", status, 50);
            Goal("status --debug (worst)", debugFailed > 0 ? -1 : debug, 50);
            Goal("update-alias until its exchange starts (worst)", alias, 50);
            Goal("reload until applied (worst)", reload, 50);
        }
        d.Stop();
        relay.Silence(false);
    }
    return 0;
}
