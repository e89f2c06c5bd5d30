// Saving a credential: insert when it was never stored, update its row otherwise.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_save";
constexpr int kLineArg = 11;
constexpr int kLineAdd = 16;
constexpr int kLineSet = 21;

}  // namespace

int KOVACredSave(KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pCred");
    }
    if (pCred->id == -1) {
        if (KOVACredAdd(pCred) != 0) {
            kova::LogInnerFailure(kUnit, kLineAdd, "Add task failed. ");
            return -1;
        }
        return 0;
    }
    if (KOVACredSetByID(pCred->id, pCred) != 0) {
        kova::LogInnerFailure(kUnit, kLineSet, "Set task failed. [%ld] ",
                              static_cast<long>(pCred->id));
        return -1;
    }
    return 0;
}
