#include "server_answer.h"

namespace zeparelayd {

const Json::Value& AnswerObject(const Json::Value& answer) {
    static const Json::Value none;
    if (answer.isObject()) return answer;
    if (answer.isArray() && !answer.empty() && answer[0u].isObject()) return answer[0u];
    return none;
}

bool AnswerString(const Json::Value& answer, const char* key, std::string& out) {
    const Json::Value& object = AnswerObject(answer);
    if (!object.isObject() || !object.isMember(key) || !object[key].isString()) return false;
    out = object[key].asString();
    return true;
}

}  // namespace zeparelayd
