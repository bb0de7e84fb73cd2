#include "platform/logger/LineCondenser.h"

LineCondenser::LineCondenser(Clock::duration window, size_t capacity)
    : window_(window), capacity_(capacity == 0 ? 1 : capacity) {}

bool LineCondenser::Offer(const std::string& key, Clock::time_point now, uint64_t* repeats) {
    std::lock_guard<std::mutex> lock(mutex_);
    *repeats = 0;
    auto it = seen_.find(key);
    if (it == seen_.end()) {
        if (seen_.size() >= capacity_) {
            seen_.erase(order_.back());
            order_.pop_back();
        }
        order_.push_front(key);
        seen_.emplace(key, Seen{now, 0, order_.begin()});
        return true;
    }
    Seen& seen = it->second;
    order_.splice(order_.begin(), order_, seen.age);
    if (now - seen.windowStart < window_) {
        ++seen.leftOut;
        return false;
    }
    *repeats = seen.leftOut;
    seen.leftOut = 0;
    seen.windowStart = now;
    return true;
}
