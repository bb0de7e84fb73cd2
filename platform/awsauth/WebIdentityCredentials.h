// WebIdentityCredentials: a role's credentials for an OIDC token in a file, as EKS (IAM roles
// for service accounts) and other OIDC providers set them up: AWS_WEB_IDENTITY_TOKEN_FILE and
// AWS_ROLE_ARN (with AWS_ROLE_SESSION_NAME when set) in, STS AssumeRoleWithWebIdentity out.
// The token file is read on every Fetch, because its owner rotates it.
//
// Keeps the environment reader and a reference to the STS client, which must outlive it;
// Fetch may run on any thread.
#pragma once

#include "platform/awsauth/AwsCredentials.h"
#include "platform/awsauth/StsClient.h"

namespace awsauth {

class WebIdentityCredentials {
  public:
    WebIdentityCredentials(Environment environment, const StsClient& sts);

    // Absent when neither variable is set; Failed when only one is, or the file is unreadable.
    Lookup Fetch() const;

  private:
    Environment environment_;
    const StsClient& sts_;
};

}  // namespace awsauth
