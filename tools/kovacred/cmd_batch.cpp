// kovacred batch FILE: runs a JSON array of calls together and ends with a summary of each
// call's outcome. The request manager builds (logging in where needed) and owns the requests;
// their transfers run together over one libcurl multi handle driven here, so that each
// transfer's end is seen as it happens: for the progress line and each call's own time.
#include <signal.h>
#include <stdlib.h>
#include <stdint.h>
#include <stdio.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <exception>
#include <fstream>
#include <iostream>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <curl/curl.h>
#include <json/json.h>

#include "commands.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovacredential.h"

namespace kovacred {
namespace {

using Clock = std::chrono::steady_clock;

struct Call {
    std::string target;   // what the summary names: the URL, or "cred ID API VERSION METHOD"
    long credId = 0;      // the stored credential a WebAPI call uses; 0 for a URL
    int index = -1;       // slot in the manager; -1 when the call could not be built
    std::string problem;  // why a call could not be built
    bool finished = false;
    bool cancelled = false;  // still running when the batch was interrupted
    long code = 0;           // the library's error code; 0 for success
    double seconds = -1;
};

struct MultiCleanup {
    void operator()(CURLM *multi) const { curl_multi_cleanup(multi); }
};
using Multi = std::unique_ptr<CURLM, MultiCleanup>;

bool ReadCalls(const std::string &path, Json::Value &calls, std::string &problem) {
    std::ifstream file;
    std::istream *in = &std::cin;
    if (path != "-") {
        file.open(path);
        if (!file) {
            problem = "cannot read " + path;
            return false;
        }
        in = &file;
    }
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    std::string errors;
    if (!Json::parseFromStream(builder, *in, &calls, &errors)) {
        // jsoncpp's report spans lines ("* Line 1, Column 2\n  Syntax error ..."); one is kept.
        std::string reason;
        for (char c : errors) {
            if (c == '\n') {
                c = ' ';
            }
            if (c != '*' && !(c == ' ' && (reason.empty() || reason.back() == ' '))) {
                reason += c;
            }
        }
        while (!reason.empty() && reason.back() == ' ') {
            reason.pop_back();
        }
        problem = (path == "-" ? std::string("standard input") : path) + " is not JSON: " + reason;
        return false;
    }
    if (!calls.isArray()) {
        problem = (path == "-" ? std::string("standard input") : path) +
                  " must hold a JSON array of calls";
        return false;
    }
    return true;
}

// The transport for the server at scheme://host:port, readied on its first use; null with
// the reason in `call` when it cannot be.
const Transport *ServerTransport(const Transport &options,
                                 std::map<std::string, Transport> &servers,
                                 const std::string &scheme, const std::string &host, int port,
                                 Call &call) {
    const std::string key = scheme + "://" + host + ":" + std::to_string(port);
    auto found = servers.find(key);
    if (found != servers.end()) {
        return &found->second;
    }
    Transport transport = options;
    const int exitCode = gExitCode;
    if (!PrepareTransport("batch", transport, scheme, host, port)) {
        gExitCode = exitCode;
        call.problem = "the transport options cannot be used for " + key;
        return nullptr;
    }
    return &servers.emplace(key, transport).first->second;
}

// Adds one call to the manager; on failure leaves the reason and the error code in `call`.
// Each server's transport is readied once (`servers`, by "scheme://host:port").
void AddCall(KOVA::CredRequestMgr &mgr, const Json::Value &item, Call &call,
             const Transport &options, std::map<std::string, Transport> &servers) {
    call.code = KOVA::CRED_REQ_ERR_BAD_PARAM;
    if (!item.isObject()) {
        call.problem = "not an object";
        return;
    }
    mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
    if (item.isMember("url")) {
        if (!item["url"].isString() || item["url"].asString().empty()) {
            call.problem = "\"url\" is not a non-empty string";
            return;
        }
        call.target = item["url"].asString();
        std::string scheme;
        std::string host;
        std::string port;
        KOVA::CredRequestUtil::ParseURL(call.target, scheme, host, port);
        const Transport *transport =
            ServerTransport(options, servers, scheme, host, atoi(port.c_str()), call);
        if (transport == nullptr) {
            return;
        }
        std::unique_ptr<KOVA::CredRequest> request(new KOVA::CredRequest());
        ApplyTransport(*transport, *request);
        if (!request->SetURL(call.target)) {
            call.problem = "bad url";
            call.code = request->GetError();
            return;
        }
        call.index = mgr.AddCredRequest(request.get());
        if (call.index >= 0) {
            request.release();
            call.code = 0;
        } else {
            call.problem = "cannot add the request";
            call.code = mgr.GetError();
        }
        return;
    }
    if (!item["cred"].isIntegral() || !item["api"].isString() || !item["method"].isString() ||
        !item["version"].isIntegral()) {
        call.problem = "needs \"url\", or \"cred\", \"api\", \"version\" and \"method\"";
        return;
    }
    const Json::Value params = item.get("params", Json::Value());
    if (!params.isNull() && !params.isObject()) {
        call.problem = "\"params\" is not an object";
        return;
    }
    call.credId = static_cast<long>(item["cred"].asInt64());
    call.target = "cred " + std::to_string(call.credId) + " " + item["api"].asString() + " " +
                  std::to_string(item["version"].asInt()) + " " + item["method"].asString();
    KOVA_CRED cred;
    if (call.credId < 1 || call.credId > INT32_MAX || KOVACredGetByID(call.credId, &cred) < 0 ||
        cred.filled == 0) {
        call.problem = "no credential with id " + std::to_string(call.credId);
        return;
    }
    // The description query and the login the manager would make are made here, over the
    // transport options, so that a failure is named as login names it.
    const Transport *transport =
        ServerTransport(options, servers, cred.protocol, cred.host, cred.port, call);
    if (transport == nullptr) {
        return;
    }
    Json::Value desc;
    std::string failure;
    if (!KOVA::CredRequestUtil::IsCredIdCached(call.credId) &&
        !FetchDescription(cred, *transport, desc, failure, call.code)) {
        call.problem = "the API description " + failure;
        return;
    }
    KOVA_CRED_SESS sess;
    if ((KOVACredSessGetByID(call.credId, &sess) < 0 || sess.filled == 0) &&
        !LogIn(cred, "", *transport, failure, call.code)) {
        call.problem = "login failed " + failure;
        return;
    }
    KOVA::CredRequestUtil::m_errCode = 0;
    call.index = mgr.AddWebAPIRequest(call.credId, item["api"].asString(), item["version"].asInt(),
                                      item["method"].asString(), params);
    if (call.index >= 0) {
        ApplyTransport(*transport, *mgr.GetRequest(call.index));
        call.code = 0;
        return;
    }
    call.problem = "cannot build the WebAPI request";
    call.code = KOVA::CredRequestUtil::m_errCode != 0       ? KOVA::CredRequestUtil::m_errCode
                : mgr.GetError() != KOVA::CRED_REQ_ERR_NONE ? mgr.GetError()
                                                            : KOVA::CRED_REQ_ERR_UNKNOWN;
}

// "done/total, failed, elapsed" on one line of standard error, redrawn in place; only when
// standard error is a terminal.
class Progress {
  public:
    explicit Progress(size_t total) : total_(total), on_(isatty(STDERR_FILENO) != 0) {}

