// kovacred's shared helpers: failure lines naming error codes, JSON and table output, and the
// masking of secrets.
#include <errno.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <strings.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include <kovacredential/kovacredential.h>

#include "commands.h"
#include "kovacred_error_table.h"

namespace kovacred {

namespace {

const ErrorCodeEntry *FindError(long code) {
    for (const ErrorCodeEntry &entry : kErrorCodeTable) {
        if (entry.code == code) {
            return &entry;
        }
    }
    return nullptr;
}

int SetExitStatus(long code) {
    gExitCode = (code >= 1 && code <= 255) ? static_cast<int>(code) : 1;
    return gExitCode;
}

// Columns on a terminal: UTF-8 continuation bytes take no column of their own.
size_t DisplayWidth(const std::string &text) {
    return static_cast<size_t>(std::count_if(text.begin(), text.end(), [](char c) {
        return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
    }));
}

constexpr char kHidden[] = "(hidden)";

}  // namespace

std::string ErrorName(long code) {
    const ErrorCodeEntry *entry = FindError(code);
    return entry != nullptr ? entry->name : "";
}

std::string ErrorText(long code) {
    const ErrorCodeEntry *entry = FindError(code);
    std::string text = "error " + std::to_string(code);
    if (entry != nullptr) {
        text += std::string(" ") + entry->name + ": " + entry->meaning;
    }
    return text;
}

int Fail(const std::string &what, long code) {
    fprintf(stderr, "kovacred: %s failed (%s)\n", what.c_str(), ErrorText(code).c_str());
    return SetExitStatus(code);
}

int FailServer(const std::string &what, long code, const std::string &text) {
    if (code == 0) {
        return FailText(what + " failed (" + text + ")");
    }
    fprintf(stderr, "kovacred: %s failed (server error %ld%s%s)\n", what.c_str(), code,
            text.empty() ? "" : ": ", text.c_str());
    return SetExitStatus(code);
}

int FailText(const std::string &message) {
    fprintf(stderr, "kovacred: %s\n", message.c_str());
    gExitCode = 1;
    return gExitCode;
}

int FailUsage(const std::string &message) {
    fprintf(stderr, "kovacred: %s\n", message.c_str());
    gExitCode = kExitUsage;
    return gExitCode;
}

CLI::Option *AddIdArgument(CLI::App *cmd, int *id) {
    return cmd->add_option("id", *id, "credential id")
        ->required()
        ->check(CLI::Validator(
            [](std::string &text) -> std::string {
                char *end = nullptr;
                errno = 0;
                const long value = strtol(text.c_str(), &end, 10);
                if (text.empty() || *end != '\0' || errno != 0 || value < 1 || value > INT32_MAX) {
                    return "a credential id is a whole number from 1 to 2147483647, not \"" + text +
                           "\"";
                }
                return "";
            },
            "ID"));
}

bool CheckURL(const std::string &command, const std::string &url) {
    const size_t sep = url.find("://");
    const std::string scheme = sep == std::string::npos ? "http" : url.substr(0, sep);
    if (strcasecmp(scheme.c_str(), "http") != 0 && strcasecmp(scheme.c_str(), "https") != 0) {
        FailText(command + " failed: unsupported scheme \"" + scheme + "\" (http or https)");
        return false;
    }
    // The authority ends at the path, query or fragment; its port follows the last ':' behind
    // the userinfo and any IPv6 literal.
    const size_t start = sep == std::string::npos ? 0 : sep + 3;
    std::string authority = url.substr(start, url.find_first_of("/?#", start) - start);
    authority.erase(0, authority.rfind('@') + 1);
    const size_t bracket = authority.rfind(']');
    const size_t colon = authority.rfind(':');
    if (authority.empty() || authority[0] == ':') {
        FailText(command + " failed: no host in \"" + url + "\"");
        return false;
    }
    if (colon != std::string::npos && (bracket == std::string::npos || colon > bracket)) {
        const std::string port = authority.substr(colon + 1);
        char *end = nullptr;
        const long value = strtol(port.c_str(), &end, 10);
        if (!port.empty() && (*end != '\0' || value < 1 || value > 65535)) {
            FailText(command + " failed: bad port \"" + port + "\" (1 to 65535)");
            return false;
        }
    }
    return true;
}

void AddJsonFlag(CLI::App *cmd, bool *json) {
    cmd->add_flag("--json", *json, "print JSON instead of text");
}

std::string JsonText(const Json::Value &value, bool pretty) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = pretty ? "  " : "";
    builder["emitUTF8"] = true;
    return Json::writeString(builder, value);
}

bool ParseJson(const std::string &text, Json::Value &value) {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    std::string errors;
    return !text.empty() && reader->parse(text.data(), text.data() + text.size(), &value, &errors);
}

void PrintJson(const Json::Value &value) {
    printf("%s\n", JsonText(value, true).c_str());
}

std::string Printable(const std::string &text) {
    std::string out;
    for (unsigned char c : text) {
        if (c < 0x20 || c == 0x7f) {
            char esc[8];
            snprintf(esc, sizeof(esc), "\\x%02X", c);
            out += esc;
        } else {
            out += static_cast<char>(c);
        }
    }
    return out;
}

void PrintTable(const std::vector<std::vector<std::string>> &rows) {
    std::vector<size_t> widths;
    for (const auto &row : rows) {
        widths.resize(std::max(widths.size(), row.size()), 0);
        for (size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], DisplayWidth(row[i]));
        }
    }
    for (const auto &row : rows) {
        std::string line;
        for (size_t i = 0; i < row.size(); ++i) {
            line += row[i];
            if (i + 1 < row.size()) {
                line.append(widths[i] - DisplayWidth(row[i]) + 2, ' ');
            }
        }
        line.erase(line.find_last_not_of(' ') + 1);
        printf("%s\n", line.c_str());
    }
}

void Secrets::Add(const std::string &secret) {
    if (!secret.empty() && std::find(secrets_.begin(), secrets_.end(), secret) == secrets_.end()) {
        secrets_.push_back(secret);
    }
}

void Secrets::AddCredential(long id) {
    KOVA_CRED cred;
    if (KOVACredGetByID(static_cast<int>(id), &cred) == 0 && cred.id != -1) {
        Add(cred.remote_passwd);
    }
    KOVA_CRED_SESS sess;
    if (KOVACredSessGetByID(static_cast<int>(id), &sess) == 0 && sess.id != -1) {
        Add(sess.access_token);
        Add(sess.csrf_token);
    }
}

std::string Secrets::Hide(const std::string &text) const {
    std::string out = text;
    for (const std::string &secret : secrets_) {
        if (out == secret) {
            return kHidden;
        }
        if (secret.size() < kMinSubstring) {
            continue;
        }
        for (size_t pos = out.find(secret); pos != std::string::npos;
             pos = out.find(secret, pos + sizeof(kHidden) - 1)) {
            out.replace(pos, secret.size(), kHidden);
        }
    }
    return out;
}

Json::Value Secrets::Hide(const Json::Value &value) const {
    if (value.isString()) {
        return Json::Value(Hide(value.asString()));
    }
    if (value.isArray()) {
        Json::Value out(Json::arrayValue);
        for (const auto &element : value) {
            out.append(Hide(element));
        }
        return out;
    }
    if (value.isObject()) {
        Json::Value out(Json::objectValue);
        for (auto it = value.begin(); it != value.end(); ++it) {
            out[Hide(it.name())] = Hide(*it);
        }
        return out;
    }
    return value;
}

}  // namespace kovacred
