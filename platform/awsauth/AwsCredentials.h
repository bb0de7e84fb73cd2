// AwsCredentials: one set of AWS credentials as a source hands it out, and what asking one
// source of the credential chain gave.
//
// Plain values, copied freely. Never log the secret key or the session token: texts that may
// reach a log (`why`) name sources and fields only.
#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>

namespace awsauth {

using Clock = std::chrono::system_clock;

struct AwsCredentials {
    std::string accessKey;
    std::string secretKey;
    std::string sessionToken;  // empty for long-term keys (an IAM user's)
    // When the set stops working; none for keys that do not expire by themselves.
    std::optional<Clock::time_point> expiration;

    bool Temporary() const { return !sessionToken.empty(); }
};

// What one source gave when asked.
struct Lookup {
    enum class Outcome {
        kAbsent,  // the source is not configured here (no variable, no file, no service)
        kFound,
        kFailed,  // configured, but it did not give usable credentials
    };
    Outcome outcome = Outcome::kAbsent;
    AwsCredentials credentials;  // kFound only
    std::string why;             // kAbsent / kFailed: for the log, without secrets

    static Lookup Absent(std::string why) { return {Outcome::kAbsent, {}, std::move(why)}; }
    static Lookup Failed(std::string why) { return {Outcome::kFailed, {}, std::move(why)}; }
    static Lookup Found(AwsCredentials credentials) {
        return {Outcome::kFound, std::move(credentials), ""};
    }
    bool Ok() const { return outcome == Outcome::kFound; }
};

// Reads one environment variable; "" when unset. Injected so that tests need not change the
// process's environment; the default reads getenv.
using Environment = std::function<std::string(const std::string& name)>;
Environment ProcessEnvironment();

// "2026-01-02T03:04:05Z" (fraction and offset "+hh:mm" allowed) as a point in time; false when
// the text is not such a time.
bool ParseIsoTime(const std::string& text, Clock::time_point& out);

// Reads a JSON credentials document as credential processes, the container endpoint and the
// instance metadata service give it: AccessKeyId, SecretAccessKey, the session token under
// `tokenField` ("SessionToken" or "Token"; optional: long-term keys have none) and an optional
// Expiration. Failed with a reason (no secrets) when it is not such a document.
Lookup CredentialsFromJson(const std::string& json, const std::string& tokenField);

}  // namespace awsauth
