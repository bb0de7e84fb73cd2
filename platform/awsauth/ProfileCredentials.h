// ProfileCredentials: the credentials that the chosen profile of the shared files describes
// (SharedConfigFile says which files and which profile), in the order the AWS CLI uses:
//   1. role_arn: STS AssumeRoleWithWebIdentity when the profile has web_identity_token_file;
//      else STS AssumeRole with the credentials of source_profile (another profile, resolved
//      the same way, or this one's own keys when it names itself) or of credential_source
//      (Environment, Ec2InstanceMetadata or EcsContainer). role_session_name, external_id
//      and duration_seconds are passed on; a role that needs mfa_serial cannot be used;
//   2. credential_process: the command's JSON output;
//   3. aws_access_key_id and aws_secret_access_key, with aws_session_token when present.
// Profiles for IAM Identity Center (sso_*) are not read: a credential_process can bring them.
//
// The files are read again on every Fetch, so edits apply to the next one. Fetch blocks for
// the STS exchanges and commands it needs; it holds no state between calls and may run on any
// thread, as long as the sources it was given may.
#pragma once

#include <functional>
#include <set>
#include <string>

#include "platform/awsauth/AwsCredentials.h"
#include "platform/awsauth/SharedConfigFile.h"
#include "platform/awsauth/StsClient.h"

namespace awsauth {

// What a profile may lean on besides STS.
struct ProfileSources {
    std::function<Lookup(const std::string& command)> process;  // runs credential_process
    std::function<Lookup()> environment;                        // credential_source = Environment
    std::function<Lookup()> instanceMetadata;  // credential_source = Ec2InstanceMetadata
    std::function<Lookup()> container;         // credential_source = EcsContainer
};

class ProfileCredentials {
  public:
    static constexpr int kMaxChain = 8;  // source_profile hops followed at most

    // `sts` must outlive this object.
    ProfileCredentials(Environment environment, const StsClient& sts, ProfileSources sources);

    // Absent when the default profile is not there or names no credentials and no profile was
    // asked for explicitly; Failed when the asked-for profile is missing or unusable.
    Lookup Fetch() const;

  private:
    Lookup resolve(const SharedConfigFile& files, const std::string& name,
                   std::set<std::string>& visited) const;
    Lookup assumeRole(const SharedConfigFile& files, const std::string& name,
                      const SharedConfigFile::Section& profile,
                      std::set<std::string>& visited) const;

    Environment environment_;
    const StsClient& sts_;
    ProfileSources sources_;
};

}  // namespace awsauth