    void Show(size_t done, size_t failed, bool last = false) {
        if (!on_) {
            return;
        }
        const Clock::time_point now = Clock::now();
        if (!last && done == shownDone_ && now - shownAt_ < std::chrono::milliseconds(500)) {
            return;
        }
        shownDone_ = done;
        shownAt_ = now;
        const double elapsed = std::chrono::duration<double>(now - start_).count();
        fprintf(stderr, "\rkovacred: batch: %zu/%zu done, %zu failed, %.1f s%s", done, total_,
                failed, elapsed, last ? "\n" : "");
        fflush(stderr);
    }

  private:
    size_t total_;
    bool on_;
    Clock::time_point start_ = Clock::now();
    Clock::time_point shownAt_;
    size_t shownDone_ = static_cast<size_t>(-1);
};

// Set by the first SIGINT; the handler then gives way to the default one, so that a second
// Ctrl-C ends the process at once.
volatile sig_atomic_t gInterrupted = 0;

void OnInterrupt(int) {
    gInterrupted = 1;
}

// While it lives, the first SIGINT sets gInterrupted instead of ending the process.
class InterruptCatcher {
  public:
    InterruptCatcher() {
        struct sigaction action = {};
        action.sa_handler = OnInterrupt;
        action.sa_flags = SA_RESETHAND;  // no SA_RESTART: a wait ends at once
        sigemptyset(&action.sa_mask);
        sigaction(SIGINT, &action, &saved_);
    }
    ~InterruptCatcher() { sigaction(SIGINT, &saved_, nullptr); }
    InterruptCatcher(const InterruptCatcher &) = delete;
    InterruptCatcher &operator=(const InterruptCatcher &) = delete;

