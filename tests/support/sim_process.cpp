#include "support/sim_process.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

namespace kova_test {

SimProcess::SimProcess(const TempDir &dir, const std::string &args, int relayHosts)
    : portsFile_(dir.File("kovasim.ports")), errorFile_(dir.File("kovasim.err")) {
    pid_ = fork();
    if (pid_ == 0) {
        std::string command = "exec " + ToolCommand(KOVASIM_BIN) + " " + args + " > " + portsFile_ +
                              " 2> " + errorFile_;
        execl("/bin/sh", "sh", "-c", command.c_str(), static_cast<char *>(nullptr));
        _exit(127);
    }
    for (int i = 0; i < 1200 && pid_ > 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        std::istringstream lines(ReadFile(portsFile_));
        int http = 0;
        int https = 0;
        std::vector<std::string> relays;
        for (std::string kind, address; lines >> kind >> address;) {
            const int port = std::stoi(address.substr(address.rfind(':') + 1));
            http = kind == "http" ? port : http;
            https = kind == "https" ? port : https;
            if (kind == "relay") {
                relays.push_back(address);
            }
        }
        if (http > 0 && https > 0 && static_cast<int>(relays.size()) >= relayHosts) {
            httpPort_ = http;
            httpsPort_ = https;
            relayHosts_ = relays;
            return;
        }
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
            pid_ = 0;  // reaped: never signal the number again
        }
    }
}

SimProcess::~SimProcess() {
    if (pid_ <= 0) {
        return;
    }
    kill(pid_, SIGTERM);
    for (int i = 0; i < 100; ++i) {
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
}

}  // namespace kova_test
