#include "platform/transfer/SigV4Signer.h"

#include <algorithm>
#include <cctype>

#include "platform/transfer/Digest.h"
#include "platform/transfer/HttpText.h"
#include "platform/transfer/UtcTime.h"

namespace {

bool Unreserved(unsigned char c) {
    return std::isalnum(c) || c == '-' || c == '_' || c == '.' || c == '~';
}

bool UnreservedOrSlash(unsigned char c) {
    return Unreserved(c) || c == '/';
}

}  // namespace

std::string SigV4Signer::EncodePath(const std::string& path) {
    return httptext::PercentEncode(path, UnreservedOrSlash);
}

std::string SigV4Signer::EncodeComponent(const std::string& text) {
    return httptext::PercentEncode(text, Unreserved);
}

std::string SigV4Signer::CanonicalQuery(const std::string& query) {
    std::vector<std::pair<std::string, std::string>> pairs;
    size_t start = 0;
    while (start <= query.size() && !query.empty()) {
        size_t end = query.find('&', start);
        if (end == std::string::npos) end = query.size();
        std::string item = query.substr(start, end - start);
        if (!item.empty()) {
            size_t eq = item.find('=');
            if (eq == std::string::npos) {
                pairs.emplace_back(EncodeComponent(item), "");
            } else {
                pairs.emplace_back(EncodeComponent(item.substr(0, eq)),
                                   EncodeComponent(item.substr(eq + 1)));
            }
        }
        start = end + 1;
    }
    std::sort(pairs.begin(), pairs.end());
    std::string out;
    for (const auto& [name, value] : pairs) {
        if (!out.empty()) out.push_back('&');
        out += name + "=" + value;
    }
    return out;
}

std::string SigV4Signer::AmzDate(std::chrono::system_clock::time_point time) {
    return FormatUtc(time, "%Y%m%dT%H%M%SZ");
}

SigV4Signature SigV4Signer::Sign(const SigV4Request& request, const SigV4Key& key,
                                 const std::string& amzDate) {
    std::vector<std::pair<std::string, std::string>> headers;
    headers.reserve(request.headers.size());
    for (const auto& [name, value] : request.headers) {
        headers.emplace_back(httptext::Lower(name), httptext::FoldSpaces(value, false));
    }
    std::sort(headers.begin(), headers.end());

    SigV4Signature out;
    std::string canonicalHeaders;
    for (const auto& [name, value] : headers) {
        canonicalHeaders += name + ":" + value + "\n";
        if (!out.signedHeaders.empty()) out.signedHeaders.push_back(';');
        out.signedHeaders += name;
    }
    out.canonicalRequest = request.method + "\n" + request.canonicalUri + "\n" +
                           CanonicalQuery(request.query) + "\n" + canonicalHeaders + "\n" +
                           out.signedHeaders + "\n" + request.payloadHash;

    const std::string date = amzDate.substr(0, 8);
    const std::string scope = date + "/" + key.region + "/" + key.service + "/aws4_request";
    out.stringToSign = "AWS4-HMAC-SHA256\n" + amzDate + "\n" + scope + "\n" +
                       digest::Hex(digest::Sha256Of(out.canonicalRequest));

    digest::Sha256 k = digest::HmacSha256("AWS4" + key.secretKey, date);
    k = digest::HmacSha256(k.data(), k.size(), key.region);
    k = digest::HmacSha256(k.data(), k.size(), key.service);
    k = digest::HmacSha256(k.data(), k.size(), "aws4_request");
    out.signature = digest::Hex(digest::HmacSha256(k.data(), k.size(), out.stringToSign));
    out.authorization = "AWS4-HMAC-SHA256 Credential=" + key.accessKey + "/" + scope +
                        ",SignedHeaders=" + out.signedHeaders + ",Signature=" + out.signature;
    return out;
}

std::chrono::system_clock::time_point SigV4Signer::Now() const {
    return std::chrono::system_clock::now() + ClockOffset();
}

void SigV4Signer::CorrectClock(std::chrono::system_clock::time_point serverTime) {
    SetClockOffset(std::chrono::duration_cast<std::chrono::seconds>(
        serverTime - std::chrono::system_clock::now()));
}
