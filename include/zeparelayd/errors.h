// Result codes, daemon states and relay-server errors, with their words.
// The numbers are part of the status file and the server protocol: never renumber.
#ifndef ZEPARELAYD_ERRORS_H
#define ZEPARELAYD_ERRORS_H

#include <json/value.h>

#include <string>

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Result of a relay operation ("error" in the status file), any int. 1, 2 and 4 are
// deliberately unassigned.
enum RELAYD_RET : int {
    RELAYD_SUCCESS = 0,
    RELAYD_ERR_CONFIG = 3,
    RELAYD_ERR_REGISTER = 5,
    RELAYD_ERR_NETWORK = 6,
    RELAYD_ERR_RESOLV = 7,
    RELAYD_ERR_AUTH = 8,
    RELAYD_ERR_NOT_SUPPORT = 9,
    RELAYD_ERR_SERVER_BUSY = 10,
    RELAYD_ERR_LOCK = 11,
    RELAYD_ERR_SERVER_LIMIT = 12,
    RELAYD_ERR_SERVER_CHANGED = 13,
    RELAYD_ERR_SERVER_IP_CHANGED = 14,
    RELAYD_ERR_API_KEY_EXPIRED = 15,
    RELAYD_ERR_UNKNOWN = 255,
};

// Small results of the process-control, status and entry-point functions
// (Daemon::Signal, GetStatus, DebugStatus, UpdateAlias, ...). 11 and 255 are
// the values of RELAYD_ERR_LOCK and RELAYD_ERR_UNKNOWN.
constexpr int RELAYD_RESULT_OK = 0;           // done; the daemon runs
constexpr int RELAYD_RESULT_NOT_RUNNING = 1;  // the daemon does not run
constexpr int RELAYD_RESULT_UNAVAILABLE = 2;  // not delivered or not available
constexpr int RELAYD_RESULT_BUSY = 11;        // another caller holds the lock
constexpr int RELAYD_RESULT_BROKEN = 255;     // a status or debug file is broken

// State of the daemon ("state" in the status file). 5 and 6 share a word.
enum RELAYD_STATE : unsigned int {
    RELAYD_STATE_NOT_RUNNING = 1,
    RELAYD_STATE_STARTING = 2,
    RELAYD_STATE_LOGIN = 3,
    RELAYD_STATE_DIRECT_CONNECT = 4,
    RELAYD_STATE_CONNECTED = 5,
    RELAYD_STATE_CONNECTED_ALT = 6,
    RELAYD_STATE_LOGOUT = 7,
    RELAYD_STATE_STOPED = 8,
};

// "errno" of a relay server answer. 12 is not assigned and must stay skipped.
// A fixed underlying type: answers may carry numbers outside the list.
enum RELAYSERVER_ERR : int {
    RELAYSERVER_ERR_SUCCESS = 0,
    RELAYSERVER_ERR_UNKNOWN = 1,
    RELAYSERVER_ERR_AUTH = 2,
    RELAYSERVER_ERR_NO_SUCH_API = 3,
    RELAYSERVER_ERR_NO_SUCH_SERV = 4,
    RELAYSERVER_ERR_NOT_SUPPORTED_VERSION = 5,
    RELAYSERVER_ERR_SESSION_TIMEOUT = 6,
    RELAYSERVER_ERR_HAS_TUNNEL = 7,
    RELAYSERVER_ERR_TL_FAIL = 8,
    RELAYSERVER_ERR_INPUT = 9,
    RELAYSERVER_ERR_DDNS_OCCUPIED = 10,
    RELAYSERVER_ERR_SERVER_LIMIT = 11,
    RELAYSERVER_ERR_SERVER_CHANGED = 13,
    RELAYSERVER_ERR_IP_CHANGED = 14,
    RELAYSERVER_ERR_API_KEY_EXPIRED = 15,
};

// "success", "err_config", ...; "err_unknown" for anything not listed.
ZEPARELAYD_API std::string GetErrorStr(RELAYD_RET ret);
// "not_running" ... "stoped"; "error" for 0 and above 8.
ZEPARELAYD_API std::string GetStateStr(RELAYD_STATE state);
// "SUCCESS", "AUTH", ...; "(unknown errno: N)" otherwise.
ZEPARELAYD_API std::string GetServerErrorStr(RELAYSERVER_ERR err);
// The daemon result reported for a server error.
ZEPARELAYD_API RELAYD_RET RespErrMap(RELAYSERVER_ERR err);
// The "errno" carried by a server answer; RELAYSERVER_ERR_UNKNOWN when there is none.
ZEPARELAYD_API RELAYSERVER_ERR ParseServerError(const Json::Value& answer);

// Credentials never reach a log, status file, debug dump or printed form. One
// list of credential keys serves every place that shows configuration,
// request bodies or request descriptions.

// True when values stored under key are credentials ("token", "key",
// "auth_key", "myhub_password", "relay_pass", ...). Exact, case-sensitive.
ZEPARELAYD_API bool IsSecretKey(const std::string& key);
// A deep copy of value in which the value of every secret key, at any depth
// of objects and arrays, is replaced by the string "***".
ZEPARELAYD_API Json::Value MaskSecrets(const Json::Value& value);
// An url-encoded form body ("name=value&name=value...") with the value of
// every secret name replaced by "***"; pieces without "=" and other names
// stay as they are, in their order.
ZEPARELAYD_API std::string MaskFormSecrets(const std::string& body);

}  // namespace Relay
}  // namespace ZEPA

#endif
