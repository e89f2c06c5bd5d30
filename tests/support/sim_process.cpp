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
    for (int i = 0; i < 1200; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        std::ifstream in(portsFile_);
        std::string kind;
        std::string address;
        int http = 0;
        int https = 0;
        std::vector<std::string> relays;
        while (in >> kind >> address) {
            int port = std::stoi(address.substr(address.rfind(':') + 1));
            if (kind == "http") {
                http = port;
            } else if (kind == "https") {
                https = port;
            } else if (kind == "relay") {
                relays.push_back(address);
            }
        }
        if (http > 0 && https > 0 && static_cast<int>(relays.size()) >= relayHosts) {
            httpPort_ = http;
            httpsPort_ = https;
            relayHosts_ = relays;
            return;
        }
        if (waitpid(pid_, &status_, WNOHANG) == pid_) {
            pid_ = 0;
            status_ = WIFEXITED(status_) ? WEXITSTATUS(status_) : -1;
            return;
        }
    }
}

SimProcess::~SimProcess() {
    Stop();
}

int SimProcess::Stop() {
    if (pid_ <= 0) {
        return status_;
    }
    kill(pid_, SIGTERM);
    for (int i = 0; i < 100; ++i) {
        int status = 0;
        if (waitpid(pid_, &status, WNOHANG) == pid_) {
            pid_ = 0;
            status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
            return status_;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = 0;
    status_ = -1;
    return status_;
}

std::string SimProcess::ErrorOutput() const {
    std::ifstream in(errorFile_);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

}  // namespace kova_test
