#include "doctor.h"

#include <strings.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>

#include <json/reader.h>
#include <json/writer.h>

#include <zeparelayd/config.h>
#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>
#include <zeparelayd/tunnel.h>

#include "config_check.h"
#include "probes.h"
#include "relayd_protocol.h"

using namespace ZEPA::Relay;
using namespace zepatools;
namespace key = zepatools::status_key;

namespace zeparelayctl {

namespace {

// The daemon's VPN port on the relay.
const int kVpnPort = 443;
// Clock offsets beyond these make TLS and the relay's token checks fail.
const long kClockWarnSeconds = 60;
const long kClockFailSeconds = 300;

long NowMs() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

std::string Join(const std::vector<std::string>& parts, const char* sep) {
    std::string out;
    for (const std::string& p : parts) {
        if (!out.empty()) out += sep;
        out += p;
    }
    return out;
}

// "12 s", "3 min", "2 h": how long ago or how long until.
std::string Span(long seconds) {
    if (seconds < 0) seconds = -seconds;
    if (seconds < 120) return std::to_string(seconds) + " s";
    if (seconds < 7200) return std::to_string(seconds / 60) + " min";
    if (seconds < 172800) return std::to_string(seconds / 3600) + " h";
    return std::to_string(seconds / 86400) + " days";
}

std::string Ago(const Json::Value& when) {
    if (!when.isIntegral()) return std::string();
    const long d = static_cast<long>(time(nullptr) - when.asInt64());
    return d >= 0 ? Span(d) + " ago" : "in " + Span(d);
}

std::string Until(const Json::Value& when) {
    if (!when.isIntegral()) return std::string();
    const long d = static_cast<long>(when.asInt64() - time(nullptr));
    return d > 0 ? "in " + Span(d) : "now";
}

// Anything an answer or a file could carry, made printable and short.
std::string Printable(const std::string& text, size_t max = 120) {
    std::string out;
    for (unsigned char c : text) {
        if (out.size() >= max) {
            out += "...";
            break;
        }
        out += (c >= 0x20 && c < 0x7f) ? static_cast<char>(c) : '?';
    }
    return out;
}

bool ExecutableFile(const std::string& path, std::string& why) {
    struct stat st {};
    if (stat(path.c_str(), &st) != 0) {
        why = "missing";
        return false;
    }
    if (!S_ISREG(st.st_mode)) {
        why = "not a regular file";
        return false;
    }
    if (access(path.c_str(), X_OK) != 0) {
        why = "not executable";
        return false;
    }
    return true;
}

// The checks in order, with what later checks need from earlier ones.
class Doctor {
public:
    explicit Doctor(int timeoutMs) : _timeoutMs(timeoutMs) {}

    DoctorReport Run() {
        const long start = NowMs();
        _report.timeoutMs = _timeoutMs;
        Configuration();
        Identity();
        DaemonChecks();
        if (_conf) {
            const ServerConf& c = _conf->serverControl;
            const std::string host = c.host.empty() ? c.ip : c.host;
            const std::string url = c.protocol + "://" + host + ":" + std::to_string(c.port) + "/";
            Server("control", url);
            Server("alias", _conf->alias.GetUrl());
            AliasMapping();
        } else {
            for (const char* name : {"control.dns", "control.tcp", "control.tls", "control.http", "alias.dns",
                                     "alias.tcp", "alias.tls", "alias.http", "alias.mapping"})
                Skip(name, "no usable configuration");
        }
        Clock();
        TunnelChecks();
        Services();
        _report.timeMs = NowMs() - start;
        return _report;
    }

private:
    // ---- recording -----------------------------------------------------------

    CheckResult& Add(const std::string& name, Verdict v, const std::string& detail, const std::string& hint,
                     long startMs) {
        CheckResult r;
        r.name = name;
        r.verdict = v;
        r.detail = detail;
        r.hint = (v == Verdict::WARN || v == Verdict::FAIL) ? hint : std::string();
        r.timeMs = NowMs() - startMs;
        _report.checks.push_back(r);
        return _report.checks.back();
    }
    void Skip(const std::string& name, const std::string& why) {
        Add(name, Verdict::SKIPPED, why, "", NowMs());
    }

    // ---- 1. configuration ----------------------------------------------------