  private:
    struct sigaction saved_;
};

// Runs every built call's transfer together until all have finished, or until SIGINT, which
// leaves the unfinished ones cancelled.
void RunTransfers(KOVA::CredRequestMgr &mgr, std::vector<Call> &calls) {
    size_t done = 0;
    size_t failed = 0;
    auto finish = [&](Call &call, long code) {
        call.finished = true;
        call.code = code;
        ++done;
        failed += code != 0 ? 1 : 0;
    };
    for (Call &call : calls) {
        if (call.index < 0 && !call.cancelled) {
            finish(call, call.code);
        }
    }
    Progress progress(calls.size());
    Multi multi(curl_multi_init());
    std::map<CURL *, Call *> running;
    for (Call &call : calls) {
        if (call.index < 0 || gInterrupted) {
            continue;
        }
        KOVA::CredRequest *request = mgr.GetRequest(call.index);
        if (!request->Process(false, 0)) {
            finish(call, request->GetError() != KOVA::CRED_REQ_ERR_NONE
                             ? request->GetError()
                             : KOVA::CRED_REQ_ERR_CURL_INTERNAL);
            continue;
        }
        CURL *easy = request->GetCurlHandler();
        if (!multi || curl_multi_add_handle(multi.get(), easy) != CURLM_OK) {
            finish(call, KOVA::CRED_REQ_ERR_CURL_INTERNAL);
            continue;
        }
        running[easy] = &call;
    }
    // Each transfer is bounded by its request's connect and low-speed time-outs.
    while (!running.empty() && !gInterrupted) {
        progress.Show(done, failed);
        int active = 0;
        if (curl_multi_perform(multi.get(), &active) != CURLM_OK) {
            break;
        }
        int queued = 0;
        while (CURLMsg *msg = curl_multi_info_read(multi.get(), &queued)) {
            auto it = running.find(msg->easy_handle);
            if (msg->msg != CURLMSG_DONE || it == running.end()) {
                continue;
            }
            long status = 0;
            double seconds = 0;
            curl_easy_getinfo(msg->easy_handle, CURLINFO_RESPONSE_CODE, &status);
            curl_easy_getinfo(msg->easy_handle, CURLINFO_TOTAL_TIME, &seconds);
            Call &call = *it->second;
            call.seconds = seconds;
            // The code Process would leave for the same transfer.
            finish(call, KOVA::CredRequest::ErrorOf(msg->data.result, status));
            mgr.GetRequest(call.index)->SetError(static_cast<KOVA::CRED_REQ_ERR>(call.code));
            curl_multi_remove_handle(multi.get(), msg->easy_handle);
            running.erase(it);
        }
        if (!running.empty() &&
            curl_multi_poll(multi.get(), nullptr, 0, 200, nullptr) != CURLM_OK) {
            break;
        }
    }
    for (auto &entry : running) {
        curl_multi_remove_handle(multi.get(), entry.first);
        if (gInterrupted) {
            entry.second->cancelled = true;
        } else {
            finish(*entry.second, KOVA::CRED_REQ_ERR_CURL_INTERNAL);
        }
    }
    for (Call &call : calls) {
        call.cancelled = call.cancelled || (gInterrupted && !call.finished);
    }
    progress.Show(done, failed, true);
}

std::string ResultText(const Call &call) {
    if (call.cancelled) {
        return "cancelled";
    }
    return call.index < 0 ? "not run" : call.code == 0 ? "ok" : "failed";
}

void PrintSummary(const std::vector<Call> &calls) {
    std::vector<std::vector<std::string>> rows = {{"#", "TARGET", "RESULT", "ERROR", "TIME"}};
    for (size_t i = 0; i < calls.size(); ++i) {
        const Call &call = calls[i];
        std::string error = "-";
        if (call.code != 0 && !call.cancelled) {
            error = std::to_string(call.code) + " " + ErrorName(call.code);
        }
        char time[32] = "-";
        if (call.seconds >= 0) {
            snprintf(time, sizeof(time), "%.3f s", call.seconds);
        }
        const std::string target =
            call.target.empty() ? "(" + call.problem + ")" : Printable(call.target);
        rows.push_back({std::to_string(i), target, ResultText(call), error, time});
    }
    PrintTable(rows);
}

Json::Value Answer(const std::string &body) {
    Json::Value value;
    return ParseJson(body, value) ? value : Json::Value(body);
}

bool UsesCredentials(const Json::Value &items) {
    for (const Json::Value &item : items) {
        if (item.isObject() && !item.isMember("url")) {
            return true;
        }
    }
    return false;
}

void RunBatch(const std::string &path, bool json, const Transport &options) {
    Json::Value items;
    std::string problem;
    if (!ReadCalls(path, items, problem)) {
        FailText("batch: " + problem);
        return;
    }
    if (UsesCredentials(items) && !CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
    const InterruptCatcher catcher;
    std::map<std::string, Transport> servers;
    KOVA::CredRequestMgr mgr;
    std::vector<Call> calls(items.size());
    for (Json::ArrayIndex i = 0; i < items.size(); ++i) {
        if (gInterrupted) {
            calls[i].cancelled = true;
            continue;
        }
        AddCall(mgr, items[i], calls[i], options, servers);
        if (calls[i].index < 0) {
            fprintf(stderr, "kovacred: batch: call %u: %s\n", i, calls[i].problem.c_str());
        }
    }
    RunTransfers(mgr, calls);

    // Answers may echo a session's id or token, or a password.
    Secrets secrets;
    size_t failed = 0;
    size_t finished = 0;
    size_t cancelled = 0;
    for (const Call &call : calls) {
        if (call.credId != 0) {
            secrets.AddCredential(call.credId);
        }
        failed += call.code != 0 && !call.cancelled ? 1 : 0;
        finished += call.finished ? 1 : 0;
        cancelled += call.cancelled ? 1 : 0;
    }
    if (json) {
        Json::Value out(Json::arrayValue);
        for (size_t i = 0; i < calls.size(); ++i) {
            const Call &call = calls[i];
            Json::Value entry(Json::objectValue);
            entry["index"] = static_cast<Json::UInt>(i);
            entry["target"] = call.target;
            entry["result"] = ResultText(call);
            entry["code"] = static_cast<Json::Int64>(call.cancelled ? 0 : call.code);
            entry["name"] = call.cancelled ? "" : ErrorName(call.code);
            entry["ms"] =
                call.seconds >= 0
                    ? Json::Value(static_cast<Json::Int64>(std::llround(call.seconds * 1000)))
                    : Json::Value();
            entry["answer"] = call.index >= 0 && call.finished ? Answer(mgr.GetResponse(call.index))
                                                               : Json::Value();
            out.append(entry);
        }
        printf("%s\n", JsonText(secrets.Hide(out), false).c_str());
    } else {
        PrintSummary(calls);
    }
    fflush(stdout);
    if (gInterrupted) {
        FailText("batch: interrupted: " + std::to_string(finished) + " of " +
                 std::to_string(calls.size()) + " calls finished, " + std::to_string(cancelled) +
                 " cancelled");
        gExitCode = kExitInterrupted;
    } else if (failed > 0) {
        FailText("batch: " + std::to_string(failed) + " of " + std::to_string(calls.size()) +
                 " calls failed");
    }
}

const Registrar registrar([](CLI::App &app) {
    CLI::App *cmd = app.add_subcommand(
        "batch", "run a JSON array of calls together and summarise their outcomes");
    auto path = std::make_shared<std::string>();
    auto json = std::make_shared<bool>(false);
    auto transport = std::make_shared<Transport>();
    cmd->add_option("FILE", *path,
                    "JSON array of {\"cred\", \"api\", \"version\", \"method\", \"params\"} "
                    "or {\"url\"} calls; - reads standard input")
        ->required();
    AddJsonFlag(cmd, json.get());
    AddTransportOptions(cmd, transport.get());
    cmd->callback([path, json, transport] {
        try {
            RunBatch(*path, *json, *transport);
        } catch (const std::exception &e) {
            FailText(std::string("batch: ") + e.what());
        }
    });
});

}  // namespace
}  // namespace kovacred
