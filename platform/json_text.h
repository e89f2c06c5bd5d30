// Port layer: the two text operations on JSON values the library needs beside jsoncpp itself.
#ifndef KOVA_PLATFORM_JSON_TEXT_H
#define KOVA_PLATFORM_JSON_TEXT_H

#include <string>

#include <json/value.h>

namespace kova {

// Parses the whole of `text` as one strict JSON document into `value`; its root may be any
// value, not only an object or array. Returns false (and leaves `value` null) for invalid text,
// trailing garbage or an empty text.
bool JsonFromString(const std::string &text, Json::Value &value);

// Parses `text` with jsoncpp's lenient reader (Json::Reader: comments allowed, text behind the
// first value ignored), as the login and encryption answers are read; comments are kept on the
// value when `collectComments` is set. On a syntax error `value` holds what the reader left in
// it; a text nested deeper than the reader allows is a failed parse with `value` null, never
// an exception.
bool JsonFromLenientText(const std::string &text, Json::Value &value, bool collectComments);

// The compact JSON text of `value` (no white space, UTF-8 kept as it is).
std::string JsonToString(const Json::Value &value);

// The text of a string, number or bool value; "" for null, arrays and objects.
std::string JsonText(const Json::Value &value);

// Whether a WebAPI answer is an object whose "success" reads as true.
bool JsonIsSuccess(const Json::Value &answer);

}  // namespace kova

#endif  // KOVA_PLATFORM_JSON_TEXT_H
