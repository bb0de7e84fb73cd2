// S3Store: stores each object with one signed HTTP PUT to an S3 bucket.
//
// Put runs on the upload thread, one call at a time, and blocks until S3 answered or the
// attempts failed: an answer or failure that may pass (5xx, SlowDown, RequestTimeout, a
// connection failure, a timeout) is tried again as config.retry says (RetryPacing); the
// credentials, region, bucket and key are checked before anything is sent, so a value with a line
// break never reaches the wire, and the key travels exactly as signed ("." and ".." parts
// included). The request carries the body's MD5 (Content-MD5, so S3 rejects a body damaged on
// the way), over plain HTTP also its SHA-256 under the signature (S3Payload), the session token
// when there is one, and the object's metadata as x-amz-meta-* headers; it is signed with
// SigV4Signer. The answer is read whole: the XML error Code decides the result, and on success the
// ETag must be the body's MD5. After RequestTimeTooSkewed the signing clock is set to the server's
// time, so the caller's retry can succeed.
//
// Cancel may come from any thread at any time (also before or between Puts). It ends a running
// Put within 100 ms (curl_multi_wakeup interrupts the wait in curl_multi_poll; the wait before a
// retry ends at once) and makes every later Put return TimeOut at once: a store serves one
// connection of the recorder and is not used after it was cancelled. The caller keeps the store
// alive while Cancel may run.
//
// Owns a curl multi handle, and with it the connection cache, so consecutive Puts reuse one
// TCP/TLS connection. Credentials and the Authorization header are never logged.
#pragma once

#include <chrono>
#include <string>
#include <vector>

#include "platform/transfer/ObjectStore.h"
#include "platform/transfer/RetryPacing.h"
#include "platform/transfer/S3PutRequest.h"
#include "platform/transfer/S3Response.h"
#include "platform/transfer/S3Target.h"
#include "platform/transfer/SigV4Signer.h"

struct S3Exchange;  // what one HTTP exchange gave (curl's codes, the answer); see S3Store.cpp

struct S3StoreConfig {
    // "" for AWS (addressed as S3Target says), or "http[s]://host[:port]" for another S3
    // server: path-style ENDPOINT/BUCKET/KEY unless `addressing` says virtual.
    // Parse checks and normalises it; the store uses only what Parse accepts.
    std::string endpoint;
    long connectTimeoutMs = 10000;  // connection set-up (TCP and TLS)
    long lowSpeedLimit = 1024;      // bytes per second; slower than this for ...
    long lowSpeedTimeS = 30;        // ... this many seconds ends the transfer with TimeOut
    RetryPolicy retry;              // attempts and waits within one Put
    // Initial offset of the signing clock against the system clock (tests use it to sign with
    // a wrong clock); corrected after RequestTimeTooSkewed.
    std::chrono::seconds clockOffset{0};
    S3Addressing addressing = S3Addressing::kAuto;
    // Sent and signed with every object: x-amz-server-side-encryption, x-amz-storage-class,
    // x-amz-acl, x-amz-tagging and the like (names in lower case).
    std::vector<std::pair<std::string, std::string>> objectHeaders;
    std::string caBundle;  // PEM file of the CAs that TLS servers are checked with; "" system's

    // Checks `endpointUrl` ("" or "http[s]://host[:port][/]", without user, path or query) and
    // sets out.endpoint to its normal form; the other fields of `out` are left as they are.
    // False with a reason in `why` when the URL cannot be used.
    static bool Parse(const std::string& endpointUrl, S3StoreConfig& out, std::string& why);
};

class S3Store : public IObjectStore {
  public:
    explicit S3Store(S3StoreConfig config);
    ~S3Store() override;
    S3Store(const S3Store&) = delete;
    S3Store& operator=(const S3Store&) = delete;

    // Upload thread only. Fills info->fileSize (bytes stored; 0 when nothing was stored) and
    // info->responseTime (ms from sending the first request to the end of the last answer).
    FileTransferResult Put(const ObjectToStore& object, const StoreCredentials& credentials,
                           FileTransferInfo* info) override;
    // Any thread.
    void Cancel() override;

    // The signing clock's current offset against the system clock.
    std::chrono::seconds ClockOffset() const { return signer_.ClockOffset(); }

  private:
    // The steps of one Put, in order. Each logs its own failure lines.
    // One signed exchange of the PUT.
    AttemptOutcome attempt(const S3Target& target, const ObjectToStore& object,
                           const StoreCredentials& credentials, const S3Payload& payload);
    // Success, or the result of a PUT that cannot be sent (no credentials, no usable target).
    FileTransferResult checkSendable(const ObjectToStore& object,
                                     const StoreCredentials& credentials, S3Target& target);
    // Sends the request and reads the answer; false when curl cannot even be set up.
    bool perform(const std::string& url, const S3PutRequest& request, const ObjectToStore& object,
                 S3Exchange& exchange);
    // The result of the exchange, and whether another attempt may succeed; `secrets` are kept
    // out of the lines it logs.
    AttemptOutcome interpret(const S3Exchange& exchange, const ObjectToStore& object,
                             const std::string& md5Hex, const std::vector<std::string>& secrets);
    // Success when the answer's ETag is the body's MD5 (or S3 checked it under SSE-KMS).
    FileTransferResult checkStored(const S3Exchange& exchange, const std::string& where,
                                   size_t size, const std::string& md5Hex);
    // After RequestTimeTooSkewed: the signing clock follows the server's.
    void correctClock(const S3Response& response);

    const S3StoreConfig config_;
    bool endpointValid_ = false;  // config_.endpoint passed Parse
    std::string endpoint_;        // its normal form
    SigV4Signer signer_;
    void* multi_ = nullptr;  // CURLM*, kept out of this header
    CancelSignal cancel_;    // raised by Cancel; ends the waits between attempts
};
