#include "platform/transfer/S3Target.h"

#include <arpa/inet.h>

#include "platform/transfer/SigV4Signer.h"

namespace {

bool LowerAlnum(unsigned char c) {
    return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9');
}

bool StartsWith(const std::string& text, const char* prefix) {
    return text.rfind(prefix, 0) == 0;
}

bool EndsWith(const std::string& text, const std::string& suffix) {
    return text.size() >= suffix.size() &&
           text.compare(text.size() - suffix.size(), suffix.size(), suffix) == 0;
}

bool Fail(std::string& why, const std::string& reason) {
    why = reason;
    return false;
}

// The characters and their order; the length and reserved names are checked by the caller.
bool BucketCharacters(const std::string& name, std::string& why) {
    if (!LowerAlnum(name.front()) || !LowerAlnum(name.back()))
        return Fail(why, "must begin and end with a lower-case letter or digit");
    for (size_t i = 0; i < name.size(); ++i) {
        const unsigned char c = name[i];
        if (!LowerAlnum(c) && c != '.' && c != '-')
            return Fail(why, "may hold only lower-case letters, digits, '.' and '-'");
        if (c == '.' && (name[i + 1] == '.' || name[i + 1] == '-' || name[i - 1] == '-'))
            return Fail(why, "must not have '..', '.-' or '-.'");
    }
    return true;
}

// What keeps S3 from addressing a bucket of this name; "" when nothing.
std::string BucketNameProblem(const std::string& name) {
    if (name.size() < 3 || name.size() > 63) return "must be 3 to 63 characters long";
    std::string problem;
    if (!BucketCharacters(name, problem)) return problem;
    in_addr address{};
    if (inet_pton(AF_INET, name.c_str(), &address) == 1) return "must not be an IP address";
    for (const char* prefix : {"xn--", "sthree-", "amzn-s3-demo-"})
        if (StartsWith(name, prefix)) return std::string("must not begin with ") + prefix;
    for (const char* suffix : {"-s3alias", "--ol-s3", ".mrap", "--x-s3", "--table-s3"})
        if (EndsWith(name, suffix)) return std::string("must not end with ") + suffix;
    return "";
}

bool ControlCharacter(unsigned char c) {
    return c < 0x20 || c == 0x7f;
}

// The AWS host that serves `bucket` in `region`, and whether the bucket goes into the path.
void AwsHost(const std::string& bucket, const StoreCredentials& credentials,
             S3Addressing addressing, std::string& host, bool& pathStyle) {
    const std::string& region = credentials.region;
    const bool china = StartsWith(region, "cn-");
    const std::string domain = china ? "amazonaws.com.cn" : "amazonaws.com";
    pathStyle = addressing == S3Addressing::kPath ||
                (addressing == S3Addressing::kAuto && bucket.find('.') != std::string::npos);
    const std::string regional = region.empty() ? "s3." + domain : "s3." + region + "." + domain;
    if (pathStyle) {
        host = regional;
    } else if (credentials.accelerate && !china) {
        host = bucket + ".s3-accelerate.amazonaws.com";
    } else {
        host = bucket + "." + regional;
    }
}

}  // namespace

bool ValidateBucketName(const std::string& name, std::string& why) {
    const std::string problem = BucketNameProblem(name);
    if (problem.empty()) return true;
    return Fail(why, "bucket name \"" + name + "\" cannot be used with S3: it " + problem);
}

bool ValidateRegion(const std::string& region, bool forAws, std::string& why) {
    if (region.empty()) return Fail(why, "region is empty");
    for (unsigned char c : region) {
        const bool usable =
            forAws ? LowerAlnum(c) || c == '-' : !ControlCharacter(c) && c != ' ' && c != '/';
        if (!usable) return Fail(why, "region has a character that cannot be used");
    }
    return true;
}

bool ValidateCredentialText(const StoreCredentials& credentials, std::string& why) {
    for (unsigned char c : credentials.accessKey) {
        if (ControlCharacter(c) || c == ' ' || c == '/' || c == ',')
            return Fail(why, "access key has a character that cannot be sent");
    }
    for (unsigned char c : credentials.sessionToken) {
        if (ControlCharacter(c)) return Fail(why, "session token has a control character");
    }
    return true;
}

bool S3TargetFor(const std::string& endpoint, const std::string& bucket, const std::string& key,
                 const StoreCredentials& credentials, S3Target& out, std::string& why,
                 S3Addressing addressing) {
    if (bucket.empty() || key.empty()) return Fail(why, "empty bucket or key");
    const bool aws = endpoint.empty();
    if (!credentials.region.empty() && !ValidateRegion(credentials.region, aws, why)) return false;
    if (aws && !ValidateBucketName(bucket, why)) return false;
    out.signingRegion = credentials.region.empty() ? "us-east-1" : credentials.region;
    const std::string encodedKey = SigV4Signer::EncodePath(key);
    if (!aws) {
        size_t schemeEnd = endpoint.find("://");
        if (schemeEnd == std::string::npos) return Fail(why, "endpoint without scheme");
        out.host = endpoint.substr(schemeEnd + 3);
        if (addressing != S3Addressing::kVirtual) {
            out.canonicalUri = "/" + SigV4Signer::EncodeComponent(bucket) + "/" + encodedKey;
            out.url = endpoint + out.canonicalUri;
            return true;
        }
        const std::string name = out.host.substr(0, out.host.rfind(':'));
        in_addr address{};
        if (out.host[0] == '[' || inet_pton(AF_INET, name.c_str(), &address) == 1)
            return Fail(why, "virtual-hosted addressing needs an endpoint with a host name");
        if (!ValidateBucketName(bucket, why)) return false;
        out.host = bucket + "." + out.host;
        out.canonicalUri = "/" + encodedKey;
        out.url = endpoint.substr(0, schemeEnd + 3) + out.host + out.canonicalUri;
        return true;
    }
    bool pathStyle = false;
    AwsHost(bucket, credentials, addressing, out.host, pathStyle);
    out.canonicalUri = pathStyle ? "/" + bucket + "/" + encodedKey : "/" + encodedKey;
    out.url = "https://" + out.host + out.canonicalUri;
    return true;
}
