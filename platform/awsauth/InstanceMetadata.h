// InstanceMetadata: the credentials of the IAM role attached to an EC2 instance, from the
// instance metadata service, version 2 only (session token first):
//   1. PUT /latest/api/token with X-aws-ec2-metadata-token-ttl-seconds: a session token;
//   2. GET /latest/meta-data/iam/security-credentials/ with that token: the role's name;
//   3. GET /latest/meta-data/iam/security-credentials/ROLE: JSON with Code "Success",
//      AccessKeyId, SecretAccessKey, Token, Expiration.
// The service is at http://169.254.169.254 (AWS_EC2_METADATA_SERVICE_ENDPOINT overrides it;
// AWS_EC2_METADATA_SERVICE_ENDPOINT_MODE=IPv6 picks http://[fd00:ec2::254]);
// AWS_EC2_METADATA_DISABLED=true turns the source off.
//
// Off EC2 there is no such service, and this is the last source of the chain: each exchange
// is bounded to 1 s, so that a machine without it falls through in about a second. Keeps only
// the environment reader; Fetch may run on any thread.
#pragma once

#include <string>

#include "platform/awsauth/AwsCredentials.h"

namespace awsauth {

class InstanceMetadata {
  public:
    static constexpr long kTimeoutMs = 1000;  // each of the three exchanges
    static constexpr int kTokenSeconds = 21600;

    explicit InstanceMetadata(Environment environment);

    // Absent when turned off, when no service answers the token request, or when no role is
    // attached to the instance.
    Lookup Fetch() const;

    // The service's base URL, without a trailing '/'.
    std::string Endpoint() const;

  private:
    Environment environment_;
};

}  // namespace awsauth
