// Port layer: the pair encoding of the host's web-API framework.
#ifndef KOVA_PLATFORM_WEBAPI_UTIL_H
#define KOVA_PLATFORM_WEBAPI_UTIL_H

#include <string>

#include <json/value.h>

namespace KOVA {
namespace WebAPIUtil {

// RFC 3986 percent-encoding: every byte outside ALPHA / DIGIT / "-" / "." / "_" / "~" becomes
// "%XX" with upper-case hexadecimal digits.
std::string URLEncode(const std::string &text);

// Writes the members of `obj` as name=value pairs joined by "&" into `out` (replacing it), in
// the object's member order (ascending by name). With `encode`, names and values are
// percent-encoded. String values are written as their text, other values in compact JSON; with
// `json` every value, strings included, is written in compact JSON (a string keeps its quotes).
// A null `obj` gives "". Returns false, leaving `out` empty, when `obj` is neither an object
// nor null.
bool JsonObjTostrPair(const Json::Value &obj, std::string &out, bool encode, bool json);

}  // namespace WebAPIUtil
}  // namespace KOVA

#endif  // KOVA_PLATFORM_WEBAPI_UTIL_H
