// Sending an alias command and classifying what came back.
#define ZEPA_LOG_SOURCE "request_alias"

#include <curl/curl.h>

#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>
#include <cctype>
#include <sstream>

#include "common/file_io.h"
#include "common/log.h"
#include "request/curl_class.h"

namespace ZEPA {
namespace Relay {

namespace {

// The libcurl code this file logged last; 0 after a good transfer.
int g_lastLoggedCurlCode = 0;

// Logs a failing code once per run of equal codes.
void LogCurlError(int code) {
    if (code == g_lastLoggedCurlCode) return;
    ZLOG(ZEPA_LOG_ERR, "curl error: %d, %s", code, CurlCodeText(code));
    g_lastLoggedCurlCode = code;
}

ALIAS_RET AliasResultOf(int code) {
    switch (ClassifyCurlCode(code)) {
        case CurlFailure::RESOLVE:
            return ALIAS_RET_DNS;
        case CurlFailure::NETWORK:
            return ALIAS_RET_NETWORK;
        default:
            return ALIAS_RET_UNKNOWN;
    }
}

// A JSON object answer, parsed with comments off.
bool ParseJsonObject(const std::string& text, Json::Value& out) {
    Json::Value parsed;
    if (!FileIo::ParseJson(text, parsed) || !parsed.isObject()) return false;
    out = parsed;
    return true;
}

// Percent-decoding of one form value, as curl_easy_escape wrote it.
std::string FormDecode(const std::string& value) {
    std::string out;
    for (std::string::size_type i = 0; i < value.size(); ++i) {
        if (value[i] == '%' && i + 2 < value.size() && isxdigit(static_cast<unsigned char>(value[i + 1])) &&
            isxdigit(static_cast<unsigned char>(value[i + 2]))) {
            out += static_cast<char>(std::stoi(value.substr(i + 1, 2), nullptr, 16));
            i += 2;
        } else {
            out += value[i];
        }
    }
    return out;
}

void ReplaceAll(std::string& text, const std::string& what, const std::string& with) {
    if (what.empty()) return;
    for (std::string::size_type at = text.find(what); at != std::string::npos;
         at = text.find(what, at + with.size())) {
        text.replace(at, what.size(), with);
    }
}

// An answer as the log may show it: form-like credentials masked, and every
// credential the request sent (encoded or not) masked wherever the server
// repeated it.
std::string MaskAnswer(const std::string& answer, const std::string& sent) {
    std::string out = MaskFormSecrets(answer);
    std::istringstream pieces(sent);
    std::string piece;
    while (std::getline(pieces, piece, '&')) {
        const std::string::size_type eq = piece.find('=');
        if (eq == std::string::npos || !IsSecretKey(piece.substr(0, eq))) continue;
        const std::string value = piece.substr(eq + 1);
        ReplaceAll(out, value, "***");
        ReplaceAll(out, FormDecode(value), "***");
    }
    return out;
}

// The answer checks of the three ParseCURLHttp forms; sent is the request's
// body, for masking what the log shows of the answer.
bool ParseHttp(HTTPResponse& r, const std::string& sent, ALIAS_RET& ret, std::string& body, int& httpStatus) {
    if (r.curlCode != CURLE_OK) {
        LogCurlError(r.curlCode);
        ret = AliasResultOf(r.curlCode);
        return false;
    }
    g_lastLoggedCurlCode = 0;

    AliasRequest::Trim(r.body);
    ZLOG(ZEPA_LOG_DEBUG, "HTTP: %d, Response: %s", r.httpStatus,
         FileIo::ClipForLog(MaskAnswer(r.body, sent)).c_str());
    httpStatus = r.httpStatus;
    if (r.httpStatus == 200) {
        body = r.body;
        return true;
    }
    // Every other status, 404 and 5xx included, ends as unknown; callers rely on it.
    ZLOG(ZEPA_LOG_ERR, "http status: %d", r.httpStatus);
    ret = ALIAS_RET_UNKNOWN;
    return false;
}

}  // namespace

bool AliasRequest::ParseCURLHttp(HTTPResponse& r, ALIAS_RET& ret, std::string& body, int& httpStatus) {
    return ParseHttp(r, std::string(), ret, body, httpStatus);
}

bool AliasRequest::ParseCURLHttp(boost::shared_ptr<Request> req, ALIAS_RET& ret, std::string& body) {
    HTTPResponse r(req->GetHttpStatus(), req->GetResponse(), req->GetCurlResult());
    int ignoredStatus = -1;
    return ParseHttp(r, req->GetData(), ret, body, ignoredStatus);
}

bool AliasRequest::ParseCURLHttp(ALIAS_RET& ret, std::string& body, int& httpStatus) {
    HTTPResponse r(_request.GetHttpStatus(), _request.GetResponse(), _request.GetCurlResult());
    return ParseHttp(r, _request.GetData(), ret, body, httpStatus);
}

bool AliasRequest::Send(ALIAS_RET& ret, ALIAS_RESPONSE_TYPE& type) {
    ALIAS_RET code = ALIAS_RET_UNKNOWN;
    int status = -1;
    std::string body;

    if (!_request.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "No valid request found!! Please call SetRequest() first");
        return false;
    }
    _request.Send();
    const bool answered = ParseCURLHttp(code, body, status);
    type = ALIAS_RESP_NONE;
    ret = code;
    _responseCode = status;
    // The exchange took place; the failure is in ret.
    if (!answered) return true;

