#include "simlib/webapi_sim.h"

#include <stdlib.h>
#include <time.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <openssl/rsa.h>

#include "simlib/sim_json.h"

namespace kovasim {

namespace {

const char kAesTextField[] = "__tXeTrEhPiC";
const char kAesTokenField[] = "__nEkOtReHpIc";
const int kMaxDelayMs = 60000;

using Params = std::map<std::string, std::string>;

struct EvpPkeyCtxFree {
    void operator()(EVP_PKEY_CTX *ctx) const { EVP_PKEY_CTX_free(ctx); }
};
struct EvpCipherCtxFree {
    void operator()(EVP_CIPHER_CTX *ctx) const { EVP_CIPHER_CTX_free(ctx); }
};
struct BnFree {
    void operator()(BIGNUM *bn) const { BN_free(bn); }
};

// Parameters of APIs whose request format is "JSON" arrive in their JSON form, so a string
// value comes quoted; the standard parameters are read through this in both formats.
std::string Plain(const std::string &value) {
    if (value.size() >= 2 && value.front() == '"') {
        Json::Value parsed;
        if (ParseJson(value, parsed, true) && parsed.isString()) {
            return parsed.asString();
        }
    }
    return value;
}

void ParsePairs(const std::string &text, Params &into, bool overwrite) {
    httplib::Params pairs;
    httplib::detail::parse_query_text(text, pairs);
    for (const auto &p : pairs) {
        if (overwrite) {
            into[p.first] = p.second;
        } else {
            into.emplace(p.first, p.second);
        }
    }
}

bool Base64Decode(const std::string &text, std::string &out) {
    static const std::string kAlphabet =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    out.clear();
    unsigned int acc = 0;
    int bits = 0;
    size_t padding = 0;
    for (char c : text) {
        if (c == '=') {
            ++padding;
            continue;
        }
        if (padding > 0) {
            return false;  // data after padding
        }
        size_t v = kAlphabet.find(c);
        if (v == std::string::npos) {
            return false;
        }
        acc = (acc << 6) | static_cast<unsigned int>(v);
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            out.push_back(static_cast<char>((acc >> bits) & 0xFF));
        }
    }
    return padding <= 2;
}

std::string RandomHex(size_t bytes) {
    std::vector<unsigned char> buf(bytes);
    if (RAND_bytes(buf.data(), static_cast<int>(buf.size())) != 1) {
        for (auto &b : buf) {
            b = static_cast<unsigned char>(rand() & 0xFF);
        }
    }
    static const char kHex[] = "0123456789abcdef";
    std::string out;
    for (unsigned char b : buf) {
        out.push_back(kHex[b >> 4]);
        out.push_back(kHex[b & 15]);
    }
    return out;
}

std::string CookieValue(const httplib::Request &req, const std::string &name) {
    std::string header = req.get_header_value("Cookie");
    std::istringstream in(header);
    std::string item;
    while (std::getline(in, item, ';')) {
        size_t start = item.find_first_not_of(' ');
        if (start == std::string::npos) {
            continue;
        }
        item = item.substr(start);
        size_t eq = item.find('=');
        if (eq != std::string::npos && item.substr(0, eq) == name) {
            return item.substr(eq + 1);
        }
    }
    return "";
}

bool ToInt(const std::string &text, long &value) {
    if (text.empty()) {
        return false;
    }
    char *end = nullptr;
    value = strtol(text.c_str(), &end, 10);
    return end != nullptr && *end == '\0';
}

}  // namespace

struct WebApiSim::KeyPair {
    EVP_PKEY *key = nullptr;
    ~KeyPair() { EVP_PKEY_free(key); }
};

// One WebAPI request on its way through the handlers.
struct WebApiSim::Call {
    const httplib::Request &req;
    httplib::Response &res;
    Params params;
    std::vector<const httplib::MultipartFormData *> files;
    std::string envelope = "plain";
    Api api;
    long version = 0;
    std::string method;

    Call(const httplib::Request &r, httplib::Response &s) : req(r), res(s) {}

    bool Has(const std::string &name) const { return params.count(name) > 0; }
    std::string Get(const std::string &name) const {
        auto it = params.find(name);
        return it == params.end() ? "" : Plain(it->second);
    }
    void Ok(const Json::Value &data) {
        Json::Value answer(Json::objectValue);
        answer["success"] = true;
        answer["data"] = data;
        res.status = 200;
        res.set_content(WriteJson(answer), "application/json");
    }
    void Fail(int code) {
        Json::Value answer(Json::objectValue);
        answer["success"] = false;
        answer["error"]["code"] = code;
        res.status = 200;
        res.set_content(WriteJson(answer), "application/json");
    }
};

