#include "platform/transfer/S3PutRequest.h"

#include <cctype>
#include <set>

#include "platform/transfer/Digest.h"
#include "platform/transfer/HttpText.h"
#include "platform/transfer/SigV4Signer.h"

namespace {

// Header values are signed in canonical form and sent in that form, printable only.
std::string HeaderValue(const std::string& value) {
    return httptext::FoldSpaces(value, true);
}

// A metadata name as an HTTP token: lower case letters, digits, '-' and '_'.
std::string MetadataName(const std::string& name) {
    std::string out = httptext::Lower(name);
    for (char& c : out) {
        if (!std::isalnum(static_cast<unsigned char>(c)) && c != '-' && c != '_') c = '-';
    }
    return out;
}

void AddMetadata(const ObjectToStore& object, SigV4Request& request) {
    std::set<std::string> names;
    for (const auto& [name, value] : object.metadata) {
        std::string header = "x-amz-meta-" + MetadataName(name);
        if (name.empty() || !names.insert(header).second) continue;
        request.headers.emplace_back(header, HeaderValue(value));
    }
}

}  // namespace

S3Payload DigestS3Payload(const ObjectToStore& object, const S3Target& target) {
    S3Payload payload;
    const digest::Md5 md5 = digest::Md5Of(object.data, object.size);
    payload.md5Base64 = digest::Base64(md5);
    payload.md5Hex = digest::Hex(md5);
    const bool overTls = target.url.compare(0, 8, "https://") == 0;
    payload.sha256Hex =
        overTls ? "UNSIGNED-PAYLOAD" : digest::Hex(digest::Sha256Of(object.data, object.size));
    return payload;
}

S3PutRequest SignS3Put(const S3Target& target, const ObjectToStore& object,
                       const StoreCredentials& credentials, const S3Payload& payload,
                       const std::string& amzDate,
                       const std::vector<std::pair<std::string, std::string>>& objectHeaders) {
    SigV4Request request;
    request.method = "PUT";
    request.canonicalUri = target.canonicalUri;
    request.payloadHash = payload.sha256Hex;
    request.headers = {{"host", target.host},
                       {"content-md5", payload.md5Base64},
                       {"content-type", HeaderValue(object.contentType)},
                       {"x-amz-content-sha256", request.payloadHash},
                       {"x-amz-date", amzDate}};
    if (!credentials.sessionToken.empty())
        request.headers.emplace_back("x-amz-security-token", HeaderValue(credentials.sessionToken));
    AddMetadata(object, request);
    for (const auto& [name, value] : objectHeaders)
        request.headers.emplace_back(httptext::Lower(name), HeaderValue(value));

    const SigV4Key key{credentials.accessKey, credentials.secretKey, target.signingRegion, "s3"};
    const SigV4Signature signature = SigV4Signer::Sign(request, key, amzDate);
    S3PutRequest out;
    out.headers = std::move(request.headers);
    out.authorization = signature.authorization;
    out.signature = signature.signature;
    return out;
}
