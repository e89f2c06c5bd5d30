// kovacred request URL / kovacred probe URL: one HTTP(S) request through KOVA::CredRequest,
// and the reachability probe. -T streams the request body from a file and -o the response body
// into one, so neither is held in memory; the body printed on standard output is byte-exact.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

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
    Transport transport;
    bool noFollow = false;
    bool fail = false;
    bool timing = false;
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

// "-" names standard input, as with curl.
File OpenInput(const std::string &path) {
    return File(path == "-" ? stdin : fopen(path.c_str(), "rb"));
}

// The body's file: written under a temporary name in the target's folder and renamed over
// the target only when the request succeeded, so that a failure leaves an existing file as
// it was. "-" is standard output.
class OutputFile {
  public:
    explicit OutputFile(std::string target) : target_(std::move(target)) {}
    ~OutputFile() { Discard(); }
    OutputFile(const OutputFile &) = delete;
    OutputFile &operator=(const OutputFile &) = delete;

    bool Open() {
        if (target_ == "-") {
            file_.reset(stdout);
            return true;
        }
        const size_t slash = target_.rfind('/');
        temp_ = (slash == std::string::npos ? std::string() : target_.substr(0, slash + 1)) +
                ".kovacred-XXXXXX";
        const int fd = mkstemp(&temp_[0]);
        if (fd < 0) {
            temp_.clear();
            return false;
        }
        // The mode a newly created file gets, as if it were opened directly.
        const mode_t mask = umask(0);
        umask(mask);
        fchmod(fd, 0666 & ~mask);
        file_.reset(fdopen(fd, "wb"));
        if (!file_) {
            close(fd);
            return false;
        }
        return true;
    }
    FILE *get() const { return file_.get(); }
    // Flushes and puts the file in place; false when a write failed.
    bool Commit() {
        if (fflush(file_.get()) != 0 || ferror(file_.get()) != 0) {
            return false;
        }
        if (temp_.empty()) {
            return true;
        }
        FILE *f = file_.release();
        if (fclose(f) != 0 || rename(temp_.c_str(), target_.c_str()) != 0) {
            return false;
        }
        temp_.clear();
        return true;
    }
    void Discard() {
        file_.reset();
        if (!temp_.empty()) {
            unlink(temp_.c_str());
            temp_.clear();
        }
    }

  private:
    std::string target_;
    std::string temp_;
    File file_;
};

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

// A failed transfer: the library's code, and the cause libcurl gave.
int FailRequest(KOVA::CredRequest &req, bool inMemory, const Transport &transport) {
    if (inMemory && req.GetCurlCode() == CURLE_WRITE_ERROR) {
        FailText("request failed (" + ErrorText(req.GetError()) +
                 "): the answer is larger than the " + std::to_string(req.GetMaxResponseSize()) +
                 " bytes held in memory; use -o FILE");
        gExitCode = req.GetError();
        return gExitCode;
    }
    return FailTransfer("request", req, &transport);
}

// The scheme, host and port of `url`, for the transport options.
bool PrepareFor(const std::string &what, const std::string &url, Transport &transport) {
    std::string scheme;
    std::string host;
    std::string port;
    KOVA::CredRequestUtil::ParseURL(url, scheme, host, port);
    return PrepareTransport(what, transport, scheme, host, atoi(port.c_str()));
}