std::vector<WebApiSim::Api> WebApiSim::DefaultApis() {
    return {
        {"KOVA.API.Info", "query.cgi", 1, 1, "", "info"},
        {"KOVA.API.Encryption", "encryption.cgi", 1, 1, "", "encryption"},
        {"KOVA.API.Auth", "auth.cgi", 1, 3, "", "auth"},
        {"KOVA.Demo.Echo", "entry.cgi", 1, 2, "", "echo"},
        {"KOVA.Demo.Json", "entry.cgi", 1, 1, "JSON", "json"},
        {"KOVA.Demo.Upload", "upload.cgi", 1, 1, "", "upload"},
        {"KOVA.Demo.Session", "entry.cgi", 1, 1, "", "session"},
        {"KOVA.Demo.Delay", "delay.cgi", 1, 1, "", "delay"},
    };
}

WebApiSim::WebApiSim() : key_(std::make_unique<KeyPair>()) {
    for (const auto &api : DefaultApis()) {
        apis_[api.name] = api;
    }
    accounts_ = {{"admin", "secret", ""}, {"otpuser", "secret", "123456"}};
    key_->key = EVP_RSA_gen(2048);
    BIGNUM *n = nullptr;
    if (key_->key != nullptr && EVP_PKEY_get_bn_param(key_->key, OSSL_PKEY_PARAM_RSA_N, &n) == 1) {
        std::unique_ptr<BIGNUM, BnFree> modulus(n);
        char *hex = BN_bn2hex(modulus.get());
        if (hex != nullptr) {
            publicKeyHex_ = hex;
            OPENSSL_free(hex);
        }
    }
}

WebApiSim::~WebApiSim() = default;

bool WebApiSim::Configure(const Json::Value &config, std::string *error) {
    auto fail = [error](const std::string &message) {
        if (error != nullptr) {
            *error = message;
        }
        return false;
    };
    if (config.isNull()) {
        return true;
    }
    if (!config.isObject()) {
        return fail("webapi configuration must be an object");
    }
    std::map<std::string, Api> apis;
    std::vector<Account> accounts;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        apis = apis_;
        accounts = accounts_;
    }
    const Json::Value &apiTable = config["apis"];
    if (!apiTable.isNull() && !apiTable.isObject()) {
        return fail("\"apis\" must be an object");
    }
    for (const auto &name : apiTable.getMemberNames()) {
        const Json::Value &entry = apiTable[name];
        if (entry.isNull()) {
            apis.erase(name);
            continue;
        }
        if (!entry.isObject() || !entry["path"].isString()) {
            return fail("API " + name + " needs a \"path\" string");
        }
        Api api = apis.count(name) ? apis[name] : Api();
        api.name = name;
        api.path = entry["path"].asString();
        if (!entry.isMember("handler") && api.handler.empty()) {
            api.handler = "echo";
        }
        if (entry.isMember("handler")) {
            static const char *kHandlers[] = {"info", "encryption", "auth",    "echo",
                                              "json", "upload",     "session", "delay"};
            std::string handler = entry["handler"].asString();
            bool known = false;
            for (const char *h : kHandlers) {
                known = known || handler == h;
            }
            if (!known) {
                return fail("API " + name + ": unknown handler \"" + handler + "\"");
            }
            api.handler = handler;
        }
        if (entry.isMember("minVersion")) {
            if (!entry["minVersion"].isInt()) {
                return fail("API " + name + ": \"minVersion\" must be an integer");
            }
            api.minVersion = entry["minVersion"].asInt();
        }
        if (entry.isMember("maxVersion")) {
            if (!entry["maxVersion"].isInt()) {
                return fail("API " + name + ": \"maxVersion\" must be an integer");
            }
            api.maxVersion = entry["maxVersion"].asInt();
        }
        if (entry.isMember("requestFormat")) {
            api.requestFormat = entry["requestFormat"].asString();
        }
        apis[name] = api;
    }
    if (config.isMember("accounts")) {
        const Json::Value &list = config["accounts"];
        if (!list.isArray()) {
            return fail("\"accounts\" must be an array");
        }
        accounts.clear();
        for (const auto &a : list) {
            if (!a.isObject() || !a["account"].isString() || !a["password"].isString()) {
                return fail("every account needs \"account\" and \"password\" strings");
            }
            accounts.push_back(
                {a["account"].asString(), a["password"].asString(), a.get("otp", "").asString()});
        }
    }
    for (const char *key : {"delayMs", "tokenWindow"}) {
        if (config.isMember(key) && !config[key].isInt()) {
            return fail(std::string("\"") + key + "\" must be an integer");
        }
    }
    for (const char *key : {"aesToken", "aesKey", "uploadDir"}) {
        if (config.isMember(key) && !config[key].isString()) {
            return fail(std::string("\"") + key + "\" must be a string");
        }
    }
    if (config.isMember("requireEncryption") && !config["requireEncryption"].isBool()) {
        return fail("\"requireEncryption\" must be true or false");
    }
    std::lock_guard<std::mutex> lock(mutex_);
    apis_ = apis;
    accounts_ = accounts;
    aesToken_ = config.get("aesToken", aesToken_).asString();
    aesKey_ = config.get("aesKey", aesKey_).asString();
    uploadDir_ = config.get("uploadDir", uploadDir_).asString();
    delayMs_ = config.get("delayMs", delayMs_.load()).asInt();
    tokenWindow_ = config.get("tokenWindow", tokenWindow_.load()).asInt();
    requireEncryption_ = config.get("requireEncryption", requireEncryption_).asBool();
    return true;
}

