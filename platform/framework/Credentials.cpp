#include "platform/framework/Credentials.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

extern char** environ;

namespace credentials {

awsauth::Lookup ParseProcessOutput(const std::string& json) {
    awsauth::Lookup lookup = awsauth::CredentialsFromJson(json, "SessionToken");
    if (!lookup.Ok()) lookup.why = "its output: " + lookup.why;
    return lookup;
}

bool RunCommand(const std::string& command, int timeoutMs, std::string* output, std::string* why) {
    int pipeFds[2];
    if (pipe2(pipeFds, O_CLOEXEC) != 0) {
        *why = "cannot create a pipe";
        return false;
    }
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, pipeFds[1], 1);
    // The child must not inherit our handlers' view of SIGINT/SIGTERM: default actions.
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
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETSIGMASK);
    const char* argv[] = {"/bin/sh", "-c", command.c_str(), nullptr};
    pid_t pid = -1;
    int rc = posix_spawn(&pid, "/bin/sh", &actions, &attributes, const_cast<char**>(argv), environ);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    close(pipeFds[1]);
    if (rc != 0) {
        close(pipeFds[0]);
        *why = "cannot start /bin/sh";
        return false;
    }

    output->clear();
    bool timedOut = false;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (true) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                        deadline - std::chrono::steady_clock::now())
                        .count();
        pollfd p{pipeFds[0], POLLIN, 0};
        int ready = left > 0 ? poll(&p, 1, static_cast<int>(left)) : 0;
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) {
            timedOut = ready == 0;
            break;
        }
        char buffer[4096];
        ssize_t n = read(pipeFds[0], buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        output->append(buffer, static_cast<size_t>(n));
        if (output->size() > 1024 * 1024) break;  // no credential document is this large
    }
    close(pipeFds[0]);
    if (timedOut) kill(pid, SIGKILL);
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (timedOut) {
        *why = "it took longer than " + std::to_string(timeoutMs / 1000) + " s";
        return false;
    }
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
    if (!RunCommand(command, kProcessTimeoutMs, &output, &why)) {
        return awsauth::Lookup::Failed("the credential process failed: " + why);
    }
    awsauth::Lookup lookup = ParseProcessOutput(output);
    if (!lookup.Ok()) lookup.why = "the credential process failed: " + lookup.why;
    return lookup;
}

awsauth::Lookup FromEnvironment(const awsauth::Environment& environment) {
    awsauth::AwsCredentials found;
    found.accessKey = environment("AWS_ACCESS_KEY_ID");
    found.secretKey = environment("AWS_SECRET_ACCESS_KEY");
    found.sessionToken = environment("AWS_SESSION_TOKEN");
    if (!found.accessKey.empty() && !found.secretKey.empty()) {
        return awsauth::Lookup::Found(found);
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
