// HostCredentials: the AWS credentials the standalone host hands to the module, and their
// renewal before they expire.
//
// For a `file://` endpoint: fixed local credentials (the local directory store checks none).
// Otherwise the standard AWS chain (awsauth::CredentialChain), first source that works:
//   1. `-credentialprocess` (Credentials.h);
//   2. the environment: AWS_ACCESS_KEY_ID, AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN;
//   3. web identity: AWS_WEB_IDENTITY_TOKEN_FILE with AWS_ROLE_ARN (EKS service accounts);
//   4. the shared files' profile (AWS_PROFILE; credential_process, keys, role_arn);
//   5. the container endpoint (ECS task roles, EKS Pod Identity);
//   6. the EC2 instance metadata service (IMDSv2).
// Long-term keys are exchanged for temporary ones with STS GetSessionToken. STS is the regional
// endpoint of the options' region unless AWS_ENDPOINT_URL_STS or AWS_STS_REGIONAL_ENDPOINTS say
// otherwise; AWS_CA_BUNDLE names the CAs that STS and the container endpoint are checked with.
// The region handed over is the options' region.
//
// Renewal: StartRenewing starts a thread that, while the credentials handed out have an
// expiration, fetches fresh ones when the chain says (5 minutes before it) and passes them to
// `deliver`; when that gives nothing new it tries again kRetryAfterFailure later. Stop (also
// the destructor) ends and joins it.
//
// Threads: Fetch may be called from any thread (the message thread after the connection reply,
// the upload thread on a token request, the renewal thread); the chain serialises lookups.
// `deliver` runs on the renewal thread.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>

#include "platform/awsauth/AwsCredentials.h"
#include "platform/framework/Credentials.h"
#include "platform/framework/FrameworkOptions.h"

namespace awsauth {
class CredentialChain;
class ProfileCredentials;
class StsClient;
class WebIdentityCredentials;
class ContainerCredentials;
class InstanceMetadata;
}  // namespace awsauth

class HostCredentials {
  public:
    static constexpr std::chrono::seconds kRetryAfterFailure{30};

    explicit HostCredentials(
        const FrameworkOptions& options,
        const awsauth::Environment& environment = awsauth::ProcessEnvironment());
    ~HostCredentials();
    HostCredentials(const HostCredentials&) = delete;
    HostCredentials& operator=(const HostCredentials&) = delete;

    // The credentials to hand over. `refresh`: ask the sources again even if the kept ones
    // are fresh (the module asks for a token after they were refused).
    credentials::Result Fetch(bool refresh);

    // At most once; `deliver` must stay callable until Stop returns.
    void StartRenewing(std::function<void(const credentials::Result&)> deliver);
    void Stop();

  private:
    void renew();

    const std::string region_;
    const bool localStore_;  // a file:// endpoint
    std::unique_ptr<awsauth::StsClient> sts_;
    std::unique_ptr<awsauth::WebIdentityCredentials> webIdentity_;
    std::unique_ptr<awsauth::ProfileCredentials> profile_;
    std::unique_ptr<awsauth::ContainerCredentials> container_;
    std::unique_ptr<awsauth::InstanceMetadata> instanceMetadata_;
    std::unique_ptr<awsauth::CredentialChain> chain_;

    std::function<void(const credentials::Result&)> deliver_;  // renewal thread only
    std::mutex mutex_;
    std::condition_variable wake_;
    uint64_t lookups_ = 0;   // guarded by mutex_: Fetches so far; the renewal thread waits for more
    bool stopping_ = false;  // guarded by mutex_
    std::thread renewer_;
};
