#include "platform/awsauth/ContainerCredentials.h"

#include <algorithm>
#include <cctype>
#include <fstream>
#include <sstream>

#include "platform/awsauth/HttpClient.h"

namespace awsauth {

namespace {

// The host of an http(s) URL, without brackets or port, in lower case.
std::string HostOf(const std::string& url) {
    size_t start = url.find("://");
    if (start == std::string::npos) return "";
    std::string authority = url.substr(start + 3, url.find_first_of("/?#", start + 3) - start - 3);
    if (authority.find('@') != std::string::npos) return "";
    std::string host;
    if (!authority.empty() && authority[0] == '[') {
        host = authority.substr(1, authority.find(']') - 1);
    } else {
        host = authority.substr(0, authority.find(':'));
    }
    std::transform(host.begin(), host.end(), host.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return host;
}

bool MayUsePlainHttp(const std::string& host) {
    return host == "localhost" || host == "::1" || host.rfind("127.", 0) == 0 ||
           host == "169.254.170.2" || host == "169.254.170.23" || host == "fd00:ec2::23";
}

std::string Trimmed(std::string text) {
    while (!text.empty() && std::isspace(static_cast<unsigned char>(text.back()))) text.pop_back();
    size_t start = 0;
    while (start < text.size() && std::isspace(static_cast<unsigned char>(text[start]))) ++start;
    return text.substr(start);
}

}  // namespace

ContainerCredentials::ContainerCredentials(Environment environment)
    : environment_(std::move(environment)) {}

std::string ContainerCredentials::Url(std::string& why) const {
    const std::string relative = environment_("AWS_CONTAINER_CREDENTIALS_RELATIVE_URI");
    if (!relative.empty()) {
        return std::string(kEcsHost) + (relative[0] == '/' ? "" : "/") + relative;
    }
    std::string full = environment_("AWS_CONTAINER_CREDENTIALS_FULL_URI");
    std::string scheme = full.substr(0, full.find("://"));
    std::transform(scheme.begin(), scheme.end(), scheme.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    const std::string host = HostOf(full);
    if (host.empty() || (scheme != "http" && scheme != "https")) {
        why = "AWS_CONTAINER_CREDENTIALS_FULL_URI \"" + full + "\" is not an http(s) URL";
        return "";
    }
    if (scheme == "http" && !MayUsePlainHttp(host)) {
        why =
            "AWS_CONTAINER_CREDENTIALS_FULL_URI may use plain http only to a loopback or "
            "container agent address, not \"" +
            host + "\"";
        return "";
    }
    return full;
}

Lookup ContainerCredentials::Fetch() const {
    if (environment_("AWS_CONTAINER_CREDENTIALS_RELATIVE_URI").empty() &&
        environment_("AWS_CONTAINER_CREDENTIALS_FULL_URI").empty()) {
        return Lookup::Absent("no AWS_CONTAINER_CREDENTIALS_RELATIVE_URI or _FULL_URI");
    }
    std::string why;
    HttpRequest request;
    request.url = Url(why);
    if (request.url.empty()) return Lookup::Failed(why);
    request.connectTimeoutMs = 2000;
    request.totalTimeoutMs = 5000;
    request.caBundle = environment_("AWS_CA_BUNDLE");
    std::string token = environment_("AWS_CONTAINER_AUTHORIZATION_TOKEN");
    const std::string tokenFile = environment_("AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE");
    if (!tokenFile.empty()) {
        std::ifstream in(tokenFile);
        std::stringstream content;
        content << in.rdbuf();
        if (!in)
            return Lookup::Failed("cannot read AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE " +
                                  tokenFile);
        token = Trimmed(content.str());
    }
    if (token.find_first_of("\r\n") != std::string::npos) {
        return Lookup::Failed("the container authorization token holds a line break");
    }
    if (!token.empty()) request.headers.emplace_back("Authorization", token);
    HttpResponse response;
    if (!Send(request, response, why)) {
        return Lookup::Failed("container credentials at " + request.url + ": " + why);
    }
    if (response.status != 200) {
        return Lookup::Failed("container credentials at " + request.url + ": HTTP " +
                              std::to_string(response.status));
    }
    Lookup found = CredentialsFromJson(response.body, "Token");
    if (!found.Ok()) found.why = "container credentials at " + request.url + ": " + found.why;
    return found;
}

}  // namespace awsauth
