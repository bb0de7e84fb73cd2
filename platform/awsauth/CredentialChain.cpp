#include "platform/awsauth/CredentialChain.h"

#include "platform/logger/Logger.h"

namespace awsauth {

namespace {

const char kFile[] = "platform/awsauth/CredentialChain";

}  // namespace

CredentialChain::CredentialChain(std::vector<ChainLink> links,
                                 std::function<Lookup(const AwsCredentials&)> exchange,
                                 std::function<Clock::time_point()> now)
    : links_(std::move(links)), exchange_(std::move(exchange)), now_(std::move(now)) {}

std::optional<Clock::time_point> CredentialChain::RefreshAt() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return refreshAt_;
}

CredentialChain::Answer CredentialChain::Get(bool refresh) {
    std::lock_guard<std::mutex> lock(mutex_);
    const Clock::time_point now = now_();
    if (kept_ && !refresh && (!refreshAt_ || now < *refreshAt_)) return *kept_;

    Answer answer = lookUp();
    if (!answer.ok) {
        const auto& expiration = kept_ ? kept_->credentials.expiration : std::nullopt;
        if (kept_ && !refresh && expiration && now < *expiration) {
            Logger::Put(5, kFile, "awsauth::CredentialChain::Get", __LINE__,
                        "AWS credentials not renewed, the current ones stay until they expire: %s",
                        answer.why.c_str());
            return *kept_;
        }
        kept_.reset();
        refreshAt_.reset();
        loggedSource_.clear();  // whatever comes next is news again
        return answer;
    }
    const auto& expiration = answer.credentials.expiration;
    if (!expiration) {
        refreshAt_.reset();
    } else if (*expiration - kRefreshAhead > now) {
        refreshAt_ = *expiration - kRefreshAhead;
    } else {
        refreshAt_ =
            now + std::max<Clock::duration>((*expiration - now) / 2, std::chrono::seconds(1));
    }
    kept_ = answer;
    if (answer.source != loggedSource_) {
        Logger::Put(11, kFile, "awsauth::CredentialChain::Get", __LINE__, "AWS credentials from %s",
                    answer.source.c_str());
        loggedSource_ = answer.source;
    }
    return answer;
}

CredentialChain::Answer CredentialChain::lookUp() {
    Answer answer;
    for (const ChainLink& link : links_) {
        Lookup lookup = link.fetch();
        if (lookup.Ok() && !lookup.credentials.Temporary()) {
            Lookup exchanged = exchange_(lookup.credentials);
            if (!exchanged.Ok()) exchanged.why = "long-term keys not exchanged: " + exchanged.why;
            lookup = exchanged;
            answer.source = link.name + " via STS GetSessionToken";
        } else {
            answer.source = link.name;
        }
        if (lookup.Ok()) {
            answer.ok = true;
            answer.credentials = std::move(lookup.credentials);
            answer.why.clear();
            return answer;
        }
        answer.why += (answer.why.empty() ? "" : "; ") + link.name + ": " + lookup.why;
    }
    answer.source.clear();
    return answer;
}

}  // namespace awsauth