    type = ALIAS_RESP_TEXT;
    _responseText = body;
    Json::Value object;
    if (ParseJsonObject(body, object)) {
        type = ALIAS_RESP_JSON;
        _responseJson = object;
        ret = ALIAS_RET_SUCCESS;
        return true;
    }
    if (ParseServerResponse(body, ret)) return true;
    ret = ALIAS_RET_UNKNOWN;
    return false;
}

bool AliasRequest::Send(ALIAS_RET& ret) {
    ALIAS_RESPONSE_TYPE ignored = ALIAS_RESP_NONE;
    return Send(ret, ignored);
}

bool AliasRequest::GetResponseForDaemon(boost::shared_ptr<Request> req, ALIAS_RET& ret, std::string& detail) {
    ALIAS_RET code = ALIAS_RET_SUCCESS;
    std::string body;
    if (!ParseCURLHttp(req, code, body)) {
        ret = code;
        return false;
    }
    if (!ParseServerResponse(body, code)) {
        ZLOG(ZEPA_LOG_ERR, "Unknown response: %s",
             FileIo::ClipForLog(MaskAnswer(body, req->GetData())).c_str());
        return false;
    }
    const std::string::size_type colon = body.find(':');
    if (colon != std::string::npos) detail = body.substr(colon + 1);
    ret = code;
    return true;
}

bool AliasRequest::GetAliasName(boost::shared_ptr<Request> req, std::string& alias) {
    const std::string& data = req->GetData();
    std::istringstream pieces(data);
    std::string piece;
    while (std::getline(pieces, piece, '&')) {
        if (piece.compare(0, 6, "alias=") != 0) continue;
        // The second "="-separated piece, percent-encoding left as it is.
        const std::string value = piece.substr(6);
        alias = value.substr(0, value.find('='));
        return true;
    }
    // Credentials never reach the log: their values are masked in the body shown.
    ZLOG(ZEPA_LOG_ERR, "not found alias name from post data [%s]", MaskFormSecrets(data).c_str());
    return false;
}

void AliasRequest::GetResponse(int& code) const { code = _responseCode; }

void AliasRequest::GetResponse(std::string& text) const { text = _responseText; }

void AliasRequest::GetResponse(Json::Value& value) const { value = _responseJson; }

}  // namespace Relay
}  // namespace ZEPA
