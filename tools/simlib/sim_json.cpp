#include "simlib/sim_json.h"

#include <memory>
#include <sstream>

#include <json/reader.h>
#include <json/writer.h>

namespace kovasim {

namespace {

std::unique_ptr<Json::CharReader> StrictReader(bool anyRoot) {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["strictRoot"] = !anyRoot;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
}

}  // namespace

bool ParseJson(const std::string &text, Json::Value &value, bool anyRoot) {
    // Building a reader costs more than most of the documents the simulators read.
    thread_local const std::unique_ptr<Json::CharReader> objects = StrictReader(false);
    thread_local const std::unique_ptr<Json::CharReader> values = StrictReader(true);
    std::string errors;
    return !text.empty() && (anyRoot ? values : objects)
                                ->parse(text.data(), text.data() + text.size(), &value, &errors);
}

std::string WriteJson(const Json::Value &value) {
    thread_local const std::unique_ptr<Json::StreamWriter> writer = [] {
        Json::StreamWriterBuilder builder;
        builder["indentation"] = "";
        return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
    }();
    std::ostringstream out;
    writer->write(value, &out);
    return out.str();
}

}  // namespace kovasim
