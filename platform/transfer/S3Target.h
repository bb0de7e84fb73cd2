// S3Target: where the PUT of one object goes, and what the signature covers of that.
//
// A pure function of the store's endpoint, the bucket, the key and the credentials' routing
// (region, acceleration); safe from any thread.
#pragma once

#include <string>

#include "platform/transfer/ObjectStore.h"

struct S3Target {
    std::string url;            // the whole request URL, key percent-encoded
    std::string host;           // the Host header value ("bucket.s3.eu-west-1.amazonaws.com")
    std::string canonicalUri;   // the URL's path, as signed
    std::string signingRegion;  // the region of the signature scope
};

// `endpoint` is "" (AWS: virtual-hosted https URL, accelerated when asked) or a normal form
// from S3StoreConfig::Parse ("http[s]://host[:port]": path-style ENDPOINT/BUCKET/KEY).
// False with a reason when the bucket or key cannot be addressed (empty, or a bucket that is no
// host name on AWS), or the region cannot be part of a host name.
bool S3TargetFor(const std::string& endpoint, const std::string& bucket, const std::string& key,
                 const StoreCredentials& credentials, S3Target& out, std::string& why);
