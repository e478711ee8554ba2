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

bool AnswerInt(const Json::Value& answer, const char* key, int& out) {
    const Json::Value& object = AnswerObject(answer);
    if (!object.isObject()) return false;
    const Json::Value& value = object[key];
    if (!value.isInt()) return false;
    out = value.asInt();
    return true;
}

Json::Value AnswerSection(const Json::Value& answer, const char* key) {
    const Json::Value& object = AnswerObject(answer);
    if (object.isObject() && object[key].isObject()) return object[key];
    return Json::Value(Json::objectValue);
}

}  // namespace zeparelayd
