// The relay on this machine for tests and benchmarks: a sample appliance
// staged in the test's root (scripts/stage_appliance.sh, with its openvpn
// wrapper, tunnel scripts and module tool), and the local server started with
// its VPN side (two network namespaces, real openvpn servers, the appliance's
// web service). Needs root, network namespaces, /dev/net/tun and openvpn.
#ifndef ZEPARELAYD_TESTS_SUPPORT_RELAY_HARNESS_H
#define ZEPARELAYD_TESTS_SUPPORT_RELAY_HARNESS_H

#include <json/value.h>
#include <signal.h>

#include <memory>
#include <string>
#include <vector>

#include "support/local_server.h"
#include "support/test_support.h"

namespace zepatest {

class RelayHarness {
public:
    // Empty when this machine can host the relay, else why not.
    static std::string Unavailable();

    RelayHarness() = default;
    // Stops the server; deletes the namespaces should they remain.
    ~RelayHarness();
    RelayHarness(const RelayHarness&) = delete;
    RelayHarness& operator=(const RelayHarness&) = delete;

    // Stages the appliance below root and starts the relay; false with
    // error() set when something did not come up.
    bool Start(const TempRoot& root);
    const std::string& error() const { return _error; }
    LocalServer& server() { return *_server; }

    // Credentials the VPN servers accept from now on; alias (optional) routes
    // the proxy to that user's tunnel. The Tunnel section's JSON.
    Json::Value Grant(const std::string& user, const std::string& alias);
    bool BlockUdp(bool on);
    // The VPN servers' answers dropped: a relay that stays silent.
    bool Silence(bool on);
    // The link between appliance and relay cut (false) or restored, at the
    // relay's end (the appliance keeps its route, loses its carrier) or at the
    // appliance's (it loses its route).
    bool Link(bool up, bool atRelay = true);
    // "stop" or "start" the VPN servers.
    bool Vpn(const std::string& action);
    Json::Value Admin(const std::string& method, const std::string& path,
                      const Json::Value& body = Json::Value());

    // GET https://127.0.0.1:<port><path> trusting the server's CA; false on
    // transport failure.
    bool HttpsGet(const std::string& path, std::string& body, long& status, double timeoutSeconds = 10) const;

    // One plain libcurl request (caFile trusted when not empty).
    static bool Fetch(const std::string& method, const std::string& url, const std::string& body,
                      const std::string& caFile, std::string& answer, long& status, double timeoutSeconds);

    // Stops the local server (and so the relay side); its wait status.
    int Stop();
    bool NamespacesExist() const;
    // Processes whose command line mentions the given text (none of ours
    // after a clean stop).
    static int CountProcesses(const std::string& needle);

    std::string name;
    std::string relayIp;
    std::string relayNetns;
    std::string applianceNetns;
    std::string workDir;

private:
    std::unique_ptr<LocalServer> _server;
    std::string _error;
};

// Base fixture of the real-relay tests: a private root with the appliance
// staged in it and the relay started; skipped, saying why, where the machine
// cannot host the relay.
class RelayTest : public RootTest {
protected:
    void SetUp() override;
    RelayHarness relay;
};

// Handlers for the signals a tunnel start relies on (SIGCHLD, SIGUSR2,
// SIGALRM), as the daemon has them.
void InstallTunnelSignalHandlers();
extern volatile sig_atomic_t g_tunnelUsr2;

}  // namespace zepatest

#endif