int RunRequest(RequestOptions &o) {
    if (!CheckURL("request", o.url) || !PrepareFor("request", o.url, o.transport)) {
        return gExitCode;
    }
    KOVA::CredRequest req;
    if (!req.SetURL(o.url)) {
        return Fail("request", req.GetError());
    }
    std::string name;
    std::string value;
    for (const auto &q : o.query) {
        if (!SplitPair(q, '=', name, value))
            return FailUsage("bad --query " + q);
        req.AddGetParam(name, value);
    }
    for (const auto &d : o.data) {
        if (!SplitPair(d, '=', name, value))
            return FailUsage("bad --data " + d);
        req.AddPostParam(name, value);
    }
    for (const auto &h : o.headers) {
        if (!SplitPair(h, ':', name, value))
            return FailUsage("bad --header " + h);
        req.AddHeader(name, value);
    }
    for (const auto &c : o.cookies) {
        if (!SplitPair(c, '=', name, value))
            return FailUsage("bad --cookie " + c);
        req.AddCookie(name, value);
    }
    for (const auto &u : o.uploads) {
        if (!SplitPair(u, '=', name, value))
            return FailUsage("bad --upload " + u + " (FIELD=PATH)");
        if (access(value.c_str(), R_OK) != 0)
            return FailText("request failed: cannot read " + value + ": " + strerror(errno));
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
        upload = OpenInput(o.uploadStream);
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
    std::unique_ptr<OutputFile> output;
    if (!o.output.empty()) {
        output.reset(new OutputFile(o.output));
        if (!output->Open())
            return FailText("cannot write " + o.output + ": " + strerror(errno));
        req.SetRespStream(output->get());
    }
    if (!o.format.empty())
        req.SetRequestFormat(o.format);
    if (o.connectTimeout > 0)
        req.SetDefaultTimeout(o.connectTimeout);
    if (o.responseTimeout > 0)
        req.SetResponseTimeout(o.responseTimeout);
    if (o.showHeaders || o.json)
        req.SetRespHeaderToJsonValue(true);
    ApplyTransport(o.transport, req);
    if (o.noFollow)
        req.SetFollowLocation(false);
    if (req.GetError() != KOVA::CRED_REQ_ERR_NONE) {
        return Fail("request", req.GetError());
    }

    // Like curl, the body of any HTTP answer is the output; --fail turns a status of 400 or
    // more into a failure, and every status but 200 is named on standard error.
    const bool done = req.Process(true, o.retries);
    long status = 0;
    if (req.GetCurlHandler() != nullptr) {
        curl_easy_getinfo(req.GetCurlHandler(), CURLINFO_RESPONSE_CODE, &status);
    }
    if (!done && (req.GetCurlCode() != CURLE_OK || status == 0 || (o.fail && status >= 400))) {
        return FailRequest(req, o.output.empty(), o.transport);
    }
    if (o.timing && !o.json) {
        PrintTiming(req);
    }
    if (!done) {
        fprintf(stderr, "kovacred: request: HTTP status %ld (%s)\n", status,
                ErrorText(req.GetError()).c_str());
    }
    long written = 0;
    if (output) {
        written = ftell(output->get());
        if (!output->Commit()) {
            FailText("cannot write " + o.output + ": " + strerror(errno));
            gExitCode = kExitWrite;
            return gExitCode;
        }
    }
    const std::string body = req.GetResponse();
    if (o.json) {
        Json::Value out(Json::objectValue);
        out["url"] = o.url;
        out["status"] = static_cast<Json::Int64>(status);
        out["headers"] = req.GetResponseHeader();
        if (o.timing) {
            out["timing"] = req.GetTransferInfo();
        }
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
    return 0;
}

void RegisterRequestCommands(CLI::App &app) {
    auto opts = std::make_shared<RequestOptions>();
    CLI::App *request = app.add_subcommand("request", "send one HTTP(S) request, print the body");
    request->add_option("url", opts->url, "target address")->required();
    // Each use of a repeatable option takes one value, so that options and the URL mix in any
    // order.
    request->add_option("-q,--query", opts->query, "query parameter name=value")
        ->allow_extra_args(false);
    request->add_option("-d,--data", opts->data, "form body parameter name=value")
        ->allow_extra_args(false);
    request->add_option("-H,--header", opts->headers, "request header 'Name: value'")
        ->allow_extra_args(false);
    request->add_option("-b,--cookie", opts->cookies, "cookie name=value (the last name wins)")
        ->allow_extra_args(false);
    request->add_option("-F,--upload", opts->uploads, "upload file as form field field=path")
        ->allow_extra_args(false);
    request->add_option("--body-file", opts->bodyFile, "send this file's bytes as the body");
    request->add_option("-T,--upload-file", opts->uploadStream,
                        "stream the body from this file (- for standard input)");
    request->add_option("-o,--output", opts->output,
                        "write the body to this file instead of standard output; the file is "
                        "replaced only when the request succeeds");
    request->add_option("--format", opts->format, "request format (JSON: values in JSON form)");
    request->add_option("-r,--retries", opts->retries, "further attempts after a failure");
    request->add_option("--connect-timeout", opts->connectTimeout, "seconds (default 120)");
    request->add_option("--response-timeout", opts->responseTimeout,
                        "seconds below 1 byte/s before giving up (default 120)");
    request->add_flag("--headers", opts->showHeaders, "print the response headers as JSON first");
    AddTransportOptions(request, &opts->transport);
    request->add_flag("--no-follow", opts->noFollow, "do not follow redirects");
    request->add_flag("--timing", opts->timing,
                      "show the transfer's timing on standard error (in the JSON with --json)");
    request->add_flag("-f,--fail", opts->fail,
                      "fail (no output) when the HTTP status is 400 or more");
    AddJsonFlag(request, &opts->json);
    request->callback([opts] { RunRequest(*opts); });

    struct ProbeOptions {
        std::string url;
        bool json = false;
        Transport transport;
    };
    auto probeOpts = std::make_shared<ProbeOptions>();
    CLI::App *probe = app.add_subcommand("probe", "check that a GET of URL answers 200");
    probe->add_option("url", probeOpts->url, "address to probe")->required();
    AddJsonFlag(probe, &probeOpts->json);
    AddTransportOptions(probe, &probeOpts->transport);
    probe->callback([probeOpts] {
        if (!CheckURL("probe", probeOpts->url) ||
            !PrepareFor("probe", probeOpts->url, probeOpts->transport)) {
            return;
        }
        // The library's probe (a GET with a 10-second connect time-out), made here so that the
        // transport options apply and the cause of a failure is known.
        KOVA::CredRequest req;
        req.SetURL(probeOpts->url);
        req.SetDefaultTimeout(10);
        ApplyTransport(probeOpts->transport, req);
        if (!req.Process(true, 0)) {
            const std::string cause = TransferCause(req);
            fprintf(stderr, "kovacred: probe failed (%s)%s%s\n",
                    ErrorText(KOVA::CRED_REQ_ERR_QUERY_FAIL).c_str(), cause.empty() ? "" : ": ",
                    cause.c_str());
            gExitCode = KOVA::CRED_REQ_ERR_QUERY_FAIL;
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
