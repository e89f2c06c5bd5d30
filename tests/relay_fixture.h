// Shared by the relay client's tests: a simulated directory on port 80 of this process's own
// loopback addresses, with the client's directory hosts pointed at it through the environment.
#ifndef KOVA_TESTS_RELAY_FIXTURE_H
#define KOVA_TESTS_RELAY_FIXTURE_H

#include <stdlib.h>

#include <string>

#include <gtest/gtest.h>
#include <json/value.h>

#include "platform/json_text.h"
#include "simlib/relay_sim.h"

namespace kova_test {

inline Json::Value ParseJson(const std::string &text) {
    Json::Value value;
    EXPECT_TRUE(kova::JsonFromString(text, value)) << "[" << text << "]";
    return value;
}

// Host 0 is the global directory (kovacredential_farlink_global), host 1 the default directory
// host (kovacredential_farlink_server); further hosts serve as more sites. Tests are skipped
// where port 80 may not be bound.
class RelayDirectoryTest : public ::testing::Test {
  protected:
    explicit RelayDirectoryTest(int hosts) : directory_(hosts) {}

    void SetUp() override {
        if (!directory_.Start()) {
            if (directory_.NotPermitted()) {
                GTEST_SKIP() << "directory hosts need port 80 on loopback addresses, which "
                                "this process may not bind: "
                             << directory_.Error();
            }
            FAIL() << directory_.Error();
        }
        setenv("kovacredential_farlink_global", Host(0).c_str(), 1);
        setenv("kovacredential_farlink_server", Host(1).c_str(), 1);
    }

    void TearDown() override {
        unsetenv("kovacredential_farlink_global");
        unsetenv("kovacredential_farlink_server");
    }

    const std::string &Host(int i) const { return directory_.Host(i); }
    kovasim::RelaySim &Sim() { return directory_.Sim(); }

    kovasim::RelayDirectory directory_;
};

}  // namespace kova_test

#endif  // KOVA_TESTS_RELAY_FIXTURE_H
