#include "platform/awsauth/InstanceMetadata.h"

#include <algorithm>
#include <cctype>

#include "platform/awsauth/HttpClient.h"

namespace awsauth {

namespace {

std::string Lower(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text;
}

}  // namespace

InstanceMetadata::InstanceMetadata(Environment environment)
    : environment_(std::move(environment)) {}

std::string InstanceMetadata::Endpoint() const {
    std::string endpoint = environment_("AWS_EC2_METADATA_SERVICE_ENDPOINT");
    if (endpoint.empty()) {
        endpoint = Lower(environment_("AWS_EC2_METADATA_SERVICE_ENDPOINT_MODE")) == "ipv6"
                       ? "http://[fd00:ec2::254]"
                       : "http://169.254.169.254";
    }
    while (!endpoint.empty() && endpoint.back() == '/') endpoint.pop_back();
    return endpoint;
}

Lookup InstanceMetadata::Fetch() const {
    if (Lower(environment_("AWS_EC2_METADATA_DISABLED")) == "true") {
        return Lookup::Absent("the instance metadata service is turned off");
    }
    const std::string base = Endpoint();
    auto exchange = [&](const std::string& method, const std::string& path,
                        std::vector<std::pair<std::string, std::string>> headers,
                        HttpResponse& response, std::string& why) {
        HttpRequest request;
        request.method = method;
        request.url = base + path;
        request.headers = std::move(headers);
        request.connectTimeoutMs = kTimeoutMs;
        request.totalTimeoutMs = kTimeoutMs;
        return Send(request, response, why);
    };

    HttpResponse response;
    std::string why;
    if (!exchange("PUT", "/latest/api/token",
                  {{"X-aws-ec2-metadata-token-ttl-seconds", std::to_string(kTokenSeconds)}},
                  response, why)) {
        return Lookup::Absent("no instance metadata service at " + base + " (" + why + ")");
    }
    if (response.status != 200 || response.body.empty()) {
        return Lookup::Failed("instance metadata at " + base + ": the token request got HTTP " +
                              std::to_string(response.status));
    }
    const std::string token = response.body;
    if (token.find_first_of("\r\n") != std::string::npos) {
        return Lookup::Failed("instance metadata at " + base + ": the token holds a line break");
    }
    const std::string path = "/latest/meta-data/iam/security-credentials/";
    if (!exchange("GET", path, {{"X-aws-ec2-metadata-token", token}}, response, why)) {
        return Lookup::Failed("instance metadata at " + base + ": " + why);
    }
    if (response.status == 404) {
        return Lookup::Absent("no IAM role is attached to this instance");
    }
    std::string role = response.body.substr(0, response.body.find_first_of("\r\n"));
    if (response.status != 200 || role.empty() ||
        role.find_first_of("/?#% ") != std::string::npos) {
        return Lookup::Failed("instance metadata at " + base + ": the role name request got HTTP " +
                              std::to_string(response.status));
    }
    if (!exchange("GET", path + role, {{"X-aws-ec2-metadata-token", token}}, response, why)) {
        return Lookup::Failed("instance metadata at " + base + ": " + why);
    }
    if (response.status != 200) {
        return Lookup::Failed("instance metadata at " + base + ": the credentials of role " + role +
                              " got HTTP " + std::to_string(response.status));
    }
    if (response.body.find("\"Code\"") != std::string::npos &&
        response.body.find("\"Success\"") == std::string::npos) {
        return Lookup::Failed("instance metadata at " + base + ": role " + role +
                              " has no credentials now");
    }
    Lookup found = CredentialsFromJson(response.body, "Token");
    if (!found.Ok()) found.why = "instance metadata role " + role + ": " + found.why;
    return found;
}

}  // namespace awsauth
