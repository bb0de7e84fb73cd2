// Credentials: the two credential sources that read this host's own settings, the first two
// links of the chain that HostCredentials builds:
//   - `-credentialprocess CMD`: CMD run through /bin/sh, its standard output read as AWS
//     `credential_process` JSON (AccessKeyId, SecretAccessKey, SessionToken, Expiration);
//   - the environment: AWS_ACCESS_KEY_ID, AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN.
// Either may give long-term keys (no session token); the chain exchanges those for temporary
// ones, because the module accepts only temporary credentials (all four values present). A key,
// secret or token that holds a control character is refused, so that it can never break a
// request's header lines.
//
// Secrets never reach a log line or an error text: texts name the source and the missing
// field only.
//
// Threads: nothing here keeps state; any function may run on several threads at once.
#pragma once

#include <map>
#include <string>

#include "platform/awsauth/AwsCredentials.h"

namespace credentials {

// How long a credential process may take before it is killed.
constexpr int kProcessTimeoutMs = 10000;

// What the host hands to the module, or why it has nothing.
struct Result {
    bool ok = false;
    std::string source;  // "local store", "credential process", "environment", ...
    std::map<std::string, std::string> properties;  // the four keys of setProperties
    std::string why;  // when !ok: why there are none, for the log (no secrets)
};

// Reads `credential_process` output. Failed with a reason (no secrets) when it is not JSON,
// not an object, or lacks the key id or the secret.
awsauth::Lookup ParseProcessOutput(const std::string& json);

// The -credentialprocess link (also runs a profile's credential_process): RunCommand with
// kProcessTimeoutMs, then ParseProcessOutput.
awsauth::Lookup FromCredentialProcess(const std::string& command);

// The environment link: absent when none of the three variables is set.
awsauth::Lookup FromEnvironment(const awsauth::Environment& environment);

// Runs `command` through /bin/sh in a process group of its own and collects its standard
// output (its standard error goes to ours). One deadline, `timeoutMs`, covers the output and
// the exit. The output is complete when the pipe closes, or as soon as it is a whole JSON
// document once the shell has exited (a helper may leave a background child that holds the
// pipe). Whatever is left of the group is killed before RunCommand returns: at the deadline,
// when `cancelFd` (-1: none) becomes readable or StopCommands is called, and after a complete
// read. False with a reason when it cannot start, exits non-zero, is killed, is stopped or
// takes too long.
bool RunCommand(const std::string& command, int timeoutMs, int cancelFd, std::string* output,
                std::string* why);

// Ends every RunCommand under way (their process groups are killed): the recorder is stopping.
// Later calls run as usual. Any thread.
void StopCommands();

}  // namespace credentials
