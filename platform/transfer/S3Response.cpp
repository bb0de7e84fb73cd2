#include "platform/transfer/S3Response.h"

#include <time.h>

#include <cctype>
#include <cstdio>
#include <cstring>
#include <set>

std::string S3Response::XmlElement(const std::string& name) const {
    const std::string open = "<" + name + ">";
    size_t begin = body.find(open);
    if (begin == std::string::npos) return "";
    begin += open.size();
    size_t end = body.find("</" + name + ">", begin);
    if (end == std::string::npos) return "";
    return body.substr(begin, end - begin);
}

FileTransferResult ClassifyS3Answer(long status, const std::string& code) {
    // Codes first: S3 sends some of them with more than one status (ExpiredToken comes as 400
    // or 403), and the code is what tells a retry with new credentials from one with a fixed
    // body.
    static const std::set<std::string> kAuthentication = {
        "InvalidAccessKeyId",   "SignatureDoesNotMatch",        "ExpiredToken",
        "InvalidToken",         "TokenRefreshRequired",         "AccessDenied",
        "AccountProblem",       "AuthorizationHeaderMalformed", "InvalidSecurity",
        "MissingSecurityHeader"};
    static const std::set<std::string> kBroken = {"BadDigest", "InvalidDigest",
                                                  "XAmzContentSHA256Mismatch", "IncompleteBody"};
    static const std::set<std::string> kPath = {"NoSuchBucket", "InvalidBucketName",
                                                "PermanentRedirect", "TemporaryRedirect"};
    if (code == "RequestTimeTooSkewed") return RequestTimeTooSkewed;
    if (kAuthentication.count(code)) return AuthenticationError;
    if (kBroken.count(code)) return FileBroken;
    if (kPath.count(code)) return FilePathError;
    if (status >= 200 && status < 300) return Success;
    if (status == 401 || status == 403) return AuthenticationError;
    if (status == 404 || (status >= 300 && status < 400)) return FilePathError;
    // 5xx and every other answer: a retry may work, and ending the upload thread (OtherError)
    // over one strange answer would stop the recording's uploads for good.
    return InternalError;
}

bool RetryableS3Answer(long status, const std::string& code) {
    static const std::set<std::string> kPassing = {"SlowDown",
                                                   "RequestTimeout",
                                                   "InternalError",
                                                   "ServiceUnavailable",
                                                   "Throttling",
                                                   "ThrottlingException",
                                                   "RequestThrottled",
                                                   "RequestLimitExceeded",
                                                   "BandwidthLimitExceeded",
                                                   "TooManyRequests",
                                                   "TooManyRequestsException",
                                                   "RequestTimeoutException",
                                                   "PriorRequestNotComplete"};
    if (kPassing.count(code)) return true;
    return status == 429 || status == 500 || status == 502 || status == 503 || status == 504;
}

bool EtagMatches(const std::string& etag, const std::string& md5Hex) {
    std::string value = etag;
    if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
        value = value.substr(1, value.size() - 2);
    }
    if (value.size() != md5Hex.size()) return false;
    for (size_t i = 0; i < value.size(); ++i) {
        if (std::tolower(static_cast<unsigned char>(value[i])) != md5Hex[i]) return false;
    }
    return true;
}

bool ParseServerTime(const std::string& text, std::chrono::system_clock::time_point& out) {
    struct tm utc {};
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    char monthName[4] = {};
    char weekday[4] = {};
    if (std::sscanf(text.c_str(), "%3s, %d %3s %d %d:%d:%d", weekday, &day, monthName, &year, &hour,
                    &minute, &second) == 7) {
        static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                              "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
        for (int i = 0; i < 12; ++i) {
            if (std::strcmp(monthName, kMonths[i]) == 0) month = i + 1;
        }
    } else if (std::sscanf(text.c_str(), "%d-%d-%dT%d:%d:%d", &year, &month, &day, &hour, &minute,
                           &second) != 6) {
        return false;
    }
    if (month < 1 || month > 12 || day < 1 || day > 31 || year < 1970 || hour > 23 || minute > 59 ||
        second > 60) {
        return false;
    }
    utc.tm_year = year - 1900;
    utc.tm_mon = month - 1;
    utc.tm_mday = day;
    utc.tm_hour = hour;
    utc.tm_min = minute;
    utc.tm_sec = second;
    out = std::chrono::system_clock::from_time_t(timegm(&utc));
    return true;
}
