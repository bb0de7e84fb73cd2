// ContainerCredentials: the credentials an ECS task (or EKS Pod Identity, or any container
// agent with the same protocol) serves its containers over HTTP.
//
// Configured by the environment the agent sets:
//   - AWS_CONTAINER_CREDENTIALS_RELATIVE_URI: a path on http://169.254.170.2 (ECS);
//   - else AWS_CONTAINER_CREDENTIALS_FULL_URI: a whole URL; plain http only to a loopback
//     address or the agents' link-local ones (169.254.170.2, 169.254.170.23, fd00:ec2::23), so
//     that the authorisation token never travels in clear to anywhere else;
//   - the Authorization header: the content of AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE (read on
//     every fetch: the agent rotates it), else AWS_CONTAINER_AUTHORIZATION_TOKEN.
// The answer is JSON: AccessKeyId, SecretAccessKey, Token, Expiration.
//
// Keeps only the environment reader; Fetch blocks for one exchange (2 s to connect, 5 s in
// all) and may run on any thread.
#pragma once

#include <string>

#include "platform/awsauth/AwsCredentials.h"

namespace awsauth {

class ContainerCredentials {
  public:
    static constexpr const char* kEcsHost = "http://169.254.170.2";

    explicit ContainerCredentials(Environment environment);

    // Absent when neither URI variable is set.
    Lookup Fetch() const;

    // The URL to ask; "" with a reason when the variables name none that may be used.
    std::string Url(std::string& why) const;

  private:
    Environment environment_;
};

}  // namespace awsauth
