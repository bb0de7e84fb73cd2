#include "platform/awsauth/StsClient.h"

#include <algorithm>
#include <cctype>
#include <set>

#include "platform/transfer/Digest.h"
#include "platform/transfer/HttpText.h"
#include "platform/transfer/SigV4Signer.h"

namespace awsauth {

namespace {

const char kVersion[] = "2011-06-15";

// Regions that used the global endpoint before regional ones were the default.
const std::set<std::string> kLegacyGlobalRegions = {
    "ap-northeast-1", "ap-south-1",   "ap-southeast-1", "ap-southeast-2",
    "aws-global",     "ca-central-1", "eu-central-1",   "eu-north-1",
    "eu-west-1",      "eu-west-2",    "eu-west-3",      "sa-east-1",
    "us-east-1",      "us-east-2",    "us-west-1",      "us-west-2"};

bool ValidRegion(const std::string& region) {
    return !region.empty() && region.size() <= 64 &&
           std::all_of(region.begin(), region.end(), [](unsigned char c) {
               return std::islower(c) || std::isdigit(c) || c == '-';
           });
}

// The text of the first <tag>...</tag> in an XML document, entities resolved; "" when absent.
std::string XmlText(const std::string& xml, const std::string& tag) {
    const std::string open = "<" + tag + ">", close = "</" + tag + ">";
    size_t start = xml.find(open);
    if (start == std::string::npos) return "";
    start += open.size();
    size_t end = xml.find(close, start);
    if (end == std::string::npos) return "";
    std::string text = xml.substr(start, end - start), out;
    static const std::pair<const char*, char> kEntities[] = {
        {"&amp;", '&'}, {"&lt;", '<'}, {"&gt;", '>'}, {"&quot;", '"'}, {"&apos;", '\''}};
    for (size_t i = 0; i < text.size(); ++i) {
        bool replaced = false;
        for (const auto& [entity, c] : kEntities) {
            if (text.compare(i, std::char_traits<char>::length(entity), entity) == 0) {
                out += c;
                i += std::char_traits<char>::length(entity) - 1;
                replaced = true;
                break;
            }
        }
        if (!replaced) out += text[i];
    }
    return out;
}

std::string DefaultSessionName() {
    return "stream-file-recorder-" +
           std::to_string(
               std::chrono::duration_cast<std::chrono::seconds>(Clock::now().time_since_epoch())
                   .count());
}

}  // namespace

StsConfig StsConfig::FromEnvironment(const Environment& environment, const std::string& region) {
    StsConfig config;
    config.region = region;
    config.endpoint = environment("AWS_ENDPOINT_URL_STS");
    std::string mode = environment("AWS_STS_REGIONAL_ENDPOINTS");
    std::transform(mode.begin(), mode.end(), mode.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    config.legacyEndpoints = mode == "legacy";
    config.caBundle = environment("AWS_CA_BUNDLE");
    return config;
}

StsClient::StsClient(StsConfig config) : config_(std::move(config)) {
    const std::string& region = config_.region;
    if (!config_.endpoint.empty()) {
        std::string url = config_.endpoint;
        while (!url.empty() && url.back() == '/') url.pop_back();
        size_t scheme = url.find("://");
        std::string prefix = url.substr(0, scheme == std::string::npos ? 0 : scheme);
        std::transform(prefix.begin(), prefix.end(), prefix.begin(),
                       [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
        host_ = scheme == std::string::npos ? "" : url.substr(scheme + 3);
        if ((prefix != "http" && prefix != "https") || host_.empty() ||
            host_.find_first_of("/?#@ ") != std::string::npos) {
            why_ = "the STS endpoint \"" + config_.endpoint + "\" is not http[s]://host[:port]";
            host_.clear();
            return;
        }
        url_ = url + "/";
        signingRegion_ = region.empty() || region == "aws-global" ? "us-east-1" : region;
    } else if (region.empty() || region == "aws-global" ||
               (config_.legacyEndpoints && kLegacyGlobalRegions.count(region) != 0)) {
        host_ = "sts.amazonaws.com";
        signingRegion_ = "us-east-1";
    } else if (ValidRegion(region)) {
        host_ = "sts." + region + ".amazonaws.com" + (region.rfind("cn-", 0) == 0 ? ".cn" : "");
        signingRegion_ = region;
    } else {
        why_ = "the region \"" + region + "\" cannot name an STS endpoint";
        return;
    }
    if (url_.empty()) url_ = "https://" + host_ + "/";
    if (!ValidRegion(signingRegion_)) {
        why_ = "the region \"" + signingRegion_ + "\" cannot sign STS requests";
        url_.clear();
    }
}

std::string StsClient::Form(std::initializer_list<std::pair<std::string, std::string>> pairs) {
    std::string form;
    for (const auto& [name, value] : pairs) {
        if (!form.empty()) form += '&';
        form += SigV4Signer::EncodeComponent(name) + "=" + SigV4Signer::EncodeComponent(value);
    }
    return form;
}

HttpRequest StsClient::Request(const std::string& form, const AwsCredentials* signWith,
                               const std::string& amzDate) const {
    HttpRequest request;
    request.method = "POST";
    request.url = url_;
    request.body = form;
    request.caBundle = config_.caBundle;
    request.totalTimeoutMs = config_.timeoutMs;
    request.headers = {{"Host", host_},
                       {"Content-Type", "application/x-www-form-urlencoded; charset=utf-8"},
                       {"X-Amz-Date", amzDate}};
    if (signWith != nullptr) {
        SigV4Request toSign;
        toSign.method = "POST";
        toSign.canonicalUri = "/";
        toSign.headers = request.headers;
        if (!signWith->sessionToken.empty()) {
            toSign.headers.emplace_back("X-Amz-Security-Token", signWith->sessionToken);
        }
        toSign.payloadHash = digest::Hex(digest::Sha256Of(form));
        SigV4Key key{signWith->accessKey, signWith->secretKey, signingRegion_, "sts"};
        request.headers = toSign.headers;
        request.headers.emplace_back("Authorization",
                                     SigV4Signer::Sign(toSign, key, amzDate).authorization);
    }
    return request;
}

Lookup StsClient::GetSessionToken(const AwsCredentials& longTermKeys) const {
    return call("GetSessionToken", Form({{"Action", "GetSessionToken"}, {"Version", kVersion}}),
                &longTermKeys);
}

Lookup StsClient::AssumeRole(const AwsCredentials& source,
                             const AssumeRoleParameters& parameters) const {
    std::string form =
        Form({{"Action", "AssumeRole"},
              {"Version", kVersion},
              {"RoleArn", parameters.roleArn},
              {"RoleSessionName",
               parameters.sessionName.empty() ? DefaultSessionName() : parameters.sessionName}});
    if (!parameters.externalId.empty()) form += "&" + Form({{"ExternalId", parameters.externalId}});
    if (parameters.durationSeconds > 0) {
        form += "&" + Form({{"DurationSeconds", std::to_string(parameters.durationSeconds)}});
    }
    return call("AssumeRole", form, &source);
}

Lookup StsClient::AssumeRoleWithWebIdentity(const AssumeRoleParameters& parameters,
                                            const std::string& webIdentityToken) const {
    std::string form =
        Form({{"Action", "AssumeRoleWithWebIdentity"},
              {"Version", kVersion},
              {"RoleArn", parameters.roleArn},
              {"RoleSessionName",
               parameters.sessionName.empty() ? DefaultSessionName() : parameters.sessionName},
              {"WebIdentityToken", webIdentityToken}});
    if (parameters.durationSeconds > 0) {
        form += "&" + Form({{"DurationSeconds", std::to_string(parameters.durationSeconds)}});
    }
    return call("AssumeRoleWithWebIdentity", form, nullptr);
}

Lookup StsClient::call(const char* action, const std::string& form,
                       const AwsCredentials* signWith) const {
    const std::string what = std::string("STS ") + action;
    if (url_.empty()) return Lookup::Failed(what + ": " + why_);
    HttpRequest request = Request(form, signWith, SigV4Signer::AmzDate(Clock::now()));
    HttpResponse response;
    std::string why;
    if (!Send(request, response, why)) return Lookup::Failed(what + " at " + url_ + ": " + why);
    const std::vector<std::string> secrets = {signWith ? signWith->secretKey : "",
                                              signWith ? signWith->sessionToken : ""};
    if (response.status != 200) {
        std::string code = XmlText(response.body, "Code");
        std::string message = httptext::Redact(XmlText(response.body, "Message"), secrets);
        return Lookup::Failed(what + ": HTTP " + std::to_string(response.status) +
                              (code.empty() ? "" : " " + code) +
                              (message.empty() ? "" : " \"" + message + "\""));
    }
    const std::string xml = XmlText(response.body, "Credentials");
    AwsCredentials credentials;
    credentials.accessKey = XmlText(xml, "AccessKeyId");
    credentials.secretKey = XmlText(xml, "SecretAccessKey");
    credentials.sessionToken = XmlText(xml, "SessionToken");
    Clock::time_point expiration;
    if (credentials.accessKey.empty() || credentials.secretKey.empty() ||
        credentials.sessionToken.empty()) {
        return Lookup::Failed(what + ": the answer has no complete Credentials");
    }
    if (!ParseIsoTime(XmlText(xml, "Expiration"), expiration)) {
        return Lookup::Failed(what + ": the answer's Expiration is not an ISO 8601 time");
    }
    credentials.expiration = expiration;
    return Lookup::Found(std::move(credentials));
}

}  // namespace awsauth
