// The Debian packages of this build tree, built once for the whole suite with cpack: what
// each holds, its control fields, lintian's verdict, and that they work unpacked into a
// throwaway root (never the system's): the consumer program builds against the -dev package
// and the tools run.
#include <algorithm>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "support/sim_process.h"
#include "support/temp_dir.h"

namespace kova_test {
namespace {

const std::string kVersion = KOVA_VERSION;
const std::string kLibDir = std::string("usr/") + KOVA_INSTALL_LIBDIR;
const char *const kPackages[] = {"libkovacredential6", "libkovacredential-dev", "kovacred",
                                 "kovasim"};

class PackageTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        dir_ = new TempDir();
        built_ =
            RunCommand(std::string("cd ") + dir_->path() + " && " KOVA_CPACK " -G DEB --config " +
                       KOVA_BINARY_DIR "/CPackConfig.cmake -B " + dir_->path() +
                       " >cpack.log 2>&1") == 0;
        for (const char *package : kPackages) {
            if (built_) {
                built_ = RunCommand("dpkg-deb -x " + Deb(package) + " " + Root()) == 0;
            }
        }
    }
    static void TearDownTestSuite() { delete dir_; }
    void SetUp() override { ASSERT_TRUE(built_) << ReadFile(dir_->File("cpack.log")); }

    static std::string Deb(const std::string &package) {
        return dir_->File(package + "_" + kVersion + "_" KOVA_DEB_ARCHITECTURE ".deb");
    }
    static std::string Root() { return dir_->File("root"); }
    static std::string Output(const std::string &command) {
        std::string out;
        RunCommand(command, &out);
        return out;
    }

    static inline TempDir *dir_ = nullptr;
    static inline bool built_ = false;
};

TEST_F(PackageTest, EachPackageHoldsItsFilesAndNothingElse) {
    const std::string lib = "./" + kLibDir + "/";
    const std::map<std::string, std::vector<std::string>> expected = {
        {"libkovacredential6",
         {lib + "libkovacredential.so.6 -> libkovacredential.so." + kVersion,
          lib + "libkovacredential.so." + kVersion,
          "./usr/share/doc/libkovacredential6/changelog.gz",
          "./usr/share/doc/libkovacredential6/copyright"}},
        {"libkovacredential-dev",
         {lib + "libkovacredential.so -> libkovacredential.so.6",
          lib + "pkgconfig/kovacredential.pc",
          lib + "cmake/KovaCredential/KovaCredentialConfig.cmake",
          lib + "cmake/KovaCredential/KovaCredentialConfigVersion.cmake",
          lib + "cmake/KovaCredential/KovaCredentialTargets.cmake",
          "./usr/include/kovacredential/kovacredential.h",
          "./usr/include/kovacredential/cred_request.h",
          "./usr/share/man/man3/libkovacredential.3.gz",
          "./usr/share/doc/libkovacredential-dev/changelog.gz",
          "./usr/share/doc/libkovacredential-dev/copyright"}},
        {"kovacred",
         {"./usr/bin/kovacred", "./usr/share/man/man1/kovacred.1.gz",
          "./usr/share/bash-completion/completions/kovacred",
          "./usr/share/doc/kovacred/changelog.gz", "./usr/share/doc/kovacred/copyright"}},
        {"kovasim",
         {"./usr/bin/kovasim", "./usr/share/man/man1/kovasim.1.gz",
          "./usr/share/doc/kovasim/changelog.gz", "./usr/share/doc/kovasim/copyright"}},
    };
    for (const auto &entry : expected) {
        // "dpkg-deb -c" lists like "tar tv"; the path (and link target) is what follows the time.
        std::istringstream listing(
            Output("dpkg-deb -c " + Deb(entry.first) + " | sed -E 's/^([^ ]+ +){5}//'"));
        std::vector<std::string> files;
        for (std::string line; std::getline(listing, line);) {
            if (line.back() != '/') {
                files.push_back(line);
            }
        }
        for (const std::string &file : entry.second) {
            EXPECT_NE(std::find(files.begin(), files.end(), file), files.end())
                << entry.first << " lacks " << file;
        }
        for (const std::string &file : files) {
            // Headers and the exported targets' per-configuration files are many.
            bool devFile = file.find("/include/kovacredential/") != std::string::npos ||
                           file.find("/cmake/KovaCredential/") != std::string::npos;
            bool known =
                std::find(entry.second.begin(), entry.second.end(), file) != entry.second.end() ||
                (entry.first == "libkovacredential-dev" && devFile);
            EXPECT_TRUE(known) << entry.first << " holds the unexpected " << file;
        }
    }
}

