// SigV4Signer: AWS Signature Version 4 for S3 requests (header-based, HMAC-SHA256).
//
// The static members are pure functions of their inputs (canonical request, string to sign,
// signing key, Authorization header, URI encoding) and safe from any thread. An instance adds a
// clock: the time a request is signed with is the system clock plus an offset, which starts at
// the configured value and is corrected after the server said the request time was too skewed.
// The offset is atomic, so any thread may read or set it; one upload thread signs.
//
// Never log what Sign returns: the Authorization header and the signing inputs derive from the
// secret key.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

// One request as the signer sees it.
struct SigV4Request {
    std::string method;        // "PUT", "GET", ...
    std::string canonicalUri;  // the path exactly as sent, already percent-encoded ("/a%20b")
    std::string query;         // raw query without '?', "" when none ("max-keys=2&prefix=J")
    // Every header to sign: names in any case, values as sent. Must include host and
    // x-amz-date; x-amz-content-sha256 for S3.
    std::vector<std::pair<std::string, std::string>> headers;
    std::string payloadHash;  // lower-case hex SHA-256 of the body
};

// Who signs, and for which scope.
struct SigV4Key {
    std::string accessKey;
    std::string secretKey;
    std::string region;  // e.g. "us-east-1"
    std::string service = "s3";
};

// Every intermediate of one signature, so that tests can compare each step.
struct SigV4Signature {
    std::string canonicalRequest;
    std::string stringToSign;
    std::string signedHeaders;  // "host;x-amz-content-sha256;x-amz-date"
    std::string signature;      // lower-case hex
    std::string authorization;  // the whole Authorization header value
};

class SigV4Signer {
  public:
    explicit SigV4Signer(std::chrono::seconds clockOffset = std::chrono::seconds(0))
        : offsetSeconds_(clockOffset.count()) {}

    // Signs `request` at `amzDate` ("YYYYMMDDTHHMMSSZ", the request's x-amz-date value).
    static SigV4Signature Sign(const SigV4Request& request, const SigV4Key& key,
                               const std::string& amzDate);

    // Percent-encodes every byte except A-Za-z0-9 - _ . ~ and, in EncodePath only, '/'.
    // Hex digits are upper case, as SigV4 requires.
    static std::string EncodePath(const std::string& path);
    static std::string EncodeComponent(const std::string& text);

    // The canonical query string of a raw query: each name and value encoded, sorted by name
    // then value, a name without value written as "name=".
    static std::string CanonicalQuery(const std::string& query);

    // "YYYYMMDDTHHMMSSZ" (UTC) of a point in time.
    static std::string AmzDate(std::chrono::system_clock::time_point time);

    // The signing clock: system clock plus the offset.
    std::chrono::system_clock::time_point Now() const;
    std::chrono::seconds ClockOffset() const {
        return std::chrono::seconds(offsetSeconds_.load(std::memory_order_relaxed));
    }
    void SetClockOffset(std::chrono::seconds offset) {
        offsetSeconds_.store(offset.count(), std::memory_order_relaxed);
    }
    // Sets the offset so that Now() reads `serverTime` at this moment.
    void CorrectClock(std::chrono::system_clock::time_point serverTime);

  private:
    std::atomic<int64_t> offsetSeconds_;  // seconds added to the system clock
};
