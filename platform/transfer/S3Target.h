// S3Target: where the PUT of one object goes, and what the signature covers of that; and the
// checks of the names that become part of a request (bucket, region, credentials).
//
// Pure functions of their inputs; safe from any thread.
//
// Addressing on AWS, as AWS clients do it:
//   virtual-hosted  https://BUCKET.s3.REGION.amazonaws.com/KEY (s3.amazonaws.com without a
//                   region; https://BUCKET.s3-accelerate.amazonaws.com/KEY when acceleration
//                   is asked for)
//   path-style      https://s3.REGION.amazonaws.com/BUCKET/KEY for a bucket whose name has
//                   dots (a TLS certificate for *.s3.REGION.amazonaws.com cannot match it;
//                   acceleration cannot serve such a bucket, so it goes to its region)
//   China           regions cn-* are served under amazonaws.com.cn (no acceleration there).
// Any other endpoint ("http[s]://host[:port]") is addressed path-style: ENDPOINT/BUCKET/KEY.
// S3Addressing may ask for one style everywhere instead (-addressing path|virtual).
// The key is sent exactly as it is, "." and ".." parts included (the URL is not normalised).
#pragma once

#include <string>

#include "platform/transfer/ObjectStore.h"

// How the bucket is named in a request.
enum class S3Addressing {
    kAuto,     // as above
    kPath,     // path-style everywhere; on AWS never accelerated (acceleration has
               // virtual-hosted names only)
    kVirtual,  // virtual-hosted everywhere, also for dotted bucket names on AWS (a private CA or
               // an endpoint over http may make that work); on another endpoint
               // http[s]://BUCKET.HOST[:PORT]/KEY, which needs a host name, not an IP address
};

struct S3Target {
    std::string url;            // the whole request URL, key percent-encoded
    std::string host;           // the Host header value ("bucket.s3.eu-west-1.amazonaws.com")
    std::string canonicalUri;   // the URL's path, as signed
    std::string signingRegion;  // the region of the signature scope
};

// `endpoint` is "" (AWS) or a normal form from S3StoreConfig::Parse. False with a reason when
// the object cannot be addressed: an empty key, a bucket name S3 cannot address (see
// ValidateBucketName; on other endpoints only an empty one), or a region ValidateRegion refuses
// (the reason then names the region).
bool S3TargetFor(const std::string& endpoint, const std::string& bucket, const std::string& key,
                 const StoreCredentials& credentials, S3Target& out, std::string& why,
                 S3Addressing addressing = S3Addressing::kAuto);

// Whether S3 can address a bucket of this name: 3 to 63 characters of lower-case letters,
// digits, '.' and '-', beginning and ending with a letter or digit, no ".." and no ".-"/"-.",
// not an IPv4 address, none of the prefixes and suffixes AWS reserves. False with a reason that
// can be shown to a user. The host checks -bucketname with it at start.
bool ValidateBucketName(const std::string& name, std::string& why);

// Whether a region can go into a signature scope (and, on AWS, a host name): not empty, no
// control characters, spaces or '/'; on AWS (`forAws`) only lower-case letters, digits and '-'.
bool ValidateRegion(const std::string& region, bool forAws, std::string& why);

// Whether the access key and session token can travel in headers: no control characters, and no
// spaces, '/' or ',' in the access key (it is part of the Authorization header).
bool ValidateCredentialText(const StoreCredentials& credentials, std::string& why);
