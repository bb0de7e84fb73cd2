#include "platform/awsauth/ProfileCredentials.h"

#include <fstream>
#include <sstream>

namespace awsauth {

namespace {

std::string Value(const SharedConfigFile::Section& profile, const std::string& key) {
    auto it = profile.find(key);
    return it == profile.end() ? std::string() : it->second;
}

// A failure inside profile `name`, or what its source said, with the profile named.
Lookup InProfile(const std::string& name, Lookup lookup) {
    if (!lookup.Ok()) {
        lookup.outcome = Lookup::Outcome::kFailed;
        lookup.why = "profile " + name + ": " + lookup.why;
    }
    return lookup;
}

}  // namespace

ProfileCredentials::ProfileCredentials(Environment environment, const StsClient& sts,
                                       ProfileSources sources)
    : environment_(std::move(environment)), sts_(sts), sources_(std::move(sources)) {}

Lookup ProfileCredentials::Fetch() const {
    const SharedConfigFile files = SharedConfigFile::Load(environment_);
    SharedConfigFile::Section profile;
    const std::string& name = files.ProfileName();
    if (!files.Profile(name, profile)) {
        std::string why = "no profile " + name + " in " + files.Files();
        return files.ProfileNamedExplicitly() ? Lookup::Failed(why) : Lookup::Absent(why);
    }
    std::set<std::string> visited;
    Lookup lookup = resolve(files, name, visited);
    if (lookup.outcome == Lookup::Outcome::kAbsent && files.ProfileNamedExplicitly()) {
        lookup.outcome = Lookup::Outcome::kFailed;
    }
    return lookup;
}

Lookup ProfileCredentials::resolve(const SharedConfigFile& files, const std::string& name,
                                   std::set<std::string>& visited) const {
    SharedConfigFile::Section profile;
    if (!files.Profile(name, profile)) {
        return Lookup::Failed("no profile " + name + " in " + files.Files());
    }
    if (!visited.insert(name).second || static_cast<int>(visited.size()) > kMaxChain) {
        return Lookup::Failed("profile " + name + ": its source_profile chain loops");
    }
    if (!Value(profile, "role_arn").empty()) return assumeRole(files, name, profile, visited);

    const std::string command = Value(profile, "credential_process");
    if (!command.empty()) {
        if (!sources_.process) return Lookup::Failed("profile " + name + ": cannot run commands");
        return InProfile(name, sources_.process(command));
    }
    AwsCredentials keys;
    keys.accessKey = Value(profile, "aws_access_key_id");
    keys.secretKey = Value(profile, "aws_secret_access_key");
    keys.sessionToken = Value(profile, "aws_session_token");
    if (!keys.accessKey.empty() && !keys.secretKey.empty()) return Lookup::Found(keys);
    if (!keys.accessKey.empty() || !keys.secretKey.empty()) {
        return Lookup::Failed("profile " + name +
                              " needs both aws_access_key_id and aws_secret_access_key");
    }
    if (!Value(profile, "sso_session").empty() || !Value(profile, "sso_start_url").empty()) {
        return Lookup::Failed("profile " + name +
                              " uses IAM Identity Center (sso_*), which is not read here; give "
                              "it a credential_process such as \"aws configure "
                              "export-credentials --profile " +
                              name + " --format process\"");
    }
    return Lookup::Absent("profile " + name + " in " + files.Files() + " names no credentials");
}

Lookup ProfileCredentials::assumeRole(const SharedConfigFile& files, const std::string& name,
                                      const SharedConfigFile::Section& profile,
                                      std::set<std::string>& visited) const {
    AssumeRoleParameters parameters;
    parameters.roleArn = Value(profile, "role_arn");
    parameters.sessionName = Value(profile, "role_session_name");
    parameters.externalId = Value(profile, "external_id");
    const std::string duration = Value(profile, "duration_seconds");
    if (!duration.empty()) {
        try {
            parameters.durationSeconds = std::stoi(duration);
        } catch (const std::exception&) {
            return Lookup::Failed("profile " + name + ": duration_seconds \"" + duration +
                                  "\" is not a number");
        }
    }
    if (!Value(profile, "mfa_serial").empty()) {
        return Lookup::Failed("profile " + name +
                              ": the role needs an MFA code (mfa_serial), which a recorder "
                              "cannot ask for");
    }

    const std::string tokenFile = Value(profile, "web_identity_token_file");
    if (!tokenFile.empty()) {
        std::ifstream in(tokenFile);
        std::stringstream token;
        token << in.rdbuf();
        if (!in || token.str().empty()) {
            return Lookup::Failed("profile " + name + ": cannot read web_identity_token_file " +
                                  tokenFile);
        }
        return InProfile(name, sts_.AssumeRoleWithWebIdentity(parameters, token.str()));
    }

    Lookup source;
    const std::string sourceProfile = Value(profile, "source_profile");
    const std::string credentialSource = Value(profile, "credential_source");
    if (sourceProfile == name) {
        AwsCredentials keys;
        keys.accessKey = Value(profile, "aws_access_key_id");
        keys.secretKey = Value(profile, "aws_secret_access_key");
        keys.sessionToken = Value(profile, "aws_session_token");
        source = keys.accessKey.empty() || keys.secretKey.empty()
                     ? Lookup::Failed("it is its own source_profile but has no keys")
                     : Lookup::Found(keys);
    } else if (!sourceProfile.empty()) {
        source = resolve(files, sourceProfile, visited);
    } else if (credentialSource == "Environment" && sources_.environment) {
        source = sources_.environment();
    } else if (credentialSource == "Ec2InstanceMetadata" && sources_.instanceMetadata) {
        source = sources_.instanceMetadata();
    } else if (credentialSource == "EcsContainer" && sources_.container) {
        source = sources_.container();
    } else if (!credentialSource.empty()) {
        source = Lookup::Failed("credential_source \"" + credentialSource + "\" is unknown");
    } else {
        source = Lookup::Failed(
            "role_arn needs source_profile, credential_source or "
            "web_identity_token_file");
    }
    if (!source.Ok()) return InProfile(name, source);
    return InProfile(name, sts_.AssumeRole(source.credentials, parameters));
}

}  // namespace awsauth
