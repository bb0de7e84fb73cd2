#include "platform/transfer/S3Target.h"

#include <cctype>

#include "platform/transfer/SigV4Signer.h"

namespace {

// Characters of the host names S3 serves buckets and regions under.
bool HostNameChars(const std::string& text) {
    if (text.empty()) return false;
    for (unsigned char c : text) {
        if (!(std::islower(c) || std::isdigit(c) || c == '.' || c == '-')) return false;
    }
    return true;
}

}  // namespace

bool S3TargetFor(const std::string& endpoint, const std::string& bucket, const std::string& key,
                 const StoreCredentials& credentials, S3Target& out, std::string& why) {
    if (bucket.empty() || key.empty()) {
        why = "empty bucket or key";
        return false;
    }
    out.signingRegion = credentials.region.empty() ? "us-east-1" : credentials.region;
    const std::string encodedKey = SigV4Signer::EncodePath(key);
    if (!endpoint.empty()) {
        size_t schemeEnd = endpoint.find("://");
        if (schemeEnd == std::string::npos) {
            why = "endpoint without scheme";
            return false;
        }
        out.host = endpoint.substr(schemeEnd + 3);
        out.canonicalUri = "/" + SigV4Signer::EncodeComponent(bucket) + "/" + encodedKey;
        out.url = endpoint + out.canonicalUri;
        return true;
    }
    if (!HostNameChars(bucket)) {
        why = "bucket name is no host name";
        return false;
    }
    if (!credentials.region.empty() && !HostNameChars(credentials.region)) {
        why = "region is no host name";
        return false;
    }
    if (credentials.accelerate) {
        out.host = bucket + ".s3-accelerate.amazonaws.com";
    } else if (credentials.region.empty()) {
        out.host = bucket + ".s3.amazonaws.com";
    } else {
        out.host = bucket + ".s3." + credentials.region + ".amazonaws.com";
    }
    out.canonicalUri = "/" + encodedKey;
    out.url = "https://" + out.host + out.canonicalUri;
    return true;
}
