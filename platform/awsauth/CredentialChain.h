// CredentialChain: the first of an ordered list of credential sources that gives credentials,
// made temporary and kept until shortly before they expire.
//
// Get asks the sources in order. A source that is absent or fails is passed over (its reason
// goes into the answer's `why` when none works). Long-term keys (no session token) are turned
// into temporary credentials with the exchange function (STS GetSessionToken), because the
// module takes temporary credentials only. The answer is kept: later Gets return it until
// RefreshAt, which is kRefreshAhead before its expiration (credentials without one are kept
// until a Get asks for a refresh). When a source hands out credentials that are already that
// close to their end, RefreshAt is half their remaining life away (at least a second), so a
// source that keeps doing so is not asked in a tight loop.
//
// The source in use is logged once (priority 11, "AWS credentials from ..."), again only when
// it changes; secrets never reach the log.
//
// Threads: Get and RefreshAt may be called from any thread. One mutex serialises them and is
// held while the sources are asked (seconds at most: every source bounds its exchanges), so
// concurrent callers share one lookup's result instead of asking twice.
#pragma once

#include <chrono>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/awsauth/AwsCredentials.h"

namespace awsauth {

struct ChainLink {
    std::string name;               // for the log: "environment", "instance metadata", ...
    std::function<Lookup()> fetch;  // asked on every lookup; may block for its exchanges
};

class CredentialChain {
  public:
    static constexpr std::chrono::minutes kRefreshAhead{5};

    struct Answer {
        bool ok = false;
        AwsCredentials credentials;  // temporary, when ok
        std::string source;          // the link's name, "... via STS GetSessionToken" if exchanged
        std::string why;             // when !ok: every source's reason, without secrets
    };

    // `exchange` turns long-term keys into temporary credentials. `now` is the clock that
    // expirations are compared with (tests move it by hand).
    CredentialChain(std::vector<ChainLink> links,
                    std::function<Lookup(const AwsCredentials&)> exchange,
                    std::function<Clock::time_point()> now = Clock::now);

    // The kept answer while it is fresh and `refresh` is false; else asks the sources again.
    // A failed lookup without `refresh` still returns the kept credentials while they have
    // not expired.
    Answer Get(bool refresh);

    // When the kept credentials should be replaced; none when nothing is kept or it does not
    // expire.
    std::optional<Clock::time_point> RefreshAt() const;

  private:
    Answer lookUp();

    const std::vector<ChainLink> links_;
    const std::function<Lookup(const AwsCredentials&)> exchange_;
    const std::function<Clock::time_point()> now_;
    mutable std::mutex mutex_;
    std::optional<Answer> kept_;                  // guarded by mutex_
    std::optional<Clock::time_point> refreshAt_;  // guarded by mutex_
    std::string loggedSource_;                    // guarded by mutex_
};

}  // namespace awsauth
