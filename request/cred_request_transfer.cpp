// Transfer set-up of KOVA::CredRequest: the settings document becomes one configured libcurl
// easy handle, plus the body, header and trace callbacks that handle uses.
#include <stdlib.h>
#include <sys/auxv.h>
#include <unistd.h>

#include <algorithm>
#include <limits>
#include <mutex>
#include <stdexcept>

#include "platform/json_text.h"
#include "platform/kova_env.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"
#include "request/cred_request_pool.h"

namespace KOVA {

namespace {

constexpr const char kUnit[] = "cred_request";
constexpr const char kUserAgent[] = "Velantix-23739";
constexpr const char kDebugEnv[] = "kovacredential_debug";

const Json::Value kNull;

// CURLOPT_SSL_VERIFYHOST value that checks the certificate's name against the host. 2 means
// that on every libcurl; 1 is refused by some versions and would fail every verified transfer.
constexpr long kVerifyHostName = 2L;

// The longest low-speed time libcurl can take: it counts the time in milliseconds held in a
// long, so a longer one overflows (beyond 24 days where long has 32 bits) and ends a transfer
// at its first stall.
constexpr long kMaxLowSpeedTime = std::numeric_limits<long>::max() / 1000;

// The text a JSON value is sent as: a string as it stands, anything else in compact JSON.
std::string ValueText(const Json::Value &value) {
    if (value.isString()) {
        return value.asString();
    }
    return value.isNull() ? std::string() : kova::JsonToString(value);
}

// The caller's TLS context callback returns nothing, while libcurl reads a CURLcode from its
// SSL context function; this adapter calls it with the caller's data and reports success. It
// reads the callback when the connection is made, so that SetSSLVerify may change or clear it
// between transfers: a cleared callback is simply not called.
CURLcode SslCtxAdapter(CURL *curl, void *sslCtx, void *user) {
    const auto *p = static_cast<const CredRequestPrivate *>(user);
    if (p->sslCtxFn != nullptr) {
        p->sslCtxFn(curl, sslCtx, p->sslCtxData);
    }
    return CURLE_OK;
}

}  // namespace

constexpr int kLineSetOptionFail = 48;

template <typename T>
bool CredRequestPrivate::SetOption(CURLoption option, T value) {
    CURLcode rc = curl_easy_setopt(curl, option, value);
    if (rc != CURLE_OK) {
        error = CRED_REQ_ERR_CURL_INTERNAL;
        kova::Log("%s:%d CURL Error(%d): %s", kUnit, kLineSetOptionFail, static_cast<int>(rc),
                  curl_easy_strerror(rc));
        return false;
    }
    return true;
}

bool CredRequestPrivate::SecureProcess() {
    return getauxval(AT_SECURE) != 0;
}

void CredRequestPrivate::ScrubCurlEnvironment(bool secure) {
    if (secure) {
        unsetenv("SSLKEYLOGFILE");
    }
}

namespace {
// libcurl's global initialisation, made once per process by InitCurlGlobal.
std::once_flag curlGlobalOnce;
}  // namespace

void CredRequestPrivate::InitCurlGlobal(bool secure) {
    std::call_once(curlGlobalOnce, [secure] {
        ScrubCurlEnvironment(secure);
        curl_global_init(CURL_GLOBAL_DEFAULT);
    });
}

constexpr int kLineFormAddFail = 181;

bool CredRequestPrivate::InitCurlHandler() {
    // The document is read once per request: later changes do not reach an existing handle.
    if (curl != nullptr) {
        return true;
    }
    InitCurlGlobal(secureProcess);
    const Json::Value &urlValue = Setting("URL");
    const Json::Value &verify = Setting("VerifySSL");
    // The handle comes from the pool of the server and TLS settings; a request with a TLS
    // context callback, or without a URL, gets one of its own.
    auto takeHandle = [&] {
        CredRequestPool::Tls tls;
        tls.verify = verify.isBool() && verify.asBool();
        tls.caFile = caFile;
        tls.pinnedKey = pinnedPublicKey;
        server =
            urlValue.isString() ? CredRequestPool::ServerOf(urlValue.asString()) : std::string();
        poolKey = sslCtxFn == nullptr ? CredRequestPool::KeyOf(server, tls) : std::string();
        curl = CredRequestPool::Acquire(poolKey, &poolGeneration);
        if (curl == nullptr) {
            error = CRED_REQ_ERR_CURL_INTERNAL;
            return false;
        }
        return true;
    };
    if (!urlValue.isString()) {
        if (takeHandle()) {
            error = CRED_REQ_ERR_NO_URL;
        }
        return false;
    }
    std::string url = urlValue.asString();

    // A multipart upload carries the session id in the query string.
    if (HasData("File") && HasData("PostParam", "_sid")) {
        std::string sid = ValueText(settings["PostParam"]["_sid"]);
        if (!SetData("GetParam", "_sid", sid)) {
            takeHandle();
            return false;
        }
        settings["PostParam"].removeMember("_sid");
    }
    if (HasData("GetParam")) {
        url += url.find('?') == std::string::npos ? "?" : "&";
        url += GetParamString(settings["GetParam"]);
    }
    // Parameters are encoded before the handle is taken: encoding may fetch the server's
    // encryption information with a request of its own, which then finds the kept connection
    // to the server free.
    const Json::Value &fileObj = Setting("File");
    const bool rawBody = HasData("RawParam");
    const Json::Value formFields =
        !rawBody && fileObj.isObject()
            ? GetParamJsonObj(HasData("PostParam") ? settings["PostParam"] : kNull)
            : Json::Value();
    const std::string postBody =
        !rawBody && !fileObj.isObject() && reqStream == nullptr && HasData("PostParam")
            ? GetParamString(settings["PostParam"])
            : std::string();
    if (!takeHandle()) {
        return false;
    }

    if (!SetOption(CURLOPT_URL, url.c_str()) ||
        !SetOption(CURLOPT_ERRORBUFFER, static_cast<char *>(curlErrorBuffer))) {
        return false;
    }
    // A process that gained privileges at exec does not let its invoker's http_proxy,
    // https_proxy or all_proxy send the request (and its session id) elsewhere: an empty proxy
    // makes libcurl ignore them.
    if (secureProcess && !SetOption(CURLOPT_PROXY, "")) {
        return false;
    }
    if (followLocation && !SetOption(CURLOPT_FOLLOWLOCATION, 1L)) {
        return false;
    }
    if (encoding && !SetOption(CURLOPT_ACCEPT_ENCODING, "")) {
        return false;
    }
    if (kova::SecureEnv(kDebugEnv) != nullptr) {
        if (!SetOption(CURLOPT_VERBOSE, 1L) ||
            !SetOption(CURLOPT_DEBUGFUNCTION, &CredRequestPrivate::DebugCallback)) {
            return false;
        }
    }
    if (!SetOption(CURLOPT_POSTREDIR, static_cast<long>(CURL_REDIR_POST_ALL)) ||
        !SetOption(CURLOPT_AUTOREFERER, 1L) || !SetOption(CURLOPT_USERAGENT, kUserAgent)) {
        return false;
    }

    // Certificate and host checks are off unless asked for; a TLS context callback forces them
    // and its own handshake on every transfer (a fresh connection, closed after it, no TLS
    // session resumed), so that the callback sees each one.
    if (sslCtxFn != nullptr) {
        if (!SetOption(CURLOPT_SSL_VERIFYPEER, 1L) ||
            !SetOption(CURLOPT_SSL_VERIFYHOST, kVerifyHostName) ||
            !SetOption(CURLOPT_SSL_CTX_FUNCTION, &SslCtxAdapter) ||
            !SetOption(CURLOPT_SSL_CTX_DATA, static_cast<void *>(this)) ||
            !SetOption(CURLOPT_FRESH_CONNECT, 1L) || !SetOption(CURLOPT_FORBID_REUSE, 1L) ||
            !SetOption(CURLOPT_SSL_SESSIONID_CACHE, 0L)) {
            return false;
        }
    } else if (verify.isBool() && verify.asBool()) {
        if (!SetOption(CURLOPT_SSL_VERIFYPEER, 1L) ||
            !SetOption(CURLOPT_SSL_VERIFYHOST, kVerifyHostName)) {
            return false;
        }
    } else {
        if (!SetOption(CURLOPT_SSL_VERIFYPEER, 0L) || !SetOption(CURLOPT_SSL_VERIFYHOST, 0L)) {
            return false;
        }
    }
    if (!caFile.empty() && !SetOption(CURLOPT_CAINFO, caFile.c_str())) {
        return false;
    }
    if (!pinnedPublicKey.empty() && !SetOption(CURLOPT_PINNEDPUBLICKEY, pinnedPublicKey.c_str())) {
        return false;
    }

    const Json::Value &respTime = Setting("RespTime");
    const Json::Int64 lowSpeedTime = respTime.isInt64() ? respTime.asInt64() : defaultTimeout;
    if (!SetOption(CURLOPT_TCP_KEEPALIVE, 1L) || !SetOption(CURLOPT_TCP_KEEPIDLE, defaultTimeout) ||
        !SetOption(CURLOPT_TCP_KEEPINTVL, defaultTimeout) ||
        !SetOption(CURLOPT_LOW_SPEED_LIMIT, 1L) ||
        !SetOption(CURLOPT_LOW_SPEED_TIME,
                   static_cast<long>(std::min<Json::Int64>(lowSpeedTime, kMaxLowSpeedTime))) ||
        !SetOption(CURLOPT_CONNECTTIMEOUT, defaultTimeout) || !SetOption(CURLOPT_NOSIGNAL, 1L)) {
        return false;
    }

    if (Setting("Cookie").isObject()) {
        std::string cookies = GetCookies();
        if (!SetOption(CURLOPT_COOKIE, cookies.c_str())) {
            return false;
        }
    }

    // An empty Expect header stops libcurl from waiting for an interim 100 answer; it is sent
    // only together with the caller's own headers.
    const Json::Value &headerObj = Setting("Header");
    if (headerObj.isObject()) {
        struct curl_slist *list = curl_slist_append(nullptr, "Expect:");
        if (list == nullptr) {
            error = CRED_REQ_ERR_CURL_INTERNAL;
            return false;
        }
        headers = list;
        for (auto it = headerObj.begin(); it != headerObj.end(); ++it) {
            std::string line = it.name() + ": " + ValueText(*it);
            list = curl_slist_append(headers, line.c_str());
            if (list == nullptr) {
                error = CRED_REQ_ERR_CURL_INTERNAL;
                return false;
            }
            headers = list;
        }
        if (!SetOption(CURLOPT_HTTPHEADER, headers)) {
            return false;
        }
    }

    // Request body: raw text, else a multipart upload, else the request stream, else the form
    // parameters; without any of them the request is a GET.
    if (rawBody) {
        const std::string body = ValueText(settings["RawParam"]);
        if (!SetOption(CURLOPT_POST, 1L) || !SetOption(CURLOPT_COPYPOSTFIELDS, body.c_str())) {
            return false;
        }
    } else if (fileObj.isObject()) {
        struct curl_httppost *last = nullptr;
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
        // The multipart form is built with the form API, which the servers' upload handling
        // was written against.
        if (formFields.isObject()) {
            for (auto it = formFields.begin(); it != formFields.end(); ++it) {
                const std::string name = it.name();
                const std::string value = ValueText(*it);
                CURLFORMcode rc = curl_formadd(&form, &last, CURLFORM_COPYNAME, name.c_str(),
                                               CURLFORM_COPYCONTENTS, value.c_str(), CURLFORM_END);
                if (rc != CURL_FORMADD_OK) {
                    error = CRED_REQ_ERR_CURL_INTERNAL;
                    kova::Log("%s:%d CURL Error(%d)", kUnit, kLineFormAddFail,
                              static_cast<int>(rc));
                    return false;
                }
            }
        }
        for (auto it = fileObj.begin(); it != fileObj.end(); ++it) {
            const std::string field = it.name();
            const std::string path = ValueText(*it);
            CURLFORMcode rc = curl_formadd(&form, &last, CURLFORM_COPYNAME, field.c_str(),
                                           CURLFORM_FILE, path.c_str(), CURLFORM_END);
            if (rc != CURL_FORMADD_OK) {
                error = CRED_REQ_ERR_CURL_INTERNAL;
                kova::Log("%s:%d CURL Error(%d)", kUnit, kLineFormAddFail, static_cast<int>(rc));
                return false;
            }
        }
        if (!SetOption(CURLOPT_HTTPPOST, form)) {
            return false;
        }
#pragma GCC diagnostic pop
    } else if (reqStream != nullptr) {
        // The body is read through ReadFromStream; the seek callback lets libcurl send it
        // again from the start (a redirect that keeps the POST, an authentication round).
        if (!SetOption(CURLOPT_POST, 1L) ||
            !SetOption(CURLOPT_READFUNCTION, &CredRequestPrivate::ReadBody) ||
            !SetOption(CURLOPT_READDATA, static_cast<void *>(this)) ||
            !SetOption(CURLOPT_SEEKFUNCTION, &CredRequestPrivate::SeekBody) ||
            !SetOption(CURLOPT_SEEKDATA, static_cast<void *>(this))) {
            return false;
        }
    } else if (HasData("PostParam")) {
        if (!SetOption(CURLOPT_POST, 1L) || !SetOption(CURLOPT_COPYPOSTFIELDS, postBody.c_str())) {
            return false;
        }
    }

    if (Setting("RespHeader").isObject()) {
        Json::Value &respHeaderSettings = settings["RespHeader"];
        const Json::Value &mode = GetData("RespHeader", "MODE", kNull);
        const std::string modeText = mode.isString() ? mode.asString() : std::string();
        if (modeText == "STDOUT") {
            const Json::Value *message = &respHeaderSettings["MESSAGE"];
            if (!SetOption(CURLOPT_HEADERFUNCTION, &CredRequestPrivate::WriteHeaderToStdout) ||
                !SetOption(CURLOPT_HEADERDATA, message)) {
                return false;
            }
        } else if (modeText == "JSON") {
            if (!SetOption(CURLOPT_HEADERFUNCTION, &CredRequestPrivate::WriteHeaderToJsonValue) ||
                !SetOption(CURLOPT_HEADERDATA, &respHeader)) {
                return false;
            }
        }
    }

    // A response stream is written through WriteToStream, or the caller's writer (which gets
    // the stream as its data), counting what an attempt wrote.
    if (respStream != nullptr) {
        if (!SetOption(CURLOPT_WRITEFUNCTION, &CredRequestPrivate::WriteBody) ||
            !SetOption(CURLOPT_WRITEDATA, static_cast<void *>(this))) {
            return false;
        }
    } else {
        if (!SetOption(CURLOPT_WRITEFUNCTION, &CredRequestPrivate::WriteResponse) ||
            !SetOption(CURLOPT_WRITEDATA, static_cast<void *>(this))) {
            return false;
        }
    }
    return true;
}

size_t CredRequestPrivate::WriteResponse(char *data, size_t size, size_t nmemb, void *self) {
    auto *p = static_cast<CredRequestPrivate *>(self);
    const size_t total = size * nmemb;
    const size_t cap = p->maxResponseBytes;
    if (cap != 0 && (total > cap || p->response.size() > cap - total)) {
        return 0;  // past the cap: libcurl ends the transfer with CURLE_WRITE_ERROR
    }
    return WriteToStrBuf(data, size, nmemb, &p->response);
}

size_t CredRequestPrivate::WriteToStrBuf(char *data, size_t size, size_t nmemb, std::string *out) {
    const size_t total = size * nmemb;
    try {
        out->append(data, total);
    } catch (...) {
        return 0;  // aborts the transfer (CURLE_WRITE_ERROR) instead of throwing into libcurl
    }
    return total;
}

size_t CredRequestPrivate::WriteToStream(char *data, size_t size, size_t nmemb, FILE *stream) {
    return fwrite(data, size, nmemb, stream);
}

size_t CredRequestPrivate::ReadFromStream(char *buffer, size_t size, size_t nmemb, FILE *stream) {
    size_t n = nmemb;
    const bool limited = reqStreamLimited;
    if (limited) {
        const uint32_t remaining = reqStreamRemaining;
        if (remaining == 0) {
            return 0;
        }
        if (size != 0 && remaining < size * nmemb) {
            n = remaining / size;
        }
    }
    const size_t read = fread(buffer, size, n, stream);
    if (read < n) {
        // A short read ends the body; a read error must not pass for its end, or the server
        // would take a cut body for a whole one.
        return ferror(stream) ? CURL_READFUNC_ABORT : read;
    }
    if (limited) {
        reqStreamRemaining -= static_cast<uint32_t>(read * size);
    }
    return read;
}

size_t CredRequestPrivate::ReadBody(char *buffer, size_t size, size_t nmemb, void *self) {
    auto *p = static_cast<CredRequestPrivate *>(self);
    const size_t read = ReadFromStream(buffer, size, nmemb, p->reqStream);
    if (read != CURL_READFUNC_ABORT) {
        p->reqStreamRead += read * size;
    }
    return read;
}

int CredRequestPrivate::SeekBody(void *self, curl_off_t offset, int origin) {
    auto *p = static_cast<CredRequestPrivate *>(self);
    // libcurl only asks for a position from the start of the body.
    if (origin != SEEK_SET || offset < 0) {
        return CURL_SEEKFUNC_CANTSEEK;
    }
    if (offset == 0 && p->reqStreamRead == 0) {
        return CURL_SEEKFUNC_OK;  // nothing was read yet, also from a pipe
    }
    if (p->reqStreamStart < 0) {
        return CURL_SEEKFUNC_CANTSEEK;
    }
    if (fseeko(p->reqStream, p->reqStreamStart + static_cast<off_t>(offset), SEEK_SET) != 0) {
        return CURL_SEEKFUNC_FAIL;
    }
    clearerr(p->reqStream);
    if (p->markLimited) {
        const uint64_t skipped = static_cast<uint64_t>(offset);
        reqStreamRemaining =
            skipped < p->markRemaining ? p->markRemaining - static_cast<uint32_t>(skipped) : 0;
        reqStreamLimited = true;
    }
    p->reqStreamRead = static_cast<uint64_t>(offset);
    return CURL_SEEKFUNC_OK;
}

size_t CredRequestPrivate::WriteBody(char *data, size_t size, size_t nmemb, void *self) {
    auto *p = static_cast<CredRequestPrivate *>(self);
    const size_t written = p->respWriteFn != nullptr
                               ? p->respWriteFn(data, size, nmemb, p->respStream)
                               : WriteToStream(data, size, nmemb, p->respStream);
    p->respStreamWritten += written * size;
    return written;
}

namespace {

// The position of a stream, -1 when it cannot be told (a pipe, a socket).
off_t StreamPosition(FILE *stream) {
    return stream != nullptr ? ftello(stream) : -1;
}

}  // namespace

void CredRequestPrivate::MarkStreams() {
    reqStreamStart = StreamPosition(reqStream);
    // With a writer of the caller's the response "stream" is only that writer's data.
    respStreamStart = respWriteFn == nullptr ? StreamPosition(respStream) : -1;
    markLimited = reqStreamLimited;
    markRemaining = reqStreamRemaining;
    reqStreamRead = 0;
    respStreamWritten = 0;
}

bool CredRequestPrivate::RewindStreams() {
    if (reqStream != nullptr) {
        // A body read from a pipe cannot be sent again.
        if (reqStreamRead > 0 &&
            (reqStreamStart < 0 || fseeko(reqStream, reqStreamStart, SEEK_SET) != 0)) {
            return false;
        }
        clearerr(reqStream);
        if (markLimited) {
            reqStreamRemaining = markRemaining;
            reqStreamLimited = true;
        }
    }
    if (respStream != nullptr && respWriteFn != nullptr) {
        // What the caller's writer took cannot be taken back.
        if (respStreamWritten > 0) {
            return false;
        }
    } else if (respStream != nullptr && respStreamWritten > 0) {
        // Only what the attempt wrote is cut off; bytes of the caller's behind the mark stay.
        // Buffered bytes of the failed attempt are flushed first: written after the cut, they
        // would land behind a hole at their old offset.
        fflush(respStream);
        if (respStreamStart < 0 || ftruncate(fileno(respStream), respStreamStart) != 0 ||
            fseeko(respStream, respStreamStart, SEEK_SET) != 0) {
            return false;
        }
    }
    reqStreamRead = 0;
    respStreamWritten = 0;
    return true;
}

constexpr int kLineHeaderNoValue = 307;

size_t CredRequestPrivate::WriteHeaderToJsonValue(char *data, size_t size, size_t nmemb,
                                                  Json::Value *headers) {
    const size_t total = size * nmemb;
    try {
        std::string line(data, total);
        const size_t colon = line.find(':');
        if (colon == std::string::npos) {
            return total;  // the status line and the blank line that ends the headers
        }
        try {
            // One blank after the colon and the closing CR LF are assumed; a header with no
            // value runs past the end of the line and is reported instead of stored.
            line = line.substr(0, total - 2);
            const std::string name = line.substr(0, colon);
            const std::string value = line.substr(colon + 2);
            (*headers)[name] = value;
        } catch (const std::out_of_range &e) {
            kova::Log("%s:%d HTTP header has no value:%s", kUnit, kLineHeaderNoValue, e.what());
        }
    } catch (...) {
        // Out of memory: the header is dropped, the transfer goes on.
    }
    return total;
}

size_t CredRequestPrivate::WriteHeaderToStdout(char *data, size_t size, size_t nmemb,
                                               const Json::Value *message) {
    const size_t total = size * nmemb;
    if (!headerMessageShown.exchange(true)) {
        if (message != nullptr && message->isString()) {
            const char *begin = nullptr;
            const char *end = nullptr;
            if (message->getString(&begin, &end) && end != begin) {
                fwrite(begin, 1, static_cast<size_t>(end - begin), stdout);
                fwrite("\r\n", 1, 2, stdout);
            }
        }
    }
    const std::string_view line(data, total);
    if (line.find(':') != std::string_view::npos &&
        line.find("Transfer-Encoding:") == std::string_view::npos) {
        return fwrite(data, size, nmemb, stdout);
    }
    if (line == "\r\n") {
        return fwrite(data, size, nmemb, stdout);
    }
    return total;
}

constexpr int kLineDebugTrace = 360;

int CredRequestPrivate::DebugCallback(void * /*handle*/, curl_infotype type, char *data,
                                      size_t size, void * /*user*/) {
    static const char *const kPrefixes[] = {
        "=> TEXT",      "<= Recv header",   "=> Send header",   "<= Recv data",
        "=> Send data", "<= Recv SSL data", "=> Send SSL data",
    };
    const int index = static_cast<int>(type);
    if (index < 0 || index > 6) {
        return 0;
    }
    // libcurl's trace data is not NUL-terminated; the record holds exactly `size` bytes.
    const int length = size > 1 << 20 ? 1 << 20 : static_cast<int>(size);
    kova::Log("%s:%d %s\n%.*s", kUnit, kLineDebugTrace, kPrefixes[index], length, data);
    return 0;
}

}  // namespace KOVA
