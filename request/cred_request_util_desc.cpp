// The per-credential cache of WebAPI descriptions: one "KOVA.API.Info" query per credential
// id, kept in CredRequestUtil::m_jsData["webapiDesc"][<id>], answering which CGI path serves
// an API and which request format it expects.
//
// The cache is read with jsoncpp's inserting subscript on purpose: a look-up of an API the
// server does not list leaves a null member under that name, so the next look-up finds it
// empty and queries the server again.
//
// The cache is process-wide; every access of the library takes gDescLock for the time of
// one look-up or store, never across a query to a server.
#include <exception>
#include <mutex>
#include <string>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "platform/json_text.h"
#include "platform/kova_log.h"
#include "request/cred_request_transport.h"
#include "request/cred_request_util_p.h"

namespace KOVA {

namespace {

const char kUnit[] = "cred_request_util";

std::mutex gDescLock;
using DescGuard = std::lock_guard<std::mutex>;

// A credential id as the cache names it: through a JSON integer, so -1 is "-1".
std::string CacheKey(long id) {
    return Json::Value(static_cast<Json::Int64>(id)).asString();
}

// The "webapiDesc" object, inserted when absent. A cache that someone replaced with a
// non-object is started afresh rather than thrown on.
Json::Value &DescRoot() {
    Json::Value &data = CredRequestUtil::m_jsData;
    if (!data.isNull() && !data.isObject()) {
        data = Json::Value(Json::objectValue);
    }
    Json::Value &root = data["webapiDesc"];
    if (!root.isNull() && !root.isObject()) {
        root = Json::Value(Json::objectValue);
    }
    return root;
}

// Whether the credential's entry holds a non-empty description of `api`.
bool ApiCached(const std::string &key, const std::string &api) {
    Json::Value &root = DescRoot();
    if (!root.isObject() || !root.isMember(key)) {
        return false;
    }
    const Json::Value &entry = root[key];
    return entry.isObject() && entry.isMember(api) && !entry[api].empty();
}

// A copy of the cached description of `api`, read through the inserting subscript (a missing
// API leaves a null member); null when the entry is not an object at all.
Json::Value ApiEntry(const std::string &key, const std::string &api) {
    Json::Value &entry = DescRoot()[key];
    if (!entry.isNull() && !entry.isObject()) {
        return Json::Value();
    }
    return entry[api];
}

bool Cached(const std::string &key, const std::string &api) {
    const DescGuard lock(gDescLock);
    return ApiCached(key, api);
}

Json::Value LockedApiEntry(const std::string &key, const std::string &api) {
    const DescGuard lock(gDescLock);
    return ApiEntry(key, api);
}

std::string TextMember(const Json::Value &object, const char *name) {
    if (!object.isObject()) {
        return "";
    }
    return kova::JsonText(object[name]);
}

}  // namespace

constexpr int kLineDescBadParam = 61;
constexpr int kLineDescSetUrl = 68;
constexpr int kLineDescCredError = 80;
constexpr int kLineDescInvalid = 86;
constexpr int kLineDescFail = 90;
constexpr int kLineDescException = 96;

// The most a parsed description may take (JsonParseCost): it stays in the cache for the life
// of the process, so a larger answer is refused as invalid however much the parse budget of its
// text would allow. Real servers describe a few thousand APIs in well under a megabyte.
constexpr uint64_t kMaxDescriptionCost = uint64_t{16} << 20;

bool StoreWebAPIDescAnswer(const std::string &key, const std::string &body) {
    Json::Value answer;
    if (!kova::JsonFromString(body, answer, kMaxDescriptionCost)) {
        kova::Log("%s:%d Query response is invalid", kUnit, kLineDescInvalid);
        return false;
    }
    if (!kova::JsonIsSuccess(answer)) {
        kova::Log("%s:%d Query request fail!", kUnit, kLineDescFail);
        return false;
    }
    // Moved, not copied, into the cache.
    const DescGuard lock(gDescLock);
    DescRoot()[key].swap(answer["data"]);
    return true;
}

bool CredRequestUtil::GetWebAPIDesc(const KOVA_CRED *cred) {
    return GetWebAPIDesc(cred, nullptr);
}

bool CredRequestUtil::GetWebAPIDesc(const KOVA_CRED *cred, KOVA::CredRequest *transport) {
    return kova::Guarded(kUnit, kLineDescException, false, [&] {
        const TransportScope scope(transport);
        if (cred == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineDescBadParam);
            return false;
        }
        const std::string key = CacheKey(cred->id);
        const std::string path = "webapi/query.cgi";
        CredRequest request;
        if (!request.SetURL(cred->protocol, cred->host, cred->port, path)) {
            kova::Log("%s:%d SetURL failed. %s %s %ld %s", kUnit, kLineDescSetUrl,
                      cred->protocol.c_str(), kova::UrlForLog(cred->host).c_str(),
                      static_cast<long>(cred->port), path.c_str());
            return false;
        }
        Json::Value params(Json::objectValue);
        params["api"] = "KOVA.API.Info";
        params["version"] = 1;
        params["method"] = "query";
        request.AddPostParam(params);
        request.SetResponseTimeout(30);
        request.SetEncoding(true);
        if (!ProcessWithTransport(request)) {
            kova::Log("%s:%d Cred Error:[%s][%d]", kUnit, kLineDescCredError,
                      kova::UrlForLog(request.GetURL()).c_str(),
                      static_cast<int>(request.GetError()));
            SetUtilError(CRED_REQ_ERR_QUERY_FAIL);
            return false;
        }
        return StoreWebAPIDescAnswer(key, request.GetResponse());
    });
}

