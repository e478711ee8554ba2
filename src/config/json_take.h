// Reading a configuration object the way every section's Overwrite does: a
// key is taken only when the object holds it with the expected JSON type;
// otherwise the target keeps its value. The expected type follows from the
// target: a string for std::string, an int for int, a boolean for bool.
#ifndef ZEPARELAYD_SRC_CONFIG_JSON_TAKE_H
#define ZEPARELAYD_SRC_CONFIG_JSON_TAKE_H

#include <json/value.h>

#include <initializer_list>
#include <string>

namespace ZEPA {
namespace Relay {
namespace JsonTake {

// Sets target from object[key] when object is an object holding key with the
// target's type; true when it did.
inline bool Take(const Json::Value& object, const char* key, std::string& target) {
    if (!object.isObject() || !object.isMember(key) || !object[key].isString()) return false;
    target = object[key].asString();
    return true;
}

inline bool Take(const Json::Value& object, const char* key, int& target) {
    if (!object.isObject() || !object.isMember(key) || !object[key].isInt()) return false;
    target = object[key].asInt();
    return true;
}

inline bool Take(const Json::Value& object, const char* key, bool& target) {
    if (!object.isObject() || !object.isMember(key) || !object[key].isBool()) return false;
    target = object[key].asBool();
    return true;
}

// One entry of a field list: the key and the member it fills.
class Field {
public:
    Field(const char* key, std::string& target) : _key(key), _text(&target) {}
    Field(const char* key, int& target) : _key(key), _number(&target) {}
    Field(const char* key, bool& target) : _key(key), _flag(&target) {}

    bool TakeFrom(const Json::Value& object) const {
        if (_text != nullptr) return Take(object, _key, *_text);
        if (_number != nullptr) return Take(object, _key, *_number);
        return Take(object, _key, *_flag);
    }

private:
    const char* _key;
    std::string* _text = nullptr;
    int* _number = nullptr;
    bool* _flag = nullptr;
};

// Takes every field in the order given.
inline void TakeAll(const Json::Value& object, std::initializer_list<Field> fields) {
    for (const Field& field : fields) field.TakeFrom(object);
}

}  // namespace JsonTake
}  // namespace Relay
}  // namespace ZEPA

#endif
