#include "platform/framework/Pacer.h"

bool Pacer::Pace(int64_t dtsUs) {
    if (stop_.Raised()) return false;
    if (rate_ <= 0) return true;
    const auto now = std::chrono::steady_clock::now();
    if (!started_) {
        started_ = true;
        firstUs_ = dtsUs;
        wallStart_ = now;
        return true;
    }
    if (dtsUs <= firstUs_) return true;
    const auto due = wallStart_ + std::chrono::microseconds(static_cast<int64_t>(
                                      static_cast<double>(dtsUs - firstUs_) / rate_));
    if (due - now <= kSlack) return true;
    return !stop_.WaitUntil(due);
}
