// Uses the installed library through the umbrella header alone.
#include <stdio.h>
#include <stdlib.h>

#include <kovacredential/kovacredential.h>

int main(int argc, char **argv) {
    if (argc < 2) {
        return 2;
    }
    setenv("kovacredential_db", argv[1], 1);
    KOVA_CRED *cred = KOVACredAlloc();
    KOVACredItemSetHost(cred, "consumer.example");
    KOVACredItemSetPort(cred, 5001);
    if (KOVACredAdd(cred) != 0 || cred->id < 1) {
        return 1;
    }
    KOVA_CRED *loaded = KOVACredAlloc();
    char host[64];
    int ok = KOVACredGetByID(cred->id, loaded) == 0 &&
             KOVACredItemGetHost(host, sizeof(host), loaded) == 0;
    KOVACredFree(cred);
    KOVACredFree(loaded);
    std::string url = KOVA::CredRequestUtil::GetURL("https", host, 5001, "webapi/query.cgi");
    printf("%s\n", url.c_str());
    return ok && url == "https://consumer.example:5001/webapi/query.cgi" ? 0 : 1;
}
