// Login and logout answers on arbitrary text: a login answer gives a session only when it is an
// object whose "success" is true and whose "data" is an object, and a logout answer is taken
// only as strict JSON whose "success" is true.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>

#include "platform/json_text.h"
#include "request/cred_request_util_p.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);

    Json::Value response;
    KOVA_CRED_SESS session;
    const bool login = KOVA::ReadLoginAnswer(text, &response, session);
    if (login != (session.filled == 1)) {
        abort();
    }
    if (login && (!kova::JsonIsSuccess(response) || !response["data"].isObject() ||
                  session.access_token != kova::JsonText(response["data"]["sid"]) ||
                  session.csrf_token != kova::JsonText(response["data"]["kovatoken"]))) {
        abort();
    }
    KOVA_CRED_SESS again;
    if (KOVA::ReadLoginAnswer(text, nullptr, again) != login) {
        abort();
    }

    Json::Value strict;
    const bool parsed = kova::JsonFromString(text, strict);
    if (KOVA::IsLogoutAnswerOk(text) != (parsed && kova::JsonIsSuccess(strict))) {
        abort();
    }
    return 0;
}