TEST_F(PackageTest, ControlFieldsNameTheDependencies) {
    struct Field {
        std::string package;
        std::string field;
        std::vector<std::string> contains;
    };
    const Field fields[] = {
        {"libkovacredential6",
         "Depends",
         {"libc6 (", "libcurl4 (", "libjsoncpp25 (", "libsqlite3-0 (", "libssl3 (",
          "libstdc++6 ("}},
        {"libkovacredential6", "Section", {"libs"}},
        {"libkovacredential-dev",
         "Depends",
         {"libkovacredential6 (= " + kVersion + ")", "libcurl4-openssl-dev | libcurl-dev",
          "libjsoncpp-dev", "libssl-dev", "libsqlite3-dev", "pkg-config"}},
        {"libkovacredential-dev", "Section", {"libdevel"}},
        {"kovacred", "Depends", {"libkovacredential6 (= " + kVersion + ")", "libcurl4 ("}},
        {"kovacred", "Section", {"utils"}},
        {"kovasim", "Depends", {"libkovacredential6 (= " + kVersion + ")"}},
        {"kovasim", "Section", {"devel"}},
    };
    for (const Field &f : fields) {
        const std::string value = Output("dpkg-deb -f " + Deb(f.package) + " " + f.field);
        for (const std::string &part : f.contains) {
            EXPECT_NE(value.find(part), std::string::npos)
                << f.package << " " << f.field << ": " << value;
        }
    }
    // kovacred needs nothing that only the simulator uses.
    const std::string toolDepends = Output("dpkg-deb -f " + Deb("kovacred") + " Depends");
    for (const std::string simOnly : {"httplib", "zlib1g", "kovasim"}) {
        EXPECT_EQ(toolDepends.find(simOnly), std::string::npos) << toolDepends;
    }
    // The runtime package tells dpkg-shlibdeps of other packages what its soname needs, by
    // soname and by symbol; dpkg's ldconfig trigger, not a maintainer script, updates the
    // linker cache.
    EXPECT_EQ(Output("dpkg-deb -I " + Deb("libkovacredential6") + " shlibs"),
              "libkovacredential 6 libkovacredential6 (>= " + kVersion + ")\n");
    const std::string symbols = Output("dpkg-deb -I " + Deb("libkovacredential6") + " symbols");
    EXPECT_EQ(symbols.rfind("libkovacredential.so.6 libkovacredential6 #MINVER#\n", 0), 0u)
        << symbols;
    EXPECT_NE(symbols.find(" _ZN4KOVA15CredRequestUtil9m_errCodeE@Base "), std::string::npos)
        << symbols;
    EXPECT_EQ(Output("dpkg-deb -I " + Deb("libkovacredential6") + " triggers"),
              "activate-noawait ldconfig\n");
    const std::string control = Output("dpkg-deb -I " + Deb("libkovacredential6"));
    EXPECT_EQ(control.find("postinst"), std::string::npos) << control;
    EXPECT_EQ(control.find("postrm"), std::string::npos) << control;
}

TEST_F(PackageTest, LintianReportsNoError) {
    std::string debs;
    for (const char *package : kPackages) {
        debs += " " + Deb(package);
    }
    const std::string report = Output("lintian --no-tag-display-limit" + debs + " 2>&1");
    std::istringstream lines(report);
    for (std::string line; std::getline(lines, line);) {
        EXPECT_NE(line.rfind("E: ", 0), 0u) << line;
        EXPECT_EQ(line.find("maintscript-calls-ldconfig"), std::string::npos) << line;
    }
    EXPECT_EQ(report.find("lintian: command not found"), std::string::npos);
}