void WebApiSim::SetAccounts(const std::vector<Account> &accounts) {
    std::lock_guard<std::mutex> lock(mutex_);
    accounts_ = accounts;
}

void WebApiSim::SetApi(const Api &api) {
    std::lock_guard<std::mutex> lock(mutex_);
    apis_[api.name] = api;
}

void WebApiSim::RemoveApi(const std::string &name) {
    std::lock_guard<std::mutex> lock(mutex_);
    apis_.erase(name);
}

void WebApiSim::SetAesSecret(const std::string &token, const std::string &key) {
    std::lock_guard<std::mutex> lock(mutex_);
    aesToken_ = token;
    aesKey_ = key;
}

void WebApiSim::Install(LoopbackServer &server) {
    server.Route("*", "/webapi/.*",
                 [this](const httplib::Request &req, httplib::Response &res) { Handle(req, res); });
    server.Route("POST", "/raw/echo", [](const httplib::Request &req, httplib::Response &res) {
        res.set_content(req.body, "application/octet-stream");
    });
}

void WebApiSim::InstallRedirect(LoopbackServer &server, int httpsPort) {
    server.Route("*", ".*", [httpsPort](const httplib::Request &req, httplib::Response &res) {
        res.set_redirect("https://127.0.0.1:" + std::to_string(httpsPort) + req.target, 302);
    });
}

long WebApiSim::Now() const {
    return static_cast<long>(time(nullptr)) + clockSkew_.load();
}

size_t WebApiSim::Hits(const std::string &api) const {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = hits_.find(api);
    return it == hits_.end() ? 0 : it->second;
}

std::vector<WebApiSim::LoginRecord> WebApiSim::Logins() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return logins_;
}

WebApiSim::LoginRecord WebApiSim::LastLogin() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return logins_.empty() ? LoginRecord() : logins_.back();
}

std::vector<WebApiSim::UploadRecord> WebApiSim::Uploads() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return uploads_;
}

bool WebApiSim::SessionValid(const std::string &sid) const {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = sessions_.find(sid);
    return it != sessions_.end() && it->second.valid;
}

size_t WebApiSim::ActiveSessions() const {
    std::lock_guard<std::mutex> lock(mutex_);
    size_t n = 0;
    for (const auto &s : sessions_) {
        n += s.second.valid ? 1 : 0;
    }
    return n;
}

