// Reading a relay server's answer without trusting its shape: every access
// checks the type first, so an array, a number or a nested answer is just an
// answer without the member asked for.
#ifndef ZEPARELAYD_TOOL_SERVER_ANSWER_H
#define ZEPARELAYD_TOOL_SERVER_ANSWER_H

#include <json/value.h>

#include <string>

namespace zeparelayd {

// The object that carries the answer's members: the answer itself, or the
// first element of an array answer (as the server's error number is read);
// a null value for anything else.
const Json::Value& AnswerObject(const Json::Value& answer);

// The string member key of the answer's object; false (out untouched) when
// it is missing or not a string.
bool AnswerString(const Json::Value& answer, const char* key, std::string& out);

// The integer member key of the answer's object; false (out untouched) when
// it is missing or not an integer that fits an int.
bool AnswerInt(const Json::Value& answer, const char* key, int& out);

// The object member key of the answer's object; an empty object when it is
// missing or not an object.
Json::Value AnswerSection(const Json::Value& answer, const char* key);

}  // namespace zeparelayd

#endif
