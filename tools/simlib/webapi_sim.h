// The WebAPI role of kovasim: API discovery, encryption information, login and logout with
// RSA and AES parameter envelopes, and a handful of demo APIs, installed as routes on a
// kovasim::LoopbackServer so that tests can run it in-process.
//
// Every WebAPI answer is HTTP 200 with a JSON envelope: {"success":true,"data":{...}} or
// {"success":false,"error":{"code":N}} (codes in WebApiSim::ErrorCode). Requests reach
// "/webapi/<path>", where <path> is the one the API table gives for the "api" parameter.
#ifndef KOVASIM_WEBAPI_SIM_H
#define KOVASIM_WEBAPI_SIM_H

#include <stdint.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <json/value.h>

#include "simlib/loopback_server.h"

namespace kovasim {

class WebApiSim {
  public:
    // Error codes of the simulator's JSON error answers.
    enum ErrorCode {
        kErrUnknown = 100,       // internal failure
        kErrMissingParam = 101,  // "api", "version", "method" or an API's own parameter
        kErrNoSuchApi = 102,     // API not in the table, or reached through another path
        kErrNoSuchMethod = 103,
        kErrBadVersion = 104,      // outside minVersion..maxVersion
        kErrBadParam = 105,        // a parameter that cannot be read (JSON API, bad number)
        kErrInvalidSession = 106,  // unknown or logged-out "_sid", or a mismatching token
        kErrBadEnvelope = 107,     // an RSA or AES envelope that cannot be opened
        kErrStaleToken = 108,      // the RSA envelope's ciphertoken is missing or too old
        kErrNeedEncryption = 109,  // login parameters sent in plain text
        kErrWrongPassword = 400,   // unknown account or wrong password
        kErrOtpRequired = 403,     // the account needs a one-time code
        kErrOtpWrong = 404,        // wrong one-time code
    };

    struct Account {
        std::string name;
        std::string password;
        std::string otp;  // one-time code the account requires; "" for none
    };

    struct Api {
        std::string name;  // e.g. "KOVA.API.Auth"
        std::string path;  // relative to "webapi/"
        int minVersion = 1;
        int maxVersion = 1;
        std::string requestFormat;  // "JSON" or "" (not published when empty)
        std::string handler;        // "info", "encryption", "auth", "echo", "json", "upload",
                                    // "session", "delay"
    };

    // One login as the server saw it.
    struct LoginRecord {
        std::map<std::string, std::string> params;  // decrypted and decoded
        std::string envelope;                       // "rsa", "aes" or "plain"
        bool success = false;
        int error = 0;
    };

    struct UploadRecord {
        std::string field;
        std::string filename;
        std::string content;
    };

    // The default table (see DefaultApis), one account "admin"/"secret" and an account
    // "otpuser"/"secret" that needs the one-time code "123456". Makes the RSA key.
    WebApiSim();
    ~WebApiSim();
    WebApiSim(const WebApiSim &) = delete;
    WebApiSim &operator=(const WebApiSim &) = delete;

    // Applies a configuration object (the "webapi" member of kovasim's configuration):
    //   "apis": {NAME: {"path", "minVersion", "maxVersion", "requestFormat", "handler"}}
    //           merged over the default table ({NAME: null} removes an entry),
    //   "accounts": [{"account", "password", "otp"}] replaces the accounts,
    //   "aesToken", "aesKey": the token and pass phrase of the AES envelope,
    //   "delayMs": default delay of the delay API,
    //   "tokenWindow": seconds a ciphertoken stays valid (default 300),
    //   "requireEncryption": whether login parameters must come in an envelope (default true),
    //   "uploadDir": folder where uploads are also written ("" keeps them in memory only).
    // False with a message for a malformed configuration; nothing is changed then.
    bool Configure(const Json::Value &config, std::string *error);

    // Installs the WebAPI routes on `server`, and "/raw/echo", which answers a POST with its
    // body as it came (for streamed uploads and downloads). Call before server.Start(). The
    // simulator must outlive the server's serving.
    void Install(LoopbackServer &server);
    // Makes `server` answer every request with a 302 to the same path on
    // https://127.0.0.1:httpsPort.
    static void InstallRedirect(LoopbackServer &server, int httpsPort);

    static std::vector<Api> DefaultApis();

    // Programmatic configuration (before serving starts).
    void SetAccounts(const std::vector<Account> &accounts);
    void SetApi(const Api &api);
    void RemoveApi(const std::string &name);
    void SetAesSecret(const std::string &token, const std::string &key);
    void SetDelayMs(int ms) { delayMs_ = ms; }
    void SetTokenWindow(int seconds) { tokenWindow_ = seconds; }
    // Moves the clock the simulator reports as "server_time" (and checks ciphertokens
    // against) by `seconds`.
    void SetClockSkew(int seconds) { clockSkew_ = seconds; }

    // Observations.
    size_t Hits(const std::string &api) const;  // requests that named this API
    size_t QueryHits() const { return Hits("KOVA.API.Info"); }
    std::vector<LoginRecord> Logins() const;
    LoginRecord LastLogin() const;
    std::vector<UploadRecord> Uploads() const;
    bool SessionValid(const std::string &sid) const;
    size_t ActiveSessions() const;
    const std::string &PublicKeyHex() const { return publicKeyHex_; }
    const std::string &CipherKey() const { return cipherKey_; }
    const std::string &CipherToken() const { return cipherToken_; }
    int MaxConcurrent() const { return maxConcurrent_; }  // of the delay API

  private:
    struct Session {
        std::string account;
        std::string kovatoken;
        std::string session;  // the "session" name given at login
        bool valid = true;
    };
    struct Call;

    void Handle(const httplib::Request &req, httplib::Response &res);
    void HandleInfo(Call &call);
    void HandleEncryption(Call &call);
    void HandleAuth(Call &call);
    void HandleEcho(Call &call);
    void HandleJson(Call &call);
    void HandleUpload(Call &call);
    void HandleSession(Call &call);
    void HandleDelay(Call &call);

    bool OpenEnvelopes(Call &call);
    bool DecryptRsa(const std::string &base64, std::string &plain) const;
    bool DecryptAes(const std::string &base64, std::string &plain) const;
    // The session a request names ("_sid", else the cookie "id"), with its token checked.
    bool FindSession(Call &call, Session *out);
    long Now() const;

    mutable std::mutex mutex_;
    std::map<std::string, Api> apis_;
    std::vector<Account> accounts_;
    std::map<std::string, Session> sessions_;
    std::vector<LoginRecord> logins_;
    std::vector<UploadRecord> uploads_;
    std::map<std::string, size_t> hits_;
    std::string aesToken_ = "kovasim-aes-token";
    std::string aesKey_ = "kovasim-aes-key";
    std::string uploadDir_;
    std::atomic<int> delayMs_{0};
    std::atomic<int> tokenWindow_{300};
    std::atomic<int> clockSkew_{0};
    bool requireEncryption_ = true;
    std::atomic<int> concurrent_{0};
    std::atomic<int> maxConcurrent_{0};

    struct KeyPair;
    std::unique_ptr<KeyPair> key_;
    std::string publicKeyHex_;
    std::string cipherKey_ = "__cIpHeRtExT";
    std::string cipherToken_ = "__cIpHeRtOkEn";
};

}  // namespace kovasim

#endif  // KOVASIM_WEBAPI_SIM_H
