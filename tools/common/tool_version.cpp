#include "common/tool_version.h"

#include <limits.h>
#include <link.h>
#include <stdlib.h>

#include <memory>
#include <string>

#include <curl/curl.h>
#include <openssl/crypto.h>
#include <sqlite3.h>

#include "kovacredential/kovacredential.h"

namespace kova_tools {
namespace {

struct FreeDeleter {
    void operator()(char *p) const { free(p); }
};

struct SonameSearch {
    std::string prefix;  // "libjsoncpp.so."
    bool found = false;
    std::string version;
};

// A library without a run-time version call is known by the file its soname link points to:
// libjsoncpp.so.25 -> libjsoncpp.so.1.9.5.
int FindLoadedVersion(struct dl_phdr_info *info, size_t, void *data) {
    auto *search = static_cast<SonameSearch *>(data);
    if (info->dlpi_name == nullptr || info->dlpi_name[0] == '\0') {
        return 0;
    }
    const std::string path = info->dlpi_name;
    const std::string base = path.substr(path.find_last_of('/') + 1);
    if (base.compare(0, search->prefix.size(), search->prefix) != 0) {
        return 0;
    }
    search->found = true;
    std::unique_ptr<char, FreeDeleter> real(realpath(path.c_str(), nullptr));
    if (!real) {
        return 1;
    }
    const std::string target = real.get();
    const std::string targetBase = target.substr(target.find_last_of('/') + 1);
    if (targetBase.compare(0, search->prefix.size(), search->prefix) == 0 &&
        targetBase.size() > search->prefix.size()) {
        search->version = targetBase.substr(search->prefix.size());
    }
    return 1;
}

std::string LoadedVersion(const std::string &library) {
    SonameSearch search{library + ".so.", false, ""};
    dl_iterate_phdr(&FindLoadedVersion, &search);
    if (!search.found) {
        return "not loaded";
    }
    return search.version.empty() ? "unknown" : search.version;
}

}  // namespace

std::string VersionText(const std::string &tool) {
    const curl_version_info_data *curl = curl_version_info(CURLVERSION_NOW);
    std::string text = tool + " " + KOVA_TOOLS_VERSION + "\n";
    text += std::string("libkovacredential ") + KOVACredentialVersion() + "\n";
    text += std::string("libcurl ") + (curl != nullptr ? curl->version : "unknown") + "\n";
    text += std::string("OpenSSL ") + OpenSSL_version(OPENSSL_VERSION_STRING) + "\n";
    text += std::string("SQLite ") + sqlite3_libversion() + "\n";
    text += "jsoncpp " + LoadedVersion("libjsoncpp");
    return text;
}

}  // namespace kova_tools