    void Configuration() {
        long t = NowMs();
        const std::string path = Daemon::GetConfPath();
        struct stat st {};
        if (stat(path.c_str(), &st) != 0) {
            Add("config", Verdict::FAIL, "no configuration file " + path,
                "install or restore the relay configuration (the package ships one), then zeparelayctl "
                "reload",
                t);
        } else {
            const ConfigCheck check = CheckConfigFile(path);
            if (!check.ok()) {
                Add("config", Verdict::FAIL, Printable(check.first(), 200),
                    "fix the file at the place named (zeparelayctl check-config lists every problem)", t);
            } else {
                _conf.reset(new RelaydConf(path.c_str()));
                if (!_conf->IsValid()) {
                    _conf.reset();
                    Add("config", Verdict::FAIL, path + " is JSON but not a valid relay configuration",
                        "zeparelayctl -v check-config shows which section is wrong", t);
                } else if (!check.warnings.empty()) {
                    Add("config", Verdict::WARN, Printable(check.warnings.front(), 200),
                        "the daemon skips this part; remove or correct it", t);
                } else {
                    Add("config", Verdict::OK, path + " is valid", "", t);
                }
            }
        }

        t = NowMs();
        // The switch lives in the system settings, not in the file.
        RelaydConf defaults(nullptr);
        if (defaults.GetEnableConf()) {
            Add("config.switch", Verdict::OK, "the relay is switched on (runrelayd=yes)", "", t);
        } else {
            Add("config.switch", Verdict::FAIL, "the relay is switched off (runrelayd is not \"yes\")",
                "switch it on: zeparelayctl enable", t);
        }

        t = NowMs();
        if (!_conf) {
            Skip("config.log", "no usable configuration");
            return;
        }
        const int level = _conf->logLevel;
        const std::string file = _conf->logFile.empty() ? std::string("standard error") : _conf->logFile;
        const std::string detail = "log level " + std::to_string(level) + " to " + file;
        if (level >= 7) {
            Add("config.log", Verdict::WARN, detail + " (debug: every exchange is logged)",
                "when done with debugging: zeparelayctl stop-log", t);
        } else if (level < 3) {
            Add("config.log", Verdict::WARN, detail + " (errors are not logged)",
                "set \"log_level\" to 4 or more so that failures reach the log", t);
        } else {
            Add("config.log", Verdict::OK, detail, "", t);
        }
    }

    // ---- 2. identity -----------------------------------------------------------

    static bool Serial(const std::string& s) {
        if (s.size() < 4 || s.size() > 64) return false;
        for (unsigned char c : s)
            if (!isalnum(c)) return false;
        return true;
    }
    static bool Mac(const std::string& s) {
        std::string hex;
        for (unsigned char c : s) {
            if (c == ':' || c == '-') continue;
            if (!isxdigit(c)) return false;
            hex += static_cast<char>(c);
        }
        if (hex.size() != 12 || hex == "000000000000") return false;
        return s.size() == 12 || s.size() == 17;
    }
    static bool Model(const std::string& s) {
        if (s.empty() || s.size() > 64) return false;
        for (unsigned char c : s)
            if (c < 0x20 || c >= 0x7f) return false;
        return true;
    }

    void Identity() {
        const long t = NowMs();
        AuthConf auth(true);
        std::vector<std::string> wrong;
        if (auth.serial.empty()) {
            wrong.push_back("no serial");
        } else if (!Serial(auth.serial)) {
            wrong.push_back("serial \"" + Printable(auth.serial, 40) + "\" is malformed");
        }
        if (auth.mac.empty()) {
            wrong.push_back("no MAC address");
        } else if (!Mac(auth.mac)) {
            wrong.push_back("MAC address \"" + Printable(auth.mac, 40) + "\" is malformed");
        }
        if (auth.model.empty()) {
            wrong.push_back("no model");
        } else if (!Model(auth.model)) {
            wrong.push_back("model name is malformed");
        }
        // Credentials: only whether they are there.
        if (auth.token.empty()) wrong.push_back("no device token");
        if (auth.key.empty()) wrong.push_back("no API key");
        _serial = auth.serial;
        _mac = auth.mac;
        if (!wrong.empty()) {
            Add("identity", Verdict::FAIL, Join(wrong, "; "),
                "the identity comes from the system (device token and cloud-service registration); repair "
                "it there, the relay cannot register without it",
                t);
            return;
        }
        Add("identity", Verdict::OK,
            "serial " + auth.serial + ", MAC " + auth.mac + ", model " + Printable(auth.model, 40) +
                "; device token and API key present (not shown)",
            "", t);
    }

    // ---- 3. the daemon ---------------------------------------------------------