bool WebApiSim::DecryptRsa(const std::string &base64, std::string &plain) const {
    std::string cipher;
    if (key_->key == nullptr || !Base64Decode(base64, cipher) || cipher.empty()) {
        return false;
    }
    std::unique_ptr<EVP_PKEY_CTX, EvpPkeyCtxFree> ctx(EVP_PKEY_CTX_new(key_->key, nullptr));
    if (!ctx || EVP_PKEY_decrypt_init(ctx.get()) != 1 ||
        EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) != 1) {
        return false;
    }
    const unsigned char *in = reinterpret_cast<const unsigned char *>(cipher.data());
    size_t outLen = 0;
    if (EVP_PKEY_decrypt(ctx.get(), nullptr, &outLen, in, cipher.size()) != 1) {
        return false;
    }
    std::vector<unsigned char> out(outLen);
    if (EVP_PKEY_decrypt(ctx.get(), out.data(), &outLen, in, cipher.size()) != 1) {
        return false;
    }
    plain.assign(reinterpret_cast<const char *>(out.data()), outLen);
    return true;
}

bool WebApiSim::DecryptAes(const std::string &base64, std::string &plain) const {
    std::string cipher;
    std::string passphrase;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        passphrase = aesKey_;
    }
    if (!Base64Decode(base64, cipher) || cipher.empty()) {
        return false;
    }
    unsigned char key[32];
    unsigned char iv[16];
    if (EVP_BytesToKey(EVP_aes_256_cbc(), EVP_sha1(), nullptr,
                       reinterpret_cast<const unsigned char *>(passphrase.data()),
                       static_cast<int>(passphrase.size()), 5, key, iv) != 32) {
        return false;
    }
    std::unique_ptr<EVP_CIPHER_CTX, EvpCipherCtxFree> ctx(EVP_CIPHER_CTX_new());
    std::vector<unsigned char> out(cipher.size() + 32);
    int len = 0;
    int finalLen = 0;
    if (!ctx || EVP_DecryptInit_ex(ctx.get(), EVP_aes_256_cbc(), nullptr, key, iv) != 1 ||
        EVP_DecryptUpdate(ctx.get(), out.data(), &len,
                          reinterpret_cast<const unsigned char *>(cipher.data()),
                          static_cast<int>(cipher.size())) != 1 ||
        EVP_DecryptFinal_ex(ctx.get(), out.data() + len, &finalLen) != 1) {
        return false;
    }
    plain.assign(reinterpret_cast<const char *>(out.data()), static_cast<size_t>(len + finalLen));
    return true;
}

// Replaces the envelope fields by the parameters they carry. False after answering with an
// error.
bool WebApiSim::OpenEnvelopes(Call &call) {
    auto rsa = call.params.find(cipherKey_);
    if (rsa != call.params.end()) {
        std::string plain;
        if (!DecryptRsa(Plain(rsa->second), plain)) {
            call.Fail(kErrBadEnvelope);
            return false;
        }
        call.params.erase(rsa);
        ParsePairs(plain, call.params, true);
        call.envelope = "rsa";
        long stamp = 0;
        long now = Now();
        if (!call.Has(cipherToken_) || !ToInt(call.Get(cipherToken_), stamp) || stamp > now + 5 ||
            now - stamp > tokenWindow_.load()) {
            call.Fail(kErrStaleToken);
            return false;
        }
        call.params.erase(cipherToken_);
    }
    auto aes = call.params.find(kAesTextField);
    if (aes != call.params.end()) {
        std::string token;
        {
            std::lock_guard<std::mutex> lock(mutex_);
            token = aesToken_;
        }
        std::string plain;
        if (call.Get(kAesTokenField) != token || !DecryptAes(Plain(aes->second), plain)) {
            call.Fail(kErrBadEnvelope);
            return false;
        }
        call.params.erase(kAesTextField);
        call.params.erase(kAesTokenField);
        ParsePairs(plain, call.params, true);
        call.envelope = "aes";
    }
    return true;
}

