#include "platform/framework/SampleClock.h"

#include <algorithm>

#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/framework/SampleClock";
constexpr const char* kFunction = "SampleClock::Place";
// Times this far from zero are garbage (hundreds of thousands of years); treated as absent so
// that no sum below can overflow.
constexpr int64_t kTimeLimitUs = int64_t{1} << 60;
// The step assumed when a track has not shown one yet.
constexpr int64_t kDefaultStepUs = 1000;

const char* trackName(SampleClock::Track track) {
    switch (track) {
        case SampleClock::kVideo:
            return "video";
        case SampleClock::kAudio:
            return "audio";
        default:
            return "meta";
    }
}

bool usable(int64_t t) {
    return t > -kTimeLimitUs && t < kTimeLimitUs;
}

}  // namespace

bool SampleClock::fits(const TrackState& state, int64_t dtsUs) const {
    if (dtsUs > newestUs_ + kMaxForwardJumpUs) return false;
    if (state.started) return dtsUs >= state.lastDtsUs;
    // A track's first packet must land near the others.
    return dtsUs >= newestUs_ - kMaxForwardJumpUs;
}

bool SampleClock::Place(Track track, bool hasPts, int64_t ptsUs, bool hasDts, int64_t dtsUs,
                        int64_t durationUs, Times* out) {
    hasPts = hasPts && usable(ptsUs);
    hasDts = hasDts && usable(dtsUs);
    if (!hasPts && !hasDts) {
        if (dropped_++ == 0) {
            Logger::Put(5, kFile, kFunction, __LINE__,
                        "packets without a timestamp are dropped (the first on the %s track)",
                        trackName(track));
        }
        return false;
    }
    if (!hasDts) dtsUs = ptsUs;
    if (!hasPts) ptsUs = dtsUs;
    if (!haveOrigin_) {
        haveOrigin_ = true;
        epochOffsetUs_ = -dtsUs;
        newestUs_ = 0;
    }

    TrackState& state = tracks_[track];
    int64_t offset = state.started ? state.offsetUs : epochOffsetUs_;
    if (!fits(state, dtsUs + offset)) {
        if (offset != epochOffsetUs_ && fits(state, dtsUs + epochOffsetUs_)) {
            // The jump another track re-based already.
            offset = epochOffsetUs_;
        } else {
            const int64_t step = state.stepUs > 0 ? state.stepUs : kDefaultStepUs;
            // One step after the newest time of any track, so that the tracks that follow
            // this jump with the same offset land after their own last packets too and stay
            // in sync with this one.
            const int64_t target =
                state.started ? std::max(state.lastDtsUs, newestUs_) + step : newestUs_;
            const int64_t jump = dtsUs + offset - target;
            offset = target - dtsUs;
            epochOffsetUs_ = offset;
            rebases_.fetch_add(1, std::memory_order_relaxed);
            Logger::Put(5, kFile, kFunction, __LINE__,
                        "the source clock of the %s track jumped by %+.3f s: re-based to go on "
                        "at %.3f s",
                        trackName(track), static_cast<double>(jump) / 1e6,
                        static_cast<double>(target) / 1e6);
        }
    }

    const int64_t dts = dtsUs + offset;
    if (durationUs > 0) {
        state.stepUs = durationUs;
    } else if (state.started && dts > state.lastDtsUs) {
        state.stepUs = dts - state.lastDtsUs;
    }
    state.started = true;
    state.offsetUs = offset;
    state.lastDtsUs = dts;
    newestUs_ = std::max(newestUs_, dts);
    out->dtsUs = dts;
    out->ptsUs = ptsUs + offset;
    return true;
}