    void DaemonChecks() {
        long t = NowMs();
        const PidFileState pidFile = DaemonFromPidFile();
        Json::Value status;
        const int probe = Daemon::GetStatus(status);
        if (pidFile.pid <= 0) {
            std::string detail =
                pidFile.stale ? "not running (stale PID file " + std::string(Daemon::GetPidFile()) + ")"
                              : "not running (no PID file " + std::string(Daemon::GetPidFile()) + ")";
            Add("daemon", Verdict::FAIL, detail,
                "start it (systemctl start zeparelayd) and read its log if it stops again", t);
            Skip("daemon.registration", "the daemon does not run");
            Skip("daemon.alias", "the daemon does not run");
            return;
        }
        if (probe == 255 || !status.isObject()) {
            Add("daemon", Verdict::FAIL,
                "pid " + std::to_string(pidFile.pid) + " runs, but its status file " +
                    Daemon::GetStatusPath() + " is broken or missing",
                "restart the daemon (zeparelayctl stop, then start it); it rewrites the file", t);
            Skip("daemon.registration", "no readable status");
            Skip("daemon.alias", "no readable status");
            return;
        }
        _status = status;
        const int statusPid = status[key::kPid].isInt() ? status[key::kPid].asInt() : -1;
        struct stat st {};
        std::string written;
        if (stat(Daemon::GetStatusPath().c_str(), &st) == 0)
            written = ", status written " + Span(static_cast<long>(time(nullptr) - st.st_mtime)) + " ago";
        if (probe != 0 || statusPid != pidFile.pid) {
            Add("daemon", Verdict::FAIL,
                "pid " + std::to_string(pidFile.pid) + " runs, but the status file is from pid " +
                    std::to_string(statusPid) + written,
                "the running daemon does not publish its state: restart it (zeparelayctl stop, then start "
                "it)",
                t);
        } else {
            Add("daemon", Verdict::OK, "running, pid " + std::to_string(pidFile.pid) + written, "", t);
        }

        t = NowMs();
        const int state = status[key::kState].isInt() ? status[key::kState].asInt() : 1;
        const int error = status[key::kError].isInt() ? status[key::kError].asInt() : 0;
        const std::string stateWord = GetStateStr(static_cast<RELAYD_STATE>(state));
        const std::string errorWord = GetErrorStr(static_cast<RELAYD_RET>(error));
        std::string detail = "state " + stateWord;
        if (error != 0) detail += ", error " + errorWord;
        const std::string since = Ago(status[key::kRegistrationAt]);
        if (!since.empty()) detail += ", since " + since;
        const std::string retry = Until(status[key::kRegistrationRetryAt]);
        if (!retry.empty()) detail += "; next attempt " + retry;
        if (status[key::kConfigError].isString())
            detail += "; last reload refused: " + Printable(status[key::kConfigError].asString());
        if (state == RELAYD_STATE_DIRECT_CONNECT || state == RELAYD_STATE_CONNECTED ||
            state == RELAYD_STATE_CONNECTED_ALT) {
            if (!status[key::kServerId].asString().empty())
                detail += ", server id " + Printable(status[key::kServerId].asString(), 64);
            Add("daemon.registration", Verdict::OK, "registered: " + detail, "", t);
        } else if (state == RELAYD_STATE_STARTING) {
            Add("daemon.registration", Verdict::WARN, detail,
                "the daemon has just started: ask again shortly", t);
        } else if (state == RELAYD_STATE_LOGOUT) {
            Add("daemon.registration", Verdict::FAIL, detail + " (the relay is switched off)",
                "switch it on: zeparelayctl enable", t);
        } else if (state == RELAYD_STATE_LOGIN && error == 0) {
            Add("daemon.registration", Verdict::WARN, detail + " (registering)",
                "the first answer is on its way: ask again shortly", t);
        } else {
            Add("daemon.registration", Verdict::FAIL, "not registered: " + detail,
                RegistrationHint(static_cast<RELAYD_RET>(error), retry.empty()), t);
        }

        t = NowMs();
        const std::string alias =
            status[key::kAlias].isString() ? status[key::kAlias].asString() : std::string();
        const std::string word =
            status[key::kAliasStatus].isString() ? status[key::kAliasStatus].asString() : "";
        if (alias.empty()) {
            Add("daemon.alias", Verdict::SKIPPED, "no alias configured", "", t);
            return;
        }
        std::string aliasDetail =
            "alias " + Printable(alias, 64) + ": " + (word.empty() ? "no result yet" : Printable(word, 64));
        const std::string aliasSince = Ago(status[key::kAliasAt]);
        if (!word.empty() && !aliasSince.empty()) aliasDetail += ", since " + aliasSince;
        const std::string aliasNext = Until(status[key::kAliasRetryAt]);
        if (!aliasNext.empty()) aliasDetail += "; next exchange " + aliasNext;
        if (word == "good") {
            Add("daemon.alias", Verdict::OK, aliasDetail, "", t);
        } else if (word.empty()) {
            Add("daemon.alias", Verdict::WARN, aliasDetail,
                "the alias follows the registration: see daemon.registration", t);
        } else {
            Add("daemon.alias", Verdict::FAIL, aliasDetail, AliasHint(word), t);
        }
    }

