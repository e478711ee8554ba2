#include "probes.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <fcntl.h>
#include <netdb.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <random>

namespace zeparelayctl {

namespace {

long NowMs() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

bool IsAddress(const std::string& host) {
    unsigned char buf[sizeof(in6_addr)];
    return inet_pton(AF_INET, host.c_str(), buf) == 1 || inet_pton(AF_INET6, host.c_str(), buf) == 1;
}

std::string NumericAddress(const sockaddr* sa, socklen_t len) {
    char host[NI_MAXHOST];
    if (getnameinfo(sa, len, host, sizeof(host), nullptr, 0, NI_NUMERICHOST) != 0) return std::string();
    return host;
}

// An address and port as a socket address; false when ip is no address.
bool SocketAddress(const std::string& ip, int port, sockaddr_storage& sa, socklen_t& len) {
    addrinfo hints{};
    hints.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV;
    addrinfo* found = nullptr;
    if (getaddrinfo(ip.c_str(), std::to_string(port).c_str(), &hints, &found) != 0 || found == nullptr)
        return false;
    memcpy(&sa, found->ai_addr, found->ai_addrlen);
    len = found->ai_addrlen;
    freeaddrinfo(found);
    return true;
}

// A datagram this machine refuses to send: a blackhole or prohibit route, no
// route at all, or a firewall rule on the way out.
bool LocallyBlocked(int err) {
    return err == EINVAL || err == EPERM || err == EACCES || err == ENETUNREACH || err == EHOSTUNREACH;
}

// ---- HTTP probe --------------------------------------------------------------

const size_t kMaxBody = 64 * 1024;
const size_t kMaxHeaderLine = 8 * 1024;

struct Transfer {
    CURL* curl = nullptr;
    HttpProbe* probe = nullptr;
};

size_t OnBody(char* data, size_t size, size_t count, void* user) {
    HttpProbe* probe = static_cast<HttpProbe*>(user);
    const size_t n = size * count;
    if (probe->body.size() < kMaxBody) probe->body.append(data, std::min(n, kMaxBody - probe->body.size()));
    return n;
}

// "Date: Tue, 15 Nov 1994 08:12:31 GMT"
size_t OnHeader(char* data, size_t size, size_t count, void* user) {
    HttpProbe* probe = static_cast<HttpProbe*>(user);
    const size_t n = size * count;
    if (n > kMaxHeaderLine || n < 5 || strncasecmp(data, "date:", 5) != 0) return n;
    std::string value(data + 5, n - 5);
    value.erase(0, value.find_first_not_of(" \t"));
    tm when{};
    const char* end = strptime(value.c_str(), "%a, %d %b %Y %H:%M:%S GMT", &when);
    if (end != nullptr) probe->serverDate = timegm(&when);
    return n;
}

std::string NameLine(X509_NAME* name) {
    if (name == nullptr) return std::string();
    char buf[512];
    X509_NAME_oneline(name, buf, sizeof(buf));
    return buf;
}

// Once connected, before the request goes out: the TLS session's facts.
int OnConnected(void* user, char*, char*, int, int) {
    Transfer* t = static_cast<Transfer*>(user);
    const curl_tlssessioninfo* info = nullptr;
    if (curl_easy_getinfo(t->curl, CURLINFO_TLS_SSL_PTR, &info) != CURLE_OK || info == nullptr ||
        info->backend != CURLSSLBACKEND_OPENSSL || info->internals == nullptr)
        return CURL_PREREQFUNC_OK;
    SSL* ssl = static_cast<SSL*>(info->internals);
    t->probe->tlsVersion = SSL_get_version(ssl);
    const char* cipher = SSL_get_cipher_name(ssl);
    if (cipher != nullptr) t->probe->cipher = cipher;
    X509* cert = SSL_get1_peer_certificate(ssl);
    if (cert != nullptr) {
        t->probe->subject = NameLine(X509_get_subject_name(cert));
        t->probe->issuer = NameLine(X509_get_issuer_name(cert));
        const ASN1_TIME* notAfter = X509_get0_notAfter(cert);
        tm when{};
        if (notAfter != nullptr && ASN1_TIME_to_tm(notAfter, &when) == 1) {
            t->probe->notAfterTime = timegm(&when);
            char buf[64];
            strftime(buf, sizeof(buf), "%Y-%m-%d %H:%M:%S UTC", &when);
            t->probe->notAfter = buf;
        }
        X509_free(cert);
    }
    return CURL_PREREQFUNC_OK;
}

long Ms(CURL* curl, CURLINFO what) {
    curl_off_t us = 0;
    if (curl_easy_getinfo(curl, what, &us) != CURLE_OK) return -1;
    return us > 0 ? static_cast<long>(us / 1000) : -1;
}

}  // namespace

bool ParseEndpoint(const std::string& url, Endpoint& out) {
    const size_t sep = url.find("://");
    if (sep == std::string::npos) return false;
    out.scheme = url.substr(0, sep);
    std::transform(out.scheme.begin(), out.scheme.end(), out.scheme.begin(), ::tolower);
    if (out.scheme != "http" && out.scheme != "https") return false;
    std::string rest = url.substr(sep + 3);
    rest = rest.substr(0, rest.find_first_of("/?#"));
    out.port = out.scheme == "https" ? 443 : 80;
    std::string host = rest;
    if (!rest.empty() && rest[0] == '[') {
        const size_t close = rest.find(']');
        if (close == std::string::npos) return false;
        host = rest.substr(1, close - 1);
        rest = rest.substr(close + 1);
        if (!rest.empty() && rest[0] != ':') return false;
    } else {
        const size_t colon = rest.rfind(':');
        host = rest.substr(0, colon);
        rest = colon == std::string::npos ? std::string() : rest.substr(colon);
    }
    if (!rest.empty()) {
        const std::string digits = rest.substr(1);
        if (digits.empty() || digits.size() > 5 ||
            digits.find_first_not_of("0123456789") != std::string::npos)
            return false;
        out.port = atoi(digits.c_str());
        if (out.port < 1 || out.port > 65535) return false;
    }
    out.host = host;
    return !host.empty();
}

Lookup LookUp(const std::string& host, int timeoutMs) {
    Lookup result;
    if (IsAddress(host)) {
        result.ok = true;
        result.addresses.push_back(host);
        return result;
    }
    // The resolver runs on its own thread; a look-up that outlives the time-out
    // keeps its request, so request and name are never freed then.
    struct Pending {
        gaicb request{};
        addrinfo hints{};
        std::string name;
    };
    Pending* p = new Pending;
    p->name = host;
    p->hints.ai_socktype = SOCK_STREAM;
    p->request.ar_name = p->name.c_str();
    p->request.ar_request = &p->hints;
    gaicb* list[1] = {&p->request};
    if (getaddrinfo_a(GAI_NOWAIT, list, 1, nullptr) != 0) {
        delete p;
        result.error = "the resolver could not be started";
        return result;
    }
    const long deadline = NowMs() + timeoutMs;
    int err = gai_error(&p->request);
    while (err == EAI_INPROGRESS) {
        const long left = deadline - NowMs();
        if (left <= 0) break;
        timespec ts{left / 1000, (left % 1000) * 1000000L};
        gai_suspend(list, 1, &ts);
        err = gai_error(&p->request);
    }
    if (err == EAI_INPROGRESS && gai_cancel(&p->request) != EAI_CANCELED) {
        result.timedOut = true;
        result.error = "no answer within " + std::to_string(timeoutMs) + " ms";
        // The resolver thread still writes into it: kept, and kept reachable.
        static std::vector<Pending*> abandoned;
        abandoned.push_back(p);
        return result;
    }
    if (err == EAI_INPROGRESS || err == EAI_CANCELED) {
        result.timedOut = true;
        result.error = "no answer within " + std::to_string(timeoutMs) + " ms";
    } else if (err != 0) {
        result.error = gai_strerror(err);
    } else {
        for (addrinfo* a = p->request.ar_result; a != nullptr; a = a->ai_next) {
            const std::string one = NumericAddress(a->ai_addr, a->ai_addrlen);
            if (!one.empty() &&
                std::find(result.addresses.begin(), result.addresses.end(), one) == result.addresses.end())
                result.addresses.push_back(one);
        }
        result.ok = !result.addresses.empty();
        if (!result.ok) result.error = "no address";
    }
    if (p->request.ar_result != nullptr) freeaddrinfo(p->request.ar_result);
    delete p;
    return result;
}

HttpProbe ProbeHttp(const std::string& url, bool post, const std::string& body, int timeoutMs) {
    HttpProbe probe;
    CURL* curl = curl_easy_init();
    if (curl == nullptr) {
        probe.failedAt = HttpProbe::CONNECT;
        probe.error = "libcurl could not be set up";
        return probe;
    }
    Transfer transfer{curl, &probe};
    char errbuf[CURL_ERROR_SIZE] = {0};
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(timeoutMs));
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, static_cast<long>(timeoutMs));
    curl_easy_setopt(curl, CURLOPT_FORBID_REUSE, 1L);
    curl_easy_setopt(curl, CURLOPT_FRESH_CONNECT, 1L);
    // The daemon's requests accept any certificate; the probe sees what they see.
    curl_easy_setopt(curl, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(curl, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(curl, CURLOPT_USERAGENT, "zeparelayctl-doctor");
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, errbuf);
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, OnBody);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &probe);
    curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, OnHeader);
    curl_easy_setopt(curl, CURLOPT_HEADERDATA, &probe);
    curl_easy_setopt(curl, CURLOPT_PREREQFUNCTION, OnConnected);
    curl_easy_setopt(curl, CURLOPT_PREREQDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
    if (post) {
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
    }
    probe.sentAt = time(nullptr);
    const CURLcode code = curl_easy_perform(curl);
    probe.answeredAt = time(nullptr);
    probe.connectMs = Ms(curl, CURLINFO_CONNECT_TIME_T);
    probe.tlsMs = Ms(curl, CURLINFO_APPCONNECT_TIME_T);
    probe.totalMs = Ms(curl, CURLINFO_TOTAL_TIME_T);
    char* ip = nullptr;
    if (curl_easy_getinfo(curl, CURLINFO_PRIMARY_IP, &ip) == CURLE_OK && ip != nullptr) probe.ip = ip;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &probe.status);
    if (code != CURLE_OK) {
        probe.error = errbuf[0] != '\0' ? errbuf : curl_easy_strerror(code);
        probe.timedOut = code == CURLE_OPERATION_TIMEDOUT;
        // The TLS facts come once the handshake is done; a failure before
        // them lies in the handshake, unless no connection was made at all.
        if (code == CURLE_COULDNT_CONNECT || code == CURLE_COULDNT_RESOLVE_HOST) {
            probe.failedAt = HttpProbe::CONNECT;
        } else if (strncasecmp(url.c_str(), "https:", 6) == 0 && probe.tlsVersion.empty()) {
            probe.failedAt = HttpProbe::TLS;
        } else {
            probe.failedAt = HttpProbe::HTTP;
        }
    }
    curl_easy_cleanup(curl);
    return probe;
}

