#include "platform/framework/Pacer.h"

#include <algorithm>

Pacer::Pacer(double rate, StopSignal& stop) : rate_(rate), stop_(stop), slack_(kSlack) {
    if (rate_ > 0) {
        const auto media = std::chrono::duration_cast<std::chrono::steady_clock::duration>(
            std::chrono::duration<double, std::micro>(
                std::chrono::duration<double, std::micro>(kMediaSlack).count() / rate_));
        slack_ = std::min<std::chrono::steady_clock::duration>(slack_, media);
    }
}

std::chrono::steady_clock::time_point Pacer::dueTime(int64_t dtsUs) {
    const auto now = std::chrono::steady_clock::now();
    if (!started_) {
        started_ = true;
        firstUs_ = dtsUs;
        wallStart_ = now;
    }
    if (dtsUs <= firstUs_) return now;
    return wallStart_ + std::chrono::microseconds(
                            static_cast<int64_t>(static_cast<double>(dtsUs - firstUs_) / rate_));
}

bool Pacer::IsDue(int64_t dtsUs) {
    if (rate_ <= 0) return true;
    return dueTime(dtsUs) - std::chrono::steady_clock::now() <= slack_;
}

bool Pacer::Pace(int64_t dtsUs) {
    if (stop_.Raised()) return false;
    if (rate_ <= 0) return true;
    const auto due = dueTime(dtsUs);
    if (due - std::chrono::steady_clock::now() <= slack_) return true;
    return !stop_.WaitUntil(due);
}
