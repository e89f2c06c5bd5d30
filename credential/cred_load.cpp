// Loading a credential: clearing it for id -1, reading the row otherwise.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_load";
constexpr int kLineArg = 10;
constexpr int kLineClear = 14;
constexpr int kLineGet = 19;

}  // namespace

int KOVACredLoad(long id, KOVA_CRED *pCred) {
    if (id < -1) {
        return kova::ArgInvalid(kUnit, kLineArg, "-1 <= id");
    }
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "NULL != pCred");
    }
    if (id == -1) {
        if (KOVACredClear(pCred) != 0) {
            kova::LogInnerFailure(kUnit, kLineClear, "clear KOVA_CRED failed. ");
            return -1;
        }
        return 0;
    }
    if (KOVACredGetByID(id, pCred) != 0) {
        kova::LogInnerFailure(kUnit, kLineGet, "get task failed. [%ld] ", id);
        return -1;
    }
    return 0;
}
