// The real daemon and control tool in a staging root against the local
// relay/alias server: the fixtures the daemon's process tests share.
#ifndef ZEPATEST_INTEGRATION_DAEMON_FIXTURE_H
#define ZEPATEST_INTEGRATION_DAEMON_FIXTURE_H

#include <curl/curl.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <zeparelayd/daemon.h>

#include "support/local_server.h"
#include "support/test_support.h"

namespace daemontest {

using namespace ZEPA::Relay;

inline const std::string kDaemon = ZEPA_BINARY_DIR "/tools/zeparelayd/zeparelayd";
inline const std::string kCtl = ZEPA_BINARY_DIR "/tools/zeparelayctl/zeparelayctl";
inline const std::string kStage = ZEPA_SOURCE_DIR "/scripts/stage_appliance.sh";

using zepatest::RunProgram;

inline size_t Append(char* data, size_t size, size_t count, void* out) {
    static_cast<std::string*>(out)->append(data, size * count);
    return size * count;
}

// A plain HTTP call to the local server's own admin routes.
inline std::string Http(const std::string& method, const std::string& url, const std::string& body = "") {
    std::string answer;
    CURL* curl = curl_easy_init();
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_CUSTOMREQUEST, method.c_str());
    if (method == "POST") curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &answer);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, 10L);
    curl_easy_perform(curl);
    curl_easy_cleanup(curl);
    return answer;
}

inline bool WaitUntil(const std::function<bool()>& cond, int ms = 15000) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    while (std::chrono::steady_clock::now() < end) {
        if (cond()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return cond();
}

// A process that is gone or a zombie no longer runs.
inline bool Alive(pid_t pid) {
    if (pid <= 0 || kill(pid, 0) != 0) return false;
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    size_t close = text.rfind(')');
    return close == std::string::npos || text.size() < close + 3 || text[close + 2] != 'Z';
}

class DaemonProcess : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        ASSERT_EQ(0, RunProgram({"/bin/bash", kStage, root.dir()}));
        WriteConfig(4);
    }

    void TearDown() override {
        pid_t pid = DaemonPid();
        if (Alive(pid)) {
            kill(pid, SIGTERM);
            if (!WaitUntil([&] { return !Alive(pid); }, 5000)) kill(pid, SIGKILL);
        }
        RootTest::TearDown();
    }

    void WriteConfig(int logLevel) {
        std::ostringstream conf;
        conf << "{\n"
             << "  \"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
             << server.httpsPort() << "},\n"
             << "  \"server_alias\": {\"alias\": \"it-box\", \"url\": \"" << server.httpsUrl() << "\"},\n"
             << "  \"service\": [{\"id\": \"nos\"}, {\"id\": \"nos_https\"}],\n"
             << "  \"log_level\": " << logLevel << ",\n"
             << "  \"log_file\": \"/var/log/zeparelayd.log\"\n"
             << "}\n";
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());
    }

    // A reload registers again only when something the registration depends
    // on changed: the service list alternates between two services and one.
    // Everything else in the file (the server id the daemon stored) stays.
    int ReloadToRegisterAgain() {
        oneService = !oneService;
        Json::Value conf = zepatest::ParseJson(root.read("/usr/zepa/etc/zeparelayd/zeparelayd.conf"));
        Json::Value services(Json::arrayValue);
        services[0u]["id"] = "nos";
        if (!oneService) services[1u]["id"] = "nos_https";
        conf["service"] = services;
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.toStyledString());
        return Ctl({"reload"});
    }

    int StartDaemon() { return RunProgram({kDaemon, "--root", root.dir(), "--ca-file", server.caFile()}); }

    int Ctl(const std::vector<std::string>& args, std::string* out = nullptr, std::string* err = nullptr) {
        std::vector<std::string> all = {kCtl, "--root", root.dir()};
        all.insert(all.end(), args.begin(), args.end());
        return RunProgram(all, out, err);
    }

    std::string CtlStatus() {
        std::string out;
        Ctl({"status"}, &out);
        return out;
    }

    bool StatusHas(const std::string& text, int ms = 15000) {
        return WaitUntil([&] { return CtlStatus().find(text) != std::string::npos; }, ms);
    }

    pid_t DaemonPid() {
        if (!root.exists("/var/run/zeparelayd.pid")) return -1;
        return atoi(root.read("/var/run/zeparelayd.pid").c_str());
    }

    Json::Value StatusFile() { return zepatest::ParseJson(root.read("/tmp/.zeparelayd.status")); }

    // 11 means the machine did not let the daemon run within the reader's few
    // milliseconds; asking again is what any caller does.
    Json::Value Dump() {
        Json::Value dump;
        int ret = Daemon::DebugStatus(dump);
        for (int i = 0; ret == 11 && i < 20; ++i) ret = Daemon::DebugStatus(dump);
        EXPECT_EQ(0, ret);
        return dump;
    }

    int Requests(const std::string& path) { return static_cast<int>(server.requests(path).size()); }

    void SignalAsThePidFileAppears(int sig, int rounds);

    int Notices() {
        if (!root.exists("/var/log/zepanosnotify.log")) return 0;
        std::string text = root.read("/var/log/zepanosnotify.log");
        return static_cast<int>(std::count(text.begin(), text.end(), '\n'));
    }

    zepatest::LocalServer server;
    bool oneService = false;
};

// The control tool without a daemon: usage, help on every level, exit statuses.
class ControlTool : public zepatest::RootTest {
protected:
    int Ctl(const std::vector<std::string>& args, std::string* out = nullptr, std::string* err = nullptr) {
        std::vector<std::string> all = {kCtl, "--root", root.dir()};
        all.insert(all.end(), args.begin(), args.end());
        return RunProgram(all, out, err);
    }
};

}  // namespace daemontest

#endif