std::string ProbeTcp(const std::string& ip, int port, int timeoutMs) {
    sockaddr_storage sa{};
    socklen_t len = 0;
    if (!SocketAddress(ip, port, sa, len)) return "\"" + ip + "\" is not an address";
    const int fd = socket(sa.ss_family, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) return std::string("no socket: ") + strerror(errno);
    std::string why;
    if (connect(fd, reinterpret_cast<sockaddr*>(&sa), len) != 0) {
        if (errno != EINPROGRESS) {
            why = strerror(errno);
        } else {
            pollfd p{fd, POLLOUT, 0};
            int ready;
            do {
                ready = poll(&p, 1, timeoutMs);
            } while (ready < 0 && errno == EINTR);
            if (ready == 0) {
                why = "no connection within " + std::to_string(timeoutMs) + " ms";
            } else {
                int err = 0;
                socklen_t errLen = sizeof(err);
                getsockopt(fd, SOL_SOCKET, SO_ERROR, &err, &errLen);
                if (err != 0) why = strerror(err);
            }
        }
    }
    close(fd);
    return why;
}

UdpVpnProbe ProbeVpnUdp(const std::string& ip, int port, int timeoutMs) {
    UdpVpnProbe result;
    sockaddr_storage sa{};
    socklen_t len = 0;
    if (!SocketAddress(ip, port, sa, len)) {
        result.detail = "\"" + ip + "\" is not an address";
        return result;
    }
    const int fd = socket(sa.ss_family, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        result.detail = std::string("no socket: ") + strerror(errno);
        return result;
    }
    if (connect(fd, reinterpret_cast<sockaddr*>(&sa), len) != 0) {
        result.outcome = LocallyBlocked(errno) ? UdpVpnProbe::BLOCKED : UdpVpnProbe::ERROR;
        result.detail = std::string("not sent: ") + strerror(errno);
        close(fd);
        return result;
    }
    // Opcode 7 (client hard reset, version 2) with key id 0, a random session
    // id, no acknowledgements, message id 0: what a client without a shared
    // control-channel key sends first.
    unsigned char packet[14] = {0};
    packet[0] = 7 << 3;
    std::random_device rd;
    for (int i = 1; i <= 8; ++i) packet[i] = static_cast<unsigned char>(rd());
    const long deadline = NowMs() + timeoutMs;
    // Sent twice (once more at half time): one lost datagram is no verdict.
    bool resent = false;
    if (send(fd, packet, sizeof(packet), 0) < 0) {
        result.outcome = errno == ECONNREFUSED   ? UdpVpnProbe::REFUSED
                         : LocallyBlocked(errno) ? UdpVpnProbe::BLOCKED
                                                 : UdpVpnProbe::ERROR;
        result.detail = std::string("not sent: ") + strerror(errno);
        close(fd);
        return result;
    }
    for (;;) {
        long left = deadline - NowMs();
        if (left <= 0) {
            result.outcome = UdpVpnProbe::SILENT;
            result.detail = "no answer within " + std::to_string(timeoutMs) + " ms";
            break;
        }
        if (!resent) left = std::min(left, std::max(1L, static_cast<long>(timeoutMs) / 2));
        pollfd p{fd, POLLIN, 0};
        const int ready = poll(&p, 1, static_cast<int>(left));
        if (ready < 0 && errno == EINTR) continue;
        if (ready == 0) {
            if (!resent) {
                resent = true;
                send(fd, packet, sizeof(packet), 0);
            }
            continue;
        }
        unsigned char reply[2048];
        const ssize_t n = recv(fd, reply, sizeof(reply), 0);
        if (n < 0) {
            if (errno == EINTR) continue;
            result.outcome = errno == ECONNREFUSED ? UdpVpnProbe::REFUSED : UdpVpnProbe::ERROR;
            result.detail = strerror(errno);
            break;
        }
        // Opcode 8: the server's hard reset, its answer to ours.
        if (n >= 10 && (reply[0] >> 3) == 8) {
            result.outcome = UdpVpnProbe::ANSWERED;
            result.detail = "a VPN server answered the handshake";
        } else {
            result.outcome = UdpVpnProbe::OTHER;
            result.detail = "an answer of " + std::to_string(n) + " bytes that is no VPN handshake";
        }
        break;
    }
    close(fd);
    return result;
}

