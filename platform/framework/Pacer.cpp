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
    if (due - now <= slack_) return true;
    return !stop_.WaitUntil(due);
}
