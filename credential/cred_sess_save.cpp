// Saving a session: insert when it was never stored, update its row otherwise.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_save";
constexpr int kLineArg = 11;
constexpr int kLineAdd = 16;
constexpr int kLineSet = 21;

}  // namespace

int KOVACredSessSave(KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pSess");
    }
    if (pSess->id == -1) {
        if (KOVACredSessAdd(pSess) != 0) {
            kova::LogInnerFailure(kUnit, kLineAdd, "Add task failed. ");
            return -1;
        }
        return 0;
    }
    if (KOVACredSessSetByID(pSess->id, pSess) != 0) {
        kova::LogInnerFailure(kUnit, kLineSet, "Set task failed. [%ld] ",
                              static_cast<long>(pSess->id));
        return -1;
    }
    return 0;
}
