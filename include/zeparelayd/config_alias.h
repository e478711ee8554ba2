// The alias section of the relay configuration and the alias status file.
#ifndef ZEPARELAYD_CONFIG_ALIAS_H
#define ZEPARELAYD_CONFIG_ALIAS_H

#include <json/value.h>

#include <string>

#include <zeparelayd/config_base.h>
#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

class ZEPARELAYD_API AliasConf : public Config {
public:
    // "https://" and the alias information server's host, 30 characters.
    static const char* const DEFAULT_URL;
    static const int DEFAULT_POLL_SECONDS = 28800;

    AliasConf();
    ~AliasConf() override;

    bool Overwrite(const Json::Value& section) override;
    bool IsValid() const override;
    // compact true leaves out "url" and "poll_seconds" when they are the defaults.
    bool Write(Json::Value& out, bool compact) const override;

    bool IsChanged() const;
    void CommitChange();
    bool IsAliasEnabled() const;
    bool SetAliasName(const std::string& name);
    std::string GetAliasName() const;
    std::string GetUrl() const;
    int GetPollSeconds() const;
    // poll + random() % poll seconds.
    int GetPollingTime() const;

private:
    bool _changed;
    int _pollSeconds;
    std::string _aliasName;
    std::string _url;
};

// Outcome of the last alias operation, kept in "/tmp/hopcloud_alias.status".
class ZEPARELAYD_API AliasStatus {
public:
    AliasStatus();
    virtual ~AliasStatus();

    bool Reload();
    bool IsValid() const;
    bool DumpToFile();
    bool SetStatus(const std::string& aliasName, const std::string& status, const std::string& extra,
                   bool dump);
    bool GetStatus(const std::string& aliasName, std::string& status, std::string& extra) const;
    // The status file, resolved against the system root.
    static std::string GetPath();

private:
    Json::Value _doc;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
