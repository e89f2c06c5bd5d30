// Shared by the relay client's tests: a simulated directory on port 80 of this process's own
// loopback addresses, with the client's directory hosts pointed at it through the environment.
#ifndef KOVA_TESTS_RELAY_FIXTURE_H
#define KOVA_TESTS_RELAY_FIXTURE_H

#include <stdlib.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/value.h>
#include <json/writer.h>

#include "platform/json_text.h"
#include "simlib/relay_sim.h"

namespace kova_test {

// `text` with "$0", "$1", ... replaced by values[0], values[1], ...
inline std::string Fill(std::string text, const std::vector<std::string> &values) {
    for (size_t i = values.size(); i-- > 0;) {
        const std::string mark = "$" + std::to_string(i);
        for (size_t at = text.find(mark); at != std::string::npos; at = text.find(mark, at)) {
            text.replace(at, mark.size(), values[i]);
            at += values[i].size();
        }
    }
    return text;
}

inline Json::Value ParseJson(const std::string &text, const std::vector<std::string> &values = {}) {
    Json::Value value;
    EXPECT_TRUE(kova::JsonFromString(Fill(text, values), value)) << "[" << text << "]";
    return value;
}

inline Json::Value Candidate(const std::string &protocol, const std::string &host, int port) {
    Json::Value candidate(Json::objectValue);
    candidate["protocol"] = protocol;
    candidate["host"] = host;
    candidate["port"] = port;
    return candidate;
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

    // One server known at host 1, which is the only site in the site list.
    void Serve(const Json::Value &server) {
        Json::Value config(Json::objectValue);
        config["sites"].append(Host(1));
        config["servers"].append(server);
        ASSERT_TRUE(Sim().Configure(config));
    }

    // The service ids of the `command`s the directory received, in order.
    std::vector<std::string> ServiceIdsAsked(const std::string &command) {
        std::vector<std::string> ids;
        for (const auto &hit : Sim().Hits(command)) {
            ids.push_back(hit.request["id"].asString());
        }
        return ids;
    }

    kovasim::RelayDirectory directory_;
};

}  // namespace kova_test

#endif  // KOVA_TESTS_RELAY_FIXTURE_H
