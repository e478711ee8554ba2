#include "support/service_staging.h"

#include <zepasdk/fw.h>
#include <zepasdk/kv.h>
#include <zepasdk/service.h>

#include <stdexcept>

namespace zepatest {

void WriteFwDefinition(const TempRoot& root, const FwDefinition& def, const std::string& fileName) {
    std::string text = "name=\"" + def.name + "\"\n";
    if (!def.title.empty()) text += "title=\"" + def.title + "\"\n";
    if (!def.subtitle.empty()) text += "subtitle=\"" + def.subtitle + "\"\n";
    if (!def.altTitle.empty()) text += "alt_title=\"" + def.altTitle + "\"\n";
    text += "protocol=\"" + def.protocol + "\"\n";
    if (!def.ports.empty()) text += "ports=\"" + def.ports + "\"\n";
    std::string file = fileName.empty() ? def.name + ".conf" : fileName;
    root.write(std::string(ZEPA_FW_SERVICE_DIR) + "/" + file, text);
}

void WriteStockFwDefinitions(const TempRoot& root) {
    WriteFwDefinition(root, {"nso", "5000", "tcp", "Management", "HTTP", ""});
    WriteFwDefinition(root, {"nso_https", "5001", "tcp", "Management", "HTTPS", ""});
    WriteFwDefinition(root, {"http", "80", "tcp", "", "", "Web Server"});
    WriteFwDefinition(root, {"https", "443", "tcp", "", "", "Web Server (HTTPS)"});
    WriteFwDefinition(root, {"telnet", "23", "tcp", "", "", "Telnet"});
    WriteFwDefinition(root, {"ssh", "22", "tcp", "", "", "SSH"});
    WriteFwDefinition(root, {"webdav_http", "5005", "tcp", "WebDAV", "HTTP", ""});
    WriteFwDefinition(root, {"webdavs_https", "5006", "tcp", "WebDAV", "HTTPS", ""});
    WriteFwDefinition(root, {"syncdock", "6690", "tcp", "", "", "SyncDock"});
}

void AddRouterRule(const TempRoot& root, const std::string& section, const std::string& sPort,
                   const std::string& rPort, const std::string& protocol, const std::string& enabled) {
    std::string file = root.path(std::string(ZEPA_ROUTER_BASE_DIR) + "/" + ZEPA_ROUTER_PF_RULES_FILE);
    root.mkdir(ZEPA_ROUTER_BASE_DIR);
    std::string text = FileExists(file) ? ReadFile(file) : "";
    text += "[" + section + "]\n";
    text += "s_port=\"" + sPort + "\"\n";
    text += "r_port=\"" + rPort + "\"\n";
    text += "protocol name=\"" + protocol + "\"\n";
    text += "enabled=\"" + enabled + "\"\n";
    WriteFile(file, text);
}

void SetKey(const TempRoot& root, const std::string& absFile, const std::string& key,
            const std::string& value) {
    size_t slash = absFile.rfind('/');
    root.mkdir(absFile.substr(0, slash));
    if (VLIBCFileSetKeyValue(root.path(absFile).c_str(), key.c_str(), value.c_str()) != 0)
        throw std::runtime_error("cannot stage " + key + " in " + absFile);
}

void SetInfo(const TempRoot& root, const std::string& key, const std::string& value) {
    SetKey(root, "/etc/zepainfo.conf", key, value);
}

void EnableSystemService(const TempRoot& root, const std::string& service) {
    root.write(std::string(ZEPA_SERVICE_MARKER_DIR) + "/" + service + ".enabled", "");
}

void EnablePackage(const TempRoot& root, const std::string& package) {
    root.write("/var/packages/" + package + "/enabled", "");
}

}  // namespace zepatest
