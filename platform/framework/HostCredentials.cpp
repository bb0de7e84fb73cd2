#include "platform/framework/HostCredentials.h"

#include <cctype>

#include "platform/awsauth/ContainerCredentials.h"
#include "platform/awsauth/CredentialChain.h"
#include "platform/awsauth/InstanceMetadata.h"
#include "platform/awsauth/ProfileCredentials.h"
#include "platform/awsauth/StsClient.h"
#include "platform/awsauth/WebIdentityCredentials.h"
#include "platform/logger/Logger.h"

namespace {

const char kFile[] = "platform/framework/HostCredentials";

bool IsFileEndpoint(const std::string& endpoint) {
    std::string scheme = endpoint.substr(0, 5);
    for (char& c : scheme) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return scheme == "file:";
}

std::map<std::string, std::string> Properties(const awsauth::AwsCredentials& credentials,
                                              const std::string& region) {
    return {{"awsAccessKey", credentials.accessKey},
            {"awsSecretKey", credentials.secretKey},
            {"sessionToken", credentials.sessionToken},
            {"region", region}};
}

}  // namespace

HostCredentials::HostCredentials(const FrameworkOptions& options,
                                 const awsauth::Environment& environment)
    : region_(options.region), localStore_(IsFileEndpoint(options.endpoint)) {
    using awsauth::ChainLink;
    sts_ = std::make_unique<awsauth::StsClient>(
        awsauth::StsConfig::FromEnvironment(environment, options.region));
    webIdentity_ = std::make_unique<awsauth::WebIdentityCredentials>(environment, *sts_);
    container_ = std::make_unique<awsauth::ContainerCredentials>(environment);
    instanceMetadata_ = std::make_unique<awsauth::InstanceMetadata>(environment);
    awsauth::ProfileSources sources;
    sources.process = credentials::FromCredentialProcess;
    sources.environment = [environment] { return credentials::FromEnvironment(environment); };
    sources.container = [this] { return container_->Fetch(); };
    sources.instanceMetadata = [this] { return instanceMetadata_->Fetch(); };
    profile_ = std::make_unique<awsauth::ProfileCredentials>(environment, *sts_, sources);

    std::vector<ChainLink> links;
    if (!options.credentialProcess.empty()) {
        const std::string command = options.credentialProcess;
        links.push_back({"credential process",
                         [command] { return credentials::FromCredentialProcess(command); }});
    }
    links.push_back({"environment", sources.environment});
    links.push_back({"web identity", [this] { return webIdentity_->Fetch(); }});
    links.push_back({"shared config files", [this] { return profile_->Fetch(); }});
    links.push_back({"container endpoint", sources.container});
    links.push_back({"instance metadata", sources.instanceMetadata});
    chain_ = std::make_unique<awsauth::CredentialChain>(
        std::move(links),
        [this](const awsauth::AwsCredentials& keys) { return sts_->GetSessionToken(keys); });
}

HostCredentials::~HostCredentials() {
    Stop();
}

credentials::Result HostCredentials::Fetch(bool refresh) {
    credentials::Result result;
    if (localStore_) {
        result.ok = true;
        result.source = "local store";
        result.properties = Properties({"local", "local", "local", std::nullopt}, region_);
        return result;
    }
    awsauth::CredentialChain::Answer answer = chain_->Get(refresh);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        ++lookups_;
    }
    wake_.notify_all();
    result.ok = answer.ok;
    result.source = answer.source;
    result.why = answer.why;
    if (answer.ok) result.properties = Properties(answer.credentials, region_);
    return result;
}

void HostCredentials::StartRenewing(std::function<void(const credentials::Result&)> deliver) {
    if (localStore_ || renewer_.joinable()) return;
    deliver_ = std::move(deliver);
    renewer_ = std::thread([this] { renew(); });
}

void HostCredentials::Stop() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    if (renewer_.joinable()) renewer_.join();
}

void HostCredentials::renew() {
    std::unique_lock<std::mutex> lock(mutex_);
    awsauth::Clock::time_point notBefore{};  // after a renewal that gave nothing new
    while (!stopping_) {
        const uint64_t seen = lookups_;
        std::optional<awsauth::Clock::time_point> at = chain_->RefreshAt();
        if (!at) {
            // Nothing that expires is kept: wait for a lookup that may keep something.
            wake_.wait(lock, [&] { return stopping_ || lookups_ != seen; });
            continue;
        }
        const awsauth::Clock::time_point due = std::max(*at, notBefore);
        if (wake_.wait_until(lock, due, [&] { return stopping_ || lookups_ != seen; })) continue;
        lock.unlock();
        credentials::Result renewed = Fetch(false);
        std::optional<awsauth::Clock::time_point> next = chain_->RefreshAt();
        const auto now = awsauth::Clock::now();
        if (!renewed.ok || (next && *next <= now)) {
            notBefore = now + kRetryAfterFailure;
            Logger::Put(5, kFile, "HostCredentials::renew", __LINE__,
                        "AWS credentials not renewed; trying again in %lld s: %s",
                        static_cast<long long>(kRetryAfterFailure.count()),
                        renewed.ok ? "the source gave no fresh ones" : renewed.why.c_str());
        }
        if (renewed.ok) deliver_(renewed);
        lock.lock();
    }
}
