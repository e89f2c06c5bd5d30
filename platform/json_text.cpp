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

}  // namespace

bool JsonFromString(const std::string &text, Json::Value &value) {
    Json::Value parsed;
    std::string errors;
    bool ok = false;
    try {
        // A text nested deeper than the reader's limit makes jsoncpp throw instead of failing.
        ok = !text.empty() &&
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
