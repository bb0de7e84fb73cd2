// Credentials: where the standalone host finds the AWS credentials it hands to the module.
//
// In order, the first that gives a complete set:
//   - a `file://` endpoint: fixed local credentials (the local directory store checks none);
//   - `-credentialprocess CMD`: CMD run through /bin/sh, its standard output read as AWS
//     `credential_process` JSON (AccessKeyId, SecretAccessKey, SessionToken; Expiration is
//     not needed because the host asks again on every token request);
//   - the environment: AWS_ACCESS_KEY_ID, AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN.
// The region comes from the options (-region, AWS_REGION, AWS_DEFAULT_REGION, us-east-1).
// The module accepts only temporary credentials (all four values present), so a set without a
// session token is incomplete.
//
// Secrets never reach a log line or an error text: texts name the source and the missing
// field only.
//
// Threads: Fetch keeps no state; it may run on several threads at once (the message thread
// after the connection reply, the upload thread on a token request).
#pragma once

#include <map>
#include <string>

#include "platform/framework/FrameworkOptions.h"

namespace credentials {

// How long a credential process may take before it is killed.
constexpr int kProcessTimeoutMs = 10000;

struct Result {
    bool ok = false;
    std::string source;  // "local store", "credential process", "environment"
    std::map<std::string, std::string> properties;  // the four keys of setProperties
    std::string why;  // when !ok: why there are none, for the log (no secrets)
};

Result Fetch(const FrameworkOptions& options);

// Parses `credential_process` output. False with a reason (no secrets) when it is not JSON,
// not an object, or lacks one of the three strings.
bool ParseProcessOutput(const std::string& json, std::string* accessKey, std::string* secretKey,
                        std::string* sessionToken, std::string* why);

// Runs `command` through /bin/sh, collects its standard output (its standard error goes to
// ours); false with a reason when it cannot start, exits non-zero, is killed or takes longer
// than `timeoutMs`.
bool RunCommand(const std::string& command, int timeoutMs, std::string* output, std::string* why);

}  // namespace credentials
