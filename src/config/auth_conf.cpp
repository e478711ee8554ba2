// The appliance identity. The token and the API key are credentials: no log
// line of this file ever carries them.
#define ZEPA_LOG_SOURCE "config"

#include <zepasdk/identity.h>
#include <zepasdk/kv.h>

#include <cstring>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

namespace {

const int TOKEN_SIZE = 33;
const int SERIAL_SIZE = 36;
const int TEXT_SIZE = 1024;

}  // namespace

AuthConf::AuthConf(bool read) : timezone(RelaydConf::GetTimeZone()) {
    if (read) ReadConf();
}

AuthConf::~AuthConf() = default;

bool AuthConf::ReadConf() {
    char tokenBuf[TOKEN_SIZE];
    char serialBuf[SERIAL_SIZE];
    char modelBuf[TEXT_SIZE];
    memset(tokenBuf, 0, sizeof(tokenBuf));
    memset(serialBuf, 0, sizeof(serialBuf));
    memset(modelBuf, 0, sizeof(modelBuf));

    if (ZEPAHubtokenGetToken(serialBuf, sizeof(serialBuf), tokenBuf, sizeof(tokenBuf)) < 0) {
        ZLOG(ZEPA_LOG_ERR, "ZEPAHubtokenGetToken failed: [0x%04X]", VLIBCErrGet());
        return false;
    }
    const std::string defaults = Paths::Resolve(Paths::ZEPAINFO_DEFAULTS_CONF);
    if (VLIBCFileGetKeyValue(defaults.c_str(), "upnpmodelname", modelBuf, sizeof(modelBuf)) < 0) {
        ZLOG(ZEPA_LOG_ERR, "VLIBCFileGetKeyValue failed: [0x%04X]", VLIBCErrGet());
        return false;
    }

    serial = serialBuf;
    token = tokenBuf;
    mac = GetMacAddress();
    model = modelBuf;
    char keyBuf[ZEPA_CLOUD_KEY_SIZE];
    memset(keyBuf, 0, sizeof(keyBuf));
    ZEPACloudServiceGetApiKey(keyBuf, 0);
    key = keyBuf;
    return true;
}

bool AuthConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    std::string newSerial;
    std::string newToken;
    JsonTake::TakeAll(
        value, {{"serial", newSerial}, {"token", newToken}, {"mac", mac}, {"key", key}, {"model", model}});

    // A token without its serial means nothing; keep the pair as it was.
    if (newSerial.empty()) return true;
    if (newToken.empty()) {
        char tokenBuf[TOKEN_SIZE];
        memset(tokenBuf, 0, sizeof(tokenBuf));
        if (ZEPAHubtokenGenerateToken(newSerial.c_str(), tokenBuf, sizeof(tokenBuf)) < 0) {
            ZLOG(ZEPA_LOG_ERR, "gen token failed");
            tokenBuf[0] = '\0';
        }
        newToken = tokenBuf;
    }
    serial = newSerial;
    token = newToken;
    return true;
}

bool AuthConf::IsValid() const { return !serial.empty() && !mac.empty() && !token.empty(); }

bool AuthConf::Write(Json::Value& out, bool full) const {
    out["serial"] = serial;
    out["mac"] = mac;
    out["timezone"] = timezone;
    out["key"] = key;
    out["model"] = model;
    if (full) out["token"] = token;
    return true;
}

std::string AuthConf::GetMacAddress() {
    std::string address = RelaydGetMacAddressByIf("eth0");
    if (address.empty()) ZLOG(ZEPA_LOG_ERR, "invalid mac address");
    return address;
}

std::string AuthConf::RelaydGetMacAddressByIf(const char* /*ifname*/) {
    // The platform decides which interface is the device's; the name is not passed on.
    char buf[TEXT_SIZE];
    memset(buf, 0, sizeof(buf));
    if (ZEPACloudServiceGetMacAddress(buf, sizeof(buf)) < 0) return std::string();
    return buf;
}

void AuthConf::GenerateApiKey() {
    char buf[TEXT_SIZE];
    memset(buf, 0, sizeof(buf));
    ZEPACloudServiceRegisterApiKey(buf, sizeof(buf));
    key = buf;
}

}  // namespace Relay
}  // namespace ZEPA
