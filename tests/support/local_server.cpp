#include "support/local_server.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <json/reader.h>
#include <json/writer.h>
#include <signal.h>
#include <spawn.h>
#include <strings.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

extern char** environ;

namespace zepatest {

namespace {

const char kServerScript[] = ZEPA_SOURCE_DIR "/tools/localserver/zepa_localserver.py";
const int kStartTimeoutMs = 20000;
const int kStopTimeoutMs = 5000;

void SleepMs(int ms) {
    struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

std::string ReadAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

size_t AppendToString(char* ptr, size_t size, size_t count, void* userdata) {
    static_cast<std::string*>(userdata)->append(ptr, size * count);
    return size * count;
}

const char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

std::string DecodeBase64(const std::string& in) {
    std::string out;
    int bits = 0;
    unsigned value = 0;
    for (char c : in) {
        const char* p = strchr(kBase64, c);
        if (c == '=' || c == '\0' || p == nullptr) continue;
        value = ((value << 6) | static_cast<unsigned>(p - kBase64)) & 0xFFFFFFu;
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            out.push_back(static_cast<char>((value >> bits) & 0xFF));
        }
    }
    return out;
}

}  // namespace

LocalServer::LocalServer() { Start(Options()); }

LocalServer::LocalServer(const Options& options) { Start(options); }

LocalServer::~LocalServer() { stop(); }

void LocalServer::Start(const Options& options) {
    char tmpl[] = "/tmp/zepa_localserver.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        _error = "mkdtemp failed";
        return;
    }
    _dir = tmpl;
    _certDir = _dir + "/certs";
    const std::string ready = _dir + "/ready.json";
    const std::string log = _dir + "/server.log";

    std::vector<std::string> args = {"python3", kServerScript, "--ready-file", ready, "--cert-dir", _certDir};
    if (!options.https) args.push_back("--no-https");
    if (!options.routesDir.empty()) {
        args.push_back("--routes-dir");
        args.push_back(options.routesDir);
    }
    args.insert(args.end(), options.extraArgs.begin(), options.extraArgs.end());
    // A test that dies without its destructors (a time-out's SIGKILL) must
    // not leave the server, or the relay's namespaces and openvpn, behind.
    args.push_back("--owner-pid");
    args.push_back(std::to_string(getpid()));
    std::vector<char*> argv;
    for (std::string& a : args) argv.push_back(&a[0]);
    argv.push_back(nullptr);

    // The server's own output goes to a file, never into a test's captured stderr.
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    int rc = posix_spawnp(&_pid, "python3", &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (rc != 0) {
        _pid = -1;
        _error = std::string("cannot start python3: ") + strerror(rc);
        return;
    }

    for (int waited = 0; waited < kStartTimeoutMs; waited += 20) {
        if (access(ready.c_str(), F_OK) == 0) break;
        int status = 0;
        if (waitpid(_pid, &status, WNOHANG) == _pid) {
            _pid = -1;
            _error = "local server exited early: " + ReadAll(log);
            return;
        }
        SleepMs(20);
    }
    Json::Value info;
    Json::Reader reader;
    if (!reader.parse(ReadAll(ready), info, false) || !info.isObject()) {
        _error = "local server did not become ready: " + ReadAll(log);
        return;
    }
    _httpPort = info.get("http_port", 0).asInt();
    _httpsPort = info.get("https_port", 0).asInt();
    _caFile = info.get("ca_file", "").asString();
    _relay = info.get("relay", Json::Value());
    _ok = _httpPort > 0;
}

int LocalServer::stop() {
    int status = -1;
    if (_pid > 0) {
        kill(_pid, SIGTERM);
        status = 0;
        bool reaped = false;
        for (int waited = 0; waited < kStopTimeoutMs && !reaped; waited += 10) {
            reaped = waitpid(_pid, &status, WNOHANG) == _pid;
            if (!reaped) SleepMs(10);
        }
        if (!reaped) {
            kill(_pid, SIGKILL);
            waitpid(_pid, &status, 0);
        }
        _pid = -1;
    }
    if (!_dir.empty()) {
        std::string cmd = "rm -rf '" + _dir + "'";
        if (system(cmd.c_str()) != 0) fprintf(stderr, "warning: could not remove %s\n", _dir.c_str());
        _dir.clear();
    }
    _ok = false;
    return status;
}

std::string LocalServer::httpUrl(const std::string& path) const {
    return "http://127.0.0.1:" + std::to_string(_httpPort) + path;
}

std::string LocalServer::httpsUrl(const std::string& path) const {
    return "https://127.0.0.1:" + std::to_string(_httpsPort) + path;
}

bool LocalServer::control(const std::string& method, const std::string& path, const std::string& body,
                          std::string& answer, long& status) const {
    CURL* curl = curl_easy_init();
    if (curl == nullptr) return false;
    std::string url = httpUrl("/_control/" + path);
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_CUSTOMREQUEST, method.c_str());
    if (method == "POST") {
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
    }
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, AppendToString);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &answer);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, 10L);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    CURLcode rc = curl_easy_perform(curl);
    status = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_cleanup(curl);
    return rc == CURLE_OK;
}

