// kovacred commands over the credential store: add, list, show, remove and session show, set,
// remove. Passwords are read from standard input (never from the command line) and are never
// printed.
#include <stdio.h>
#include <termios.h>
#include <time.h>
#include <unistd.h>

#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include <kovacredential/kovacredential.h>

#include "commands.h"

namespace kovacred {
namespace {

struct CredDeleter {
    void operator()(KOVA_CRED *p) const { KOVACredFree(p); }
};
struct SessDeleter {
    void operator()(KOVA_CRED_SESS *p) const { KOVACredSessFree(p); }
};
using Cred = std::unique_ptr<KOVA_CRED, CredDeleter>;
using Sess = std::unique_ptr<KOVA_CRED_SESS, SessDeleter>;

// Clears the error slot so that a failure reports the code of this call, not an older one.
void ResetError() {
    VLIBCErrSetEx(0, "", 0);
}

// Reports a failed library call with the code it left in the error slot. Statement failures
// leave no code; their cause is only in the system log.
void FailStore(const std::string &what) {
    const int code = VLIBCErrGet();
    if (code == 0) {
        FailText(what + " failed: the database could not be used (details in the system log)");
    } else {
        Fail(what, code);
    }
}

std::string TimeText(int32_t seconds) {
    if (seconds <= 0) {
        return "-";
    }
    time_t t = seconds;
    struct tm tm;
    char buf[32];
    gmtime_r(&t, &tm);
    strftime(buf, sizeof(buf), "%Y-%m-%d %H:%M:%SZ", &tm);
    return buf;
}

// One line from standard input; on a terminal, after a prompt and without echo.
bool ReadPassword(std::string *password) {
    const bool terminal = isatty(STDIN_FILENO) != 0;
    struct termios saved;
    if (terminal) {
        fprintf(stderr, "Password: ");
        fflush(stderr);
        if (tcgetattr(STDIN_FILENO, &saved) == 0) {
            struct termios quiet = saved;
            quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
            tcsetattr(STDIN_FILENO, TCSANOW, &quiet);
        }
    }
    const bool got = static_cast<bool>(std::getline(std::cin, *password));
    if (terminal) {
        tcsetattr(STDIN_FILENO, TCSANOW, &saved);
        fprintf(stderr, "\n");
    }
    if (!password->empty() && password->back() == '\r') {
        password->pop_back();
    }
    return got;
}

// Loads credential `id` into a fresh record; null (after reporting why) when it cannot.
Cred LoadCredential(const std::string &command, int id) {
    Cred cred(KOVACredAlloc());
    if (!cred) {
        FailStore(command);
        return nullptr;
    }
    ResetError();
    if (KOVACredGetByID(id, cred.get()) != 0) {
        FailStore(command + ": reading credential " + std::to_string(id));
        return nullptr;
    }
    if (cred->id == -1) {
        FailText(command + ": no credential with id " + std::to_string(id));
        return nullptr;
    }
    return cred;
}

Sess LoadSession(const std::string &command, int id) {
    Sess sess(KOVACredSessAlloc());
    if (!sess) {
        FailStore(command);
        return nullptr;
    }
    ResetError();
    if (KOVACredSessGetByID(id, sess.get()) != 0) {
        FailStore(command + ": reading the session of credential " + std::to_string(id));
        return nullptr;
    }
    if (sess->id == -1) {
        FailText(command + ": no session for credential " + std::to_string(id));
        return nullptr;
    }
    return sess;
}

struct AddOptions {
    std::string host;
    int port = 0;
    std::string protocol = "https";
    std::string account;
    std::string application;
    std::string extra;
    int owner = -1;
};

void RunAdd(const AddOptions &opts) {
    std::string password;
    if (!ReadPassword(&password)) {
        FailText("add: no password on standard input (give it as one line)");
        return;
    }
    Cred cred(KOVACredAlloc());
    if (!cred) {
        FailStore("add");
        return;
    }
    cred->host = opts.host;
    cred->port = opts.port;
    cred->protocol = opts.protocol;
    cred->remote_account = opts.account;
    cred->remote_passwd = password;
    cred->application = opts.application;
    cred->extra_info = opts.extra;
    cred->owner = opts.owner;
    ResetError();
    if (KOVACredAdd(cred.get()) != 0) {
        FailStore("add credential");
        return;
    }
    printf("added credential %d\n", cred->id);
}

Json::Value CredentialJson(const KOVA_CRED &cred) {
    Json::Value v(Json::objectValue);
    v["id"] = cred.id;
    v["host"] = cred.host;
    v["port"] = cred.port;
    v["protocol"] = cred.protocol;
    v["account"] = cred.remote_account;
    v["application"] = cred.application;
    v["owner"] = cred.owner;
    v["extra"] = cred.extra_info;
    v["ctime"] = cred.ctime;
    v["mtime"] = cred.mtime;
    return v;
}

void RunList(bool json) {
    KOVA_CRED *list = nullptr;
    ResetError();
    const int count = KOVACredListGet(&list, nullptr, nullptr);
    if (count < 0) {
        FailStore("list credentials");
        return;
    }
    // The library lists the newest first; people read a table oldest first.
    std::vector<const KOVA_CRED *> creds;
    for (KOVA_CRED *p = list; p != nullptr; p = KOVACredNext(p)) {
        creds.insert(creds.begin(), p);
    }
    if (json) {
        Json::Value out(Json::arrayValue);
        for (const KOVA_CRED *c : creds) {
            out.append(CredentialJson(*c));
        }
        PrintJson(out);
    } else if (creds.empty()) {
        printf("no credentials\n");
    } else {
        std::vector<std::vector<std::string>> rows = {
            {"ID", "HOST", "PORT", "PROTOCOL", "ACCOUNT", "APPLICATION", "OWNER", "MODIFIED"}};
        for (const KOVA_CRED *c : creds) {
            rows.push_back({std::to_string(c->id), Printable(c->host), std::to_string(c->port),
                            Printable(c->protocol), Printable(c->remote_account),
                            Printable(c->application), std::to_string(c->owner),
                            TimeText(c->mtime)});
        }
        PrintTable(rows);
    }
    KOVACredListFree(&list);
}

void RunShow(int id, bool json) {
    Cred cred = LoadCredential("show", id);
    if (!cred) {
        return;
    }
    Sess sess(KOVACredSessAlloc());
    const bool hasSession = sess && KOVACredSessGetByID(id, sess.get()) == 0 && sess->id != -1;
    if (json) {
        Json::Value out = CredentialJson(*cred);
        out["session"] = hasSession;
        PrintJson(out);
        return;
    }
    PrintTable({
        {"id:", std::to_string(cred->id)},
        {"host:", Printable(cred->host)},
        {"port:", std::to_string(cred->port)},
        {"protocol:", Printable(cred->protocol)},
        {"account:", Printable(cred->remote_account)},
        {"password:", cred->remote_passwd.empty() ? "(empty)" : "(stored, not shown)"},
        {"application:", Printable(cred->application)},
        {"owner:", std::to_string(cred->owner)},
        {"extra:", Printable(cred->extra_info)},
        {"created:", TimeText(cred->ctime)},
        {"modified:", TimeText(cred->mtime)},
        {"session:", hasSession ? "stored" : "none"},
    });
}

void RunRemove(int id) {
    if (!LoadCredential("remove", id)) {
        return;
    }
    ResetError();
    if (KOVACredRemoveByID(id) != 0) {
        FailStore("remove credential " + std::to_string(id));
        return;
    }
    printf("removed credential %d\n", id);
}

// The one place that prints a session id and token: the user asked for them by name.
void RunSessionShow(int id, bool json) {
    Sess sess = LoadSession("session show", id);
    if (!sess) {
        return;
    }
    if (json) {
        Json::Value out(Json::objectValue);
        out["id"] = sess->id;
        out["sid"] = sess->access_token;
        out["token"] = sess->csrf_token;
        out["extra"] = sess->extra_info;
        PrintJson(out);
        return;
    }
    PrintTable({
        {"id:", std::to_string(sess->id)},
        {"sid:", Printable(sess->access_token)},
        {"token:", Printable(sess->csrf_token)},
        {"extra:", Printable(sess->extra_info)},
    });
}

struct SessionSetOptions {
    int id = 0;
    std::string sid;
    std::string token;
    std::string extra;
};

void RunSessionSet(const SessionSetOptions &opts) {
    if (!LoadCredential("session set", opts.id)) {
        return;
    }
    Sess sess(KOVACredSessAlloc());
    if (!sess) {
        FailStore("session set");
        return;
    }
    sess->id = opts.id;
    sess->access_token = opts.sid;
    sess->csrf_token = opts.token;
    sess->extra_info = opts.extra;
    ResetError();
    if (KOVACredSessSetByID(opts.id, sess.get()) != 0) {
        FailStore("set session of credential " + std::to_string(opts.id));
        return;
    }
    printf("stored session of credential %d\n", opts.id);
}

void RunSessionRemove(int id) {
    if (!LoadSession("session remove", id)) {
        return;
    }
    ResetError();
    if (KOVACredSessRemoveByID(id) != 0) {
        FailStore("remove session of credential " + std::to_string(id));
        return;
    }
    printf("removed session of credential %d\n", id);
}

struct IdOptions {
    int id = 0;
    bool json = false;
};

CLI::Option *AddIdArgument(CLI::App *cmd, int *id) {
    return cmd->add_option("id", *id, "credential id")->required()->check(CLI::PositiveNumber);
}

void RegisterStore(CLI::App &app) {
    auto addOpts = std::make_shared<AddOptions>();
    CLI::App *add = app.add_subcommand(
        "add", "store a credential; the password is read from standard input (one line)");
    add->add_option("--host", addOpts->host, "remote host")->required();
    add->add_option("--port", addOpts->port, "remote port")
        ->required()
        ->check(CLI::Range(1, 65535));
    add->add_option("--protocol", addOpts->protocol, "protocol (default https)");
    add->add_option("--account", addOpts->account, "remote account")->required();
    add->add_option("--application", addOpts->application, "application tag");
    add->add_option("--extra", addOpts->extra, "free-form extra information");
    add->add_option("--owner", addOpts->owner, "owning user id (default -1: none)");
    add->callback([addOpts] { RunAdd(*addOpts); });

    auto json = std::make_shared<bool>(false);
    CLI::App *list = app.add_subcommand("list", "list the stored credentials (no passwords)");
    AddJsonFlag(list, json.get());
    list->callback([json] { RunList(*json); });

    auto showOpts = std::make_shared<IdOptions>();
    CLI::App *show = app.add_subcommand("show", "show one credential (no password)");
    AddIdArgument(show, &showOpts->id);
    AddJsonFlag(show, &showOpts->json);
    show->callback([showOpts] { RunShow(showOpts->id, showOpts->json); });

    auto removeId = std::make_shared<int>(0);
    CLI::App *remove = app.add_subcommand("remove", "remove a credential and its session");
    AddIdArgument(remove, removeId.get());
    remove->callback([removeId] { RunRemove(*removeId); });

    CLI::App *session = app.add_subcommand("session", "the stored session of a credential");
    session->require_subcommand(1);

    auto sessShowOpts = std::make_shared<IdOptions>();
    CLI::App *sessShow = session->add_subcommand(
        "show", "show the session of a credential (the only output with its id and token)");
    AddIdArgument(sessShow, &sessShowOpts->id);
    AddJsonFlag(sessShow, &sessShowOpts->json);
    sessShow->callback([sessShowOpts] { RunSessionShow(sessShowOpts->id, sessShowOpts->json); });

    auto setOpts = std::make_shared<SessionSetOptions>();
    CLI::App *sessSet = session->add_subcommand("set", "store (replace) a credential's session");
    AddIdArgument(sessSet, &setOpts->id);
    sessSet->add_option("--sid", setOpts->sid, "session id")->required();
    sessSet->add_option("--token", setOpts->token, "CSRF token");
    sessSet->add_option("--extra", setOpts->extra, "free-form extra information");
    sessSet->callback([setOpts] { RunSessionSet(*setOpts); });

    auto sessRemoveId = std::make_shared<int>(0);
    CLI::App *sessRemove = session->add_subcommand("remove", "remove the session of a credential");
    AddIdArgument(sessRemove, sessRemoveId.get());
    sessRemove->callback([sessRemoveId] { RunSessionRemove(*sessRemoveId); });
}

const Registrar kStoreCommands(RegisterStore);

}  // namespace
}  // namespace kovacred
