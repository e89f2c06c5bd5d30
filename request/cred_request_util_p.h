// Internal operations of KOVA::CredRequestUtil's description cache that other units of the
// library share.
#ifndef KOVA_REQUEST_CRED_REQUEST_UTIL_P_H
#define KOVA_REQUEST_CRED_REQUEST_UTIL_P_H

namespace KOVA {

// The first of -1, -2, -3, ... that has no entry in the description cache, reserved there with
// an empty entry in the same locked step, so that no other thread hands it out too. The entry
// is filled by the first look-up under that id and freed by RemoveWebAPIDesc.
long ReserveUncachedCredId();

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_UTIL_P_H
