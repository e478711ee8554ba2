// The registration and alias cycles against the local HTTPS server on
// loopback, on a clock the test moves by hand: a sample appliance staged in
// a throwaway system root, the loop stepped one round at a time.
#ifndef ZEPARELAYD_TEST_CYCLE_FIXTURE_H
#define ZEPARELAYD_TEST_CYCLE_FIXTURE_H

#include <curl/curl.h>
#include <gtest/gtest.h>
#include <json/reader.h>
#include <json/value.h>
#include <json/writer.h>
#include <stdlib.h>
#include <time.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zepasdk/sysroot.h>

#include "event_loop.h"
#include "fake_clock.h"
#include "support/local_server.h"

namespace zepatest {

class CycleTest : public ::testing::Test {
protected:
    // Each round of the loop moves the clock on by this much, so that
    // curl's own short timers come due as well.
    static constexpr int64_t STEP_MS = 2;

    void SetUp() override {
        ASSERT_TRUE(server.ok()) << server.error();
        char dir[] = "/tmp/zepa_cycle_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(dir));
        root = dir;
        const std::string stage =
            "/bin/bash '" ZEPA_SOURCE_DIR "/scripts/stage_appliance.sh' '" + root + "' >/dev/null";
        ASSERT_EQ(0, system(stage.c_str()));
        ZEPASysRootSet(root.c_str());
        ZEPA::Relay::Request::SetExtraCaFile(server.caFile());
    }

    void TearDown() override {
        ZEPA::Relay::Request::SetExtraCaFile("");
        ZEPASysRootSet("/");
        if (!root.empty()) {
            const std::string cmd = "rm -rf '" + root + "'";
            EXPECT_EQ(0, system(cmd.c_str()));
        }
    }

    // The relay configuration: the control server and the alias server are
    // the local server's HTTPS side unless a test says otherwise.
    Json::Value Config() const {
        Json::Value conf(Json::objectValue);
        conf["server_control"]["protocol"] = "https";
        conf["server_control"]["host"] = "127.0.0.1";
        conf["server_control"]["port"] = server.httpsPort();
        conf["server_alias"]["alias"] = "cyclebox";
        conf["server_alias"]["url"] = server.httpsUrl();
        conf["server_alias"]["poll_seconds"] = 600;
        conf["service"][0u]["id"] = "nso";
        return conf;
    }

    void WriteConfig(const Json::Value& conf) {
        std::ofstream out(ZEPA::Relay::Daemon::GetConfPath());
        out << Json::StyledWriter().write(conf);
    }

    Json::Value ReadJson(const std::string& path) const {
        std::ifstream in(path);
        Json::Value value;
        Json::Reader().parse(in, value);
        return value;
    }

    // A plain POST of a JSON body to the local server's HTTP side (its admin
    // calls); the HTTP status, or 0 when the transfer failed.
    long Post(const std::string& path, const Json::Value& body) const {
        CURL* curl = curl_easy_init();
        if (curl == nullptr) return 0;
        const std::string url = server.httpUrl(path);
        const std::string text = Json::FastWriter().write(body);
        curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
        curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, text.c_str());
        curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
        curl_easy_setopt(curl, CURLOPT_TIMEOUT, 10L);
        curl_easy_setopt(
            curl, CURLOPT_WRITEFUNCTION, +[](char*, size_t size, size_t n, void*) { return size * n; });
        long code = 0;
        if (curl_easy_perform(curl) == CURLE_OK) curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &code);
        curl_slist_free_all(headers);
        curl_easy_cleanup(curl);
        return code;
    }

    // Steps the loop until cond holds or maxMs of real time pass; whether it held.
    bool Pump(const std::function<bool()>& cond, int64_t maxMs = 10000) {
        const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(maxMs);
        while (!cond()) {
            if (std::chrono::steady_clock::now() > end) return false;
            clock.Advance(STEP_MS);
            if (!loop.RunOnce(10)) return false;
        }
        return true;
    }

    // Steps the loop for ms of real time without moving the clock.
    void Settle(int64_t ms) {
        const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
        while (std::chrono::steady_clock::now() < end) loop.RunOnce(10);
    }

    // Moves the clock by ms and runs what fell due.
    void AdvanceAndRun(int64_t ms) {
        clock.Advance(ms);
        loop.RunOnce(0);
    }

    LocalServer server;
    std::string root;
    FakeClock clock;
    FixedRandom random;
    zeparelayd::EventLoop loop{clock};
};

}  // namespace zepatest

#endif
