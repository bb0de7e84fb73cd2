// Answers of the AWS services the credential sources talk to, in the documented shapes, for
// ScriptedHttpServer handlers that stand in for STS, the container endpoint and the instance
// metadata service. Pure functions.
#pragma once

#include <chrono>
#include <string>

namespace testsupport {

// "2026-01-02T03:04:05Z".
std::string IsoTime(std::chrono::system_clock::time_point time);

// STS's 200 answer to `action` ("AssumeRole", "GetSessionToken", ...) carrying credentials.
std::string StsCredentialsAnswer(const std::string& action, const std::string& accessKey,
                                 const std::string& secretKey, const std::string& sessionToken,
                                 std::chrono::system_clock::time_point expiration);

// STS's error answer: "403 Forbidden", "AccessDenied", "...".
std::string StsErrorAnswer(const std::string& statusLine, const std::string& code,
                           const std::string& message);

// The JSON the container endpoint and the instance metadata service answer with.
std::string CredentialsJson(const std::string& accessKey, const std::string& secretKey,
                            const std::string& token,
                            std::chrono::system_clock::time_point expiration);

// The value of `name` in a form body ("a=1&b=2"), percent-decoded; "" when absent.
std::string FormValue(const std::string& form, const std::string& name);

}  // namespace testsupport
