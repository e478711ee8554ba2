// The relay configuration model: the sections and the aggregate RelaydConf
// with its JSON file helpers (the Config interface is in config_base.h).
#ifndef ZEPARELAYD_CONFIG_H
#define ZEPARELAYD_CONFIG_H

#include <json/value.h>

#include <cstdint>
#include <list>
#include <ostream>
#include <string>

#include <zeparelayd/config_alias.h>
#include <zeparelayd/config_base.h>
#include <zeparelayd/export.h>

// The platform's interface information record (zepasdk/net.h).
struct VLIBNetIfInfo;

namespace ZEPA {
namespace Relay {

// One server endpoint (global, control, wait-command).
class ZEPARELAYD_API ServerConf : public Config {
public:
    ServerConf(const char* host, const char* page);
    explicit ServerConf(const Json::Value& value);
    ~ServerConf() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    bool operator==(const ServerConf& other) const;
    bool operator!=(const ServerConf& other) const;

    // protocol://host-or-ip:port/page; empty when invalid.
    std::string GetUrl(const char* page) const;
    std::string GetRegion() const;

    std::string protocol;  // "http" or "https"
    std::string host;
    std::string ip;  // used when host is empty
    int port;
    std::string page;  // without a leading slash
};

// The appliance identity. token and key are credentials: never logged.
class ZEPARELAYD_API AuthConf : public Config {
public:
    explicit AuthConf(bool read);
    ~AuthConf() override;

    bool ReadConf();
    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    std::string GetMacAddress();
    std::string RelaydGetMacAddressByIf(const char* ifname);
    void GenerateApiKey();

    std::string serial;
    std::string mac;
    std::string token;
    std::string timezone;
    std::string key;
    std::string model;
};

// The device's account on the maker's account service.
class ZEPARELAYD_API MyHubConf : public Config {
public:
    MyHubConf();
    ~MyHubConf() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    std::string GetHost() const;
    std::string GetMyHubAccount() const;
    bool SetMyHubAccount(const std::string& account);

    // The account service's default host name.
    static const char* const DEFAULT_HOST;

private:
    std::string _account;
    std::string _host;
};

// Whether the remote support channel is on.
class ZEPARELAYD_API SupportChannelConf : public Config {
public:
    SupportChannelConf();
    ~SupportChannelConf() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    void SetEnabled(bool enabled);
    bool GetEnabled() const;

private:
    bool _enabled;
};

// One row of the constant service catalogue.
struct SupportService {
    const char* szName;
    const char* szConfFile;
    const char* szKey;
    const char* szValue;
    int32_t iCheckOpt;
    const char* szPackage;
    const char* szServiceName;
    uint32_t uMask;
};

// 24 rows and a terminating row whose szName is null.
ZEPARELAYD_API extern const SupportService grgszSupportService[];

// One relayed service.
class ZEPARELAYD_API ServiceConf : public Config {
public:
    explicit ServiceConf(const char* id);
    ServiceConf(const Json::Value& value, bool readConf);
    ~ServiceConf() override;

    bool ReadConf(const std::string& id);
    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    bool operator==(const ServiceConf& other) const;
    bool operator!=(const ServiceConf& other) const;

    std::string id;
    std::string name;
    int port;      // -1: absent
    int ext_port;  // -1: absent
};

// One IPv4 interface that is up.
class ZEPARELAYD_API InterfaceConf : public Config {
public:
    InterfaceConf();
    InterfaceConf(const std::string& name, const std::string& address, const std::string& mask);
    explicit InterfaceConf(const ::VLIBNetIfInfo& info);
    ~InterfaceConf() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    bool operator==(const InterfaceConf& other) const;
    bool operator!=(const InterfaceConf& other) const;

    std::string name;
    std::string address;
    std::string mask;
};

// The network state reported to the relay.
class ZEPARELAYD_API NetworkConf : public Config {
public:
    explicit NetworkConf(bool read);
    ~NetworkConf() override;

    bool ReadConf();
    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    bool operator==(const NetworkConf& other) const;
    bool operator!=(const NetworkConf& other) const;

    std::string ddns;
    std::string gateway;
    std::list<InterfaceConf> interfaces;
    std::string mode;  // set by the caller; never read from the system

private:
    void ReadInterfaces();
    void ReadPppoe();
    void ReadGateway();
    void ReadDdns();
};

// The whole relay configuration.
class ZEPARELAYD_API RelaydConf : public Config {
public:
    // The relay service's global entry point.
    static const char* const GLOBAL_HOST;

    explicit RelaydConf(const char* path);
    ~RelaydConf() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    bool Reload();
    static std::string GetTimeZone();
    bool SetEnableConf(bool enable) const;
    bool GetEnableConf() const;
    void DumpDataForAliasReq(Json::Value& out);

    // JSON files: the only way any JSON file is read or written.
    static bool ReadJsonFile(const std::string& path, Json::Value& value);
    static bool WriteJsonFile(const std::string& path, const Json::Value& value);
    bool ReadConfigFile(const std::string& path);
    bool WriteConfigFile(const std::string& path);
    bool WriteConfigFile();
    bool WriteJsonFileWithNotification(const std::string& path, const Json::Value& value);

    // Field writers: change one key of the file, keep every other.
    bool WriteServerId(const std::string& path);
    bool WriteAliasName(const std::string& path, const std::string& alias);
    bool WriteMyHubAccount(const std::string& path, const std::string& account);
    bool WriteControlServerHost(const std::string& path, const std::string& host);

    // The service list.
    void GenServiceConf();
    bool AddServiceById(const std::string& id);
    std::list<ServiceConf>::const_iterator GetServiceById(const std::string& id) const;
    bool RemoveServiceById(const std::string& id);
    bool CheckServiceRunKey(const SupportService* row) const;
    // The service list as a JSON array, each element in the form Write(full)
    // gives; the same array as the "service" member of Write. For programs
    // that publish or send the list (status file, registration).
    void WriteServices(Json::Value& out, bool full) const;

    bool enable;
    std::string serverID;
    ServerConf serverGlobal;
    ServerConf serverControl;
    ServerConf serverWaitCmd;
    AliasConf alias;
    MyHubConf myhub;
    SupportChannelConf supportChannel;
    std::list<ServiceConf> services;
    NetworkConf network;
    AuthConf auth;
    std::string logFile;
    int logLevel;
    bool debug;
    std::string path;
    // Set with a new serverID; cleared by the next successful file write,
    // which sends the administrators' notice.
    bool serverIdChanged;

private:
    void OverwriteServices(const Json::Value& list);
    void TakeOver(const RelaydConf& other);
    bool BeginFieldWrite(const std::string& path, std::string& file, Json::Value& value) const;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
