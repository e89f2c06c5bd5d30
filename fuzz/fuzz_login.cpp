// Login and logout answers on arbitrary text: a login answer gives a session only when it is an
// object whose "success" is true and whose "data" is an object, and a logout answer is taken
// only as strict JSON whose "success" is true.
#include "fuzz_target.h"
#include "platform/json_text.h"
#include "request/cred_request_util_p.h"

KOVA_FUZZ_TARGET(text) {
    Json::Value response;
    KOVA_CRED_SESS session;
    const bool login = KOVA::ReadLoginAnswer(text, &response, session);
    Require(login == (session.filled == 1));
    Require(!login || (kova::JsonIsSuccess(response) && response["data"].isObject() &&
                       session.access_token == kova::JsonText(response["data"]["sid"]) &&
                       session.csrf_token == kova::JsonText(response["data"]["kovatoken"])));
    KOVA_CRED_SESS again;
    Require(KOVA::ReadLoginAnswer(text, nullptr, again) == login);

    Json::Value strict;
    const bool parsed = kova::JsonFromString(text, strict);
    Require(KOVA::IsLogoutAnswerOk(text) == (parsed && kova::JsonIsSuccess(strict)));
}
