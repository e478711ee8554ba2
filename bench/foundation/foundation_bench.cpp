// Costs of the foundation's hot paths: a filtered log call (debug messages may
// stay in hot paths), key/value look-ups, result words, JSON file writes.
#include <benchmark/benchmark.h>
#include <unistd.h>
#include <zepasdk/kv.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>

using namespace ZEPA::Relay;

namespace {

std::string TempDir() {
    char tmpl[] = "/tmp/zepabench.XXXXXX";
    return mkdtemp(tmpl);
}

void BM_LogBelowLevel(benchmark::State& state) {
    Daemon::_logLevel = 4;
    for (auto _ : state) Daemon::Log(7, "%s:%d value %d text %s", "bench", __LINE__, 42, "unused");
}
BENCHMARK(BM_LogBelowLevel);

void BM_ResultWords(benchmark::State& state) {
    int i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(GetErrorStr(static_cast<RELAYD_RET>(i % 16)));
        benchmark::DoNotOptimize(GetStateStr(static_cast<RELAYD_STATE>(i % 10)));
        ++i;
    }
}
BENCHMARK(BM_ResultWords);

void BM_KeyValueLookup(benchmark::State& state) {
    std::string dir = TempDir();
    std::string file = dir + "/zepainfo.conf";
    FILE* f = fopen(file.c_str(), "w");
    for (int i = 0; i < state.range(0); ++i) fprintf(f, "key%d=\"value %d\"\n", i, i);
    fprintf(f, "runrelayd=\"yes\"\n");
    fclose(f);
    char buf[64];
    for (auto _ : state)
        benchmark::DoNotOptimize(VLIBCFileGetKeyValue(file.c_str(), "runrelayd", buf, sizeof(buf)));
    state.SetLabel(std::to_string(state.range(0) + 1) + " keys");
    unlink(file.c_str());
    rmdir(dir.c_str());
}
BENCHMARK(BM_KeyValueLookup)->Arg(10)->Arg(200);

void BM_WriteJsonFile(benchmark::State& state) {
    std::string dir = TempDir();
    std::string file = dir + "/zeparelayd.conf";
    Json::Value conf;
    for (int i = 0; i < state.range(0); ++i) {
        Json::Value s;
        s["id"] = "service_" + std::to_string(i);
        conf["service"].append(s);
    }
    conf["serverID"] = "0123456789";
    for (auto _ : state) benchmark::DoNotOptimize(RelaydConf::WriteJsonFile(file, conf));
    state.SetLabel(std::to_string(state.range(0)) + " services");
    unlink(file.c_str());
    rmdir(dir.c_str());
}
BENCHMARK(BM_WriteJsonFile)->Arg(4)->Arg(48);

}  // namespace

BENCHMARK_MAIN();
