// Answers of the AWS services the credential sources talk to, in their documented shapes, for
// ScriptedHttpServer handlers standing in for STS, the container endpoint and the instance
// metadata service.
#pragma once

#include <chrono>
#include <string>

#include "platform/transfer/UtcTime.h"
#include "tests/support/ScriptedHttpServer.h"

namespace testsupport {

// "2026-01-02T03:04:05Z".
inline std::string IsoTime(std::chrono::system_clock::time_point time) {
    return FormatUtc(time, "%Y-%m-%dT%H:%M:%SZ");
}

// STS's 200 answer to `action` ("AssumeRole", "GetSessionToken", ...) carrying credentials.
inline std::string StsCredentialsAnswer(const std::string& action, const std::string& accessKey,
                                        const std::string& secretKey,
                                        const std::string& sessionToken,
                                        std::chrono::system_clock::time_point expiration) {
    const std::string user = action.rfind("AssumeRole", 0) == 0
                                 ? "<AssumedRoleUser><AssumedRoleId>AROA:s</AssumedRoleId><Arn>"
                                   "arn:aws:sts::1:assumed-role/r/s</Arn></AssumedRoleUser>"
                                 : "";
    return HttpAnswer(
        "200 OK", "Content-Type: text/xml\r\n",
        "<" + action + "Response xmlns=\"https://sts.amazonaws.com/doc/2011-06-15/\"><" + action +
            "Result><Credentials><AccessKeyId>" + accessKey + "</AccessKeyId><SecretAccessKey>" +
            secretKey + "</SecretAccessKey><SessionToken>" + sessionToken +
            "</SessionToken><Expiration>" + IsoTime(expiration) + "</Expiration></Credentials>" +
            user + "</" + action + "Result><ResponseMetadata><RequestId>r-1</RequestId>" +
            "</ResponseMetadata></" + action + "Response>");
}

// STS's error answer: "403 Forbidden", "AccessDenied", "...".
inline std::string StsErrorAnswer(const std::string& statusLine, const std::string& code,
                                  const std::string& message) {
    return HttpAnswer(statusLine, "Content-Type: text/xml\r\n",
                      "<ErrorResponse xmlns=\"https://sts.amazonaws.com/doc/2011-06-15/\"><Error>"
                      "<Type>Sender</Type><Code>" +
                          code + "</Code><Message>" + message +
                          "</Message></Error><RequestId>r-2</RequestId></ErrorResponse>");
}

// The JSON the container endpoint and the instance metadata service answer with.
inline std::string CredentialsJson(const std::string& accessKey, const std::string& secretKey,
                                   const std::string& token,
                                   std::chrono::system_clock::time_point expiration) {
    return "{\"Code\":\"Success\",\"Type\":\"AWS-HMAC\",\"AccessKeyId\":\"" + accessKey +
           "\",\"SecretAccessKey\":\"" + secretKey + "\",\"Token\":\"" + token +
           "\",\"Expiration\":\"" + IsoTime(expiration) + "\"}";
}

// The value of `name` in a form body ("a=1&b=2"), percent-decoded; "" when absent.
inline std::string FormValue(const std::string& form, const std::string& name) {
    const std::string pair = "&" + form + "&";
    const size_t at = pair.find("&" + name + "=");
    if (at == std::string::npos) return "";
    const size_t start = at + name.size() + 2;
    std::string value;
    for (size_t i = start; i < pair.find('&', start); ++i) {
        if (pair[i] == '%' && i + 2 < pair.size()) {
            value += static_cast<char>(std::stoi(pair.substr(i + 1, 2), nullptr, 16));
            i += 2;
        } else {
            value += pair[i] == '+' ? ' ' : pair[i];
        }
    }
    return value;
}

}  // namespace testsupport