void WebApiSim::Handle(const httplib::Request &req, httplib::Response &res) {
    Call call(req, res);
    try {
        size_t q = req.target.find('?');
        if (q != std::string::npos) {
            ParsePairs(req.target.substr(q + 1), call.params, false);
        }
        if (req.is_multipart_form_data()) {
            for (const auto &f : req.files) {
                if (f.second.filename.empty()) {
                    call.params.emplace(f.second.name, f.second.content);
                } else {
                    call.files.push_back(&f.second);
                }
            }
        } else if (req.get_header_value("Content-Type").find("application/x-www-form-urlencoded") ==
                   0) {
            ParsePairs(req.body, call.params, false);
        }
        if (!OpenEnvelopes(call)) {
            return;
        }
        if (!call.Has("api") || !call.Has("version") || !call.Has("method")) {
            call.Fail(kErrMissingParam);
            return;
        }
        std::string name = call.Get("api");
        {
            std::lock_guard<std::mutex> lock(mutex_);
            auto it = apis_.find(name);
            if (it == apis_.end() || req.path != "/webapi/" + it->second.path) {
                call.Fail(kErrNoSuchApi);
                return;
            }
            call.api = it->second;
            ++hits_[name];
        }
        if (!ToInt(call.Get("version"), call.version)) {
            call.Fail(kErrBadParam);
            return;
        }
        if (call.version < call.api.minVersion || call.version > call.api.maxVersion) {
            call.Fail(kErrBadVersion);
            return;
        }
        call.method = call.Get("method");
        const std::string &h = call.api.handler;
        if (h == "info") {
            HandleInfo(call);
        } else if (h == "encryption") {
            HandleEncryption(call);
        } else if (h == "auth") {
            HandleAuth(call);
        } else if (h == "json") {
            HandleJson(call);
        } else if (h == "upload") {
            HandleUpload(call);
        } else if (h == "session") {
            HandleSession(call);
        } else if (h == "delay") {
            HandleDelay(call);
        } else {
            HandleEcho(call);
        }
    } catch (const std::exception &) {
        call.Fail(kErrUnknown);
    }
}

void WebApiSim::HandleInfo(Call &call) {
    if (call.method != "query") {
        call.Fail(kErrNoSuchMethod);
        return;
    }
    // "query" may name a comma-separated list of APIs; absent or "all" publishes everything.
    std::string wanted = call.Get("query");
    Json::Value data(Json::objectValue);
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto &entry : apis_) {
        const Api &api = entry.second;
        if (!wanted.empty() && wanted != "all" && wanted != "ALL" &&
            ("," + wanted + ",").find("," + api.name + ",") == std::string::npos) {
            continue;
        }
        Json::Value &d = data[api.name];
        d["path"] = api.path;
        d["minVersion"] = api.minVersion;
        d["maxVersion"] = api.maxVersion;
        if (!api.requestFormat.empty()) {
            d["requestFormat"] = api.requestFormat;
        }
    }
    call.Ok(data);
}

void WebApiSim::HandleEncryption(Call &call) {
    if (call.method != "getinfo") {
        call.Fail(kErrNoSuchMethod);
        return;
    }
    Json::Value data(Json::objectValue);
    data["cipherkey"] = cipherKey_;
    data["ciphertoken"] = cipherToken_;
    data["public_key"] = publicKeyHex_;
    data["server_time"] = static_cast<Json::Int64>(Now());
    call.Ok(data);
}

void WebApiSim::HandleAuth(Call &call) {
    if (call.method == "logout") {
        std::string sid = call.Has("_sid") ? call.Get("_sid") : CookieValue(call.req, "id");
        std::string cookie = CookieValue(call.req, "id");
        if (sid.empty()) {
            call.Fail(kErrMissingParam);
            return;
        }
        std::lock_guard<std::mutex> lock(mutex_);
        auto it = sessions_.find(sid);
        if (it == sessions_.end() || !it->second.valid || (!cookie.empty() && cookie != sid)) {
            call.Fail(kErrInvalidSession);
            return;
        }
        it->second.valid = false;
        call.Ok(Json::Value(Json::objectValue));
        return;
    }
    if (call.method != "login") {
        call.Fail(kErrNoSuchMethod);
        return;
    }
    if (call.version != 3) {
        call.Fail(kErrBadVersion);
        return;
    }
    LoginRecord record;
    for (const auto &p : call.params) {
        record.params[p.first] = p.second;
    }
    record.envelope = call.envelope;
    int error = 0;
    std::lock_guard<std::mutex> lock(mutex_);
    if (requireEncryption_ && call.envelope == "plain") {
        error = kErrNeedEncryption;
    } else if (!call.Has("account") || !call.Has("passwd")) {
        error = kErrMissingParam;
    } else {
        const Account *found = nullptr;
        for (const auto &a : accounts_) {
            if (a.name == call.Get("account")) {
                found = &a;
            }
        }
        if (found == nullptr || found->password != call.Get("passwd")) {
            error = kErrWrongPassword;
        } else if (!found->otp.empty() && call.Get("otp_code").empty()) {
            error = kErrOtpRequired;
        } else if (!found->otp.empty() && call.Get("otp_code") != found->otp) {
            error = kErrOtpWrong;
        }
    }
    record.error = error;
    record.success = error == 0;
    logins_.push_back(record);
    if (error != 0) {
        call.Fail(error);
        return;
    }
    Session session;
    session.account = call.Get("account");
    session.kovatoken = RandomHex(12);
    session.session = call.Get("session");
    std::string sid = RandomHex(16);
    sessions_[sid] = session;
    Json::Value data(Json::objectValue);
    data["sid"] = sid;
    data["kovatoken"] = session.kovatoken;
    call.Ok(data);
}

