// Staging of the system facts that the service catalogue reads: firewall
// definitions, router rules, system service and package switches, settings.
#ifndef ZEPARELAYD_TESTS_SUPPORT_SERVICE_STAGING_H
#define ZEPARELAYD_TESTS_SUPPORT_SERVICE_STAGING_H

#include <string>

#include "support/test_support.h"

namespace zepatest {

struct FwDefinition {
    FwDefinition(std::string n, std::string p, std::string proto = "tcp", std::string t = "",
                 std::string sub = "", std::string alt = "")
        : name(n), ports(p), protocol(proto), title(t), subtitle(sub), altTitle(alt) {}
    std::string name;
    std::string ports;  // "ports" value; empty: key left out
    std::string protocol;
    std::string title;
    std::string subtitle;
    std::string altTitle;
};

// One firewall definition file under the root (file name: name + ".conf",
// or fileName when given).
void WriteFwDefinition(const TempRoot& root, const FwDefinition& def, const std::string& fileName = "");

// The definitions of a typical appliance: nso 5000, nso_https 5001, http 80,
// https 443, telnet 23, ssh 22, webdav_http 5005, webdavs_https 5006,
// syncdock 6690.
void WriteStockFwDefinitions(const TempRoot& root);

// Appends one section to the router's port-forwarding rule file.
void AddRouterRule(const TempRoot& root, const std::string& section, const std::string& sPort,
                   const std::string& rPort, const std::string& protocol, const std::string& enabled);

// Sets key="value" in a key/value file under the root (created when missing).
void SetKey(const TempRoot& root, const std::string& absFile, const std::string& key,
            const std::string& value);
void SetInfo(const TempRoot& root, const std::string& key, const std::string& value);

void EnableSystemService(const TempRoot& root, const std::string& service);
void EnablePackage(const TempRoot& root, const std::string& package);

}  // namespace zepatest

#endif