    static std::string RegistrationHint(RELAYD_RET err, bool waitsForReload) {
        std::string hint;
        switch (err) {
            case RELAYD_ERR_RESOLV:
                hint = "the control server's name does not resolve: see control.dns";
                break;
            case RELAYD_ERR_NETWORK:
                hint = "the control server cannot be reached or refuses: see control.tcp to control.http";
                break;
            case RELAYD_ERR_AUTH:
                hint = "the relay refused the identity: check the device token and API key (identity)";
                break;
            case RELAYD_ERR_API_KEY_EXPIRED:
                hint = "the API key has expired: register the appliance with the cloud service again";
                break;
            case RELAYD_ERR_CONFIG:
                hint = "the configuration names no usable control server: see config";
                break;
            case RELAYD_ERR_SERVER_BUSY:
            case RELAYD_ERR_SERVER_LIMIT:
                hint = "the relay is busy or full: the daemon tries again by itself";
                break;
            default:
                hint = "see the control server checks below and the daemon's log";
        }
        if (waitsForReload) hint += "; it will not try again before zeparelayctl reload";
        return hint;
    }

    static std::string AliasHint(const std::string& word) {
        if (word == "alias_inused") return "another appliance holds this alias: choose another one";
        if (word == "alias_self_inused")
            return "this appliance holds another alias: release it or force the new one";
        if (word == "badauth") return "the alias server refused the token: check the identity";
        if (word == "alias_not_found")
            return "the alias is mapped again at the next exchange, or now: zeparelayctl update-alias";
        return "see alias.* below and the daemon's log; zeparelayctl update-alias asks again now";
    }

    // ---- 4. and 5. the servers -------------------------------------------------

    struct ServerFacts {
        bool reachable = false;  // the HTTP exchange came back
        bool https = false;
    };

    void Server(const std::string& name, const std::string& url) {
        ServerFacts& facts = _servers[name];
        Endpoint ep;
        long t = NowMs();
        if (!ParseEndpoint(url, ep)) {
            Add(name + ".dns", Verdict::FAIL, "no usable server URL \"" + Printable(url) + "\"",
                "correct the server in the configuration", t);
            for (const char* step : {".tcp", ".tls", ".http"}) Skip(name + step, "no usable server URL");
            return;
        }
        facts.https = ep.scheme == "https";
        const Lookup lookup = LookUp(ep.host, _timeoutMs);
        const long lookupMs = NowMs() - t;
        if (!lookup.ok) {
            Add(name + ".dns", Verdict::FAIL, "name lookup of " + ep.host + " failed: " + lookup.error,
                lookup.timedOut ? "the name server does not answer: check the appliance's DNS servers"
                                : "check the appliance's DNS servers and the host name in the configuration",
                t);
            for (const char* step : {".tcp", ".tls", ".http"}) Skip(name + step, "no address");
            return;
        }
        Add(name + ".dns", Verdict::OK,
            ep.host + " -> " + Join(lookup.addresses, ", ") + " in " + std::to_string(lookupMs) + " ms", "",
            t);

        // TCP on its own first: a time-out in the exchange below then lies
        // in TLS or HTTP, never in the connection.
        t = NowMs();
        const std::string where = ep.host + ":" + std::to_string(ep.port);
        const std::string timeout = " within " + std::to_string(_timeoutMs) + " ms";
        const std::string address = lookup.addresses.front();
        const std::string tcp = ProbeTcp(address, ep.port, _timeoutMs);
        if (!tcp.empty()) {
            const bool silent = tcp.find("no connection within") != std::string::npos;
            Add(name + ".tcp", Verdict::FAIL,
                "no connection to " + address + ":" + std::to_string(ep.port) + ": " + tcp,
                silent
                    ? "a firewall drops the packets, or the server is down: check the route and the firewall"
                    : "nothing accepts connections there: check the port in the configuration and the server",
                t);
            Skip(name + ".tls", "no connection");
            Skip(name + ".http", "no connection");
            return;
        }
        Add(name + ".tcp", Verdict::OK,
            "connected to " + address + ":" + std::to_string(ep.port) + " in " + std::to_string(NowMs() - t) +
                " ms",
            "", t);

        t = NowMs();
        const HttpProbe p = ProbeHttp(url, false, std::string(), _timeoutMs);
        if (p.failedAt == HttpProbe::CONNECT) {
            const std::string detail = "the second connection to " + where + " failed: " + Printable(p.error);
            const char* hint = "the server takes connections only now and then: it may be overloaded";
            if (facts.https) {
                Add(name + ".tls", Verdict::FAIL, detail, hint, t);
                Skip(name + ".http", "no connection");
            } else {
                Skip(name + ".tls", "plain HTTP");
                Add(name + ".http", Verdict::FAIL, detail, hint, t);
            }
            return;
        }

        if (!facts.https) {
            Skip(name + ".tls", "plain HTTP");
        } else if (p.failedAt == HttpProbe::TLS) {
            Add(name + ".tls", Verdict::FAIL,
                "TLS handshake with " + where +
                    " failed: " + (p.timedOut ? "no answer" + timeout : Printable(p.error)),
                p.timedOut
                    ? "the server accepts connections but does not answer: it hangs or is not a TLS server"
                    : "the server does not speak TLS there, or a middlebox breaks it: check the port and any "
                      "proxy",
                t);
            Skip(name + ".http", "no TLS session");
            return;
        } else {
            std::string detail = p.tlsVersion + ", " + p.cipher + "; certificate " + Printable(p.subject) +
                                 ", issuer " + Printable(p.issuer) + ", expires " + p.notAfter +
                                 " (shown only: the relay's requests accept any certificate)";
            Verdict v = Verdict::OK;
            std::string hint;
            if (p.notAfterTime != 0 && p.notAfterTime < time(nullptr)) {
                v = Verdict::WARN;
                detail += "; the certificate has expired";
                hint = "the server's certificate has expired (or this clock is wrong: see clock)";
            }
            // One exchange carries TLS and HTTP: each gets its own share.
            Add(name + ".tls", v, detail, hint, t).timeMs = std::max(0L, p.tlsMs);
        }

        if (p.failedAt == HttpProbe::HTTP) {
            t += std::max(0L, p.tlsMs);
            Add(name + ".http", Verdict::FAIL,
                "GET " + url + ": " + (p.timedOut ? "no answer" + timeout : Printable(p.error)),
                p.timedOut ? "the server accepted the request but never answered: it hangs"
                           : "the server closed the connection without an answer",
                t);
            return;
        }
        facts.reachable = true;
        NoteDate(p);
        const std::string detail = "GET " + url + ": HTTP " + std::to_string(p.status) + " in " +
                                   std::to_string(p.totalMs) + " ms (a read-only request)";
        if (p.status >= 500) {
            Add(name + ".http", Verdict::WARN, detail,
                "the server answers but reports its own failure: try later", t);
        } else {
            Add(name + ".http", Verdict::OK, detail, "", t);
        }
        if (facts.https && p.tlsMs >= 0) _report.checks.back().timeMs = std::max(0L, p.totalMs - p.tlsMs);
    }

