// A caller of the library built from described.h alone: it reads the exported statics of
// KOVA::CredRequestUtil straight from their symbols, as such programs do. Argument: the port of
// a loopback WebAPI server on 127.0.0.1. Prints what it read and the library it ran with;
// exits 0 when every value is the described one.
#include <link.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "described.h"

namespace {

int ShowLibrary(struct dl_phdr_info *info, size_t, void *) {
    if (info->dlpi_name != nullptr && strstr(info->dlpi_name, "libkovacredential.so") != nullptr) {
        printf("library %s\n", info->dlpi_name);
    }
    return 0;
}

}  // namespace

int main(int argc, char **argv) {
    if (argc != 2) {
        fprintf(stderr, "usage: %s PORT\n", argv[0]);
        return 2;
    }
    dl_iterate_phdr(&ShowLibrary, nullptr);
    int failures = 0;

    // Nothing listens on port 1 of loopback, so the probe fails with CRED_REQ_ERR_QUERY_FAIL.
    KOVA::CredRequestUtil::m_errCode = 0;
    const bool probed = KOVA::CredRequestUtil::TestURL("http://127.0.0.1:1/");
    printf("TestURL %d m_errCode %d\n", probed ? 1 : 0, KOVA::CredRequestUtil::m_errCode);
    failures += probed || KOVA::CredRequestUtil::m_errCode != 5;

    KOVA_CRED *cred = KOVACredAlloc();
    const bool described =
        cred != nullptr && KOVACredItemSetID(cred, 7) == 0 &&
        KOVACredItemSetProtocol(cred, "http") == 0 && KOVACredItemSetHost(cred, "127.0.0.1") == 0 &&
        KOVACredItemSetPort(cred, atoi(argv[1])) == 0 && KOVA::CredRequestUtil::GetWebAPIDesc(cred);
    KOVACredFree(cred);
    const Json::Value &entry = KOVA::CredRequestUtil::m_jsData["webapiDesc"]["7"];
    const std::string authPath = entry["KOVA.API.Auth"]["path"].asString();
    const std::string jsonFormat = entry["KOVA.Demo.Json"]["requestFormat"].asString();
    printf("GetWebAPIDesc %d auth %s format %s\n", described ? 1 : 0, authPath.c_str(),
           jsonFormat.c_str());
    failures += !described || authPath != "auth.cgi" || jsonFormat != "JSON";
    return failures == 0 ? 0 : 1;
}
