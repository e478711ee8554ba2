// In-process measurements for scripts/bench.sh: each sub-command times one
// operation of the library (or its floor) and prints one JSON line of figures.
// The driver (bench/figures/bench.py) interleaves the runs and takes medians.
#include <fcntl.h>
#include <json/reader.h>
#include <json/value.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>
#include <zepasdk/sysroot.h>

using namespace ZEPA::Relay;

namespace {

double NowNs() {
    return static_cast<double>(std::chrono::duration_cast<std::chrono::nanoseconds>(
                                   std::chrono::steady_clock::now().time_since_epoch())
                                   .count());
}

double CpuNs() {
    struct rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    return (ru.ru_utime.tv_sec + ru.ru_stime.tv_sec) * 1e9 +
           (ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) * 1e3;
}

double Percentile(std::vector<double> v, double p) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    size_t i = static_cast<size_t>(p * static_cast<double>(v.size() - 1) + 0.5);
    return v[std::min(i, v.size() - 1)];
}

// Times fn once per iteration; prints the median and the CPU per call.
template <typename Fn>
void TimeCalls(const char* name, int iters, Fn fn) {
    std::vector<double> samples;
    samples.reserve(static_cast<size_t>(iters));
    fn();  // warm-up: first-use costs are not what a steady caller pays
    double cpu0 = CpuNs();
    for (int i = 0; i < iters; ++i) {
        double t0 = NowNs();
        fn();
        samples.push_back(NowNs() - t0);
    }
    double cpu = (CpuNs() - cpu0) / iters;
    printf("{\"name\": \"%s\", \"median_ns\": %.0f, \"cpu_ns\": %.0f, \"iters\": %d}\n", name,
           Percentile(samples, 0.5), cpu, iters);
}

// The floor of a status probe: read the file, find "pid", kill(pid, 0).
int FloorProbe(const std::string& path) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 1;
    char buf[65536];
    ssize_t n = read(fd, buf, sizeof(buf) - 1);
    close(fd);
    if (n <= 0) return 255;
    buf[n] = '\0';
    const char* p = strstr(buf, "\"pid\"");
    if (p == nullptr || (p = strchr(p, ':')) == nullptr) return 255;
    long pid = strtol(p + 1, nullptr, 10);
    if (pid <= 0) return 255;
    return kill(static_cast<pid_t>(pid), 0) == 0 ? 0 : 1;
}

int Probe(const char* root, const std::string& mode, int iters) {
    ZEPASysRootSet(root);
    const std::string path = std::string(root) + "/tmp/.zeparelayd.status";
    if (mode == "json") {
        TimeCalls("probe_json", iters, [] {
            Json::Value v;
            if (Daemon::GetStatus(v) != 0) abort();
        });
    } else if (mode == "words") {
        TimeCalls("probe_words", iters, [] {
            std::string id, state, error;
            if (!Daemon::GetStatus(id, state, error, nullptr) || state != "connected") abort();
        });
    } else {
        TimeCalls("probe_floor", iters, [&path] {
            if (FloorProbe(path) != 0) abort();
        });
    }
    return 0;
}

// One map exchange with the alias server through the library, per call.
int Alias(const char* root, const char* baseUrl, const char* caFile, int iters) {
    ZEPASysRootSet(root);
    Request::SetExtraCaFile(caFile);
    Json::Value data(Json::objectValue);
    data["alias"] = "bench-box";
    data["serial"] = "2150ZSN012345";
    data["token"] = "5f0c2a9e8d7b41c3a6e0f9b2d4c8e1a7";
    data["url"] = baseUrl;
    data["id"] = "bench-id";
    double first = 0;
    {
        double t0 = NowNs();
        AliasRequest req;
        ALIAS_RET ret = ALIAS_RET_UNKNOWN;
        if (!req.SetRequest(ALIAS_REQ_MAP, data) || !req.Send(ret)) abort();
        first = NowNs() - t0;
        int code = 0;
        req.GetResponse(code);
        if (code != 200) {
            fprintf(stderr, "alias exchange answered HTTP %d\n", code);
            return 1;
        }
    }
    printf("{\"name\": \"alias_first\", \"median_ns\": %.0f}\n", first);
    TimeCalls("alias_map", iters, [&data] {
        AliasRequest req;
        ALIAS_RET ret = ALIAS_RET_UNKNOWN;
        if (!req.SetRequest(ALIAS_REQ_MAP, data) || !req.Send(ret)) abort();
    });
    return 0;
}

// GenServiceConf against the staged rule file.
int Gen(const char* root, int iters) {
    ZEPASysRootSet(root);
    const std::string conf = std::string(root) + "/usr/zepa/etc/zeparelayd/zeparelayd.conf";
    RelaydConf rc(conf.c_str());
    size_t services = 0;
    TimeCalls("gen_service_conf", iters, [&rc, &services] {
        rc.GenServiceConf();
        services = rc.services.size();
    });
    fprintf(stderr, "services generated: %zu\n", services);
    return 0;
}

