#include "platform/framework/Credentials.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <mutex>
#include <nlohmann/json.hpp>
#include <set>

extern char** environ;

namespace credentials {

awsauth::Lookup ParseProcessOutput(const std::string& json) {
    awsauth::Lookup lookup = awsauth::CredentialsFromJson(json, "SessionToken");
    if (!lookup.Ok()) lookup.why = "its output: " + lookup.why;
    return lookup;
}

namespace {

// The cancel pipes (write ends) of the RunCommand calls under way, for StopCommands.
std::mutex g_runningMutex;
std::set<int> g_running;

bool hasControlCharacter(const std::string& text) {
    for (unsigned char c : text)
        if (c < 0x20 || c == 0x7f) return true;
    return false;
}

// `found` unless one of its texts holds a control character, which would break a request's
// header lines: then failed, naming the field as `names` call them (never showing the value).
awsauth::Lookup checked(awsauth::Lookup found, const char* const (&names)[3]) {
    if (!found.Ok()) return found;
    const std::string* texts[] = {&found.credentials.accessKey, &found.credentials.secretKey,
                                  &found.credentials.sessionToken};
    for (int i = 0; i < 3; ++i)
        if (hasControlCharacter(*texts[i]))
            return awsauth::Lookup::Failed(std::string(names[i]) + " holds a control character");
    return found;
}

// A child run through /bin/sh in a process group of its own, read until its output is
// complete and it has exited, or the deadline passes, or a cancel descriptor becomes readable.
class Child {
  public:
    Child(int stdoutFd, pid_t pid)
        : stdout_(stdoutFd), pid_(pid), pidfd_(static_cast<int>(syscall(SYS_pidfd_open, pid, 0))) {}
    ~Child() {
        // Whatever is left of the group (a helper's background child holding our pipe, or the
        // whole group at the deadline) ends with us: no orphan outlives the fetch.
        kill(-pid_, SIGKILL);
        if (!exited_) {
            while (waitpid(pid_, &status_, 0) < 0 && errno == EINTR) {
            }
        }
        if (pidfd_ >= 0) close(pidfd_);
        if (stdout_ >= 0) close(stdout_);
    }
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    enum class End { kDone, kTimedOut, kCancelled, kBroken };

    End Collect(std::chrono::steady_clock::time_point deadline, const int (&cancelFds)[2],
                std::string* output) {
        if (pidfd_ < 0) return End::kBroken;
        while (!(exited_ && (stdout_ < 0 || nlohmann::json::accept(*output)))) {
            auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                            deadline - std::chrono::steady_clock::now())
                            .count();
            if (left <= 0) return End::kTimedOut;
            pollfd fds[4] = {{stdout_, POLLIN, 0},
                             {exited_ ? -1 : pidfd_, POLLIN, 0},
                             {cancelFds[0], POLLIN, 0},
                             {cancelFds[1], POLLIN, 0}};
            int ready = poll(fds, 4, static_cast<int>(left));
            if (ready < 0 && errno != EINTR) return End::kBroken;
            if (ready <= 0) continue;
            if (fds[2].revents != 0 || fds[3].revents != 0) return End::kCancelled;
            if (fds[1].revents != 0) reap();
            if (fds[0].revents != 0 && !read(output)) return End::kBroken;
        }
        return End::kDone;
    }
    int Status() const { return status_; }

  private:
    void reap() {
        if (waitpid(pid_, &status_, WNOHANG) == pid_) exited_ = true;
    }
    // One read; closes the pipe at its end. False when the output is too large to be credentials.
    bool read(std::string* output) {
        char buffer[4096];
        ssize_t n = ::read(stdout_, buffer, sizeof buffer);
        if (n < 0) return errno == EINTR || errno == EAGAIN;
        if (n == 0) {
            close(stdout_);
            stdout_ = -1;
            return true;
        }
        output->append(buffer, static_cast<size_t>(n));
        return output->size() <= 1024 * 1024;
    }

