// The database row callbacks on arbitrary rows: any column names (known, unknown, empty) and
// values (NULL, non-numeric, huge) must fill records without crashing or leaking.
#include <stddef.h>
#include <stdint.h>

#include <algorithm>
#include <string>
#include <vector>

#include "kovacredential/kovacred.h"
#include "kovacredential/kovacred_db.h"

namespace {

const char *const kNames[] = {"id",
                              "ctime",
                              "mtime",
                              "host",
                              "owner",
                              "remote_account",
                              "remote_passwd",
                              "protocol",
                              "port",
                              "application",
                              "extra_info",
                              "access_token",
                              "csrf_token",
                              "pid",
                              ""};

}  // namespace

// Input: a sequence of columns, each a name selector byte, a value length byte (255 = NULL)
// and that many value bytes. Every fourth column starts a new row.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    constexpr size_t kMaxColumns = 64;
    std::vector<std::string> values;
    values.reserve(kMaxColumns);  // the texts point into it
    std::vector<const char *> names;
    std::vector<char *> texts;
    for (size_t pos = 0; pos + 2 <= size && names.size() < kMaxColumns;) {
        names.push_back(kNames[data[pos] % (sizeof(kNames) / sizeof(kNames[0]))]);
        const uint8_t length = data[pos + 1];
        pos += 2;
        const size_t take = length == 255 ? 0 : std::min<size_t>(length, size - pos);
        values.emplace_back(reinterpret_cast<const char *>(data + pos), take);
        texts.push_back(length == 255 ? nullptr : &values.back()[0]);
        pos += take;
    }
    const int nCol = static_cast<int>(names.size());
    KOVA_CRED cred;
    KOVA_CRED_SESS sess;
    KOVA_CRED *credList = nullptr;
    KOVA_CRED_SESS *sessList = nullptr;
    for (int start = 0; start == 0 || start < nCol; start += 4) {
        const int n = std::min(4, nCol - start);
        char **vals = texts.data() + start;
        char **cols = const_cast<char **>(names.data()) + start;
        CredRowFirst(&cred, n, vals, cols);
        CredRowAppend(&credList, n, vals, cols);
        CredSessRowFirst(&sess, n, vals, cols);
        CredSessRowAppend(&sessList, n, vals, cols);
    }
    KOVACredListFree(&credList);
    KOVACredSessListFree(&sessList);
    return 0;
}
