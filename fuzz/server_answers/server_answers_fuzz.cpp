// Any bytes as a server answer: the relay-server error and its result, the
// alias answer's classification, retry class and word, all without a throw
// and within their tables.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>

#include "fuzz_support.h"

using namespace ZEPA::Relay;
using fuzzsupport::Check;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Daemon::_logLevel = 2;
    const std::string text(reinterpret_cast<const char*>(data), size);
    Json::Value answer;
    fuzzsupport::Parse(text, answer);
    RELAYSERVER_ERR err = ParseServerError(answer);
    RELAYD_RET ret = RespErrMap(err);
    Check(!GetErrorStr(ret).empty(), "every result has a word");
    Check(!GetServerErrorStr(err).empty(), "every server error has a word");
    if (answer.isArray() && !answer.empty()) ParseServerError(answer[0u]);

    HTTPResponse response(200, text, 0);
    ALIAS_RET aliasRet = ALIAS_RET_SUCCESS;
    std::string body;
    int status = -1;
    Check(AliasRequest::ParseCURLHttp(response, aliasRet, body, status), "an HTTP 200 answer is taken");
    std::string trimmed = text;
    Check(body == AliasRequest::Trim(trimmed), "the body is handed on trimmed");
    // Any int as the libcurl code, as callers of the public struct may pass.
    int code = 0;
    for (size_t i = 0; i < size && i < sizeof(code); ++i)
        code = static_cast<int>((static_cast<unsigned>(code) << 8) | data[i]);
    HTTPResponse failed(-1, text, code);
    AliasRequest::ParseCURLHttp(failed, aliasRet, body, status);
    ALIAS_RET classified = ALIAS_RET_UNKNOWN;
    if (AliasRequest::ParseServerResponse(text, classified)) {
        ALIAS_RETRY_TYPE retry;
        std::string word;
        Check(AliasRequest::GetRetryType(classified, retry), "a classified answer has a retry class");
        Check(AliasRequest::ResponseToString(classified, word), "a classified answer has a word");
    }
    return 0;
}
