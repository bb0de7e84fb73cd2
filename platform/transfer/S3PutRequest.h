// S3PutRequest: the header lines of one S3 PUT of an object, signed with AWS Signature V4.
//
// DigestS3Payload hashes the body once per object; SignS3Put, a pure function of the target,
// the object, the credentials, the digests and the signing time, signs each attempt anew. Both
// are safe from any thread. Every value is sent in the form it was signed in, and no value
// carries a line break or another control character (such a value would add a header of its
// own), so any server signs exactly what it received.
//
// Headers: host, Content-MD5, Content-Type, x-amz-content-sha256 (see S3Payload), x-amz-date,
// x-amz-security-token when there is a session token, the object's metadata as x-amz-meta-*
// (names folded to HTTP tokens; of two names that fold into one, the first wins), and the
// store's headers of every object (encryption, storage class, ACL, tags).
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/transfer/ObjectStore.h"
#include "platform/transfer/S3Target.h"

// The body's digests, as the request carries them. Over HTTPS the signature does not cover the
// body (x-amz-content-sha256: UNSIGNED-PAYLOAD): TLS guards it on the way and Content-MD5 lets
// S3 check it, so the body is hashed once. Over plain HTTP the signature covers its SHA-256 too.
struct S3Payload {
    std::string md5Base64;  // Content-MD5
    std::string md5Hex;     // to compare with the ETag of the answer
    std::string sha256Hex;  // x-amz-content-sha256: lower-case hex SHA-256, or UNSIGNED-PAYLOAD
};

S3Payload DigestS3Payload(const ObjectToStore& object, const S3Target& target);

struct S3PutRequest {
    // Every signed header, names in lower case, values as sent.
    std::vector<std::pair<std::string, std::string>> headers;
    std::string authorization;  // the Authorization header value; never log it
    std::string signature;      // its hex signature, to keep it out of log lines
};

// Signs the PUT of `object`, whose digests are `payload`, to `target` at `amzDate`
// ("YYYYMMDDTHHMMSSZ"), with `objectHeaders` (x-amz-* names) besides the object's own.
S3PutRequest SignS3Put(const S3Target& target, const ObjectToStore& object,
                       const StoreCredentials& credentials, const S3Payload& payload,
                       const std::string& amzDate,
                       const std::vector<std::pair<std::string, std::string>>& objectHeaders = {});
