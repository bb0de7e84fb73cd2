#include "platform/transfer/RetryPacing.h"

#include <algorithm>
#include <random>

std::chrono::milliseconds RetryDelay(const RetryPolicy& policy, int retry, uint64_t random) {
    // base * 2^(retry-1), computed so that it cannot overflow before the cap applies.
    int64_t ceiling = std::max<int64_t>(policy.retryBase.count(), 0);
    for (int i = 1; i < retry && ceiling < policy.retryCap.count(); ++i) ceiling *= 2;
    ceiling = std::min<int64_t>(ceiling, policy.retryCap.count());
    if (ceiling <= 0) return std::chrono::milliseconds(0);
    if (!policy.jitter) return std::chrono::milliseconds(ceiling);
    return std::chrono::milliseconds(random % (static_cast<uint64_t>(ceiling) + 1));
}

std::chrono::steady_clock::duration FailureFloor::Remaining(
    std::chrono::steady_clock::time_point now) const {
    if (delay_.count() == 0 || now >= notBefore_) return std::chrono::steady_clock::duration(0);
    return notBefore_ - now;
}

void FailureFloor::Record(bool succeeded, std::chrono::steady_clock::time_point now) {
    if (succeeded) {
        delay_ = std::chrono::milliseconds(0);
        return;
    }
    delay_ = delay_.count() == 0 ? policy_.floorStart : std::min(delay_ * 2, policy_.floorCap);
    notBefore_ = now + delay_;
}

void CancelSignal::Raise() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        raised_ = true;
    }
    changed_.notify_all();
}

bool CancelSignal::Wait(std::chrono::steady_clock::duration duration) {
    std::unique_lock<std::mutex> lock(mutex_);
    return !changed_.wait_for(lock, duration, [this] { return raised_.load(); });
}

FileTransferResult RunAttempts(const RetryPolicy& policy, CancelSignal& cancel,
                               const std::function<AttemptOutcome()>& attempt) {
    thread_local std::mt19937_64 random{std::random_device{}()};
    for (int tried = 1;; ++tried) {
        const AttemptOutcome outcome = attempt();
        if (outcome.result == Success || !outcome.retryable || tried >= policy.attempts)
            return outcome.result;
        if (!cancel.Wait(RetryDelay(policy, tried, random()))) return TimeOut;
    }
}
