// Network and program probes for "doctor": each one bounded by its own
// time-out, each one only looks (no request that changes a server's state is
// made here; the caller chooses what it sends).
#ifndef ZEPARELAYD_TOOL_CTL_PROBES_H
#define ZEPARELAYD_TOOL_CTL_PROBES_H

#include <ctime>
#include <string>
#include <vector>

namespace zeparelayctl {

// scheme://host[:port][/...]; the port defaults to the scheme's.
struct Endpoint {
    std::string scheme;  // "http" or "https"
    std::string host;
    int port = 0;
};
bool ParseEndpoint(const std::string& url, Endpoint& out);

struct Lookup {
    bool ok = false;
    bool timedOut = false;
    std::vector<std::string> addresses;  // numeric, in resolver order, no repeats
    std::string error;                   // why it failed
};
// Name lookup of host within timeoutMs (an address is its own answer).
Lookup LookUp(const std::string& host, int timeoutMs);

// One HTTP(S) exchange, split into the steps that can fail.
struct HttpProbe {
    enum Step { DONE, CONNECT, TLS, HTTP };
    Step failedAt = DONE;   // the first step that failed, DONE when none did
    bool timedOut = false;  // that step ran out of time
    std::string error;      // what failed, in libcurl's words
    std::string ip;         // the address connected to
    long connectMs = -1;    // from the start: TCP connected
    long tlsMs = -1;        // TLS handshake done (https)
    long totalMs = -1;      // answer complete
    long status = 0;        // HTTP status, 0 without an answer
    std::string tlsVersion, cipher, subject, issuer, notAfter;
    time_t notAfterTime = 0;  // the certificate's expiry, 0 when unknown
    time_t serverDate = -1;   // the answer's Date header, -1 when none
    time_t sentAt = 0;        // local time at the start and at the end
    time_t answeredAt = 0;
    std::string body;  // the first 64 KiB of the answer
};
// A GET (post false) or a form POST of body to url, certificates accepted as
// the daemon's requests accept them, no connection kept.
HttpProbe ProbeHttp(const std::string& url, bool post, const std::string& body, int timeoutMs);

// A TCP connection to ip:port within timeoutMs, closed at once. Empty when it
// was made, else why not.
std::string ProbeTcp(const std::string& ip, int port, int timeoutMs);

// Whether a VPN server answers on UDP ip:port: sends the VPN's first client
// handshake packet (a hard reset without any key) and waits for the reply.
struct UdpVpnProbe {
    // BLOCKED: this machine's own routing or firewall does not send it.
    enum Outcome { ANSWERED, REFUSED, SILENT, OTHER, BLOCKED, ERROR };
    Outcome outcome = ERROR;
    std::string detail;
};
UdpVpnProbe ProbeVpnUdp(const std::string& ip, int port, int timeoutMs);

// Runs program with one argument and gives the first line it prints; the
// program is killed when it has not ended within timeoutMs. False when it
// could not be run or printed nothing.
bool FirstLineOf(const std::string& program, const std::string& arg, int timeoutMs, std::string& line);

}  // namespace zeparelayctl

#endif
