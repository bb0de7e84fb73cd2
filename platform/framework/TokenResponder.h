// TokenResponder: answers the module's token requests, paced.
//
// The module asks for credentials whenever it has none and after every authentication error.
// Answered at once each time, a wrong secret turns into a storm: a request, a credential-process
// run and a failed transfer after another. The responder answers the first request at once and
// each later one no sooner than a delay after the previous answer; the delay doubles from
// kFirstDelay up to kLongestDelay and starts again from kFirstDelay once an object was stored
// (ObjectStored): good credentials are never held back. Requests that come while an answer
// waits are answered by that one answer.
//
// Threads: Request and ObjectStored come on any thread (the module's upload thread) and never
// block; `answer` runs on the responder's own thread, without any lock of the responder held.
// Stop ends that thread: a waiting answer is dropped, a running one is asked to end by `cancel`
// (called on Stop's thread), and Stop returns once it has. After Stop, requests are ignored.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>

class TokenResponder {
  public:
    static constexpr std::chrono::milliseconds kFirstDelay{1000};
    static constexpr std::chrono::milliseconds kLongestDelay{30000};

    // `answer`: fetch and hand over the credentials. `cancel`: make a running `answer` return
    // soon (end a credential process). `first` and `longest` replace kFirstDelay and
    // kLongestDelay (tests use short ones).
    TokenResponder(std::function<void()> answer, std::function<void()> cancel,
                   std::chrono::milliseconds first = kFirstDelay,
                   std::chrono::milliseconds longest = kLongestDelay);
    ~TokenResponder();
    TokenResponder(const TokenResponder&) = delete;
    TokenResponder& operator=(const TokenResponder&) = delete;

    void Request();
    void ObjectStored();
    void Stop();

  private:
    using Clock = std::chrono::steady_clock;
    void run();

    const std::function<void()> answer_;
    const std::function<void()> cancel_;
    const std::chrono::milliseconds first_, longest_;

    std::mutex mutex_;  // guards the fields below
    std::condition_variable changed_;
    bool pending_ = false;  // a request waits for its answer
    bool stopped_ = false;
    bool answered_ = false;            // an answer was given since the last reset
    Clock::time_point lastAnswer_;     // when the last answer began
    std::chrono::milliseconds delay_;  // from lastAnswer_ to the next answer

    std::thread thread_;  // last: starts once everything above is ready
};
