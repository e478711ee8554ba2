#define ZEPA_LOG_SOURCE "config"
// A firewall definition without a name breaks the firewall layer's own
// invariant: the assertion below stays on whatever the build type.
#undef NDEBUG
#include <assert.h>

#include <zepasdk/fw.h>
#include <zepasdk/kv.h>
#include <zepasdk/service.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

namespace {

constexpr const char kSupportPrefix[] = "support_";
constexpr size_t kSupportPrefixLen = sizeof(kSupportPrefix) - 1;
constexpr int kTextMax = 1024;
constexpr int kShortMax = 8;
constexpr int kRouterListSize = 512;

struct FwListDeleter {
    void operator()(ZEPAFwService* list) const { ZEPAFwServiceFree(list); }
};
using FwList = std::unique_ptr<ZEPAFwService, FwListDeleter>;

struct SzListDeleter {
    void operator()(VLIBCSzList* list) const { VLIBCSzListFree(list); }
};
using SzList = std::unique_ptr<VLIBCSzList, SzListDeleter>;

bool Contains(const std::string& text, const char* part) { return text.find(part) != std::string::npos; }

bool InfoSaysYes(const char* key) {
    std::string info = Paths::Resolve(Paths::ZEPAINFO_CONF);
    return VLIBCFileCheckKeyValue(info.c_str(), key, "yes", 0) == 1;
}

// The SPDY variants are offered only where the system runs SPDY for them.
bool PassesSpdyGate(const std::string& id) {
    if (Contains(id, "nos_https_spdy") || Contains(id, "nos_portal_https_spdy")) {
        if (!InfoSaysYes("support_spdy") || !InfoSaysYes("runsysspdy")) return false;
    }
    if (Contains(id, "photo_https_spdy") || Contains(id, "photo_portal_https_spdy")) {
        if (!InfoSaysYes("support_spdy") || !InfoSaysYes("runuserspdy")) return false;
    }
    return true;
}

// The firewall's name of the service; several services share one definition.
std::string FirewallName(const std::string& id) {
    std::string name =
        id.compare(0, kSupportPrefixLen, kSupportPrefix) == 0 ? id.substr(kSupportPrefixLen) : id;
    static const struct {
        const char* service;
        const char* firewall;
    } kMap[] = {
        {"photo_http", "http"},
        {"photo_portal_http", "http"},
        {"photo_https", "https"},
        {"photo_https_spdy_30", "https"},
        {"photo_portal_https", "https"},
        {"photo_portal_https_spdy_30", "https"},
        {"nos", "nso"},
        {"nos_portal", "nso"},
        {"file_sharing", "nso"},
        {"audio_http", "nso"},
        {"nos_https", "nso_https"},
        {"nos_https_spdy_30", "nso_https"},
        {"nos_portal_https", "nso_https"},
        {"nos_portal_https_spdy_30", "nso_https"},
        {"file_sharing_https", "nso_https"},
        {"audio_https", "nso_https"},
    };
    for (const auto& entry : kMap)
        if (name == entry.service) return entry.firewall;
    return name;
}

// The settings key that names the external port of a firewall service, if any.
bool ExternalPortSetting(const std::string& fwName, const std::string& id, std::string& file,
                         const char*& key) {
    if (fwName == "nso_https") {
        file = Paths::ZEPAINFO_CONF, key = "external_port_nos_https";
    } else if (fwName == "nso") {
        file = Paths::ZEPAINFO_CONF, key = "external_port_nos_http";
    } else if (fwName == "https" && Contains(id, "photo")) {
        file = Paths::PHOTO_SETTINGS_CONF, key = "external_port_photo_https";
    } else if (fwName == "http" && Contains(id, "photo")) {
        file = Paths::PHOTO_SETTINGS_CONF, key = "external_port_photo_http";
    } else {
        return false;
    }
    file = Paths::Resolve(file);
    return true;
}

// A port list text as integers; false on malformed text.
bool ParsePortList(const char* text, std::vector<int>& ports) {
    int count = VLibParsePorts(text, nullptr, 0);
    if (count < 0) return false;
    ports.assign(static_cast<size_t>(count), 0);
    if (count == 0) return true;
    return VLibParsePorts(text, ports.data(), count) == count;
}

bool ReadRuleValue(const std::string& file, const char* section, const char* key, char* buf, int size) {
    return VLIBCFileGetSectionValue(file.c_str(), section, key, buf, size) > 0;
}

// Whether one port-forwarding rule forwards the internal port over TCP.
bool RuleForwards(const std::string& file, const char* section, int port) {
    char sPort[kTextMax] = {0}, rPort[kTextMax] = {0};
    char protocol[kShortMax] = {0}, enabled[kShortMax] = {0};
    if (!ReadRuleValue(file, section, "s_port", sPort, sizeof(sPort)) ||
        !ReadRuleValue(file, section, "r_port", rPort, sizeof(rPort)) ||
        !ReadRuleValue(file, section, "protocol name", protocol, sizeof(protocol)) ||
        !ReadRuleValue(file, section, "enabled", enabled, sizeof(enabled)))
        return false;
    std::vector<int> source, router;
    if (!ParsePortList(sPort, source) || !ParsePortList(rPort, router)) {
        ZLOG(ZEPA_LOG_ERR, "Router[%s] or source[%s] ports parse failed.", rPort, sPort);
        return false;
    }
    // The router side must parse, but whether it lists the port does not
    // matter: this lookup and its ignored outcome are deliberate.
    bool onRouter = std::find(router.begin(), router.end(), port) != router.end();
    static_cast<void>(onRouter);
    bool onSource = std::find(source.begin(), source.end(), port) != source.end();
    bool tcp = strcmp(protocol, "tcp") == 0 || strcmp(protocol, "all") == 0;
    return onSource && tcp && strtol(enabled, nullptr, 10) == 1;
}

// The router's rules: the internal port in decimal when a rule forwards it,
// "-1" otherwise.
bool ScanRouterRules(int port, std::string& buffer) {
    SzList sections(VLIBCSzListAlloc(kRouterListSize));
    if (!sections) {
        ZLOG(ZEPA_LOG_ERR, "List allocation failed.");
        return false;
    }
    char base[kTextMax] = {0};
    if (VLIBServiceRouterBasepathGet(base, sizeof(base)) < 0) return false;
    std::string file = std::string(base) + "/" + Paths::ROUTER_PF_RULES_NAME;
    VLIBCSzList* raw = sections.release();
    int count = VLIBCFileEnumSection(file.c_str(), &raw);
    sections.reset(raw);
    if (count <= 0) return false;
    for (int i = 0; i < sections->nItem; ++i) {
        if (RuleForwards(file, VLIBCSzListGet(sections.get(), i), port)) {
            buffer = std::to_string(port);
            break;
        }
    }
    return true;
}

// A port that UPnP reports as not mapped for TCP is reachable under no port.
void ApplyUpnpRules(std::string& buffer) {
    Json::Value rules;
    if (!RelaydConf::ReadJsonFile(Paths::Resolve(Paths::UPNP_RULES), rules) || !rules.isObject()) return;
    const Json::Value& entry = rules[buffer];
    if (!entry.isObject()) return;
    const Json::Value& tcp = entry["TCP"];
    if (!tcp.isNull() && tcp.isConvertibleTo(Json::booleanValue) && !tcp.asBool()) buffer = "0";
}

// The port under which the service is reachable from outside: a settings key
// first, else a forwarding rule of the router checked against UPnP.
bool LookupExternalPort(const std::string& fwName, const std::string& id, int port, int& extPort) {
    std::string buffer = "-1";
    std::string file;
    const char* key = nullptr;
    if (ExternalPortSetting(fwName, id, file, key)) {
        char value[kTextMax] = {0};
        if (VLIBCFileGetKeyValue(file.c_str(), key, value, sizeof(value)) > 0) {
            extPort = static_cast<int>(strtol(value, nullptr, 10));
            return true;
        }
    }
    if (!ScanRouterRules(port, buffer)) {
        extPort = -1;
        return false;
    }
    long number = strtol(buffer.c_str(), nullptr, 10);
    if (number <= 0) {
        extPort = static_cast<int>(number);
        return false;
    }
    ApplyUpnpRules(buffer);
    extPort = static_cast<int>(strtol(buffer.c_str(), nullptr, 10));
    return true;
}

}  // namespace

