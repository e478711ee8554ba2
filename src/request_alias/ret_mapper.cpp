// The table of alias outcomes and the look-ups over it.
#define ZEPA_LOG_SOURCE "request_alias"

#include <zeparelayd/request_alias.h>
#include <cstring>

#include "common/log.h"

namespace ZEPA {
namespace Relay {

const RetMapper gRetMapper[ALIAS_RET_MAPPER_ROWS] = {
    {ALIAS_RET_SUCCESS, ALIAS_RETRY_NORMAL, "success", "good"},
    {ALIAS_RET_911, ALIAS_RETRY_NORMAL, "error_911", "911"},
    {ALIAS_RET_SYSTEM, ALIAS_RETRY_NORMAL, "error_system", "badsys"},
    {ALIAS_RET_NETWORK, ALIAS_RETRY_NORMAL, "error_network", ""},
    {ALIAS_RET_DNS, ALIAS_RETRY_RESOLVE, "error_dns", ""},
    {ALIAS_RET_SERVER_BUSY, ALIAS_RETRY_NORMAL, "error_server_busy", ""},
    {ALIAS_RET_AUTH, ALIAS_RETRY_STOP, "error_auth", "badauth"},
    {ALIAS_RET_BAD_IP, ALIAS_RETRY_STOP, "error_bad_ip", "badip"},
    {ALIAS_RET_NOT_FOUND, ALIAS_RETRY_NORMAL, "error_not_found", "alias_not_found"},
    {ALIAS_RET_INUSED, ALIAS_RETRY_STOP, "error_inused", "alias_inused"},
    {ALIAS_RET_SELF_INUSED, ALIAS_RETRY_STOP, "error_self_inused", "alias_self_inused"},
    {ALIAS_RET_BAD_PARAM, ALIAS_RETRY_NORMAL, "error_bad_param", "badparam"},
    {ALIAS_RET_UNKNOWN, ALIAS_RETRY_NORMAL, "error_unknown", ""},
    {ALIAS_RET_API_KEY_EXPIRED, ALIAS_RETRY_NORMAL, "error_api_key_expired", "api_key_expired"},
    {ALIAS_RET_NOT_SET, ALIAS_RETRY_NONE, "not_set", ""},
    {static_cast<ALIAS_RET>(0), ALIAS_RETRY_NONE, "", ""},
};

namespace {

// The row of code ret before the end mark, or null.
const RetMapper* FindRow(ALIAS_RET ret) {
    for (const RetMapper* row = gRetMapper; !row->statusWord.empty(); ++row) {
        if (row->code == ret) return row;
    }
    return nullptr;
}

// text is exactly word, or word followed by ":" and a detail.
bool MatchesServerWord(const std::string& text, const std::string& word) {
    if (text.compare(0, word.size(), word) != 0) return false;
    return text.size() == word.size() || text[word.size()] == ':';
}

}  // namespace

bool AliasRequest::GetRetryType(ALIAS_RET ret, ALIAS_RETRY_TYPE& type) {
    const RetMapper* row = FindRow(ret);
    if (row == nullptr) {
        ZLOG(ZEPA_LOG_ERR, "Cannot convert retry type %d", static_cast<int>(ret));
        return false;
    }
    type = row->retryType;
    return true;
}

bool AliasRequest::ResponseToString(ALIAS_RET ret, std::string& word) {
    const RetMapper* row = FindRow(ret);
    if (row == nullptr) {
        ZLOG(ZEPA_LOG_ERR, "Cannot convert response %d", static_cast<int>(ret));
        return false;
    }
    word = row->statusWord;
    return true;
}

bool AliasRequest::ParseServerResponse(const std::string& text, ALIAS_RET& ret) {
    for (const RetMapper* row = gRetMapper; !row->statusWord.empty(); ++row) {
        if (row->serverWord.empty()) continue;
        if (MatchesServerWord(text, row->serverWord)) {
            ret = row->code;
            return true;
        }
    }
    return false;
}

std::string& AliasRequest::Trim(std::string& s) {
    // Handled as a C string: anything after an embedded NUL is dropped.
    const char* begin = s.c_str();
    while (*begin != '\0' && static_cast<unsigned char>(*begin) <= 32) ++begin;
    const char* end = begin + strlen(begin);
    while (end > begin && static_cast<unsigned char>(end[-1]) < 33) --end;
    s = std::string(begin, end);
    return s;
}

}  // namespace Relay
}  // namespace ZEPA
