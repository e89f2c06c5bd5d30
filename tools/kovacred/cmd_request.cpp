// kovacred request URL / kovacred probe URL: one HTTP(S) request through KOVA::CredRequest,
// and the reachability probe. -T streams the request body from a file and -o the response body
// into one, so neither is held in memory.
#include <stdio.h>
#include <strings.h>

#include <fstream>
#include <iostream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <curl/curl.h>
#include <json/value.h>

#include "commands.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"

namespace kovacred {
namespace {

struct RequestOptions {
    std::string url;
    std::vector<std::string> query;
    std::vector<std::string> data;
    std::vector<std::string> headers;
    std::vector<std::string> cookies;
    std::vector<std::string> uploads;
    std::string bodyFile;
    std::string uploadStream;  // -T
    std::string output;        // -o
    std::string format;
    int retries = 0;
    long connectTimeout = 0;
    long responseTimeout = 0;
    bool showHeaders = false;
    bool verify = false;
    bool noFollow = false;
    bool json = false;
};

struct FileCloser {
    void operator()(FILE *f) const {
        if (f != nullptr && f != stdin && f != stdout) {
            fclose(f);
        }
    }
};
using File = std::unique_ptr<FILE, FileCloser>;

// "-" names standard input or output, as with curl.
File OpenStream(const std::string &path, bool write) {
    if (path == "-") {
        return File(write ? stdout : stdin);
    }
    return File(fopen(path.c_str(), write ? "wb" : "rb"));
}

// Splits "name<sep>value" at the first separator; false when there is none or no name.
bool SplitPair(const std::string &text, char sep, std::string &name, std::string &value) {
    size_t pos = text.find(sep);
    if (pos == std::string::npos || pos == 0) {
        return false;
    }
    name = text.substr(0, pos);
    value = text.substr(pos + 1);
    if (sep == ':' && !value.empty() && value[0] == ' ') {
        value.erase(0, 1);
    }
    return true;
}

int RunRequest(const RequestOptions &o) {
    KOVA::CredRequest req;
    if (!req.SetURL(o.url)) {
        return Fail("request", req.GetError());
    }
    std::string name;
    std::string value;
    for (const auto &q : o.query) {
        if (!SplitPair(q, '=', name, value))
            return FailText("bad --query " + q);
        req.AddGetParam(name, value);
    }
    for (const auto &d : o.data) {
        if (!SplitPair(d, '=', name, value))
            return FailText("bad --data " + d);
        req.AddPostParam(name, value);
    }
    for (const auto &h : o.headers) {
        if (!SplitPair(h, ':', name, value))
            return FailText("bad --header " + h);
        req.AddHeader(name, value);
    }
    for (const auto &c : o.cookies) {
        if (!SplitPair(c, '=', name, value))
            return FailText("bad --cookie " + c);
        req.AddCookie(name, value);
    }
    for (const auto &u : o.uploads) {
        if (!SplitPair(u, '=', name, value))
            return FailText("bad --upload " + u);
        req.SetUploadFile(name.c_str(), value.c_str());
    }
    if (!o.bodyFile.empty()) {
        std::ifstream in(o.bodyFile, std::ios::binary);
        if (!in)
            return FailText("cannot read " + o.bodyFile);
        std::ostringstream body;
        body << in.rdbuf();
        req.AddRawParam(body.str());
    }
    File upload;
    if (!o.uploadStream.empty()) {
        upload = OpenStream(o.uploadStream, false);
        if (!upload)
            return FailText("cannot read " + o.uploadStream);
        req.SetReqStream(upload.get());
        // A streamed file is sent as it is, not as a form (libcurl's default type for a POST).
        bool typed = false;
        for (const auto &h : o.headers) {
            typed = typed || strncasecmp(h.c_str(), "Content-Type:", 13) == 0;
        }
        if (!typed) {
            req.AddHeader("Content-Type", "application/octet-stream");
        }
    }
    File output;
    if (!o.output.empty()) {
        output = OpenStream(o.output, true);
        if (!output)
            return FailText("cannot write " + o.output);
        req.SetRespStream(output.get());
    }
    if (!o.format.empty())
        req.SetRequestFormat(o.format);
    if (o.connectTimeout > 0)
        req.SetDefaultTimeout(o.connectTimeout);
    if (o.responseTimeout > 0)
        req.SetResponseTimeout(o.responseTimeout);
    if (o.showHeaders || o.json)
        req.SetRespHeaderToJsonValue(true);
    if (o.verify)
        req.SetHTTPSVerify(true);
    if (o.noFollow)
        req.SetFollowLocation(false);
    if (req.GetError() != KOVA::CRED_REQ_ERR_NONE) {
        return Fail("request", req.GetError());
    }

    if (!req.Process(true, o.retries)) {
        return Fail("request", req.GetError());
    }
    long written = 0;
    if (output) {
        written = ftell(output.get());
        if (fflush(output.get()) != 0 || ferror(output.get()) != 0) {
            return FailText("cannot write " + o.output);
        }
    }
    const std::string body = req.GetResponse();
    if (o.json) {
        Json::Value out(Json::objectValue);
        long status = 0;
        curl_easy_getinfo(req.GetCurlHandler(), CURLINFO_RESPONSE_CODE, &status);
        out["url"] = o.url;
        out["status"] = static_cast<Json::Int64>(status);
        out["headers"] = req.GetResponseHeader();
        if (output) {
            out["output"] = o.output;
            out["bytes"] = static_cast<Json::Int64>(written);
        } else {
            out["body"] = body;
        }
        PrintJson(out);
        return 0;
    }
    if (o.showHeaders) {
        printf("%s\n", JsonText(req.GetResponseHeader(), false).c_str());
    }
    fwrite(body.data(), 1, body.size(), stdout);
    if (!body.empty() && body.back() != '\n') {
        fputc('\n', stdout);
    }
    return 0;
}

void RegisterRequestCommands(CLI::App &app) {
    auto opts = std::make_shared<RequestOptions>();
    CLI::App *request = app.add_subcommand("request", "send one HTTP(S) request, print the body");
    request->add_option("url", opts->url, "target address")->required();
    request->add_option("-q,--query", opts->query, "query parameter name=value");
    request->add_option("-d,--data", opts->data, "form body parameter name=value");
    request->add_option("-H,--header", opts->headers, "request header 'Name: value'");
    request->add_option("-b,--cookie", opts->cookies, "cookie name=value (the last name wins)");
    request->add_option("-F,--upload", opts->uploads, "upload file as form field field=path");
    request->add_option("--body-file", opts->bodyFile, "send this file's bytes as the body");
    request->add_option("-T,--upload-file", opts->uploadStream,
                        "stream the body from this file (- for standard input)");
    request->add_option("-o,--output", opts->output,
                        "write the body to this file instead of standard output");
    request->add_option("--format", opts->format, "request format (JSON: values in JSON form)");
    request->add_option("-r,--retries", opts->retries, "further attempts after a failure");
    request->add_option("--connect-timeout", opts->connectTimeout, "seconds (default 120)");
    request->add_option("--response-timeout", opts->responseTimeout,
                        "seconds below 1 byte/s before giving up (default 120)");
    request->add_flag("--headers", opts->showHeaders, "print the response headers as JSON first");
    request->add_flag("--verify", opts->verify, "verify the server certificate and host name");
    request->add_flag("--no-follow", opts->noFollow, "do not follow redirects");
    AddJsonFlag(request, &opts->json);
    request->callback([opts] { RunRequest(*opts); });

    struct ProbeOptions {
        std::string url;
        bool json = false;
    };
    auto probeOpts = std::make_shared<ProbeOptions>();
    CLI::App *probe = app.add_subcommand("probe", "check that a GET of URL answers 200");
    probe->add_option("url", probeOpts->url, "address to probe")->required();
    AddJsonFlag(probe, &probeOpts->json);
    probe->callback([probeOpts] {
        KOVA::CredRequest req;
        if (!req.isURLValid(probeOpts->url)) {
            Fail("probe", KOVA::CredRequestUtil::m_errCode);
            return;
        }
        if (probeOpts->json) {
            Json::Value out(Json::objectValue);
            out["url"] = probeOpts->url;
            out["reachable"] = true;
            PrintJson(out);
        } else {
            printf("reachable\n");
        }
    });
}

const Registrar registrar(RegisterRequestCommands);

}  // namespace
}  // namespace kovacred