    void NoteDate(const HttpProbe& p) {
        if (p.serverDate < 0) return;
        // The server's second lies between our start and our end.
        const double mid = (static_cast<double>(p.sentAt) + static_cast<double>(p.answeredAt)) / 2.0;
        _offsets.push_back(static_cast<long>(static_cast<double>(p.serverDate) - mid));
    }

    void AliasMapping() {
        const long t = NowMs();
        const std::string alias = _conf->alias.GetAliasName();
        if (alias.empty()) {
            Skip("alias.mapping", "no alias configured");
            return;
        }
        if (!_servers["alias"].reachable) {
            Skip("alias.mapping", "the alias server did not answer");
            return;
        }
        Json::Value data;
        _conf->DumpDataForAliasReq(data);
        if (_conf->serverID.empty()) data["id"] = "-";  // the query sends no id
        AliasRequest query;
        std::string body, url;
        if (!query.SetRequest(ALIAS_REQ_QUERY, data) || !query.GetRequest(body, url)) {
            Add("alias.mapping", Verdict::FAIL, "the alias query cannot be built (identity incomplete)",
                "see identity", t);
            return;
        }
        const HttpProbe p = ProbeHttp(url, true, body, _timeoutMs);
        if (p.failedAt != HttpProbe::DONE || p.status != 200) {
            const std::string what =
                p.failedAt != HttpProbe::DONE
                    ? (p.timedOut ? "no answer within " + std::to_string(_timeoutMs) + " ms"
                                  : Printable(p.error))
                    : "HTTP " + std::to_string(p.status);
            Add("alias.mapping", Verdict::FAIL, "alias query for " + Printable(alias, 64) + ": " + what,
                "the alias server does not answer its query script: try later, or check alias.http", t);
            return;
        }
        NoteDate(p);
        Json::Value answer;
        Json::CharReaderBuilder reader;
        reader["collectComments"] = false;
        reader["stackLimit"] = 64;
        std::string errs;
        std::istringstream in(p.body);
        if (!Json::parseFromStream(reader, in, &answer, &errs) || !answer.isObject()) {
            std::string word = p.body;
            AliasRequest::Trim(word);
            word = word.substr(0, word.find(':'));
            Add("alias.mapping", Verdict::FAIL,
                "alias " + Printable(alias, 64) + " is not mapped (the server says \"" + Printable(word, 64) +
                    "\")",
                _status.isObject() ? "the daemon maps it after registering: see daemon.alias"
                                   : "start the daemon: it maps the alias after registering",
                t);
            return;
        }
        const std::string id = answer["id"].isString() ? answer["id"].asString() : std::string();
        const std::string mac = answer["mac"].isString() ? answer["mac"].asString() : std::string();
        const bool ours = (!_conf->serverID.empty() && id == _conf->serverID) ||
                          (!mac.empty() && strcasecmp(mac.c_str(), _mac.c_str()) == 0);
        const std::string detail = "alias " + Printable(alias, 64) + " -> id " + Printable(id, 64) +
                                   (mac.empty() ? std::string() : ", MAC " + Printable(mac, 40));
        if (ours) {
            Add("alias.mapping", Verdict::OK, detail + " (this appliance)", "", t);
        } else {
            Add("alias.mapping", Verdict::FAIL, detail + " (another appliance)",
                "the alias points elsewhere: choose another alias, or map it again (force) from here", t);
        }
    }

