#include "platform/framework/Credentials.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cctype>
#include <chrono>
#include <cstdlib>
#include <nlohmann/json.hpp>

extern char** environ;

namespace credentials {

namespace {

std::string envValue(const char* name) {
    const char* v = std::getenv(name);
    return v ? std::string(v) : std::string();
}

bool isFileEndpoint(const std::string& endpoint) {
    if (endpoint.size() < 5) return false;
    std::string scheme = endpoint.substr(0, 5);
    for (char& c : scheme) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return scheme == "file:";
}

std::map<std::string, std::string> properties(const std::string& accessKey,
                                              const std::string& secretKey,
                                              const std::string& sessionToken,
                                              const std::string& region) {
    return {{"awsAccessKey", accessKey},
            {"awsSecretKey", secretKey},
            {"sessionToken", sessionToken},
            {"region", region}};
}

}  // namespace

bool ParseProcessOutput(const std::string& json, std::string* accessKey, std::string* secretKey,
                        std::string* sessionToken, std::string* why) {
    nlohmann::json document = nlohmann::json::parse(json, nullptr, false);
    if (document.is_discarded() || !document.is_object()) {
        *why = "its output is not a JSON object";
        return false;
    }
    const std::pair<const char*, std::string*> fields[] = {
        {"AccessKeyId", accessKey}, {"SecretAccessKey", secretKey}, {"SessionToken", sessionToken}};
    for (const auto& [name, target] : fields) {
        auto it = document.find(name);
        if (it == document.end() || !it->is_string() || it->get<std::string>().empty()) {
            *why = std::string("its output has no ") + name;
            if (std::string(name) == "SessionToken")
                *why += " (the recorder takes temporary credentials only)";
            return false;
        }
        *target = it->get<std::string>();
    }
    return true;
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

Result Fetch(const FrameworkOptions& options) {
    Result result;
    if (isFileEndpoint(options.endpoint)) {
        result.ok = true;
        result.source = "local store";
        result.properties = properties("local", "local", "local", options.region);
        return result;
    }
    std::string reasons;
    if (!options.credentialProcess.empty()) {
        std::string output, why, accessKey, secretKey, token;
        if (RunCommand(options.credentialProcess, kProcessTimeoutMs, &output, &why) &&
            ParseProcessOutput(output, &accessKey, &secretKey, &token, &why)) {
            result.ok = true;
            result.source = "credential process";
            result.properties = properties(accessKey, secretKey, token, options.region);
            return result;
        }
        reasons = "the credential process failed: " + why + "; ";
    }
    const std::string accessKey = envValue("AWS_ACCESS_KEY_ID");
    const std::string secretKey = envValue("AWS_SECRET_ACCESS_KEY");
    const std::string token = envValue("AWS_SESSION_TOKEN");
    if (!accessKey.empty() && !secretKey.empty() && !token.empty()) {
        result.ok = true;
        result.source = "environment";
        result.properties = properties(accessKey, secretKey, token, options.region);
        return result;
    }
    if (accessKey.empty() && secretKey.empty() && token.empty()) {
        reasons +=
            "no AWS_ACCESS_KEY_ID, AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN in the "
            "environment";
    } else {
        std::string missing;
        for (const char* name : {"AWS_ACCESS_KEY_ID", "AWS_SECRET_ACCESS_KEY", "AWS_SESSION_TOKEN"})
            if (envValue(name).empty()) missing += std::string(missing.empty() ? "" : ", ") + name;
        reasons += missing + " not set (the recorder takes temporary credentials only)";
    }
    if (options.credentialProcess.empty()) reasons += "; no -credentialprocess given";
    result.why = reasons;
    return result;
}

}  // namespace credentials
