#include "support/temp_dir.h"

#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace kova_test {

TempDir::TempDir(const std::string &base) {
    const char *tmp = getenv("TMPDIR");
    std::string tmpl =
        (base.empty() ? std::string(tmp && *tmp ? tmp : "/tmp") : base) + "/kovatest.XXXXXX";
    if (mkdtemp(tmpl.data()) == nullptr) {
        throw std::runtime_error("mkdtemp failed");
    }
    path_ = tmpl;
}

TempDir::~TempDir() {
    std::error_code ec;
    // Folders made unwritable by a test are opened up again before removal.
    std::filesystem::permissions(path_, std::filesystem::perms::owner_all,
                                 std::filesystem::perm_options::add, ec);
    std::filesystem::remove_all(path_, ec);
}

TempDatabase::TempDatabase() : db_(dir_.File("credentials.sqlite")) {
    if (const char *old = getenv("kovacredential_db")) {
        old_ = old;
    }
    setenv("kovacredential_db", db_.c_str(), 1);
}

TempDatabase::~TempDatabase() {
    old_ ? setenv("kovacredential_db", old_->c_str(), 1) : unsetenv("kovacredential_db");
}

std::string ReadFile(const std::string &path) {
    std::stringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

bool WriteFile(const std::string &path, const std::string &content, mode_t mode) {
    File f(fopen(path.c_str(), "w"));
    return f && fwrite(content.data(), 1, content.size(), f.get()) == content.size() &&
           fflush(f.get()) == 0 && chmod(path.c_str(), mode) == 0;
}

int RunCommand(const std::string &command, std::string *out) {
    FILE *pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) {
        return -1;
    }
    char buf[4096];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), pipe)) > 0) {
        if (out != nullptr) {
            out->append(buf, n);
        }
    }
    int status = pclose(pipe);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string ToolCommand(const std::string &path) {
    const char *launcher = getenv("KOVA_TEST_LAUNCHER");
    std::string command =
        launcher != nullptr && *launcher != '\0' ? launcher + std::string(" ") : "";
    return command + "'" + path + "'";
}

}  // namespace kova_test