    // ---- 6. the clock ----------------------------------------------------------

    void Clock() {
        const long t = NowMs();
        if (_offsets.empty()) {
            Skip("clock", "no server answer with a date");
            return;
        }
        long worst = 0;
        for (long o : _offsets)
            if (labs(o) > labs(worst)) worst = o;
        const std::string detail = "offset " + std::string(worst > 0 ? "+" : "") + std::to_string(worst) +
                                   " s against the servers' Date headers (" +
                                   std::to_string(_offsets.size()) + " answers)";
        const std::string hint =
            std::string("this clock is ") + (worst > 0 ? "behind" : "ahead") +
            ": TLS and the relay's token checks fail on a wrong clock; set it right (NTP)";
        if (labs(worst) >= kClockFailSeconds) {
            Add("clock", Verdict::FAIL, detail, hint, t);
        } else if (labs(worst) >= kClockWarnSeconds) {
            Add("clock", Verdict::WARN, detail, hint, t);
        } else {
            Add("clock", Verdict::OK, detail, "", t);
        }
    }

    // ---- 7. the tunnel's prerequisites -----------------------------------------

    void TunnelChecks() {
        long t = NowMs();
        const std::string tun = Tunnel::GetTunDevicePath();
        struct stat st {};
        if (stat(tun.c_str(), &st) != 0) {
            Add("tunnel.tun", Verdict::FAIL, tun + " is missing",
                "load the tun module (modprobe tun) or give the container the device", t);
        } else if (!S_ISCHR(st.st_mode)) {
            Add("tunnel.tun", Verdict::FAIL, tun + " is not a character device",
                "replace it by the kernel's tun device (character device 10, 200)", t);
        } else {
            Add("tunnel.tun", Verdict::OK, tun + " is a character device", "", t);
        }

        t = NowMs();
        const std::string program = Tunnel::GetProgramPath();
        std::string why;
        if (!ExecutableFile(program, why)) {
            Add("tunnel.openvpn", Verdict::FAIL, program + ": " + why,
                "install the VPN program; without it no tunnel can be opened", t);
        } else {
            std::string version;
            if (FirstLineOf(program, "--version", std::min(_timeoutMs, 2000), version)) {
                Add("tunnel.openvpn", Verdict::OK, program + ": " + Printable(version, 80), "", t);
            } else {
                Add("tunnel.openvpn", Verdict::WARN, program + " gives no version",
                    "the program may be broken: run it by hand with --version", t);
            }
        }

        t = NowMs();
        std::vector<std::string> bad;
        for (const std::string& script : {Tunnel::GetUpScriptPath(), Tunnel::GetDownScriptPath()}) {
            if (!ExecutableFile(script, why)) bad.push_back(script + ": " + why);
        }
        if (bad.empty()) {
            Add("tunnel.scripts", Verdict::OK, "up and down scripts present and executable", "", t);
        } else {
            Add("tunnel.scripts", Verdict::FAIL, Join(bad, "; "),
                "reinstall the package: the tunnel's routes depend on these scripts", t);
        }

        t = NowMs();
        const std::string ca = Tunnel::GetCaCertPath();
        CaCheck(ca, t);

        t = NowMs();
        const std::string tool = Tunnel::GetModuleToolPath();
        if (ExecutableFile(tool, why)) {
            Add("tunnel.module_tool", Verdict::OK, tool + " present and executable", "", t);
        } else {
            Add("tunnel.module_tool", Verdict::FAIL, tool + ": " + why,
                "reinstall the system package that brings it: the tunnel's kernel modules are loaded with it",
                t);
        }

        const Json::Value& status = _status;  // const: a null stays null
        const Json::Value& tunnel = status[key::kTunnel];
        const std::string relay = tunnel.isObject() && tunnel[key::kTunnelRelayIp].isString()
                                      ? tunnel[key::kTunnelRelayIp].asString()
                                      : std::string();
        if (relay.empty()) {
            const char* why2 = _status.isObject()
                                   ? "the daemon reports no relay address (no tunnel needed or "
                                     "not yet assigned)"
                                   : "no relay address without a running daemon";
            Skip("tunnel.relay_tcp", why2);
            Skip("tunnel.relay_udp", why2);
            return;
        }
        const std::string where = Printable(relay, 64) + ":" + std::to_string(kVpnPort);
        t = NowMs();
        const std::string tcp = ProbeTcp(relay, kVpnPort, _timeoutMs);
        if (tcp.empty()) {
            Add("tunnel.relay_tcp", Verdict::OK, "TCP connection to " + where + " made", "", t);
        } else {
            Add("tunnel.relay_tcp", Verdict::FAIL, "no TCP connection to " + where + ": " + tcp,
                "the relay's VPN port is not reachable: check the firewall towards the relay", t);
        }
        t = NowMs();
        const UdpVpnProbe udp = ProbeVpnUdp(relay, kVpnPort, std::min(_timeoutMs, 2000));
        switch (udp.outcome) {
            case UdpVpnProbe::ANSWERED:
                Add("tunnel.relay_udp", Verdict::OK, "UDP " + where + ": " + udp.detail, "", t);
                break;
            case UdpVpnProbe::REFUSED:
                Add("tunnel.relay_udp", Verdict::WARN, "UDP " + where + ": refused (" + udp.detail + ")",
                    "no VPN server listens on UDP there: the tunnel falls back to TCP", t);
                break;
            case UdpVpnProbe::SILENT:
                Add("tunnel.relay_udp", Verdict::WARN,
                    "UDP " + where + ": " + udp.detail +
                        "; cannot tell whether UDP is filtered or the server ignores handshakes without its "
                        "key",
                    "if UDP is blocked on the way, the tunnel falls back to TCP (slower)", t);
                break;
            case UdpVpnProbe::BLOCKED:
                Add("tunnel.relay_udp", Verdict::WARN, "UDP " + where + ": " + udp.detail,
                    "this appliance's routing or firewall keeps UDP from the relay: the tunnel falls back to "
                    "TCP "
                    "(slower); allow UDP to port 443 for the faster tunnel",
                    t);
                break;
            case UdpVpnProbe::OTHER:
                Add("tunnel.relay_udp", Verdict::WARN, "UDP " + where + ": " + udp.detail,
                    "something other than the relay's VPN server answers there", t);
                break;
            default:
                Add("tunnel.relay_udp", Verdict::WARN, "UDP " + where + ": " + udp.detail,
                    "the probe could not be sent from this machine", t);
        }
    }

