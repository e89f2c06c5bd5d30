// A fresh mkdtemp folder, removed with everything in it when the object goes.
#ifndef KOVA_TESTS_SUPPORT_TEMP_DIR_H
#define KOVA_TESTS_SUPPORT_TEMP_DIR_H

#include <stdio.h>
#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

namespace kova_test {

class TempDir {
  public:
    // Below `base`, or below $TMPDIR (else /tmp) when base is empty.
    explicit TempDir(const std::string &base = "");
    ~TempDir();
    TempDir(const TempDir &) = delete;
    TempDir &operator=(const TempDir &) = delete;
    const std::string &path() const { return path_; }
    std::string File(const std::string &name) const { return path_ + "/" + name; }

  private:
    std::string path_;
};

// Points kovacredential_db at a database in a fresh temporary folder for the object's life
// and restores the previous value afterwards.
class TempDatabase {
  public:
    TempDatabase();
    ~TempDatabase();
    const std::string &path() const { return db_; }
    const TempDir &dir() const { return dir_; }

  private:
    TempDir dir_;
    std::string db_;
    std::optional<std::string> old_;
};

// An owned stdio stream, closed when it goes.
struct FileCloser {
    void operator()(FILE *f) const {
        if (f != nullptr) {
            fclose(f);
        }
    }
};
using File = std::unique_ptr<FILE, FileCloser>;

// The whole content of the file at `path` ("" when it cannot be read).
std::string ReadFile(const std::string &path);
// Writes `content` to the file at `path` (created or replaced) and gives it `mode`; true when
// all of it was written.
bool WriteFile(const std::string &path, const std::string &content, mode_t mode = 0600);

// Runs a shell command, returning its exit status and (optionally) its standard output.
int RunCommand(const std::string &command, std::string *out = nullptr);

// The shell words that start the program at `path`: its quoted path, behind the launcher named
// by the environment variable KOVA_TEST_LAUNCHER when that is set. A cross build sets it for
// ctest to the emulator that runs its programs ("qemu-ppc-static -L SYSROOT").
std::string ToolCommand(const std::string &path);

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_TEMP_DIR_H
