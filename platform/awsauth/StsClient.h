// StsClient: the three AWS Security Token Service actions the credential chain uses, over the
// STS query API (an HTTPS POST of a form, an XML answer):
//   - GetSessionToken: long-term keys (an IAM user's) in, temporary credentials out;
//   - AssumeRole: any credentials in, the role's temporary credentials out;
//   - AssumeRoleWithWebIdentity: an OIDC token (EKS service accounts) in, the role's
//     temporary credentials out; this one is not signed.
// Signed requests use SigV4Signer (service "sts"); the form is the signed payload.
//
// Where requests go: the `endpoint` override when given (AWS_ENDPOINT_URL_STS), else the
// regional endpoint https://sts.REGION.amazonaws.com (amazonaws.com.cn in China), else, with
// legacy endpoints asked for (AWS_STS_REGIONAL_ENDPOINTS=legacy), the global
// https://sts.amazonaws.com for the regions that had it first. The global endpoint signs for
// us-east-1.
//
// Immutable after construction: any thread may call it, calls do not share connections. Each
// call blocks for one exchange (bounded by the request's timeouts). Failures carry STS's error
// code and message, never a secret.
#pragma once

#include <string>

#include "platform/awsauth/AwsCredentials.h"
#include "platform/awsauth/HttpClient.h"

namespace awsauth {

struct StsConfig {
    std::string region;    // the client's region; "" or "aws-global" for the global endpoint
    std::string endpoint;  // "http[s]://host[:port]" to send every request there; "" for AWS
    bool legacyEndpoints = false;  // AWS_STS_REGIONAL_ENDPOINTS=legacy
    std::string caBundle;          // AWS_CA_BUNDLE
    long timeoutMs = 15000;        // one whole exchange

    // region, AWS_ENDPOINT_URL_STS, AWS_STS_REGIONAL_ENDPOINTS and AWS_CA_BUNDLE.
    static StsConfig FromEnvironment(const Environment& environment, const std::string& region);
};

struct AssumeRoleParameters {
    std::string roleArn;
    std::string sessionName;  // "" for "stream-file-recorder-<seconds since the epoch>"
    std::string externalId;   // "" when the role's trust policy asks for none
    int durationSeconds = 0;  // 0 for STS's default (one hour)
};

class StsClient {
  public:
    explicit StsClient(StsConfig config);

    Lookup GetSessionToken(const AwsCredentials& longTermKeys) const;
    Lookup AssumeRole(const AwsCredentials& source, const AssumeRoleParameters& parameters) const;
    Lookup AssumeRoleWithWebIdentity(const AssumeRoleParameters& parameters,
                                     const std::string& webIdentityToken) const;

    // The URL requests go to, and the region they are signed for; "" URL when the region or
    // the endpoint cannot be used (then every call fails with the reason).
    const std::string& Url() const { return url_; }
    const std::string& SigningRegion() const { return signingRegion_; }

    // The request of `form` ("Action=...&Version=..."), signed with `signWith` at `amzDate`
    // ("YYYYMMDDTHHMMSSZ") unless it is null. What every call sends; tests check signatures.
    HttpRequest Request(const std::string& form, const AwsCredentials* signWith,
                        const std::string& amzDate) const;

    // "Name=value&..." of the pairs, each part percent-encoded as SigV4 wants it.
    static std::string Form(std::initializer_list<std::pair<std::string, std::string>> pairs);

  private:
    Lookup call(const char* action, const std::string& form, const AwsCredentials* signWith) const;

    const StsConfig config_;
    std::string url_;            // "https://sts.eu-west-1.amazonaws.com/"
    std::string host_;           // Host header: "sts.eu-west-1.amazonaws.com"
    std::string signingRegion_;  // "eu-west-1"
    std::string why_;            // why url_ is empty
};

}  // namespace awsauth
