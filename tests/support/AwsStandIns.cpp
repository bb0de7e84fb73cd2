#include "tests/support/AwsStandIns.h"

#include <time.h>

#include "tests/support/ScriptedHttpServer.h"

namespace testsupport {

std::string IsoTime(std::chrono::system_clock::time_point time) {
    time_t seconds = std::chrono::system_clock::to_time_t(time);
    struct tm utc {};
    gmtime_r(&seconds, &utc);
    char text[32];
    strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &utc);
    return text;
}

std::string StsCredentialsAnswer(const std::string& action, const std::string& accessKey,
                                 const std::string& secretKey, const std::string& sessionToken,
                                 std::chrono::system_clock::time_point expiration) {
    const std::string assumed =
        action.rfind("AssumeRole", 0) == 0
            ? "<AssumedRoleUser><AssumedRoleId>AROA:s</AssumedRoleId><Arn>arn:aws:sts::1:"
              "assumed-role/r/s</Arn></AssumedRoleUser>"
            : "";
    return HttpAnswer("200 OK", "Content-Type: text/xml\r\n",
                      "<" + action +
                          "Response xmlns=\"https://sts.amazonaws.com/doc/2011-06-15/\">"
                          "<" +
                          action + "Result><Credentials><AccessKeyId>" + accessKey +
                          "</AccessKeyId><SecretAccessKey>" + secretKey +
                          "</SecretAccessKey><SessionToken>" + sessionToken +
                          "</SessionToken><Expiration>" + IsoTime(expiration) +
                          "</Expiration></Credentials>" + assumed + "</" + action +
                          "Result><ResponseMetadata><RequestId>r-1</RequestId>"
                          "</ResponseMetadata></" +
                          action + "Response>");
}

std::string StsErrorAnswer(const std::string& statusLine, const std::string& code,
                           const std::string& message) {
    return HttpAnswer(statusLine, "Content-Type: text/xml\r\n",
                      "<ErrorResponse xmlns=\"https://sts.amazonaws.com/doc/2011-06-15/\"><Error>"
                      "<Type>Sender</Type><Code>" +
                          code + "</Code><Message>" + message +
                          "</Message></Error><RequestId>r-2</RequestId></ErrorResponse>");
}

std::string CredentialsJson(const std::string& accessKey, const std::string& secretKey,
                            const std::string& token,
                            std::chrono::system_clock::time_point expiration) {
    return "{\"Code\":\"Success\",\"Type\":\"AWS-HMAC\",\"AccessKeyId\":\"" + accessKey +
           "\",\"SecretAccessKey\":\"" + secretKey + "\",\"Token\":\"" + token +
           "\",\"Expiration\":\"" + IsoTime(expiration) + "\"}";
}

std::string FormValue(const std::string& form, const std::string& name) {
    const std::string key = name + "=";
    size_t at = 0;
    while (at < form.size()) {
        size_t end = form.find('&', at);
        if (end == std::string::npos) end = form.size();
        if (form.compare(at, key.size(), key) == 0) {
            std::string value, raw = form.substr(at + key.size(), end - at - key.size());
            for (size_t i = 0; i < raw.size(); ++i) {
                if (raw[i] == '%' && i + 2 < raw.size()) {
                    value += static_cast<char>(std::stoi(raw.substr(i + 1, 2), nullptr, 16));
                    i += 2;
                } else {
                    value += raw[i] == '+' ? ' ' : raw[i];
                }
            }
            return value;
        }
        at = end + 1;
    }
    return "";
}

}  // namespace testsupport
