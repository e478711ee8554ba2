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
    const std::string daemonPath = ZEPA_BINARY_DIR "/tools/zeparelayd/zeparelayd";
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
    return 0;
}
