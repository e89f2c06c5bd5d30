#include "platform/webapi_util.h"

#include "platform/json_text.h"

namespace KOVA {
namespace WebAPIUtil {

std::string URLEncode(const std::string &text) {
    static const char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(text.size() * 3);
    for (unsigned char c : text) {
        bool unreserved = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
                          (c >= '0' && c <= '9') || c == '-' || c == '.' || c == '_' || c == '~';
        if (unreserved) {
            out.push_back(static_cast<char>(c));
        } else {
            out.push_back('%');
            out.push_back(kHex[c >> 4]);
            out.push_back(kHex[c & 15]);
        }
    }
    return out;
}

bool JsonObjTostrPair(const Json::Value &obj, std::string &out, bool encode, bool json) {
    out.clear();
    if (obj.isNull()) {
        return true;
    }
    if (!obj.isObject()) {
        return false;
    }
    for (auto it = obj.begin(); it != obj.end(); ++it) {
        std::string name = it.name();
        std::string value = (!json && it->isString()) ? it->asString() : kova::JsonToString(*it);
        if (!out.empty()) {
            out.push_back('&');
        }
        out += encode ? URLEncode(name) : name;
        out.push_back('=');
        out += encode ? URLEncode(value) : value;
    }
    return true;
}

}  // namespace WebAPIUtil
}  // namespace KOVA
