#include "platform/transfer/StoreSettings.h"

#include <sys/stat.h>

#include <cctype>
#include <climits>

#include "platform/logger/SecretMask.h"
#include "platform/transfer/HttpText.h"
#include "platform/transfer/ObjectKey.h"
#include "platform/transfer/S3Store.h"
#include "platform/transfer/S3Target.h"
#include "platform/transfer/SegmentFormat.h"

namespace {

// `prefix` in lower case.
bool startsWithNoCase(const std::string& text, const std::string& prefix) {
    return httptext::Lower(text.substr(0, prefix.size())) == prefix;
}

bool isDirectory(const std::string& path) {
    struct stat s {};
    return stat(path.c_str(), &s) == 0 && S_ISDIR(s.st_mode);
}

bool checkEndpoint(const FrameworkOptions& options, const std::string& bucketName,
                   std::string* why) {
    const std::string shown = "-endpoint \"" + MaskedSecrets(options.endpoint) + "\"";
    if (!startsWithNoCase(options.endpoint, "file:")) {
        S3StoreConfig config;
        std::string fault;
        if (!S3StoreConfig::Parse(options.endpoint, config, fault)) {
            *why = shown + " cannot be used: " + fault;
            return false;
        }
        // Other S3 servers name their buckets as they like; AWS only as its rules allow.
        const bool aws = options.endpoint.empty();
        if (aws && !ValidateBucketName(bucketName, fault)) {
            *why = "-bucketname: " + fault;
            return false;
        }
        if (!ValidateRegion(options.region, aws, fault)) {
            // The region itself is not shown: it may hold a line break.
            *why = "the region from " + options.regionSource + " cannot be used: " + fault;
            return false;
        }
        return true;
    }
    std::string directory;
    if (!ParseFileEndpoint(options.endpoint, &directory)) {
        *why = shown + " is not a usable file URL (file:///absolute/directory)";
        return false;
    }
    if (!isDirectory(directory)) {
        *why = shown + ": the directory " + directory + " does not exist";
        return false;
    }
    const std::string bucketDirectory = (directory == "/" ? "" : directory) + "/" + bucketName;
    if (!isDirectory(bucketDirectory)) {
        *why = shown + ": the bucket directory " + bucketDirectory +
               " does not exist (create it, as a bucket is created)";
        return false;
    }
    return true;
}

}  // namespace

bool ParseFileEndpoint(const std::string& url, std::string* directory) {
    if (!startsWithNoCase(url, "file://")) return false;
    std::string rest = url.substr(7);  // after "file://"
    if (startsWithNoCase(rest, "localhost/")) rest = rest.substr(9);
    if (rest.empty() || rest[0] != '/' || rest.find_first_of("?#") != std::string::npos)
        return false;
    std::string path;
    for (size_t i = 0; i < rest.size(); ++i) {
        if (rest[i] != '%') {
            path.push_back(rest[i]);
            continue;
        }
        if (i + 2 >= rest.size() || !std::isxdigit(static_cast<unsigned char>(rest[i + 1])) ||
            !std::isxdigit(static_cast<unsigned char>(rest[i + 2])))
            return false;
        char c = static_cast<char>(std::stoi(rest.substr(i + 1, 2), nullptr, 16));
        if (c == '\0') return false;
        path.push_back(c);
        i += 2;
    }
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    *directory = path;
    return true;
}

bool CheckStoreSettings(const FrameworkOptions& options, const std::string& bucketName,
                        const std::string& streamingId, std::string* why) {
    if (!checkEndpoint(options, bucketName, why)) return false;
    // The longest key of the run: the largest sequence number, a capture time of the same width
    // as any other.
    const SegmentFormat* format = SegmentFormat::Find(options.segmentFormat);
    const size_t longest = ObjectKey(options.keyPrefix, streamingId, INT32_MAX, 0,
                                     (format ? *format : SegmentFormat::Ts()).extension)
                               .size();
    if (longest > kMaxObjectKeyBytes) {
        *why = "-keyprefix and the stream id make object keys of up to " + std::to_string(longest) +
               " bytes; S3 takes at most " + std::to_string(kMaxObjectKeyBytes);
        return false;
    }
    return true;
}
