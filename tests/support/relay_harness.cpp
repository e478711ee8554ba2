#include "support/relay_harness.h"

#include <curl/curl.h>
#include <dirent.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <vector>

namespace zepatest {

volatile sig_atomic_t g_tunnelUsr2 = 0;

namespace {

std::atomic<int> g_counter{0};

void OnTunnelSignal(int sig) {
    if (sig == SIGUSR2) g_tunnelUsr2 = 1;
}

size_t Collect(char* data, size_t size, size_t count, void* out) {
    static_cast<std::string*>(out)->append(data, size * count);
    return size * count;
}

bool RunQuiet(const std::string& command) { return system((command + " >/dev/null 2>&1").c_str()) == 0; }

std::string ReadWhole(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

// The test process that made a namespace "zepa-t<pid>-<n>-<side>", when it is
// gone; 0 for a namespace of a live test or of another owner.
pid_t DeadOwner(const std::string& ns) {
    if (ns.compare(0, 6, "zepa-t") != 0) return 0;
    const pid_t pid = static_cast<pid_t>(atoi(ns.c_str() + 6));
    return pid > 0 && kill(pid, 0) != 0 && errno == ESRCH ? pid : 0;
}

std::vector<pid_t> Processes() {
    std::vector<pid_t> pids;
    DIR* proc = opendir("/proc");
    if (proc == nullptr) return pids;
    while (struct dirent* entry = readdir(proc)) {
        const std::string name = entry->d_name;
        if (!name.empty() && name.find_first_not_of("0123456789") == std::string::npos)
            pids.push_back(atoi(name.c_str()));
    }
    closedir(proc);
    return pids;
}

// What a test killed midway (no destructors ran) left: its daemon, which
// runs in the host's namespace, and its relay's namespaces with whatever
// still runs inside. The local server stops on its own with its owner.
void SweepDeadTests() {
    for (pid_t pid : Processes()) {
        if (ReadWhole("/proc/" + std::to_string(pid) + "/comm") != "zeparelayd\n") continue;
        const std::string cmdline = ReadWhole("/proc/" + std::to_string(pid) + "/cmdline");
        const std::string flag = std::string("--root") + '\0';
        const size_t at = cmdline.find(flag);
        if (at == std::string::npos) continue;
        const std::string root = cmdline.c_str() + at + flag.size();
        std::string ns = ReadWhole(root + "/etc/zepa/appliance_netns");
        ns = ns.substr(0, ns.find('\n'));
        if (!ns.empty() && DeadOwner(ns) > 0) kill(pid, SIGKILL);
    }
    DIR* dir = opendir("/run/netns");
    if (dir == nullptr) return;
    std::vector<std::string> stale;
    while (struct dirent* entry = readdir(dir)) {
        if (DeadOwner(entry->d_name) > 0) stale.push_back(entry->d_name);
    }
    closedir(dir);
    for (const std::string& ns : stale) {
        RunQuiet("ip netns pids " + ns + " | xargs -r kill -9");
        RunQuiet("ip netns del " + ns);
    }
}

}  // namespace

void RelayTest::SetUp() {
    RootTest::SetUp();
    const std::string why = RelayHarness::Unavailable();
    if (!why.empty()) GTEST_SKIP() << "real relay tests skipped: " << why;
    ASSERT_TRUE(relay.Start(root)) << relay.error();
}

void InstallTunnelSignalHandlers() {
    struct sigaction action;
    memset(&action, 0, sizeof(action));
    action.sa_handler = OnTunnelSignal;
    sigemptyset(&action.sa_mask);
    for (int sig : {SIGCHLD, SIGUSR2, SIGALRM}) sigaction(sig, &action, nullptr);
    g_tunnelUsr2 = 0;
}

std::string RelayHarness::Unavailable() {
    if (geteuid() != 0) return "needs root (network namespaces, tun devices); CI runs as root";
    if (access("/dev/net/tun", R_OK | W_OK) != 0) return "no usable /dev/net/tun on this machine";
    if (access("/usr/sbin/openvpn", X_OK) != 0)
        return "openvpn is not installed: run scripts/install-deps.sh";
    if (!RunQuiet("command -v nsenter")) return "nsenter (util-linux) is not installed";
    const std::string probe = "zepa-probe-" + std::to_string(getpid());
    if (!RunQuiet("ip netns add " + probe))
        return "cannot create network namespaces here (ip netns add failed)";
    RunQuiet("ip netns del " + probe);
    return "";
}

RelayHarness::~RelayHarness() {
    Stop();
    if (!name.empty()) {
        RunQuiet("ip netns del " + relayNetns);
        RunQuiet("ip netns del " + applianceNetns);
    }
}

bool RelayHarness::Start(const TempRoot& root) {
    SweepDeadTests();
    name = "t" + std::to_string(getpid()) + "-" + std::to_string(g_counter++);
    relayNetns = "zepa-" + name + "-r";
    applianceNetns = "zepa-" + name + "-a";
    workDir = root.path("/relay-side");
    const std::string stage =
        std::string("bash '") + ZEPA_SOURCE_DIR + "/scripts/stage_appliance.sh' '" + root.dir() + "'";
    if (!RunQuiet(stage)) {
        _error = "staging the appliance failed: " + stage;
        return false;
    }
    LocalServer::Options options;
    options.extraArgs = {"--relay", name, "--relay-dir", workDir};
    _server.reset(new LocalServer(options));
    if (!_server->ok()) {
        _error = _server->error();
        return false;
    }
    const Json::Value& info = _server->relayInfo();
    relayIp = info.get("ip", "").asString();
    if (relayIp.empty() || info.get("appliance_netns", "").asString() != applianceNetns) {
        _error = "the local server did not report its relay side";
        return false;
    }
    // The staged appliance's network is the appliance namespace; its VPN
    // client trusts the relay's throwaway CA.
    root.write("/etc/zepa/appliance_netns", applianceNetns + "\n");
    root.write("/usr/zepa/etc/zeparelayd/ca/ca.crt", ReadFile(workDir + "/pki/ca.crt"));
    return true;
}

Json::Value RelayHarness::Grant(const std::string& user, const std::string& alias) {
    Json::Value body;
    body["user"] = user;
    if (!alias.empty()) body["alias"] = alias;
    return Admin("POST", "/relay/admin/grant", body);
}

bool RelayHarness::BlockUdp(bool on) {
    Json::Value body;
    body["on"] = on;
    return Admin("POST", "/relay/admin/block_udp", body)["ok"].asBool();
}

bool RelayHarness::Silence(bool on) {
    Json::Value body;
    body["on"] = on;
    return Admin("POST", "/relay/admin/silence", body)["ok"].asBool();
}

bool RelayHarness::Link(bool up, bool atRelay) {
    Json::Value body;
    body["up"] = up;
    body["side"] = atRelay ? "relay" : "appliance";
    return Admin("POST", "/relay/admin/link", body)["ok"].asBool();
}

bool RelayHarness::Vpn(const std::string& action) {
    Json::Value body;
    body["action"] = action;
    return Admin("POST", "/relay/admin/vpn", body)["ok"].asBool();
}

Json::Value RelayHarness::Admin(const std::string& method, const std::string& path, const Json::Value& body) {
    std::string answer;
    long status = 0;
    const std::string text = body.isNull() ? "" : ToJson(body);
    if (!_server || !Fetch(method, _server->httpUrl(path), text, "", answer, status, 15))
        return Json::Value();
    return ParseJson(answer);
}

bool RelayHarness::HttpsGet(const std::string& path, std::string& body, long& status,
                            double timeoutSeconds) const {
    if (!_server) return false;
    return Fetch("GET", _server->httpsUrl(path), "", _server->caFile(), body, status, timeoutSeconds);
}

bool RelayHarness::Fetch(const std::string& method, const std::string& url, const std::string& body,
                         const std::string& caFile, std::string& answer, long& status,
                         double timeoutSeconds) {
    answer.clear();
    status = 0;
    CURL* curl = curl_easy_init();
    if (curl == nullptr) return false;
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_CUSTOMREQUEST, method.c_str());
    if (method == "POST") {
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
    }
    if (!caFile.empty()) curl_easy_setopt(curl, CURLOPT_CAINFO, caFile.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Collect);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &answer);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, static_cast<long>(timeoutSeconds * 1000));
    const CURLcode rc = curl_easy_perform(curl);
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_cleanup(curl);
    return rc == CURLE_OK;
}

int RelayHarness::Stop() {
    if (!_server) return -1;
    const int status = _server->stop();
    _server.reset();
    return status;
}

bool RelayHarness::NamespacesExist() const {
    struct stat st;
    return stat(("/run/netns/" + relayNetns).c_str(), &st) == 0 ||
           stat(("/run/netns/" + applianceNetns).c_str(), &st) == 0;
}

int RelayHarness::CountProcesses(const std::string& needle) {
    int count = 0;
    DIR* proc = opendir("/proc");
    if (proc == nullptr) return -1;
    const std::string self = std::to_string(getpid());
    while (struct dirent* entry = readdir(proc)) {
        const std::string pid = entry->d_name;
        if (pid.empty() || pid.find_first_not_of("0123456789") != std::string::npos || pid == self) continue;
        std::ifstream in("/proc/" + pid + "/cmdline", std::ios::binary);
        std::stringstream ss;
        ss << in.rdbuf();
        std::string cmdline = ss.str();
        // A zombie has an empty command line: it is no running process.
        if (!cmdline.empty() && cmdline.find(needle) != std::string::npos) ++count;
    }
    closedir(proc);
    return count;
}

}  // namespace zepatest
