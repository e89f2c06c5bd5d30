// Loading a session: clearing it for id -1, reading the row otherwise.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_load";
constexpr int kLineArg = 10;
constexpr int kLineClear = 14;
constexpr int kLineGet = 19;

}  // namespace

int KOVACredSessLoad(long id, KOVA_CRED_SESS *pSess) {
    if (id < -1) {
        return kova::ArgInvalid(kUnit, kLineArg, "-1 <= id");
    }
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "NULL != pSess");
    }
    if (id == -1) {
        if (KOVACredSessClear(pSess) != 0) {
            kova::LogInnerFailure(kUnit, kLineClear, "clear KOVA_CRED_SESS failed. ");
            return -1;
        }
        return 0;
    }
    if (KOVACredSessGetByID(id, pSess) != 0) {
        kova::LogInnerFailure(kUnit, kLineGet, "get task failed. [%ld] ", id);
        return -1;
    }
    return 0;
}
