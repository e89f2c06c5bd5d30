// The database row callbacks on arbitrary rows: any column names (known, unknown, empty) and
// values (NULL, non-numeric, huge) must fill records without crashing or leaking.
#include <stddef.h>
#include <stdint.h>

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
    std::vector<std::string> values;
    std::vector<bool> nulls;
    std::vector<const char *> names;
    size_t pos = 0;
    while (pos + 2 <= size && names.size() < 64) {
        names.push_back(kNames[data[pos] % (sizeof(kNames) / sizeof(kNames[0]))]);
        const uint8_t length = data[pos + 1];
        pos += 2;
        const bool isNull = length == 255;
        const size_t take = isNull ? 0 : (length < size - pos ? length : size - pos);
        values.emplace_back(reinterpret_cast<const char *>(data + pos), take);
        nulls.push_back(isNull);
        pos += take;
    }
    std::vector<char *> texts;
    for (size_t i = 0; i < values.size(); ++i) {
        texts.push_back(nulls[i] ? nullptr : &values[i][0]);
    }
    char **azVal = texts.empty() ? nullptr : texts.data();
    char **azCol = const_cast<char **>(names.empty() ? nullptr : names.data());
    const int nCol = static_cast<int>(names.size());

    KOVA_CRED cred;
    KOVA_CRED_SESS sess;
    KOVA_CRED *credList = nullptr;
    KOVA_CRED_SESS *sessList = nullptr;
    for (int start = 0; start < nCol || start == 0; start += 4) {
        const int n = nCol - start < 4 ? nCol - start : 4;
        char **vals = azVal ? azVal + start : nullptr;
        char **cols = azCol ? azCol + start : nullptr;
        CredRowFirst(&cred, n, vals, cols);
        CredRowAppend(&credList, n, vals, cols);
        CredSessRowFirst(&sess, n, vals, cols);
        CredSessRowAppend(&sessList, n, vals, cols);
        if (nCol == 0) {
            break;
        }
    }
    KOVACredListFree(&credList);
    KOVACredSessListFree(&sessList);
    return 0;
}
