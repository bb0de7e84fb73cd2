// SharedConfigFile: the AWS shared configuration and credentials files, as the AWS CLI and
// SDKs write them, read into profiles.
//
// Files: AWS_CONFIG_FILE (default ~/.aws/config, sections "[profile NAME]" and "[default]")
// and AWS_SHARED_CREDENTIALS_FILE (default ~/.aws/credentials, sections "[NAME]"). A missing
// file counts as empty. Syntax: "key = value" lines; names are case-sensitive, blanks around
// them are trimmed; lines starting with '#' or ';' are comments; indented lines continue a
// nested setting ("s3 =\n  max_concurrent_requests = 4") and are skipped. For a profile in
// both files, the credentials file's keys win.
//
// The profile to use: AWS_PROFILE, else AWS_DEFAULT_PROFILE, else "default".
//
// A plain value once loaded: any thread may read it.
#pragma once

#include <map>
#include <string>

#include "platform/awsauth/AwsCredentials.h"

namespace awsauth {

class SharedConfigFile {
  public:
    using Section = std::map<std::string, std::string>;

    // Reads both files named by the environment (HOME for the defaults).
    static SharedConfigFile Load(const Environment& environment);

    // Sections of one file's text: name as written between the brackets (trimmed) to its keys.
    static std::map<std::string, Section> Parse(const std::string& text);

    // The merged keys of profile `name`; false when neither file has it.
    bool Profile(const std::string& name, Section& out) const;

    const std::string& ProfileName() const { return profileName_; }
    bool ProfileNamedExplicitly() const { return explicitProfile_; }  // AWS_PROFILE was set
    // "/root/.aws/config and /root/.aws/credentials", for messages.
    std::string Files() const { return configPath_ + " and " + credentialsPath_; }

  private:
    std::map<std::string, Section> config_;       // config file, by profile name
    std::map<std::string, Section> credentials_;  // credentials file, by profile name
    std::string configPath_, credentialsPath_;
    std::string profileName_ = "default";
    bool explicitProfile_ = false;
};

}  // namespace awsauth