bool LocalServer::scriptRaw(const Json::Value& plan) {
    Json::FastWriter writer;
    std::string answer;
    long status = 0;
    return control("POST", "script", writer.write(plan), answer, status) && status == 200;
}

bool LocalServer::script(const std::string& path, int status, const std::string& body, int count,
                         const std::map<std::string, std::string>& headers) {
    Json::Value plan;
    plan["path"] = path;
    plan["status"] = status;
    plan["body"] = body;
    plan["count"] = count;
    for (const auto& h : headers) plan["headers"][h.first] = h.second;
    return scriptRaw(plan);
}

bool LocalServer::hang(const std::string& path, double seconds, int count) {
    Json::Value plan;
    plan["path"] = path;
    plan["action"] = "hang";
    plan["seconds"] = seconds;
    plan["count"] = count;
    return scriptRaw(plan);
}

bool LocalServer::scriptAction(const std::string& path, const std::string& action, int count) {
    Json::Value plan;
    plan["path"] = path;
    plan["action"] = action;
    plan["count"] = count;
    return scriptRaw(plan);
}

Json::Value LocalServer::requests(const std::string& path) const {
    std::string target = "requests";
    if (!path.empty()) {
        char* escaped = curl_easy_escape(nullptr, path.c_str(), static_cast<int>(path.size()));
        target += std::string("?path=") + escaped;
        curl_free(escaped);
    }
    std::string answer;
    long status = 0;
    Json::Value result(Json::arrayValue);
    if (!control("GET", target, "", answer, status) || status != 200) return result;
    Json::Value parsed;
    Json::Reader reader;
    if (reader.parse(answer, parsed, false) && parsed.isObject()) result = parsed["requests"];
    return result;
}

bool LocalServer::reset() {
    std::string answer;
    long status = 0;
    return control("POST", "reset", "", answer, status) && status == 200;
}

std::string RecordedBody(const Json::Value& record) { return DecodeBase64(record["body_base64"].asString()); }

std::string RecordedRequestLine(const Json::Value& record) {
    return DecodeBase64(record["request_line_base64"].asString());
}

std::string RecordedHeader(const Json::Value& record, const std::string& name) {
    for (const Json::Value& h : record["headers"]) {
        if (strcasecmp(h[0].asCString(), name.c_str()) == 0) return h[1].asString();
    }
    return "";
}

int RecordedHeaderCount(const Json::Value& record, const std::string& name) {
    int n = 0;
    for (const Json::Value& h : record["headers"]) {
        if (strcasecmp(h[0].asCString(), name.c_str()) == 0) ++n;
    }
    return n;
}

}  // namespace zepatest