    void CaCheck(const std::string& ca, long t) {
        struct stat st {};
        if (stat(ca.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
            Add("tunnel.ca", Verdict::FAIL, ca + " is missing",
                "reinstall the package: the tunnel cannot check the relay without its CA", t);
            return;
        }
        std::ifstream in(ca);
        std::string head(4096, '\0');
        in.read(&head[0], static_cast<std::streamsize>(head.size()));
        head.resize(static_cast<size_t>(in.gcount()));
        if (head.find("-----BEGIN CERTIFICATE-----") == std::string::npos) {
            Add("tunnel.ca", Verdict::FAIL, ca + " holds no PEM certificate",
                "reinstall the package: the file is damaged", t);
            return;
        }
        Add("tunnel.ca", Verdict::OK, ca + " holds a PEM certificate", "", t);
    }

    // ---- 8. services -----------------------------------------------------------

    void Services() {
        const long t = NowMs();
        if (!_conf) {
            Skip("services", "no usable configuration");
            return;
        }
        for (const ServiceConf& s : _conf->services) {
            Json::Value one(Json::objectValue);
            one["id"] = s.id;
            one["name"] = s.name;
            one["port"] = s.port < 0 ? Json::Value() : Json::Value(s.port);
            one["ext_port"] = s.ext_port < 0 ? Json::Value() : Json::Value(s.ext_port);
            _report.services.append(one);
        }
        const Json::ArrayIndex n = _report.services.size();
        if (n == 0) {
            Add("services", Verdict::WARN, "no service is relayed",
                "allow services for the relay (services.conf), then zeparelayctl enable", t);
        } else {
            Add("services", Verdict::OK,
                std::to_string(n) + (n == 1 ? " service" : " services") + " relayed (table below)", "", t);
        }
    }

    int _timeoutMs;
    DoctorReport _report;
    std::unique_ptr<RelaydConf> _conf;
    Json::Value _status;  // the status file of the running daemon, else null
    std::string _serial, _mac;
    std::map<std::string, ServerFacts> _servers;
    std::vector<long> _offsets;
};

}  // namespace

const char* VerdictWord(Verdict v) {
    switch (v) {
        case Verdict::OK:
            return "ok";
        case Verdict::WARN:
            return "warn";
        case Verdict::FAIL:
            return "fail";
        default:
            return "skipped";
    }
}

int DoctorReport::ExitStatus() const {
    int worst = 0;
    for (const CheckResult& c : checks) {
        if (c.verdict == Verdict::FAIL) return 2;
        if (c.verdict == Verdict::WARN) worst = 1;
    }
    return worst;
}

Json::Value DoctorReport::ToJson() const {
    static const char* const kResults[] = {"ok", "warn", "fail"};
    Json::Value out(Json::objectValue);
    out["schema"] = 1;
    out["result"] = kResults[ExitStatus()];
    out["exit_status"] = ExitStatus();
    out["time_ms"] = static_cast<Json::Int64>(timeMs);
    out["timeout_ms"] = timeoutMs;
    Json::Value& list = out["checks"] = Json::Value(Json::arrayValue);
    for (const CheckResult& c : checks) {
        Json::Value one(Json::objectValue);
        one["name"] = c.name;
        one["result"] = VerdictWord(c.verdict);
        one["time_ms"] = static_cast<Json::Int64>(c.timeMs);
        one["detail"] = c.detail;
        one["hint"] = c.hint;
        list.append(one);
    }
    out["services"] = services;
    return out;
}

std::string DoctorReport::ToText(bool colour) const {
    std::ostringstream out;
    size_t width = 0;
    for (const CheckResult& c : checks) width = std::max(width, c.name.size());
    int counts[4] = {0, 0, 0, 0};
    for (const CheckResult& c : checks) {
        ++counts[static_cast<int>(c.verdict)];
        static const char* const kMarks[] = {"ok", "WARN", "FAIL", "--"};
        static const char* const kColours[] = {"\033[32m", "\033[33m", "\033[31m", "\033[2m"};
        const int i = static_cast<int>(c.verdict);
        char mark[32];
        snprintf(mark, sizeof(mark), "%-4s", kMarks[i]);
        if (colour) {
            out << kColours[i] << mark << "\033[0m";
        } else {
            out << mark;
        }
        char name[64];
        snprintf(name, sizeof(name), "  %-*s", static_cast<int>(width), c.name.c_str());
        char ms[32];
        snprintf(ms, sizeof(ms), "%5ld ms  ", c.timeMs);
        out << name << ms << c.detail << "\n";
        if (!c.hint.empty()) out << std::string(4 + 2 + width + 10, ' ') << "-> " << c.hint << "\n";
    }
    if (services.size() > 0) {
        out << "\nRelayed services:\n";
        char line[160];
        snprintf(line, sizeof(line), "  %-24s %-24s %6s %8s\n", "ID", "NAME", "PORT", "EXT_PORT");
        out << line;
        for (const Json::Value& s : services) {
            const std::string port = s["port"].isInt() ? std::to_string(s["port"].asInt()) : "-";
            const std::string ext = s["ext_port"].isInt() ? std::to_string(s["ext_port"].asInt()) : "-";
            snprintf(line, sizeof(line), "  %-24s %-24s %6s %8s\n", s["id"].asCString(),
                     s["name"].asCString(), port.c_str(), ext.c_str());
            out << line;
        }
    }
    char summary[200];
    snprintf(summary, sizeof(summary), "\n%s: %d ok, %d warning%s, %d failure%s, %d skipped in %.2f s\n",
             ExitStatus() == 2   ? "FAILED"
             : ExitStatus() == 1 ? "WARNINGS"
                                 : "ALL OK",
             counts[0], counts[1], counts[1] == 1 ? "" : "s", counts[2], counts[2] == 1 ? "" : "s", counts[3],
             static_cast<double>(timeMs) / 1000.0);
    out << summary;
    return out.str();
}

DoctorReport RunDoctor(int timeoutMs) { return Doctor(timeoutMs).Run(); }

}  // namespace zeparelayctl
