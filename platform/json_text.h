// Port layer: the two text operations on JSON values the library needs beside jsoncpp itself.
#ifndef KOVA_PLATFORM_JSON_TEXT_H
#define KOVA_PLATFORM_JSON_TEXT_H

#include <stdint.h>

#include <string>

#include <json/value.h>

namespace kova {

// A parsed JSON value takes far more memory than its text: about 100 bytes for each value of
// "[0,0,...]". Before a parse the text is scanned, without building anything, for an upper
// bound of what its values would take (JsonParseCost). A text whose bound exceeds
// kJsonCostFactor times its length plus kJsonCostMargin is refused as unparsable, so that the
// peak of a parse stays under about eight times its text (the text, the values, the reader's
// own) plus the margin.
constexpr uint64_t kJsonCostFactor = 6;
constexpr uint64_t kJsonCostMargin = uint64_t{8} << 20;

// The bound on the bytes parsing `text` allocates, counted from its tokens; the count stops
// as soon as it exceeds `limit`. Text that is no JSON is counted all the same.
uint64_t JsonParseCost(const std::string &text, uint64_t limit = UINT64_MAX);

// Parses the whole of `text` as one strict JSON document into `value`; its root may be any
// value, not only an object or array. Returns false (and leaves `value` null) for invalid text,
// trailing garbage, an empty text, or a text over the parse budget above or over `maxCost`.
bool JsonFromString(const std::string &text, Json::Value &value, uint64_t maxCost = UINT64_MAX);

// Parses `text` with jsoncpp's lenient reader (Json::Reader: comments allowed, text behind the
// first value ignored), as the login and encryption answers are read; comments are kept on the
// value when `collectComments` is set. On a syntax error `value` holds what the reader left in
// it; a text nested deeper than the reader allows, or over the parse budget, is a failed parse
// with `value` null, never an exception.
bool JsonFromLenientText(const std::string &text, Json::Value &value, bool collectComments);

// The compact JSON text of `value` (no white space, UTF-8 kept as it is).
std::string JsonToString(const Json::Value &value);

// The text of a string, number or bool value; "" for null, arrays and objects.
std::string JsonText(const Json::Value &value);

// Whether a WebAPI answer is an object whose "success" reads as true.
bool JsonIsSuccess(const Json::Value &answer);

}  // namespace kova

#endif  // KOVA_PLATFORM_JSON_TEXT_H
