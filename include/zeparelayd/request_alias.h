// The alias-server client: builds one alias command as a form POST, sends it
// and classifies the answer into a result code with its retry class.
// Single-threaded, like Request.
#ifndef ZEPARELAYD_REQUEST_ALIAS_H
#define ZEPARELAYD_REQUEST_ALIAS_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <string>

#include <zeparelayd/export.h>
#include <zeparelayd/request.h>

namespace ZEPA {
namespace Relay {

// The command given to AliasRequest::SetRequest.
enum ALIAS_REQUEST_CMD : int {
    ALIAS_REQ_NONE = 0,
    ALIAS_REQ_MAP = 1,
    ALIAS_REQ_DELETE = 2,
    ALIAS_REQ_KEEP_ALIVE = 3,
    ALIAS_REQ_QUERY = 4,
    ALIAS_REQ_UNSPECIFIED = 5,
};

// Outcome of an alias operation. The numbers are stored by callers: never renumber.
// A fixed int type, so that any code a caller hands in can be looked up safely.
enum ALIAS_RET : int {
    ALIAS_RET_SUCCESS = 1,
    ALIAS_RET_NOT_FOUND = 2,
    ALIAS_RET_INUSED = 3,
    ALIAS_RET_SYSTEM = 4,
    ALIAS_RET_BAD_PARAM = 5,
    ALIAS_RET_NETWORK = 6,
    ALIAS_RET_DNS = 7,
    ALIAS_RET_AUTH = 8,
    ALIAS_RET_911 = 9,
    ALIAS_RET_SERVER_BUSY = 10,
    ALIAS_RET_BAD_IP = 11,
    ALIAS_RET_SELF_INUSED = 12,
    ALIAS_RET_NOT_SET = 13,
    ALIAS_RET_API_KEY_EXPIRED = 14,
    ALIAS_RET_UNKNOWN = 255,
};

// How the caller should retry after an outcome; the waiting times are the caller's.
enum ALIAS_RETRY_TYPE : int {
    ALIAS_RETRY_NONE = 0,
    ALIAS_RETRY_RESOLVE = 1,
    ALIAS_RETRY_NORMAL = 2,
    ALIAS_RETRY_STOP = 3,
};

// What kind of answer the last Send got.
enum ALIAS_RESPONSE_TYPE : int {
    ALIAS_RESP_JSON = 1,
    ALIAS_RESP_TEXT = 2,
    ALIAS_RESP_NONE = 3,
};

// One row of gRetMapper.
struct ZEPARELAYD_API RetMapper {
    ALIAS_RET code;
    ALIAS_RETRY_TYPE retryType;
    std::string statusWord;  // stored in the alias status; empty marks the table's end
    std::string serverWord;  // what the alias server answers; empty when it never does
};

// 15 rows and the end mark (code 0, empty status word). Searches stop at the
// first row whose status word is empty.
constexpr int ALIAS_RET_MAPPER_ROWS = 16;
ZEPARELAYD_API extern const RetMapper gRetMapper[ALIAS_RET_MAPPER_ROWS];

// What the answer classification works on.
struct ZEPARELAYD_API HTTPResponse {
    HTTPResponse() : httpStatus(-1), body(), curlCode(0) {}
    HTTPResponse(int status, const std::string& text, int code)
        : httpStatus(status), body(text), curlCode(code) {}

    int httpStatus;  // -1 unknown
    std::string body;
    int curlCode;  // a CURLcode
};

class ZEPARELAYD_API AliasRequest {
public:
    AliasRequest();
    ~AliasRequest();
    AliasRequest(const AliasRequest&) = delete;
    AliasRequest& operator=(const AliasRequest&) = delete;

    // ---- building the request ----------------------------------------------
    // "alias", "serial", "token", "url" and "id" must be non-empty strings,
    // whatever the command.
    bool IsDataValid(const Json::Value& data) const;
    bool SetRequest(ALIAS_REQUEST_CMD cmd, const Json::Value& data);
    // Appends key=escaped-value pairs joined by "&", keys in jsoncpp's order.
    static void ToPostRequest(const Json::Value& fields, std::string& body);
    // False until a SetRequest succeeded.
    bool GetRequest(Json::Value& data, std::string& url) const;
    // Appends to body without clearing it first.
    bool GetRequest(std::string& body, std::string& url) const;

    // ---- answers and their classification ------------------------------------
    static bool GetRetryType(ALIAS_RET ret, ALIAS_RETRY_TYPE& type);
    static bool ResponseToString(ALIAS_RET ret, std::string& word);
    // Matches "<server word>" or "<server word>:<anything>".
    static bool ParseServerResponse(const std::string& text, ALIAS_RET& ret);
    static std::string& Trim(std::string& s);
    // True for HTTP 200 (body := trimmed answer, ret untouched); otherwise ret
    // is the transfer or HTTP classification.
    static bool ParseCURLHttp(HTTPResponse& r, ALIAS_RET& ret, std::string& body, int& httpStatus);
    static bool ParseCURLHttp(boost::shared_ptr<Request> req, ALIAS_RET& ret, std::string& body);
    bool ParseCURLHttp(ALIAS_RET& ret, std::string& body, int& httpStatus);
    // For a request the daemon ran itself; detail := text after the first ":".
    static bool GetResponseForDaemon(boost::shared_ptr<Request> req, ALIAS_RET& ret, std::string& detail);
    // The "alias" field of the request's form body, still percent-encoded.
    static bool GetAliasName(boost::shared_ptr<Request> req, std::string& alias);

    // Sends synchronously; true when the exchange took place (the outcome is in ret).
    bool Send(ALIAS_RET& ret, ALIAS_RESPONSE_TYPE& type);
    bool Send(ALIAS_RET& ret);

    void GetResponse(int& code) const;
    void GetResponse(std::string& text) const;
    void GetResponse(Json::Value& value) const;

private:
    int _responseCode;
    std::string _url;
    std::string _postData;
    std::string _responseText;
    Json::Value _responseJson;
    Json::Value _requestData;
    Request _request;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
