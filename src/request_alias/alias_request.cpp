// Building an alias command: caller data checks, request fields, form body.
#define ZEPA_LOG_SOURCE "request_alias"

#include <curl/curl.h>
#include <syslog.h>

#include <zeparelayd/config.h>
#include <zeparelayd/request_alias.h>
#include <memory>

#include "common/log.h"
#include "common/syslog.h"

namespace ZEPA {
namespace Relay {

namespace {

struct CurlEasyDeleter {
    void operator()(CURL* handle) const { curl_easy_cleanup(handle); }
};
using CurlEasyPtr = std::unique_ptr<CURL, CurlEasyDeleter>;

struct CurlFreeDeleter {
    void operator()(char* text) const { curl_free(text); }
};
using CurlText = std::unique_ptr<char, CurlFreeDeleter>;

bool IsNonEmptyString(const Json::Value& value) { return value.isString() && !value.asString().empty(); }

// Copies data[key] into fields when it is a string.
void CopyString(const Json::Value& data, const char* key, Json::Value& fields) {
    if (data.isMember(key) && data[key].isString()) fields[key] = data[key];
}

void CopyStrings(const Json::Value& data, std::initializer_list<const char*> keys, Json::Value& fields) {
    for (const char* key : keys) CopyString(data, key, fields);
}

// Field values are strings; anything else that jsoncpp cannot word is sent empty.
std::string FieldText(const Json::Value& value) {
    return value.isConvertibleTo(Json::stringValue) ? value.asString() : std::string();
}

}  // namespace

AliasRequest::AliasRequest()
    : _responseCode(-1),
      _url(),
      _postData(),
      _responseText(),
      _responseJson(),
      _requestData(),
      _request(nullptr, "", true) {}

AliasRequest::~AliasRequest() = default;

bool AliasRequest::IsDataValid(const Json::Value& data) const {
    if (!data.isObject()) {
        ZLOG(ZEPA_LOG_ERR, "data should be an object");
        return false;
    }
    // Presence of every key first, then their contents.
    if (!data.isMember("alias")) {
        ZLOG(ZEPA_LOG_ERR, "alias name is not found");
        return false;
    }
    if (!data.isMember("serial")) {
        ZLOG(ZEPA_LOG_ERR, "serial is not found");
        return false;
    }
    if (!data.isMember("token")) {
        ZLOG(ZEPA_LOG_ERR, "token is not found");
        return false;
    }
    if (!data.isMember("url")) {
        ZLOG(ZEPA_LOG_ERR, "url is not found");
        return false;
    }
    if (!data.isMember("id")) {
        ZLOG(ZEPA_LOG_ERR, "hopcloud_id is not found");
        return false;
    }
    if (!IsNonEmptyString(data["alias"])) {
        ZLOG(ZEPA_LOG_ERR, "alias name is not string or empty");
        return false;
    }
    if (!IsNonEmptyString(data["serial"])) {
        ZLOG(ZEPA_LOG_ERR, "serial is not string or empty");
        return false;
    }
    if (!IsNonEmptyString(data["token"])) {
        ZLOG(ZEPA_LOG_ERR, "token is not string or empty");
        return false;
    }
    if (!IsNonEmptyString(data["url"])) {
        ZLOG(ZEPA_LOG_ERR, "url is not string or empty");
        return false;
    }
    if (!IsNonEmptyString(data["id"])) {
        ZLOG(ZEPA_LOG_ERR, "id is not string or empty");
        return false;
    }
    return true;
}

bool AliasRequest::SetRequest(ALIAS_REQUEST_CMD cmd, const Json::Value& data) {
    AuthConf auth(true);
    if (!IsDataValid(data)) return false;

    // Built aside and committed at the end, so a refused command changes nothing.
    Json::Value fields(Json::objectValue);
    fields["mac"] = auth.mac;
    fields["key"] = auth.key;
    fields["model"] = auth.model;

    std::string script;
    switch (cmd) {
        case ALIAS_REQ_MAP:
            fields["action"] = "map_alias";
            script = "alias_update.php";
            CopyStrings(data,
                        {"alias", "serial", "token", "id", "myhub_account", "myhub_password", "myhub_id",
                         "auth_key", "force"},
                        fields);
            break;
        case ALIAS_REQ_DELETE:
            fields["action"] = "delete_alias";
            script = "alias_update.php";
            CopyStrings(data, {"alias", "serial", "token", "id"}, fields);
            break;
        case ALIAS_REQ_KEEP_ALIVE:
            fields["action"] = "keep_alive_alias";
            script = "alias_update.php";
            CopyStrings(data, {"alias", "serial", "token", "id"}, fields);
            break;
        case ALIAS_REQ_QUERY:
            fields["action"] = "query_alias";
            script = "alias_query.php";
            CopyString(data, "alias", fields);
            break;
        case ALIAS_REQ_UNSPECIFIED:
            // Deliberately the bare system-log line, without source and line.
            SystemLog(LOG_ERR, "not specify request");
            return false;
        default:
            // ALIAS_REQ_NONE and unknown values: only the common fields, to the base URL.
            break;
    }

    _requestData = fields;
    _postData.clear();
    ToPostRequest(_requestData, _postData);
    _url = data["url"].asString() + "/" + script;
    // A failed set-up shows later as an invalid request, which Send refuses.
    _request.Set(_url, _postData, true);
    return true;
}

void AliasRequest::ToPostRequest(const Json::Value& fields, std::string& body) {
    if (!fields.isObject()) return;
    CurlEasyPtr curl(curl_easy_init());
    if (!curl) return;

    bool first = true;
    for (const std::string& key : fields.getMemberNames()) {
        const std::string value = FieldText(fields[key]);
        CurlText escaped(curl_easy_escape(curl.get(), value.data(), static_cast<int>(value.size())));
        if (!first) body += "&";
        first = false;
        body += key;
        body += "=";
        if (escaped) body += escaped.get();
    }
}

bool AliasRequest::GetRequest(Json::Value& data, std::string& url) const {
    if (_requestData.empty()) return false;
    url = _url;
    data = _requestData;
    return true;
}

bool AliasRequest::GetRequest(std::string& body, std::string& url) const {
    if (_requestData.empty()) return false;
    url = _url;
    ToPostRequest(_requestData, body);
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
