// A kovasim process for end-to-end tests: started with its listener lines written to a file,
// stopped with SIGTERM (SIGKILL after five seconds).
#ifndef KOVA_TESTS_SUPPORT_SIM_PROCESS_H
#define KOVA_TESTS_SUPPORT_SIM_PROCESS_H

#include <sys/types.h>

#include <string>
#include <vector>

#include "support/temp_dir.h"

namespace kova_test {

class SimProcess {
  public:
    // Runs `kovasim ARGS` and waits (at most 60 s, for an emulated kovasim making its key)
    // until it has printed its listeners; the relay hosts are awaited too when `relayHosts` is
    // above 0.
    SimProcess(const TempDir &dir, const std::string &args = "", int relayHosts = 0);
    ~SimProcess();
    SimProcess(const SimProcess &) = delete;
    SimProcess &operator=(const SimProcess &) = delete;

    int HttpPort() const { return httpPort_; }
    int HttpsPort() const { return httpsPort_; }
    // "HOST:PORT" of each relay-directory listener, in the order printed.
    const std::vector<std::string> &RelayHosts() const { return relayHosts_; }
    // Everything kovasim wrote to its standard error.
    std::string ErrorOutput() const { return ReadFile(errorFile_); }

  private:
    pid_t pid_ = 0;
    std::string portsFile_;
    std::string errorFile_;
    int httpPort_ = 0;
    int httpsPort_ = 0;
    std::vector<std::string> relayHosts_;
};

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_SIM_PROCESS_H