// One parse of the rule file: lines, sections and key=value pairs.
int Parse(const char* file, int iters) {
    TimeCalls("parse_rules", iters, [file] {
        std::ifstream in(file);
        std::string line, section;
        std::vector<std::pair<std::string, std::string>> entries;
        size_t sections = 0;
        while (std::getline(in, line)) {
            size_t b = line.find_first_not_of(" \t\r");
            if (b == std::string::npos || line[b] == '#') continue;
            if (line[b] == '[') {
                section = line.substr(b + 1, line.find(']') - b - 1);
                ++sections;
                continue;
            }
            size_t eq = line.find('=');
            if (eq == std::string::npos) continue;
            std::string value = line.substr(eq + 1);
            if (!value.empty() && value[0] == '"') value = value.substr(1, value.rfind('"') - 1);
            entries.emplace_back(section + "\n" + line.substr(b, eq - b), value);
        }
        if (sections == 0) abort();
    });
    return 0;
}

// DebugStatus calls one after the other: answered / 11 / other, latencies.
int Debug(const char* root, int calls) {
    ZEPASysRootSet(root);
    std::vector<double> lat;
    int answered = 0, busy = 0, other = 0;
    for (int i = 0; i < calls; ++i) {
        Json::Value out;
        double t0 = NowNs();
        int ret = Daemon::DebugStatus(out);
        lat.push_back(NowNs() - t0);
        if (ret == 0)
            ++answered;
        else if (ret == 11)
            ++busy;
        else
            ++other;
    }
    printf(
        "{\"name\": \"debug_query\", \"answered\": %d, \"busy\": %d, \"other\": %d, \"p50_ns\": %.0f, "
        "\"p99_ns\": %.0f, \"max_ns\": %.0f}\n",
        answered, busy, other, Percentile(lat, 0.5), Percentile(lat, 0.99), Percentile(lat, 1.0));
    return 0;
}

// The daemon's status record for n services: built every loop round and
// compared with the last one, written when it changed.
Json::Value StatusRecord(int n, int state) {
    Json::Value status(Json::objectValue);
    status["pid"] = static_cast<int>(getpid());
    status["state"] = state;
    status["error"] = 0;
    status["serverID"] = "ZS0123456789";
    Json::Value& services = status["service"];
    services = Json::Value(Json::arrayValue);
    for (int i = 0; i < n; ++i) {
        ServiceConf s(Json::Value(), false);
        Json::Value in(Json::objectValue);
        in["id"] = "svc" + std::to_string(i);
        in["name"] = "Service " + std::to_string(i);
        in["port"] = 5000 + i;
        in["ext_port"] = 5000 + i;
        s.Overwrite(in);
        Json::Value one;
        s.Write(one, true);
        services.append(one);
    }
    status["alias"] = "bench-box";
    status["alias_status"] = "success";
    return status;
}

int Grow(const char* root, int n, int iters) {
    ZEPASysRootSet(root);
    const std::string path = std::string(root) + "/tmp/.zeparelayd.status";
    Json::Value last = StatusRecord(n, 8);
    bool same = true;
    TimeCalls(("round_" + std::to_string(n)).c_str(), iters, [n, &last, &same] {
        Json::Value now = StatusRecord(n, 8);
        same = now == last;
    });
    if (!same) abort();
    int state = 0;
    TimeCalls(("rewrite_" + std::to_string(n)).c_str(), iters, [n, &path, &state] {
        Json::Value now = StatusRecord(n, 7 + (state++ & 1));
        if (!RelaydConf::WriteJsonFile(path, now)) abort();
    });
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string cmd = argc > 1 ? argv[1] : "";
    if (cmd == "probe" && argc == 5) return Probe(argv[2], argv[3], atoi(argv[4]));
    if (cmd == "alias" && argc == 6) return Alias(argv[2], argv[3], argv[4], atoi(argv[5]));
    if (cmd == "gen" && argc == 4) return Gen(argv[2], atoi(argv[3]));
    if (cmd == "parse" && argc == 4) return Parse(argv[2], atoi(argv[3]));
    if (cmd == "debug" && argc == 4) return Debug(argv[2], atoi(argv[3]));
    if (cmd == "grow" && argc == 5) return Grow(argv[2], atoi(argv[3]), atoi(argv[4]));
    fprintf(stderr,
            "usage: zepa_figures probe ROOT json|words|floor N | alias ROOT URL CAFILE N | gen ROOT N |\n"
            "       parse FILE N | debug ROOT N | grow ROOT SERVICES N\n");
    return 64;
}
