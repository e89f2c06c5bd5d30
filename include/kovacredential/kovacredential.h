// libkovacredential: the whole public interface.
#ifndef KOVACREDENTIAL_KOVACREDENTIAL_H
#define KOVACREDENTIAL_KOVACREDENTIAL_H

#include "kovaplatform.h"
#include "kovacred.h"
#include "kovacred_db.h"
#include "kovacredsetter.h"
#include "kovacredgetter.h"
#include "kovacredsesssetter.h"
#include "kovacredsessgetter.h"
#include "cred_request.h"
#include "cred_request_util.h"
#include "cred_request_mgr.h"
#include "cred_request_farlink.h"

#ifdef __cplusplus
extern "C" {
#endif

// The version of the library the program runs with, "MAJOR.MINOR.PATCH" (for example "6.0.0").
// A static text; may be called from any thread.
KOVA_EXPORT const char *KOVACredentialVersion(void);

#ifdef __cplusplus
}
#endif

#endif  // KOVACREDENTIAL_KOVACREDENTIAL_H
