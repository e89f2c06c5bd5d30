// kovacred commands over the credential store: add, passwd, list, show, remove and session
// show, set, remove. Passwords, session ids and tokens are read from standard input (never from
// the command line); passwords are never printed.
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

// One line from standard input; on a terminal, after `prompt` and without echo. The line's
// end (and a carriage return) is not part of it. False at the end of the input.
bool ReadSecret(const char *prompt, std::string *secret) {
    const bool terminal = isatty(STDIN_FILENO) != 0;
    struct termios saved;
    if (terminal) {
        fprintf(stderr, "%s: ", prompt);
        fflush(stderr);
        if (tcgetattr(STDIN_FILENO, &saved) == 0) {
            struct termios quiet = saved;
            quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
            tcsetattr(STDIN_FILENO, TCSANOW, &quiet);
        }
    }
    const bool got = static_cast<bool>(std::getline(std::cin, *secret));
    if (terminal) {
        tcsetattr(STDIN_FILENO, TCSANOW, &saved);
        fprintf(stderr, "\n");
    }
    if (!secret->empty() && secret->back() == '\r') {
        secret->pop_back();
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
    bool json = false;
};

// The stored credential for the same server, account and application, 0 when there is none.
int FindSameCredential(const AddOptions &opts) {
    KOVA_CRED *list = nullptr;
    if (KOVACredListGet(&list, nullptr, nullptr) < 0) {
        return -1;
    }
    int id = 0;
    for (KOVA_CRED *p = list; p != nullptr && id == 0; p = KOVACredNext(p)) {
        if (p->host == opts.host && p->port == opts.port && p->protocol == opts.protocol &&
            p->remote_account == opts.account && p->application == opts.application) {
            id = p->id;
        }
    }
    KOVACredListFree(&list);
    return id;
}

// Stores a credential, or replaces the one stored for the same server, account and
// application (a second row would never be chosen by a look-up by application).
void RunAdd(const AddOptions &opts) {
    if (opts.host.empty() || opts.account.empty()) {
        FailUsage(std::string("add: --") + (opts.host.empty() ? "host" : "account") +
                  " must not be empty");
        return;
    }
    if (!CheckDatabase(DatabaseUse::kCreate)) {
        return;
    }
    std::string password;
    if (!ReadSecret("Password", &password)) {
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
    // A database that does not exist yet holds nothing to replace.
    const int same = access(DatabasePath().c_str(), F_OK) == 0 ? FindSameCredential(opts) : 0;
    if (same < 0) {
        FailStore("add credential");
        return;
    }
    const bool updated = same > 0;
    if (updated) {
        cred->id = same;
        if (KOVACredSetByID(same, cred.get()) != 0) {
            FailStore("update credential " + std::to_string(same));
            return;
        }
    } else if (KOVACredAdd(cred.get()) != 0) {
        FailStore("add credential");
        return;
    }
    if (opts.json) {
        Json::Value out(Json::objectValue);
        out["id"] = cred->id;
        out["updated"] = updated;
        PrintJson(out);
    } else {
        printf("%s credential %d\n", updated ? "updated" : "added", cred->id);
    }
}

// Replaces the stored password of credential `id` with one read as add reads it.
void RunPasswd(int id) {
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
    Cred cred = LoadCredential("passwd", id);
    if (!cred) {
        return;
    }
    std::string password;
    if (!ReadSecret("New password", &password)) {
        FailText("passwd: no password on standard input (give it as one line)");
        return;
    }
    cred->remote_passwd = password;
    ResetError();
    if (KOVACredSetByID(id, cred.get()) != 0) {
        FailStore("passwd: storing the password of credential " + std::to_string(id));
        return;
    }
    printf("changed the password of credential %d\n", id);
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
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
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
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
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
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
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
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
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
    std::string extra;
};

// The session id and token are secrets: they are read as add reads a password, never taken
// from the command line (where ps and the shell's history would show them).
void RunSessionSet(const SessionSetOptions &opts) {
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
    if (!LoadCredential("session set", opts.id)) {
        return;
    }
    Sess sess(KOVACredSessAlloc());
    if (!sess) {
        FailStore("session set");
        return;
    }
    if (!ReadSecret("Session id", &sess->access_token) || sess->access_token.empty()) {
        FailText("session set: no session id on standard input (give it as the first line)");
        return;
    }
    if (!ReadSecret("Token", &sess->csrf_token)) {
        sess->csrf_token.clear();  // a session without a token
    }
    sess->id = opts.id;
    sess->extra_info = opts.extra;
    ResetError();
    if (KOVACredSessSetByID(opts.id, sess.get()) != 0) {
        FailStore("set session of credential " + std::to_string(opts.id));
        return;
    }
    printf("stored session of credential %d\n", opts.id);
}

void RunSessionRemove(int id) {
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return;
    }
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

void RegisterStore(CLI::App &app) {
    auto addOpts = std::make_shared<AddOptions>();
    CLI::App *add = app.add_subcommand(
        "add",
        "store a credential, or update the one for the same server, account and application; "
        "the password is read from standard input (one line)");
    add->add_option("--host", addOpts->host, "remote host")->required();
    add->add_option("--port", addOpts->port, "remote port (1 to 65535)")
        ->required()
        ->check(CLI::Range(1, 65535));
    add->add_option("--protocol", addOpts->protocol, "http or https (default https)")
        ->check(CLI::IsMember({"http", "https"}));
    add->add_option("--account", addOpts->account, "remote account")->required();
    add->add_option("--application", addOpts->application, "application tag");
    add->add_option("--extra", addOpts->extra, "free-form extra information");
    add->add_option("--owner", addOpts->owner, "owning user id (default -1: none)");
    AddJsonFlag(add, &addOpts->json);
    add->callback([addOpts] { RunAdd(*addOpts); });

    auto passwdId = std::make_shared<int>(0);
    CLI::App *passwd = app.add_subcommand(
        "passwd", "change a credential's stored password (read from standard input)");
    AddIdArgument(passwd, passwdId.get());
    passwd->callback([passwdId] { RunPasswd(*passwdId); });

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
    CLI::App *sessSet = session->add_subcommand(
        "set",
        "store (replace) a credential's session; the session id and the token are read from "
        "standard input (one line each)");
    AddIdArgument(sessSet, &setOpts->id);
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
