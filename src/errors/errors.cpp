// Words of the result codes, daemon states and relay-server errors.
#include <zeparelayd/errors.h>

#include <string>

namespace ZEPA {
namespace Relay {

namespace {

struct Word {
    long long value;
    const char* word;
};

const Word kRetWords[] = {
    {RELAYD_SUCCESS, "success"},
    {RELAYD_ERR_CONFIG, "err_config"},
    {RELAYD_ERR_REGISTER, "err_register"},
    {RELAYD_ERR_NETWORK, "err_network"},
    {RELAYD_ERR_RESOLV, "err_resolv"},
    {RELAYD_ERR_AUTH, "err_auth"},
    {RELAYD_ERR_NOT_SUPPORT, "err_not_support"},
    {RELAYD_ERR_SERVER_BUSY, "err_server_busy"},
    {RELAYD_ERR_LOCK, "err_lock"},
    {RELAYD_ERR_SERVER_LIMIT, "err_server_limit"},
    {RELAYD_ERR_SERVER_CHANGED, "err_server_changed"},
    {RELAYD_ERR_SERVER_IP_CHANGED, "err_server_ip_changed"},
    {RELAYD_ERR_API_KEY_EXPIRED, "err_api_key_expired"},
    {RELAYD_ERR_UNKNOWN, "err_unknown"},
};

const Word kStateWords[] = {
    {RELAYD_STATE_NOT_RUNNING, "not_running"},
    {RELAYD_STATE_STARTING, "starting"},
    {RELAYD_STATE_LOGIN, "login"},
    {RELAYD_STATE_DIRECT_CONNECT, "direct_connect"},
    {RELAYD_STATE_CONNECTED, "connected"},
    {RELAYD_STATE_CONNECTED_ALT, "connected"},
    {RELAYD_STATE_LOGOUT, "logout"},
    {RELAYD_STATE_STOPED, "stoped"},  // one p: readers match it as it stands
};

const Word kServerErrWords[] = {
    {RELAYSERVER_ERR_SUCCESS, "SUCCESS"},
    {RELAYSERVER_ERR_UNKNOWN, "UNKNOWN"},
    {RELAYSERVER_ERR_AUTH, "AUTH"},
    {RELAYSERVER_ERR_NO_SUCH_API, "NO_SUCH_API"},
    {RELAYSERVER_ERR_NO_SUCH_SERV, "NO_SUCH_SERV"},
    {RELAYSERVER_ERR_NOT_SUPPORTED_VERSION, "NOT_SUPPORTED_VERSION"},
    {RELAYSERVER_ERR_SESSION_TIMEOUT, "SESSION_TIMEOUT"},
    {RELAYSERVER_ERR_HAS_TUNNEL, "HAS_TUNNEL"},
    {RELAYSERVER_ERR_TL_FAIL, "TL_FAIL"},
    {RELAYSERVER_ERR_INPUT, "INPUT"},
    {RELAYSERVER_ERR_DDNS_OCCUPIED, "DDNS_OCCUPIED"},
    {RELAYSERVER_ERR_SERVER_LIMIT, "SERVER_LIMIT"},
    {RELAYSERVER_ERR_SERVER_CHANGED, "SERVER_CHANGED"},
    {RELAYSERVER_ERR_IP_CHANGED, "IP_CHANGED"},
    {RELAYSERVER_ERR_API_KEY_EXPIRED, "API_KEY_EXPIRED"},
};

template <size_t N>
const char* Find(const Word (&table)[N], long long value) {
    for (const Word& w : table)
        if (w.value == value) return w.word;
    return nullptr;
}

}  // namespace

std::string GetErrorStr(RELAYD_RET ret) {
    const char* w = Find(kRetWords, static_cast<int>(ret));
    return w ? w : "err_unknown";
}

std::string GetStateStr(RELAYD_STATE state) {
    const char* w = Find(kStateWords, static_cast<unsigned int>(state));
    return w ? w : "error";
}

std::string GetServerErrorStr(RELAYSERVER_ERR err) {
    // Compared as unsigned so that negative numbers are never found.
    const char* w = Find(kServerErrWords, static_cast<unsigned int>(err));
    if (w) return w;
    return "(unknown errno: " + std::to_string(static_cast<int>(err)) + ")";
}

RELAYD_RET RespErrMap(RELAYSERVER_ERR err) {
    // An expired session and an occupied DDNS name read as authentication
    // failures, an input error as lack of support.
    switch (static_cast<unsigned int>(err)) {
        case RELAYSERVER_ERR_SUCCESS:
            return RELAYD_SUCCESS;
        case RELAYSERVER_ERR_UNKNOWN:
        case RELAYSERVER_ERR_HAS_TUNNEL:
        case RELAYSERVER_ERR_TL_FAIL:
            return RELAYD_ERR_UNKNOWN;
        case RELAYSERVER_ERR_AUTH:
        case RELAYSERVER_ERR_SESSION_TIMEOUT:
        case RELAYSERVER_ERR_DDNS_OCCUPIED:
            return RELAYD_ERR_AUTH;
        case RELAYSERVER_ERR_SERVER_LIMIT:
            return RELAYD_ERR_SERVER_LIMIT;
        case RELAYSERVER_ERR_SERVER_CHANGED:
            return RELAYD_ERR_SERVER_CHANGED;
        case RELAYSERVER_ERR_IP_CHANGED:
            return RELAYD_ERR_SERVER_IP_CHANGED;
        case RELAYSERVER_ERR_API_KEY_EXPIRED:
            return RELAYD_ERR_API_KEY_EXPIRED;
        default:
            return RELAYD_ERR_NOT_SUPPORT;
    }
}

RELAYSERVER_ERR ParseServerError(const Json::Value& answer) {
    // Success must be stated as "errno": 0; anything else unreadable is UNKNOWN.
    const Json::Value* holder = nullptr;
    if (answer.isObject()) {
        holder = &answer;
    } else if (answer.isArray() && !answer.empty() && answer[0u].isObject()) {
        holder = &answer[0u];
    }
    if (holder && holder->isMember("errno") && (*holder)["errno"].isInt())
        return static_cast<RELAYSERVER_ERR>((*holder)["errno"].asInt());
    return RELAYSERVER_ERR_UNKNOWN;
}

}  // namespace Relay
}  // namespace ZEPA