bool WebApiSim::FindSession(Call &call, Session *out) {
    std::string sid = call.Has("_sid") ? call.Get("_sid") : CookieValue(call.req, "id");
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = sessions_.find(sid);
    if (sid.empty() || it == sessions_.end() || !it->second.valid ||
        (call.Has("KovaToken") && call.Get("KovaToken") != it->second.kovatoken)) {
        call.Fail(kErrInvalidSession);
        return false;
    }
    *out = it->second;
    return true;
}

void WebApiSim::HandleEcho(Call &call) {
    Json::Value data(Json::objectValue);
    data["api"] = call.api.name;
    data["version"] = static_cast<Json::Int64>(call.version);
    data["method"] = call.method;
    data["envelope"] = call.envelope;
    Json::Value &params = data["params"] = Json::Value(Json::objectValue);
    for (const auto &p : call.params) {
        if (p.first != "api" && p.first != "version" && p.first != "method") {
            params[p.first] = p.second;
        }
    }
    call.Ok(data);
}

void WebApiSim::HandleJson(Call &call) {
    Json::Value params(Json::objectValue);
    for (const auto &p : call.params) {
        if (p.first == "api" || p.first == "version" || p.first == "method" ||
            p.first == "KovaToken") {
            continue;
        }
        Json::Value value;
        if (!ParseJson(p.second, value, true)) {
            call.Fail(kErrBadParam);
            return;
        }
        params[p.first] = value;
    }
    Json::Value data(Json::objectValue);
    data["method"] = call.method;
    data["params"] = params;
    call.Ok(data);
}

void WebApiSim::HandleUpload(Call &call) {
    Session session;
    if (!FindSession(call, &session)) {
        return;
    }
    if (call.files.empty()) {
        call.Fail(kErrMissingParam);
        return;
    }
    Json::Value data(Json::objectValue);
    Json::Value &files = data["files"] = Json::Value(Json::arrayValue);
    std::string dir;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        dir = uploadDir_;
        for (const auto *f : call.files) {
            uploads_.push_back({f->name, f->filename, f->content});
        }
    }
    for (const auto *f : call.files) {
        if (!dir.empty()) {
            // Only the last path element of the client's name is used.
            std::string base = f->filename.substr(f->filename.find_last_of('/') + 1);
            std::ofstream out(dir + "/" + (base.empty() ? "upload" : base), std::ios::binary);
            out.write(f->content.data(), static_cast<std::streamsize>(f->content.size()));
        }
        Json::Value entry(Json::objectValue);
        entry["field"] = f->name;
        entry["name"] = f->filename;
        entry["size"] = static_cast<Json::UInt64>(f->content.size());
        files.append(entry);
    }
    data["name"] = call.files.front()->filename;
    data["size"] = static_cast<Json::UInt64>(call.files.front()->content.size());
    call.Ok(data);
}

void WebApiSim::HandleSession(Call &call) {
    Session session;
    if (!FindSession(call, &session)) {
        return;
    }
    Json::Value data(Json::objectValue);
    data["account"] = session.account;
    data["session"] = session.session;
    data["method"] = call.method;
    call.Ok(data);
}

void WebApiSim::HandleDelay(Call &call) {
    long ms = delayMs_.load();
    if (call.Has("ms") && !ToInt(call.Get("ms"), ms)) {
        call.Fail(kErrBadParam);
        return;
    }
    ms = std::max(0L, std::min(ms, static_cast<long>(kMaxDelayMs)));
    int now = ++concurrent_;
    int seen = maxConcurrent_.load();
    while (now > seen && !maxConcurrent_.compare_exchange_weak(seen, now)) {
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(ms));
    --concurrent_;
    Json::Value data(Json::objectValue);
    data["delayed_ms"] = static_cast<Json::Int64>(ms);
    call.Ok(data);
}

}  // namespace kovasim
