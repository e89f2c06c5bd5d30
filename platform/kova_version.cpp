// The library's own version, as the build set it.
#include "kovacredential/kovacredential.h"

extern "C" const char *KOVACredentialVersion(void) {
    return KOVA_LIBRARY_VERSION;
}
