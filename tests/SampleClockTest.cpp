// The shared clock's rules: origin, dropped packets, re-basing of jumps and wraps, and what
// must not be re-based (gaps of sparse tracks, B-frame reordering).
#include <gtest/gtest.h>

#include "platform/framework/SampleClock.h"
#include "tests/support/LogCapture.h"

namespace {

constexpr int64_t kSecond = 1000000;
constexpr int64_t kFrame = 33333;  // 30 fps
constexpr auto kVideo = SampleClock::kVideo;
constexpr auto kAudio = SampleClock::kAudio;

// The times a packet with both timestamps gets; dtsUs = INT64_MIN when it is dropped.
SampleClock::Times place(SampleClock& clock, SampleClock::Track track, int64_t dts, int64_t pts,
                         int64_t duration = 0) {
    SampleClock::Times t;
    if (!clock.Place(track, true, pts, true, dts, duration, &t)) t.dtsUs = INT64_MIN;
    return t;
}

TEST(SampleClockTest, TimesStartAtTheFirstPacketAndKeepReordering) {
    SampleClock clock;
    const int64_t base = 5000 * kSecond;
    auto v0 = place(clock, kVideo, base, base + 2 * kFrame);
    auto a0 = place(clock, kAudio, base - 10000, base - 10000);
    auto v1 = place(clock, kVideo, base + kFrame, base + 4 * kFrame);
    EXPECT_EQ(v0.dtsUs, 0);
    EXPECT_EQ(v0.ptsUs, 2 * kFrame);
    EXPECT_EQ(a0.dtsUs, -10000);  // before the first packet read: kept, not re-based
    EXPECT_EQ(v1.dtsUs, kFrame);
    EXPECT_EQ(v1.ptsUs, 4 * kFrame);
    EXPECT_EQ(clock.Rebases(), 0u);
    EXPECT_EQ(clock.NewestUs(), kFrame);
}

TEST(SampleClockTest, PacketsWithoutTimestampAreDroppedAndLoggedOnce) {
    LogCapture capture;
    SampleClock clock;
    SampleClock::Times t;
    EXPECT_FALSE(clock.Place(kVideo, false, 0, false, 0, 0, &t));
    EXPECT_FALSE(clock.Place(kAudio, false, 0, false, 0, 0, &t));
    // Garbage far outside any real clock counts as no timestamp.
    EXPECT_FALSE(clock.Place(kVideo, true, INT64_MAX, true, INT64_MIN, 0, &t));
    EXPECT_EQ(clock.DroppedWithoutTimestamp(), 3u);
    EXPECT_EQ(capture.CountContaining("without a timestamp are dropped"), 1u);
    // Only one of the two: used for both. The first packet with a time is the origin.
    ASSERT_TRUE(clock.Place(kVideo, true, 7 * kSecond, false, 0, 0, &t));
    EXPECT_EQ(t.dtsUs, 0);
    EXPECT_EQ(t.ptsUs, 0);
    ASSERT_TRUE(clock.Place(kVideo, false, 0, true, 7 * kSecond + kFrame, 0, &t));
    EXPECT_EQ(t.dtsUs, kFrame);
    EXPECT_EQ(t.ptsUs, kFrame);
}

TEST(SampleClockTest, BackwardJumpOfAllTracksIsOneRebaseAndStaysContinuous) {
    LogCapture capture;
    SampleClock clock;
    SampleClock::Times last{};
    // 3 s of a camera whose audio is muxed 150 ms ahead of its video, then its clock restarts.
    for (int64_t t = 100 * kSecond; t < 103 * kSecond; t += kFrame) {
        place(clock, kVideo, t, t, kFrame);
        last = place(clock, kAudio, t + 150000, t + 150000);
    }
    auto v = place(clock, kVideo, 0, kFrame, kFrame);
    auto a = place(clock, kAudio, 5000, 5000);
    EXPECT_EQ(v.dtsUs, last.dtsUs + kFrame);  // one frame after the newest time
    EXPECT_EQ(v.ptsUs - v.dtsUs, kFrame);
    EXPECT_EQ(a.dtsUs - v.dtsUs, 5000);  // audio follows the same offset, in sync
    EXPECT_EQ(clock.Rebases(), 1u);
    EXPECT_EQ(capture.CountContaining("jumped by"), 1u);
}

TEST(SampleClockTest, ForwardJumpsBeyondTenSecondsAreRebasedGapsBelowAreKept) {
    SampleClock clock;
    place(clock, kVideo, 0, 0, kFrame);
    EXPECT_EQ(place(clock, kVideo, 8 * kSecond, 8 * kSecond, kFrame).dtsUs, 8 * kSecond);
    EXPECT_EQ(clock.Rebases(), 0u);
    const int64_t hours = 3 * 3600 * kSecond;
    EXPECT_EQ(place(clock, kVideo, hours, hours, kFrame).dtsUs, 8 * kSecond + kFrame);
    EXPECT_EQ(clock.Rebases(), 1u);
    // An audio track whose clock is two hours off joins at the newest time; the video, whose
    // own offset still fits, is not dragged along.
    EXPECT_EQ(place(clock, kAudio, hours + 7200 * kSecond, hours + 7200 * kSecond).dtsUs,
              8 * kSecond + kFrame);
    EXPECT_EQ(clock.Rebases(), 2u);
    EXPECT_EQ(place(clock, kVideo, hours + kFrame, hours + kFrame, kFrame).dtsUs,
              8 * kSecond + 2 * kFrame);
}

TEST(SampleClockTest, MpegTsWrapIsContinuous) {
    SampleClock clock;
    const int64_t wrap = (int64_t{1} << 33) * kSecond / 90000;
    int64_t previous = -1;
    for (int64_t t = wrap - kSecond; t < wrap + kSecond; t += kFrame) {
        auto v = place(clock, kVideo, t % wrap, t % wrap);
        place(clock, kAudio, t % wrap, t % wrap);
        if (previous >= 0) {
            EXPECT_TRUE(v.dtsUs > previous && v.dtsUs - previous <= 2 * kFrame) << t;
        }
        previous = v.dtsUs;
    }
    EXPECT_EQ(clock.Rebases(), 1u);
}

TEST(SampleClockTest, SparseMetaTrackIsNotRebasedAndDecodeTimeNeverDecreases) {
    SampleClock clock;
    for (int i = 0; i <= 40 * 30; ++i) {
        place(clock, kVideo, i * kFrame, i * kFrame, kFrame);
        if (i % (15 * 30) == 0) {  // a meta packet every 15 s
            EXPECT_EQ(place(clock, SampleClock::kMeta, i * kFrame, i * kFrame).dtsUs, i * kFrame);
        }
    }
    EXPECT_EQ(clock.Rebases(), 0u);
    // A single track stepping back a little: re-based forward, never handed out decreasing.
    const int64_t audioFrame = 21333, t = 40 * kSecond;
    auto a1 = place(clock, kAudio, t, t, audioFrame);
    EXPECT_GE(place(clock, kAudio, t - 5000, t - 5000, audioFrame).dtsUs, a1.dtsUs + audioFrame);
}

}  // namespace
