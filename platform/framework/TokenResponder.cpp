#include "platform/framework/TokenResponder.h"

#include <algorithm>

TokenResponder::TokenResponder(std::function<void()> answer, std::function<void()> cancel,
                               std::chrono::milliseconds first, std::chrono::milliseconds longest)
    : answer_(std::move(answer)),
      cancel_(std::move(cancel)),
      first_(first),
      longest_(longest),
      delay_(first) {
    thread_ = std::thread([this] { run(); });
}

TokenResponder::~TokenResponder() {
    Stop();
}

void TokenResponder::Request() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (stopped_ || pending_) return;
        pending_ = true;
    }
    changed_.notify_all();
}

void TokenResponder::ObjectStored() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        answered_ = false;
        delay_ = first_;
    }
    changed_.notify_all();
}

void TokenResponder::Stop() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (stopped_) return;
        stopped_ = true;
    }
    changed_.notify_all();
    cancel_();
    if (thread_.joinable()) thread_.join();
}

void TokenResponder::run() {
    std::unique_lock<std::mutex> lock(mutex_);
    while (true) {
        changed_.wait(lock, [this] { return stopped_ || pending_; });
        if (stopped_) return;
        // Wait out the delay; an ObjectStored meanwhile shortens it, a Stop ends it.
        const bool stopped = changed_.wait_until(lock, lastAnswer_ + delay_, [this] {
            return stopped_ || !answered_;
        }) && stopped_;
        if (stopped) return;
        pending_ = false;
        if (answered_) delay_ = std::min(delay_ * 2, longest_);
        answered_ = true;
        lastAnswer_ = Clock::now();
        lock.unlock();
        answer_();
        lock.lock();
    }
}
