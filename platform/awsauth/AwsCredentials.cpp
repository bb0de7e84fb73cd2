#include "platform/awsauth/AwsCredentials.h"

#include <time.h>

#include <cstdio>
#include <cstdlib>
#include <nlohmann/json.hpp>

namespace awsauth {

Environment ProcessEnvironment() {
    return [](const std::string& name) {
        const char* value = std::getenv(name.c_str());
        return value ? std::string(value) : std::string();
    };
}

bool ParseIsoTime(const std::string& text, Clock::time_point& out) {
    struct tm t {};
    int consumed = 0;
    if (std::sscanf(text.c_str(), "%4d-%2d-%2dT%2d:%2d:%2d%n", &t.tm_year, &t.tm_mon, &t.tm_mday,
                    &t.tm_hour, &t.tm_min, &t.tm_sec, &consumed) != 6 ||
        consumed != 19) {
        return false;
    }
    std::string rest = text.substr(19);
    if (!rest.empty() && rest[0] == '.') {  // fraction of a second: ignored
        size_t end = rest.find_first_not_of("0123456789", 1);
        rest = end == std::string::npos ? "" : rest.substr(end);
    }
    long offsetSeconds = 0;
    if (rest == "Z" || rest == "z") {
    } else if (rest.size() == 6 && (rest[0] == '+' || rest[0] == '-') && rest[3] == ':') {
        int hours = 0, minutes = 0;
        if (std::sscanf(rest.c_str() + 1, "%2d:%2d", &hours, &minutes) != 2) return false;
        offsetSeconds = (rest[0] == '+' ? 1 : -1) * (hours * 3600L + minutes * 60L);
    } else {
        return false;
    }
    if (t.tm_mon < 1 || t.tm_mon > 12 || t.tm_mday < 1 || t.tm_mday > 31 || t.tm_hour > 23 ||
        t.tm_min > 59 || t.tm_sec > 60) {
        return false;
    }
    t.tm_year -= 1900;
    t.tm_mon -= 1;
    out = Clock::from_time_t(timegm(&t) - offsetSeconds);
    return true;
}

Lookup CredentialsFromJson(const std::string& json, const std::string& tokenField) {
    nlohmann::json document = nlohmann::json::parse(json, nullptr, false);
    if (document.is_discarded() || !document.is_object()) {
        return Lookup::Failed("not a JSON object");
    }
    auto text = [&](const char* name, std::string* target) {
        auto it = document.find(name);
        if (it == document.end() || it->is_null()) return true;
        if (!it->is_string()) return false;
        *target = it->get<std::string>();
        return true;
    };
    AwsCredentials credentials;
    std::string expiration;
    if (!text("AccessKeyId", &credentials.accessKey) || credentials.accessKey.empty()) {
        return Lookup::Failed("no AccessKeyId");
    }
    if (!text("SecretAccessKey", &credentials.secretKey) || credentials.secretKey.empty()) {
        return Lookup::Failed("no SecretAccessKey");
    }
    if (!text(tokenField.c_str(), &credentials.sessionToken)) {
        return Lookup::Failed(tokenField + " is not a string");
    }
    if (!text("Expiration", &expiration)) return Lookup::Failed("Expiration is not a string");
    if (!expiration.empty()) {
        Clock::time_point at;
        if (!ParseIsoTime(expiration, at)) {
            return Lookup::Failed("Expiration \"" + expiration + "\" is not an ISO 8601 time");
        }
        credentials.expiration = at;
    }
    return Lookup::Found(std::move(credentials));
}

}  // namespace awsauth
