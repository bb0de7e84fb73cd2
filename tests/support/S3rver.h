// S3rver: runs the S3 test server (scripts/s3rver.sh, @20minutes/s3rver) as a child process on
// 127.0.0.1. Header-only: the benchmarks, which do not link the test support library, use it too.
// Each instance has its own data directory and port; the server also ends when this process dies
// (its standard input is a pipe held here). One thread starts and stops it.
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
        if (pipe(in) != 0 || pipe(out) != 0 || (pid_ = fork()) < 0) return Fail("cannot fork");
        if (pid_ == 0) {
            dup2(in[0], 0);
            dup2(out[1], 1);
            for (int fd : {in[0], in[1], out[0], out[1]}) close(fd);
            execl("/bin/bash", "bash", script.c_str(), nodePrefix.c_str(), dataDir_.c_str(),
                  kAccessKey, kSecretKey, kBucket, static_cast<char*>(nullptr));
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        stdin_ = in[1];
        std::string line;  // the port, on the first line
        const auto deadline =
            std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
        for (char buffer[64]; line.find('\n') == std::string::npos;) {
            const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                deadline - std::chrono::steady_clock::now());
            pollfd p{out[0], POLLIN, 0};
            ssize_t n = 0;
            if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0 ||
                (n = read(out[0], buffer, sizeof buffer)) <= 0)
                break;
            line.append(buffer, static_cast<size_t>(n));
        }
        close(out[0]);
        if ((port_ = std::atoi(line.c_str())) > 0) return true;
        Stop();
        return Fail("s3rver did not report a port (output \"" + line + "\")");
    }

    // Ends the server and removes its data. Idempotent.
    void Stop() {
        if (stdin_ >= 0) close(stdin_);
        if (pid_ > 0 && kill(pid_, SIGTERM) == 0) waitpid(pid_, nullptr, 0);
        std::error_code ignored;
        if (!dataDir_.empty()) std::filesystem::remove_all(dataDir_, ignored);
        stdin_ = pid_ = -1;
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
