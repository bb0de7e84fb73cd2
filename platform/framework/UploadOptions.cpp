#include "platform/framework/UploadOptions.h"

#include <algorithm>
#include <cstdlib>

#include "platform/framework/FrameworkOptions.h"
#include "platform/transfer/SigV4Signer.h"

namespace {

const char* const kStorageClasses[] = {"STANDARD",     "REDUCED_REDUNDANCY",  "STANDARD_IA",
                                       "ONEZONE_IA",   "INTELLIGENT_TIERING", "GLACIER",
                                       "DEEP_ARCHIVE", "GLACIER_IR",          "OUTPOSTS",
                                       "SNOW",         "EXPRESS_ONEZONE"};
const char* const kCannedAcls[] = {
    "private",       "public-read",       "public-read-write",        "authenticated-read",
    "aws-exec-read", "bucket-owner-read", "bucket-owner-full-control"};

template <size_t N>
bool OneOf(const std::string& value, const char* const (&allowed)[N]) {
    return std::find(std::begin(allowed), std::end(allowed), value) != std::end(allowed);
}

template <size_t N>
std::string List(const char* const (&allowed)[N]) {
    std::string out;
    for (const char* value : allowed) out += std::string(out.empty() ? "" : ", ") + value;
    return out;
}

// "k=v&k2=v2" as (key, value) pairs; false with a reason when it breaks S3's rules for tags.
bool ParseTags(const std::string& text, std::vector<std::pair<std::string, std::string>>& tags,
               std::string& why) {
    tags.clear();
    size_t start = 0;
    while (start <= text.size()) {
        size_t end = std::min(text.find('&', start), text.size());
        const std::string pair = text.substr(start, end - start);
        size_t equals = pair.find('=');
        if (equals == std::string::npos || equals == 0) {
            why = "each tag is key=value with a key, got \"" + pair + "\"";
            return false;
        }
        std::string key = pair.substr(0, equals), value = pair.substr(equals + 1);
        if (key.size() > 128 || value.size() > 256) {
            why = "a tag key has at most 128 characters and a value at most 256";
            return false;
        }
        for (const auto& tag : tags) {
            if (tag.first == key) {
                why = "the tag key \"" + key + "\" is given twice";
                return false;
            }
        }
        tags.emplace_back(std::move(key), std::move(value));
        start = end + 1;
    }
    if (tags.size() > 10) {
        why = "an object has at most 10 tags";
        return false;
    }
    return true;
}

}  // namespace

UploadOptions UploadOptions::Read(const CommandLine& cl, std::vector<std::string>& errors) {
    UploadOptions o;
    std::string v;
    if (cl.Find("sse", v)) {
        if (v == "AES256" || v == "aws:kms") {
            o.sse = v;
        } else {
            errors.push_back("-sse is AES256 or aws:kms, got \"" + v + "\"");
        }
    }
    if (cl.Find("ssekmskeyid", v)) {
        if (o.sse == "aws:kms" && !v.empty()) {
            o.sseKmsKeyId = v;
        } else {
            errors.push_back("-ssekmskeyid needs -sse aws:kms and a key");
        }
    }
    if (cl.Find("storageclass", v)) {
        if (OneOf(v, kStorageClasses)) {
            o.storageClass = v;
        } else {
            errors.push_back("-storageclass is one of " + List(kStorageClasses) + ", got \"" + v +
                             "\"");
        }
    }
    if (cl.Find("acl", v)) {
        if (OneOf(v, kCannedAcls)) {
            o.acl = v;
        } else {
            errors.push_back("-acl is one of " + List(kCannedAcls) + ", got \"" + v + "\"");
        }
    }
    if (cl.Find("tagging", v)) {
        std::vector<std::pair<std::string, std::string>> tags;
        std::string why;
        if (ParseTags(v, tags, why)) {
            o.tagging = v;
        } else {
            errors.push_back("-tagging: " + why);
        }
    }
    if (cl.Find("addressing", v)) {
        if (v == "path" || v == "virtual" || v == "auto") {
            o.addressing = v;
        } else {
            errors.push_back("-addressing is path, virtual or auto, got \"" + v + "\"");
        }
    }
    const char* bundle = std::getenv("AWS_CA_BUNDLE");
    o.caBundle = bundle ? bundle : "";
    return o;
}

std::vector<std::pair<std::string, std::string>> UploadOptions::Headers() const {
    std::vector<std::pair<std::string, std::string>> headers;
    if (!sse.empty()) headers.emplace_back("x-amz-server-side-encryption", sse);
    if (!sseKmsKeyId.empty()) {
        headers.emplace_back("x-amz-server-side-encryption-aws-kms-key-id", sseKmsKeyId);
    }
    if (!storageClass.empty()) headers.emplace_back("x-amz-storage-class", storageClass);
    if (!acl.empty()) headers.emplace_back("x-amz-acl", acl);
    std::vector<std::pair<std::string, std::string>> tags;
    std::string why;
    if (!tagging.empty() && ParseTags(tagging, tags, why)) {
        std::string encoded;
        for (const auto& [key, value] : tags) {
            encoded += (encoded.empty() ? "" : "&") + SigV4Signer::EncodeComponent(key) + "=" +
                       SigV4Signer::EncodeComponent(value);
        }
        headers.emplace_back("x-amz-tagging", encoded);
    }
    return headers;
}
