#include "platform/json_text.h"

#include <memory>
#include <sstream>

#include <json/reader.h>
#include <json/writer.h>

namespace kova {

namespace {

// jsoncpp's readers and writers keep per-parse state, so each thread has its own pair; no
// object is shared between threads.
Json::CharReader &StrictReader() {
    thread_local const std::unique_ptr<Json::CharReader> reader = [] {
        Json::CharReaderBuilder builder;
        Json::CharReaderBuilder::strictMode(&builder.settings_);
        builder["allowSpecialFloats"] = false;
        // Any JSON value may stand at the root ("0", "\"busy\""); callers that need an object
        // check for one themselves.
        builder["strictRoot"] = false;
        return std::unique_ptr<Json::CharReader>(builder.newCharReader());
    }();
    return *reader;
}

Json::StreamWriter &CompactWriter() {
    thread_local const std::unique_ptr<Json::StreamWriter> writer = [] {
        Json::StreamWriterBuilder builder;
        builder["indentation"] = "";
        builder["emitUTF8"] = true;
        return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
    }();
    return *writer;
}

// Upper bounds of what jsoncpp allocates, measured on 64-bit hosts (smaller elsewhere): a
// value with its node in the parent's map; the map of an array or object; the heap copy of a
// string or member name beyond its bytes; the comment store of a value.
constexpr uint64_t kValueCost = 96;
constexpr uint64_t kContainerCost = 64;
constexpr uint64_t kStringCost = 32;
constexpr uint64_t kCommentCost = 128;

bool IsSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

bool EndsScalar(char c) {
    return IsSpace(c) || c == ',' || c == ':' || c == '[' || c == ']' || c == '{' || c == '}' ||
           c == '"' || c == '/';
}

// Whether the text may be parsed: its cost within the budget for its length and `maxCost`.
bool WithinBudget(const std::string &text, uint64_t maxCost) {
    const uint64_t budget = kJsonCostFactor * text.size() + kJsonCostMargin;
    const uint64_t limit = budget < maxCost ? budget : maxCost;
    return JsonParseCost(text, limit) <= limit;
}

}  // namespace

uint64_t JsonParseCost(const std::string &text, uint64_t limit) {
    const char *p = text.data();
    const size_t n = text.size();
    uint64_t cost = 0;
    size_t i = 0;
    while (i < n && cost <= limit) {
        const char c = p[i];
        if (IsSpace(c) || c == ',' || c == ':' || c == ']' || c == '}') {
            ++i;
        } else if (c == '[' || c == '{') {
            cost += kValueCost + kContainerCost;
            ++i;
        } else if (c == '"') {
            size_t end = i + 1;
            while (end < n && p[end] != '"') {
                end += p[end] == '\\' ? 2 : 1;
            }
            const uint64_t length = (end < n ? end : n) - i - 1;
            i = end + 1;
            // A member name lives in its value's node; any other string is a value of its own.
            size_t next = i;
            while (next < n && IsSpace(p[next])) {
                ++next;
            }
            cost += length + kStringCost + (next < n && p[next] == ':' ? 0 : kValueCost);
        } else if (c == '/' && i + 1 < n && (p[i + 1] == '/' || p[i + 1] == '*')) {
            const bool line = p[i + 1] == '/';
            size_t end = text.find(line ? "\n" : "*/", i + 2);
            end = end == std::string::npos ? n : end + (line ? 1 : 2);
            cost += kCommentCost + (end - i);
            i = end;
        } else {
            // A number, a literal, or anything else a reader would take as one token.
            size_t end = i + 1;
            while (end < n && !EndsScalar(p[end])) {
                ++end;
            }
            cost += kValueCost + (end - i);
            i = end;
        }
    }
    return cost;
}

bool JsonFromString(const std::string &text, Json::Value &value, uint64_t maxCost) {
    Json::Value parsed;
    std::string errors;
    bool ok = false;
    try {
        // A text nested deeper than the reader's limit makes jsoncpp throw instead of failing.
        ok = !text.empty() && WithinBudget(text, maxCost) &&
             StrictReader().parse(text.data(), text.data() + text.size(), &parsed, &errors);
    } catch (const Json::Exception &) {
        ok = false;
    }
    if (!ok) {
        value = Json::Value();
        return false;
    }
    value.swap(parsed);
    return true;
}

bool JsonFromLenientText(const std::string &text, Json::Value &value, bool collectComments) {
    try {
        if (!WithinBudget(text, UINT64_MAX)) {
            value = Json::Value();
            return false;
        }
        // A reader keeps per-parse state, so each parse has its own.
        Json::Reader reader;
        return reader.parse(text, value, collectComments);
    } catch (const Json::Exception &) {
        value = Json::Value();
        return false;
    }
}

std::string JsonToString(const Json::Value &value) {
    std::ostringstream out;
    CompactWriter().write(value, &out);
    return out.str();
}

std::string JsonText(const Json::Value &value) {
    return value.isConvertibleTo(Json::stringValue) ? value.asString() : std::string();
}

bool JsonIsSuccess(const Json::Value &answer) {
    if (!answer.isObject()) {
        return false;
    }
    const Json::Value &success = answer["success"];
    return success.isConvertibleTo(Json::booleanValue) && success.asBool();
}

}  // namespace kova
