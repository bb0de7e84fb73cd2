// S3rver: runs the S3 test server (scripts/s3rver.sh, @20minutes/s3rver) as a child process
// on 127.0.0.1 for one test or benchmark program.
//
// Header-only so that benchmarks, which do not link the test support library, can use it too.
// Each instance has its own data directory and port, so parallel test processes do not meet;
// the script serialises the one-time npm install into the build tree. The server also ends by
// itself when this process dies (its standard input is a pipe held here). Not thread-safe: one
// thread starts and stops it.
#pragma once

#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <string>

namespace testsupport {

class S3rver {
  public:
    // The key pair and bucket every instance serves.
    static constexpr const char* kAccessKey = "AKIDTEST";
    static constexpr const char* kSecretKey = "secretTEST";
    static constexpr const char* kBucket = "rec";

    S3rver() = default;
    ~S3rver() { Stop(); }
    S3rver(const S3rver&) = delete;
    S3rver& operator=(const S3rver&) = delete;

    // Starts the server with `script` (scripts/s3rver.sh) and the npm prefix `nodePrefix`
    // (in the build tree). Waits up to `timeoutMs` for the port (the first run installs the
    // package). False when it did not start; `Error()` says why.
    bool Start(const std::string& script, const std::string& nodePrefix, int timeoutMs = 300000) {
        char templ[] = "/tmp/sfr-s3rver-XXXXXX";
        if (mkdtemp(templ) == nullptr) return Fail("mkdtemp failed");
        dataDir_ = templ;
        int in[2], out[2];
        if (pipe(in) != 0) return Fail("pipe failed");
        if (pipe(out) != 0) {
            close(in[0]);
            close(in[1]);
            return Fail("pipe failed");
        }
        pid_ = fork();
        if (pid_ == 0) {
            dup2(in[0], 0);
            dup2(out[1], 1);
            close(in[0]);
            close(in[1]);
            close(out[0]);
            close(out[1]);
            execl("/bin/bash", "bash", script.c_str(), nodePrefix.c_str(), dataDir_.c_str(),
                  kAccessKey, kSecretKey, kBucket, static_cast<char*>(nullptr));
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        stdin_ = in[1];
        int stdoutFd = out[0];
        if (pid_ < 0) {
            close(stdoutFd);
            return Fail("fork failed");
        }
        std::string line;
        auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
        while (line.find('\n') == std::string::npos) {
            auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                            deadline - std::chrono::steady_clock::now())
                            .count();
            pollfd p{stdoutFd, POLLIN, 0};
            if (left <= 0 || poll(&p, 1, static_cast<int>(left)) <= 0) break;
            char buffer[64];
            ssize_t n = read(stdoutFd, buffer, sizeof buffer);
            if (n <= 0) break;
            line.append(buffer, static_cast<size_t>(n));
        }
        close(stdoutFd);
        port_ = std::atoi(line.c_str());
        if (port_ <= 0) {
            Stop();
            return Fail("s3rver did not report a port (output \"" + line + "\")");
        }
        return true;
    }

    // Ends the server and removes its data. Idempotent.
    void Stop() {
        if (stdin_ >= 0) close(stdin_);
        stdin_ = -1;
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            int status = 0;
            waitpid(pid_, &status, 0);
        }
        pid_ = -1;
        if (!dataDir_.empty()) {
            std::error_code ignored;
            std::filesystem::remove_all(dataDir_, ignored);
        }
        dataDir_.clear();
    }

    int Port() const { return port_; }
    std::string Endpoint() const { return "http://127.0.0.1:" + std::to_string(port_); }
    const std::string& Error() const { return error_; }

  private:
    bool Fail(const std::string& why) {
        error_ = why;
        return false;
    }

    pid_t pid_ = -1;
    int stdin_ = -1;  // write end of the server's standard input
    int port_ = 0;
    std::string dataDir_;
    std::string error_;
};

}  // namespace testsupport
