#include "platform/awsauth/WebIdentityCredentials.h"

#include <fstream>
#include <sstream>

namespace awsauth {

WebIdentityCredentials::WebIdentityCredentials(Environment environment, const StsClient& sts)
    : environment_(std::move(environment)), sts_(sts) {}

Lookup WebIdentityCredentials::Fetch() const {
    const std::string tokenFile = environment_("AWS_WEB_IDENTITY_TOKEN_FILE");
    AssumeRoleParameters parameters;
    parameters.roleArn = environment_("AWS_ROLE_ARN");
    parameters.sessionName = environment_("AWS_ROLE_SESSION_NAME");
    if (tokenFile.empty() && parameters.roleArn.empty()) {
        return Lookup::Absent("no AWS_WEB_IDENTITY_TOKEN_FILE and AWS_ROLE_ARN");
    }
    if (tokenFile.empty() || parameters.roleArn.empty()) {
        return Lookup::Failed(
            std::string(tokenFile.empty() ? "AWS_WEB_IDENTITY_TOKEN_FILE" : "AWS_ROLE_ARN") +
            " is missing beside the other");
    }
    std::ifstream in(tokenFile);
    std::stringstream token;
    token << in.rdbuf();
    if (!in || token.str().empty()) {
        return Lookup::Failed("cannot read AWS_WEB_IDENTITY_TOKEN_FILE " + tokenFile);
    }
    return sts_.AssumeRoleWithWebIdentity(parameters, token.str());
}

}  // namespace awsauth