// The symbol check CPack runs before it builds the packages, on the unpacked library: a symbol
// of the symbols file that the library lacks fails it; one the file does not list yet passes.
TEST_F(PackageTest, SymbolCheckFailsOnALostSymbolOnly) {
    const std::string symbols = ReadFile(KOVA_SOURCE_DIR "/doc/deb/libkovacredential6.symbols");
    const std::string removed = " (c++)\"KOVACredAlloc()@Base\" 6.0.0~\n";
    ASSERT_NE(symbols.find(removed), std::string::npos);
    std::string fewer = symbols;
    fewer.erase(fewer.find(removed), removed.size());
    const std::string lost = symbols + " (c++)\"KOVACredLost(long)@Base\" 6.0.0~\n";
    for (const auto &template_ :
         {std::make_pair(std::string("fewer"), fewer), std::make_pair(std::string("lost"), lost)}) {
        std::ofstream(dir_->File(template_.first + ".symbols")) << template_.second;
        std::string log;
        const int status = RunCommand(
            "cmake -DCPACK_KOVA_SYMBOLS_TEMPLATE=" + dir_->File(template_.first + ".symbols") +
                " -DCPACK_KOVA_SYMBOLS_OUTPUT=" + dir_->File(template_.first + "/symbols") +
                " -DCPACK_TEMPORARY_INSTALL_DIRECTORY=" + Root() +
                " -DCPACK_PACKAGE_VERSION=" + kVersion +
                " -DCPACK_DEBIAN_PACKAGE_ARCHITECTURE=" KOVA_DEB_ARCHITECTURE " -P " KOVA_SOURCE_DIR
                "/doc/deb/check-symbols.cmake 2>&1",
            &log);
        if (template_.first == "fewer") {
            EXPECT_EQ(status, 0) << log;
            EXPECT_NE(ReadFile(dir_->File("fewer/symbols")).find(" _Z13KOVACredAllocv@Base "),
                      std::string::npos);
        } else {
            EXPECT_NE(status, 0) << log;
            EXPECT_NE(log.find("#MISSING: " + kVersion + "# (c++)\"KOVACredLost(long)@Base\""),
                      std::string::npos)
                << log;
        }
    }
}

// Unpacked into a throwaway root, the -dev package builds the consumer program, and the tools
// and manual pages work.
TEST_F(PackageTest, UnpackedPackagesWork) {
    std::string log;
    EXPECT_EQ(RunCommand("cmake " KOVA_SUBPROJECT_DEFINES " -DPREFIX=" + Root() +
                             "/usr -DLIBDIR=" + KOVA_INSTALL_LIBDIR " -DWORK=" + dir_->path() +
                             " -P " KOVA_SOURCE_DIR "/tests/consumer/run_consumer.cmake 2>&1",
                         &log),
              0)
        << log;
    const std::string env = "LD_LIBRARY_PATH=" + Root() + "/" + kLibDir + " ";
    for (const std::string tool : {"kovacred", "kovasim"}) {
        std::string out;
        EXPECT_EQ(RunCommand(env + ToolCommand(Root() + "/usr/bin/" + tool) + " --version", &out),
                  0);
        EXPECT_EQ(out.rfind(tool + " " + kVersion + "\nlibkovacredential " + kVersion + "\n", 0),
                  0u)
            << out;
    }
    for (const std::string page :
         {"man1/kovacred.1.gz", "man1/kovasim.1.gz", "man3/libkovacredential.3.gz"}) {
        const std::string text =
            Output("MANWIDTH=100 LC_ALL=C man -l " + Root() + "/usr/share/man/" + page);
        const std::string name = page.substr(5, page.find('.') - 5);
        EXPECT_NE(text.find("NAME\n       " + name + " - "), std::string::npos) << page;
    }
}

}  // namespace
}  // namespace kova_test
