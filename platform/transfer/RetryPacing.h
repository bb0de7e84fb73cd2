// RetryPacing: how a store paces its attempts after failures, so that a fault never turns into
// a storm of requests.
//
// Two rules, as AWS clients pace themselves ("standard" retry mode):
// - Inside one transfer, an attempt whose failure may pass (a 5xx answer, SlowDown,
//   RequestTimeout, a connection failure, a timeout) is tried again, up to `attempts` tries in
//   all, after a wait drawn at random from [0, min(retryCap, retryBase * 2^(n-1))] before the
//   n-th retry ("full jitter": clients that failed together do not come back together).
// - Between transfers: after a failed transfer the next one starts no sooner than `floorStart`
//   later; each further failure doubles that delay up to `floorCap`; a success resets it.
//
// Every wait ends at once when the store is cancelled (CancelSignal). The pure parts
// (RetryDelay, FailureFloor) take the time and the random number from the caller.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>

#include "platform/transfer/FileTransfer.h"

struct RetryPolicy {
    int attempts = 3;  // tries per transfer, the first one included
    std::chrono::milliseconds retryBase{100};
    std::chrono::milliseconds retryCap{20000};
    std::chrono::milliseconds floorStart{200};
    std::chrono::milliseconds floorCap{30000};
    bool jitter = true;  // false: every wait before a retry is its whole ceiling
};

// The wait before retry number `retry` (1 for the first retry), from a uniformly distributed
// `random` number (unused without jitter).
std::chrono::milliseconds RetryDelay(const RetryPolicy& policy, int retry, uint64_t random);

// The floor between failed transfers. Not thread-safe: one transfer thread uses it.
class FailureFloor {
  public:
    explicit FailureFloor(const RetryPolicy& policy) : policy_(policy) {}
    // How long after `now` the next transfer may start; zero when at once.
    std::chrono::steady_clock::duration Remaining(std::chrono::steady_clock::time_point now) const;
    // A transfer ended at `now`.
    void Record(bool succeeded, std::chrono::steady_clock::time_point now);

  private:
    const RetryPolicy policy_;
    std::chrono::milliseconds delay_{0};  // the floor after the last failure; 0 after a success
    std::chrono::steady_clock::time_point notBefore_{};
};

// A one-way stop for waits: once raised, every wait, running or later, ends at once. Any
// thread may raise it or wait on it.
class CancelSignal {
  public:
    void Raise();
    bool Raised() const { return raised_.load(); }
    // Waits `duration`; false when raised before or during the wait.
    bool Wait(std::chrono::steady_clock::duration duration);

  private:
    std::atomic<bool> raised_{false};
    std::mutex mutex_;  // orders Raise against the waiters' check
    std::condition_variable changed_;
};

// What one attempt of a transfer gave.
struct AttemptOutcome {
    FileTransferResult result = Success;
    bool retryable = false;  // a later attempt may succeed (see the class comment)
};

// Runs `attempt` until it succeeds, fails for good, the policy's attempts are used up, or
// `cancel` is raised during a wait (then TimeOut). Returns the last attempt's result.
FileTransferResult RunAttempts(const RetryPolicy& policy, CancelSignal& cancel,
                               const std::function<AttemptOutcome()>& attempt);
