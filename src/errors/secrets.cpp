// The one list of credential keys and the masks built on it.
#include <zeparelayd/errors.h>

#include <string>

namespace ZEPA {
namespace Relay {

namespace {

// Every key under which a credential travels: the device token, the API key,
// the account password and auth key of the alias commands, the relay
// password of the tunnel, and the generic names a section could carry.
const char* const kSecretKeys[] = {
    "token", "key", "auth_key", "myhub_password", "relay_pass", "password", "passwd", "api_key", "secret",
};

const char kMasked[] = "***";

}  // namespace

bool IsSecretKey(const std::string& key) {
    for (const char* secret : kSecretKeys) {
        if (key == secret) return true;
    }
    return false;
}

Json::Value MaskSecrets(const Json::Value& value) {
    if (value.isObject()) {
        Json::Value out(Json::objectValue);
        for (Json::Value::const_iterator it = value.begin(); it != value.end(); ++it) {
            const std::string name = it.name();
            out[name] = IsSecretKey(name) ? Json::Value(kMasked) : MaskSecrets(*it);
        }
        return out;
    }
    if (value.isArray()) {
        Json::Value out(Json::arrayValue);
        for (const Json::Value& element : value) out.append(MaskSecrets(element));
        return out;
    }
    return value;
}

std::string MaskFormSecrets(const std::string& body) {
    std::string out;
    out.reserve(body.size());
    std::string::size_type start = 0;
    while (true) {
        const std::string::size_type end = body.find('&', start);
        const std::string piece =
            body.substr(start, end == std::string::npos ? std::string::npos : end - start);
        const std::string::size_type eq = piece.find('=');
        if (eq != std::string::npos && IsSecretKey(piece.substr(0, eq))) {
            out.append(piece, 0, eq + 1);
            out += kMasked;
        } else {
            out += piece;
        }
        if (end == std::string::npos) break;
        out += '&';
        start = end + 1;
    }
    return out;
}

}  // namespace Relay
}  // namespace ZEPA