bool FirstLineOf(const std::string& program, const std::string& arg, int timeoutMs, std::string& line) {
    line.clear();
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return false;
    const pid_t pid = fork();
    if (pid < 0) {
        close(fds[0]);
        close(fds[1]);
        return false;
    }
    if (pid == 0) {
        const int devnull = open("/dev/null", O_RDWR);
        if (devnull >= 0) {
            dup2(devnull, 0);
            dup2(devnull, 2);
        }
        dup2(fds[1], 1);
        execl(program.c_str(), program.c_str(), arg.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    close(fds[1]);
    std::string out;
    const long deadline = NowMs() + timeoutMs;
    for (;;) {
        const long left = deadline - NowMs();
        if (left <= 0 || out.size() > 4096 || out.find('\n') != std::string::npos) break;
        pollfd p{fds[0], POLLIN, 0};
        const int ready = poll(&p, 1, static_cast<int>(left));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) break;
        char buf[1024];
        const ssize_t n = read(fds[0], buf, sizeof(buf));
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        out.append(buf, static_cast<size_t>(n));
    }
    close(fds[0]);
    // Our own child: ended when it has not ended by itself, then reaped.
    int status = 0;
    if (waitpid(pid, &status, WNOHANG) == 0) {
        const long grace = NowMs() + 200;
        while (waitpid(pid, &status, WNOHANG) == 0 && NowMs() < grace) usleep(5000);
        if (waitpid(pid, &status, WNOHANG) == 0) {
            kill(pid, SIGKILL);
            waitpid(pid, &status, 0);
        }
    }
    line = out.substr(0, out.find('\n'));
    while (!line.empty() && (line.back() == '\r' || line.back() == ' ')) line.pop_back();
    return !line.empty();
}

}  // namespace zeparelayctl