ServiceConf::ServiceConf(const char* id) : port(-1), ext_port(-1) {
    if (id != nullptr) ReadConf(id);
}

ServiceConf::ServiceConf(const Json::Value& value, bool readConf) : port(-1), ext_port(-1) {
    JsonTake::Take(value, "id", id);
    if (readConf) ReadConf(std::string(id));
    Overwrite(value);
}

ServiceConf::~ServiceConf() {}

bool ServiceConf::ReadConf(const std::string& serviceId) {
    id = serviceId;
    ZEPAFwService* raw = nullptr;
    int count = ZEPAFwServiceEnum(&raw);
    FwList list(raw);
    if (count <= 0) {
        ZLOG(ZEPA_LOG_ERR, "enum fw service failed [0x%04X]", VLIBCErrGet());
        return false;
    }
    if (!PassesSpdyGate(id)) return false;
    const ZEPAFwService* pService = ZEPAFWServiceFind(list.get(), FirewallName(id).c_str());
    if (pService == nullptr) return false;
    assert('\0' != *(pService->szName));
    if (pService->dwTcp == 0 && pService->dwUdp == 0) return false;

    if (pService->szTitle[0] != '\0' && pService->szSubTitle[0] != '\0')
        name = std::string(pService->szTitle) + ":" + pService->szSubTitle;
    else if (pService->szAltTitle[0] != '\0')
        name = pService->szAltTitle;
    if (pService->pPorts != nullptr && pService->pPorts->nItem == 1)
        port = static_cast<int>(strtol(VLIBCSzListGet(pService->pPorts, 0), nullptr, 10));
    if (!LookupExternalPort(pService->szName, id, port, ext_port)) ext_port = -1;
    return true;
}

bool ServiceConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    JsonTake::TakeAll(value, {{"id", id}, {"name", name}, {"port", port}, {"ext_port", ext_port}});
    return true;
}

bool ServiceConf::IsValid() const { return !id.empty() && port >= 0; }

bool ServiceConf::Write(Json::Value& out, bool full) const {
    out["id"] = id;
    if (!full) return true;
    out["name"] = name;
    if (port >= 0) out["port"] = port;
    if (ext_port >= 0) out["ext_port"] = ext_port;
    return true;
}

// The display name is deliberately left out of the comparison.
bool ServiceConf::operator==(const ServiceConf& other) const {
    return id == other.id && port == other.port && ext_port == other.ext_port;
}

bool ServiceConf::operator!=(const ServiceConf& other) const { return !(*this == other); }

}  // namespace Relay
}  // namespace ZEPA