    int stdout_;
    pid_t pid_;
    int pidfd_;
    bool exited_ = false;
    int status_ = 0;
};

// Starts /bin/sh -c `command` with its standard output on `stdoutFd`, in a new process group,
// with default SIGINT/SIGTERM/SIGPIPE actions and no blocked signals. -1 when it cannot start.
pid_t spawnShell(const std::string& command, int stdoutFd) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, stdoutFd, 1);
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    sigset_t defaults;
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGINT);
    sigaddset(&defaults, SIGTERM);
    sigaddset(&defaults, SIGPIPE);
    posix_spawnattr_setsigdefault(&attributes, &defaults);
    sigset_t none;
    sigemptyset(&none);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setflags(
        &attributes, POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETPGROUP);
    const char* argv[] = {"/bin/sh", "-c", command.c_str(), nullptr};
    pid_t pid = -1;
    int rc = posix_spawn(&pid, "/bin/sh", &actions, &attributes, const_cast<char**>(argv), environ);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    return rc == 0 ? pid : -1;
}

}  // namespace

void StopCommands() {
    std::lock_guard<std::mutex> lock(g_runningMutex);
    const char byte = 1;
    for (int fd : g_running) {
        while (write(fd, &byte, 1) < 0 && errno == EINTR) {
        }
    }
}

bool RunCommand(const std::string& command, int timeoutMs, int cancelFd, std::string* output,
                std::string* why) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    int pipeFds[2];
    if (pipe2(pipeFds, O_CLOEXEC) != 0) {
        *why = "cannot create a pipe";
        return false;
    }
    // Its own cancel pipe, which StopCommands writes to while it is registered.
    struct Registered {
        int fds[2] = {-1, -1};
        Registered() {
            if (pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) return;
            std::lock_guard<std::mutex> lock(g_runningMutex);
            g_running.insert(fds[1]);
        }
        ~Registered() {
            if (fds[0] < 0) return;
            {
                std::lock_guard<std::mutex> lock(g_runningMutex);
                g_running.erase(fds[1]);
            }
            close(fds[0]);
            close(fds[1]);
        }
    } stop;
    const pid_t pid = spawnShell(command, pipeFds[1]);
    close(pipeFds[1]);
    if (pid < 0) {
        close(pipeFds[0]);
        *why = "cannot start /bin/sh";
        return false;
    }
    output->clear();
    Child child(pipeFds[0], pid);
    const int cancelFds[2] = {cancelFd, stop.fds[0]};
    switch (child.Collect(deadline, cancelFds, output)) {
        case Child::End::kTimedOut:
            *why = "it took longer than " + std::to_string(timeoutMs / 1000) + " s";
            return false;
        case Child::End::kCancelled:
            *why = "the recorder is stopping";
            return false;
        case Child::End::kBroken:
            *why = "its output could not be read";
            return false;
        case Child::End::kDone:
            break;
    }
    const int status = child.Status();
    if (WIFSIGNALED(status)) {
        *why = "it was ended by signal " + std::to_string(WTERMSIG(status));
        return false;
    }
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        *why = "it exited with status " + std::to_string(WEXITSTATUS(status));
        return false;
    }
    return true;
}

awsauth::Lookup FromCredentialProcess(const std::string& command) {
    std::string output, why;
    if (!RunCommand(command, kProcessTimeoutMs, -1, &output, &why)) {
        return awsauth::Lookup::Failed("the credential process failed: " + why);
    }
    awsauth::Lookup lookup = checked(
        ParseProcessOutput(output), {"its AccessKeyId", "its SecretAccessKey", "its SessionToken"});
    if (!lookup.Ok()) lookup.why = "the credential process failed: " + lookup.why;
    return lookup;
}

awsauth::Lookup FromEnvironment(const awsauth::Environment& environment) {
    awsauth::AwsCredentials found;
    found.accessKey = environment("AWS_ACCESS_KEY_ID");
    found.secretKey = environment("AWS_SECRET_ACCESS_KEY");
    found.sessionToken = environment("AWS_SESSION_TOKEN");
    if (!found.accessKey.empty() && !found.secretKey.empty()) {
        return checked(awsauth::Lookup::Found(found),
                       {"AWS_ACCESS_KEY_ID", "AWS_SECRET_ACCESS_KEY", "AWS_SESSION_TOKEN"});
    }
    if (found.accessKey.empty() && found.secretKey.empty() && found.sessionToken.empty()) {
        return awsauth::Lookup::Absent(
            "no AWS_ACCESS_KEY_ID, AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN");
    }
    return awsauth::Lookup::Failed(
        std::string(found.accessKey.empty() ? "AWS_ACCESS_KEY_ID" : "AWS_SECRET_ACCESS_KEY") +
        " not set");
}

}  // namespace credentials
