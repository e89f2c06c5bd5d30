// Programs built from the described declarations alone (described.h, not the library's
// headers) and linked against a stub with the library's soname, run against the real library
// as position-independent and as fixed-address executables: each reads m_errCode after a
// failed probe and m_jsData after a description fetch from kovasim straight from the
// exported symbols. A change of those symbols' kind or layout makes them crash or read wrong
// values.
#include <stdint.h>

#include <fstream>
#include <string>
#include <utility>

#include <gtest/gtest.h>

#include "support/sim_process.h"
#include "support/temp_dir.h"

namespace kova_test {
namespace {

constexpr uint16_t kElfExecutable = 2;  // ET_EXEC: linked at a fixed address
constexpr uint16_t kElfShared = 3;      // ET_DYN: a position-independent executable

// e_type of an ELF file, in the byte order its header names; 0 when it cannot be read.
uint16_t ElfType(const std::string &path) {
    unsigned char header[18] = {};
    std::ifstream in(path, std::ios::binary);
    if (!in.read(reinterpret_cast<char *>(header), sizeof(header)) || header[0] != 0x7f) {
        return 0;
    }
    const bool bigEndian = header[5] == 2;  // EI_DATA: ELFDATA2MSB
    return bigEndian ? static_cast<uint16_t>(header[16] << 8 | header[17])
                     : static_cast<uint16_t>(header[17] << 8 | header[16]);
}

// Built once and run against one kovasim, so one test covers both programs.
TEST(ForeignCallerTest, ReadsTheExportedStaticsOfTheRealLibrary) {
    TempDir dir;
    std::string log;
    ASSERT_EQ(RunCommand("cmake " KOVA_SUBPROJECT_DEFINES " -DWORK=" + dir.path() +
                             " -P " KOVA_SOURCE_DIR
                             "/tests/foreign_caller/build_foreign_caller.cmake 2>&1",
                         &log),
              0)
        << log;
    const std::string build = dir.File("foreign-caller-build/");
    // The programs were linked against the stub; the real library is what they run with.
    EXPECT_EQ(ElfType(build + "stub/libkovacredential.so.6"), kElfShared);
    SimProcess sim(dir);
    ASSERT_GT(sim.HttpPort(), 0) << sim.ErrorOutput();
    for (const auto &program : {std::make_pair("foreign_pie", kElfShared),
                                std::make_pair("foreign_nopie", kElfExecutable)}) {
        SCOPED_TRACE(program.first);
        EXPECT_EQ(ElfType(build + program.first), program.second);
        std::string out;
        EXPECT_EQ(RunCommand("LD_LIBRARY_PATH=" KOVA_LIBRARY_DIR " " +
                                 ToolCommand(build + program.first) + " " +
                                 std::to_string(sim.HttpPort()) + " 2>&1",
                             &out),
                  0)
            << out;
        EXPECT_NE(out.find("library " KOVA_LIBRARY_DIR "/libkovacredential.so.6\n"),
                  std::string::npos)
            << out;
        EXPECT_NE(out.find("TestURL 0 m_errCode 5\n"), std::string::npos) << out;
        EXPECT_NE(out.find("GetWebAPIDesc 1 auth auth.cgi format JSON\n"), std::string::npos)
            << out;
    }
}

}  // namespace
}  // namespace kova_test