void CredRequestUtil::RemoveWebAPIDesc(const KOVA_CRED *cred) {
    kova::Guarded(kUnit, kLineDescException, 0, [&] {
        if (cred != nullptr) {
            const DescGuard lock(gDescLock);
            Json::Value &root = DescRoot();
            if (root.isObject()) {
                root.removeMember(CacheKey(cred->id));
            }
        }
        return 0;
    });
}

bool CredRequestUtil::IsCredIdCached(long id) {
    return kova::Guarded(kUnit, kLineDescException, false, [&] {
        const std::string key = CacheKey(id);
        const DescGuard lock(gDescLock);
        Json::Value &root = DescRoot();
        return root.isObject() && root.isMember(key);
    });
}

long ReserveUncachedCredId() {
    const DescGuard lock(gDescLock);
    Json::Value &root = DescRoot();
    long id = -1;
    while (root.isMember(CacheKey(id))) {
        --id;
    }
    root[CacheKey(id)] = Json::Value();
    return id;
}

constexpr int kLinePathBadParam = 141;
constexpr int kLinePathNoDesc = 148;
constexpr int kLinePathNoApi = 154;

std::string CredRequestUtil::GetWebAPIPath(const KOVA_CRED *cred, const std::string &api) {
    return kova::Guarded(kUnit, kLineDescException, std::string(), [&]() -> std::string {
        if (cred == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLinePathBadParam);
            return "";
        }
        const std::string key = CacheKey(cred->id);
        if (!Cached(key, api) && !GetWebAPIDesc(cred)) {
            kova::Log("%s:%d cannot get cgi path from id=[%s]", kUnit, kLinePathNoDesc,
                      key.c_str());
            return "";
        }
        Json::Value desc = LockedApiEntry(key, api);
        if (desc.empty()) {
            kova::Log("%s:%d No such api: %s", kUnit, kLinePathNoApi, api.c_str());
            SetUtilError(CRED_REQ_ERR_NO_SUCH_API);
            return "";
        }
        return TextMember(desc, "path");
    });
}

constexpr int kLinePathIdMissing = 172;

std::string CredRequestUtil::GetWebAPIPath(long id, const std::string &api) {
    return kova::Guarded(kUnit, kLineDescException, std::string(), [&]() -> std::string {
        KOVA_CRED cred;
        if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
            kova::Log("%s:%d cannot get cgi path from id=[%ld]", kUnit, kLinePathIdMissing, id);
            return "";
        }
        return GetWebAPIPath(&cred, api);
    });
}

constexpr int kLineFormatBadParam = 186;
constexpr int kLineFormatNoDesc = 192;

bool CredRequestUtil::GetWebAPIRequestFormat(const KOVA_CRED *cred, const std::string &api,
                                             std::string &format) {
    return kova::Guarded(kUnit, kLineDescException, false, [&] {
        if (cred == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineFormatBadParam);
            return false;
        }
        const std::string key = CacheKey(cred->id);
        if (!Cached(key, api) && !GetWebAPIDesc(cred)) {
            kova::Log("%s:%d Cannot find api[%s] description", kUnit, kLineFormatNoDesc,
                      api.c_str());
            return false;
        }
        // An API the server does not list gives "" here, not a failure.
        format = TextMember(LockedApiEntry(key, api), "requestFormat");
        return true;
    });
}

constexpr int kLineFormatFailed = 207;

std::string CredRequestUtil::GetWebAPIRequestFormat(const KOVA_CRED *cred, const std::string &api) {
    return kova::Guarded(kUnit, kLineDescException, std::string(), [&]() -> std::string {
        std::string format;
        if (!GetWebAPIRequestFormat(cred, api, format)) {
            kova::Log("%s:%d GetWebAPIRequestFormat failed", kUnit, kLineFormatFailed);
            return "";
        }
        return format;
    });
}

constexpr int kLineFormatIdMissing = 221;

std::string CredRequestUtil::GetWebAPIRequestFormat(long id, const std::string &api) {
    return kova::Guarded(kUnit, kLineDescException, std::string(), [&]() -> std::string {
        KOVA_CRED cred;
        if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
            kova::Log("%s:%d Cannot find id[%ld] in database", kUnit, kLineFormatIdMissing, id);
            return "";
        }
        return GetWebAPIRequestFormat(&cred, api);
    });
}

}  // namespace KOVA
