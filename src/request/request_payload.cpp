// Request: body placement, the JSON views of body and answer, and the
// description record.
#define ZEPA_LOG_SOURCE "request"

#include <json/writer.h>

#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>

#include "common/file_io.h"
#include "common/log.h"

namespace ZEPA {
namespace Relay {

namespace {

std::string Serialise(const Json::Value& data) {
    Json::FastWriter writer;
    return writer.write(data);
}

bool Parse(const std::string& text, Json::Value& out) {
    Json::Value parsed;
    if (FileIo::ParseJson(text, parsed)) {
        out.swap(parsed);
        return true;
    }
    ZLOG(ZEPA_LOG_DEBUG, "failed to parse response: %s", FileIo::ClipForLog(text).c_str());
    return false;
}

// The body as a description may show it: credentials masked, otherwise the
// text as it stands.
std::string MaskedBody(const std::string& data) {
    Json::Value parsed;
    if (!data.empty() && (data[0] == '{' || data[0] == '[') && FileIo::ParseJson(data, parsed)) {
        const Json::Value masked = MaskSecrets(parsed);
        if (masked == parsed) return data;
        std::string text = Serialise(masked);
        if (!text.empty() && text.back() == '\n') text.pop_back();
        return text;
    }
    return MaskFormSecrets(data);
}

}  // namespace

bool Request::Set(const std::string& url, const Json::Value& data, bool post) {
    return Set(url, Serialise(data), post);
}

bool Request::SetData(const std::string& data, bool post) {
    if (!IsValid()) return false;
    _data = data;
    if (post) {
        if (curl_easy_setopt(_curl, CURLOPT_URL, _url.c_str()) != CURLE_OK) {
            ZLOG(ZEPA_LOG_ERR, "set CURLOPT_URLto curl handle failed");
            return false;
        }
        // Empty data: no body option, so libcurl sends a GET of the bare URL.
        if (_data.empty()) return true;
        // libcurl keeps the pointer, not a copy: _data must not change until
        // the transfer is over.
        if (curl_easy_setopt(_curl, CURLOPT_POSTFIELDS, _data.c_str()) != CURLE_OK) {
            ZLOG(ZEPA_LOG_ERR, "set CURLOPT_POSTFIELDSto curl handle failed");
            return false;
        }
        _postBody = true;
        return true;
    }
    std::string url = _url + "?" + _data;
    if (curl_easy_setopt(_curl, CURLOPT_URL, url.c_str()) != CURLE_OK) {
        ZLOG(ZEPA_LOG_ERR, "set CURLOPT_URLto curl handle failed");
        return false;
    }
    return true;
}

bool Request::SetData(const Json::Value& data, bool post) { return SetData(Serialise(data), post); }

bool Request::GetData(Json::Value& out) const { return Parse(_data, out); }

bool Request::GetResponse(Json::Value& out) const {
    if (!_done || _httpStatus != 200) return false;
    return Parse(_response, out);
}

bool Request::Write(Json::Value& out) const {
    out["url"] = _url;
    // Descriptions end in logs and dumps: never with a credential in them.
    out["data"] = MaskedBody(_data);
    out["mode"] = _async ? "async" : "sync";
    if (_done) {
        out["http_status"] = static_cast<int>(_httpStatus);
        out["response"] = GetResponse();
    }
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
