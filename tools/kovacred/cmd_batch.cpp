// kovacred batch FILE: runs a JSON array of calls together through the request manager and
// prints their answers as one JSON array in input order.
#include <stdio.h>

#include <exception>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <curl/curl.h>
#include <json/json.h>

#include "commands.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"

namespace kovacred {
namespace {

// Batches larger than this report their progress on standard error.
constexpr size_t kQuietBatchSize = 20;

struct Call {
    int index = -1;       // slot in the manager, -1 when the call could not be built
    std::string problem;  // why it failed, empty while it has not
};

bool ReadJsonFile(const std::string &path, Json::Value &value, std::string &problem) {
    std::ifstream in(path);
    if (!in) {
        problem = "cannot read " + path;
        return false;
    }
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    std::string errors;
    if (!Json::parseFromStream(builder, in, &value, &errors)) {
        problem = path + " is not JSON: " + errors;
        return false;
    }
    return true;
}

// Adds one call to the manager; fills `problem` when it cannot be made.
int AddCall(KOVA::CredRequestMgr &mgr, const Json::Value &call, std::string &problem) {
    if (!call.isObject()) {
        problem = "not an object";
        return -1;
    }
    if (call.isMember("url")) {
        if (!call["url"].isString() || call["url"].asString().empty()) {
            problem = "\"url\" is not a non-empty string";
            return -1;
        }
        std::unique_ptr<KOVA::CredRequest> request(new KOVA::CredRequest());
        if (!request->SetURL(call["url"].asString())) {
            problem = "bad url (error " + std::to_string(request->GetError()) + ")";
            return -1;
        }
        int index = mgr.AddCredRequest(request.get());
        if (index >= 0) {
            request.release();
        } else {
            problem = "cannot add request (error " + std::to_string(mgr.GetError()) + ")";
        }
        return index;
    }
    if (!call["cred"].isIntegral() || !call["api"].isString() || !call["method"].isString() ||
        !call["version"].isIntegral()) {
        problem = "needs \"url\", or \"cred\", \"api\", \"version\" and \"method\"";
        return -1;
    }
    Json::Value params = call.get("params", Json::Value());
    if (!params.isNull() && !params.isObject()) {
        problem = "\"params\" is not an object";
        return -1;
    }
    int index =
        mgr.AddWebAPIRequest(static_cast<long>(call["cred"].asInt64()), call["api"].asString(),
                             call["version"].asInt(), call["method"].asString(), params);
    if (index < 0) {
        problem = "cannot build the WebAPI request for credential " +
                  std::to_string(call["cred"].asInt64());
    }
    return index;
}

// The body as JSON when it is JSON, otherwise as a string.
Json::Value Answer(const std::string &body) {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    Json::Value value;
    std::string errors;
    if (!body.empty() && reader->parse(body.data(), body.data() + body.size(), &value, &errors)) {
        return value;
    }
    return Json::Value(body);
}

void RunBatch(const std::string &path) {
    Json::Value calls;
    std::string problem;
    if (!ReadJsonFile(path, calls, problem)) {
        FailText("batch: " + problem);
        return;
    }
    if (!calls.isArray()) {
        FailText("batch: " + path + " must hold a JSON array of calls");
        return;
    }

    KOVA::CredRequestMgr mgr;
    std::vector<Call> states(calls.size());
    for (Json::ArrayIndex i = 0; i < calls.size(); ++i) {
        states[i].index = AddCall(mgr, calls[i], states[i].problem);
    }
    bool verbose = calls.size() > kQuietBatchSize;
    if (verbose) {
        fprintf(stderr, "kovacred: batch: running %u calls together\n", calls.size());
    }
    bool ran = mgr.Run();

    Json::Value answers(Json::arrayValue);
    size_t failed = 0;
    for (Json::ArrayIndex i = 0; i < calls.size(); ++i) {
        Call &state = states[i];
        if (state.index < 0) {
            answers.append(Json::Value());
        } else {
            KOVA::CredRequest *request = mgr.GetRequest(state.index);
            answers.append(Answer(request->GetResponse()));
            long status = 0;
            CURL *easy = request->GetCurlHandler();
            if (easy != nullptr) {
                curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &status);
            }
            if (easy == nullptr) {
                state.problem = "not started (error " + std::to_string(request->GetError()) + ")";
            } else if (status == 0) {
                state.problem = ran ? "no answer"
                                    : "no answer, the run failed (error " +
                                          std::to_string(mgr.GetError()) + ")";
            } else if (status != 200) {
                state.problem = "HTTP status " + std::to_string(status);
            }
        }
        if (!state.problem.empty()) {
            ++failed;
        }
    }
    if (verbose) {
        fprintf(stderr, "kovacred: batch: %u calls done, %zu failed\n", calls.size(), failed);
    }

    Json::StreamWriterBuilder writer;
    writer["indentation"] = "";
    printf("%s\n", Json::writeString(writer, answers).c_str());
    fflush(stdout);

    for (Json::ArrayIndex i = 0; i < calls.size(); ++i) {
        if (!states[i].problem.empty()) {
            fprintf(stderr, "kovacred: batch: call %u failed: %s\n", i, states[i].problem.c_str());
        }
    }
    if (failed > 0) {
        FailText("batch: " + std::to_string(failed) + " of " + std::to_string(calls.size()) +
                 " calls failed");
    }
}

const Registrar registrar([](CLI::App &app) {
    CLI::App *cmd = app.add_subcommand(
        "batch", "run a JSON array of calls together and print their answers in order");
    auto path = std::make_shared<std::string>();
    cmd->add_option("FILE", *path,
                    "JSON array of {\"cred\", \"api\", \"version\", \"method\", \"params\"} "
                    "or {\"url\"} calls")
        ->required();
    cmd->callback([path] {
        try {
            RunBatch(*path);
        } catch (const std::exception &e) {
            FailText(std::string("batch: ") + e.what());
        }
    });
});

}  // namespace
}  // namespace kovacred
