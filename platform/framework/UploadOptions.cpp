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

// Reads option `name` into `field` when `valid` accepts it; otherwise appends `problem` followed
// by the value given.
template <typename Valid>
void readChecked(const CommandLine& cl, const char* name, Valid valid, std::string& field,
                 const std::string& problem, std::vector<std::string>& errors) {
    std::string v;
    if (!cl.Find(name, v)) return;
    if (valid(v)) {
        field = v;
        return;
    }
    errors.push_back(problem + ", got \"" + v + "\"");
}

}  // namespace

UploadOptions UploadOptions::Read(const CommandLine& cl, std::vector<std::string>& errors) {
    UploadOptions o;
    readChecked(
        cl, "sse", [](const std::string& v) { return v == "AES256" || v == "aws:kms"; }, o.sse,
        "-sse is AES256 or aws:kms", errors);
    std::string keyId;
    if (cl.Find("ssekmskeyid", keyId)) {
        if (o.sse == "aws:kms" && !keyId.empty()) {
            o.sseKmsKeyId = keyId;
        } else {
            errors.push_back("-ssekmskeyid needs -sse aws:kms and a key");
        }
    }
    readChecked(
        cl, "storageclass", [](const std::string& v) { return OneOf(v, kStorageClasses); },
        o.storageClass, "-storageclass is one of " + List(kStorageClasses), errors);
    readChecked(
        cl, "acl", [](const std::string& v) { return OneOf(v, kCannedAcls); }, o.acl,
        "-acl is one of " + List(kCannedAcls), errors);
    std::string tagging;
    if (cl.Find("tagging", tagging)) {
        std::vector<std::pair<std::string, std::string>> tags;
        std::string why;
        if (ParseTags(tagging, tags, why)) {
            o.tagging = tagging;
        } else {
            errors.push_back("-tagging: " + why);
        }
    }
    readChecked(
        cl, "addressing",
        [](const std::string& v) { return v == "path" || v == "virtual" || v == "auto"; },
        o.addressing, "-addressing is path, virtual or auto", errors);
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
