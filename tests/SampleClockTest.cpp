// The shared clock's rules: origin, dropped packets, re-basing of jumps and wraps, and what
// must not be re-based (gaps of sparse tracks, B-frame reordering).
#include <gtest/gtest.h>

#include "platform/framework/SampleClock.h"
#include "platform/logger/LogCapture.h"

namespace {

constexpr int64_t kSecond = 1000000;
constexpr int64_t kFrame = 33333;  // 30 fps
constexpr int64_t kAudioFrame = 21333;

struct Placed {
    bool ok;
    SampleClock::Times times;
};

Placed place(SampleClock& clock, SampleClock::Track track, int64_t dts, int64_t pts,
             int64_t duration = 0) {
    Placed p{};
    p.ok = clock.Place(track, true, pts, true, dts, duration, &p.times);
    return p;
}

size_t countContaining(const LogCapture& capture, const std::string& text) {
    size_t n = 0;
    for (const auto& m : capture.Messages()) n += m.find(text) != std::string::npos;
    return n;
}

TEST(SampleClockTest, TimesStartAtTheFirstPacketAndKeepReordering) {
    SampleClock clock;
    const int64_t base = 5000 * kSecond;
    // B-frames: presentation after decode; audio interleaved and starting a little earlier.
    auto v0 = place(clock, SampleClock::kVideo, base, base + 2 * kFrame);
    auto a0 = place(clock, SampleClock::kAudio, base - 10000, base - 10000);
    auto v1 = place(clock, SampleClock::kVideo, base + kFrame, base + 4 * kFrame);
    ASSERT_TRUE(v0.ok && a0.ok && v1.ok);
    EXPECT_EQ(v0.times.dtsUs, 0);
    EXPECT_EQ(v0.times.ptsUs, 2 * kFrame);
    EXPECT_EQ(a0.times.dtsUs, -10000);  // before the first packet read: kept, not re-based
    EXPECT_EQ(v1.times.dtsUs, kFrame);
    EXPECT_EQ(v1.times.ptsUs, 4 * kFrame);
    EXPECT_EQ(clock.Rebases(), 0u);
    EXPECT_EQ(clock.NewestUs(), kFrame);
}

TEST(SampleClockTest, PacketsWithoutTimestampAreDroppedAndLoggedOnce) {
    LogCapture capture;
    SampleClock clock;
    SampleClock::Times t;
    EXPECT_FALSE(clock.Place(SampleClock::kVideo, false, 0, false, 0, 0, &t));
    EXPECT_FALSE(clock.Place(SampleClock::kAudio, false, 0, false, 0, 0, &t));
    // Garbage far outside any real clock counts as no timestamp.
    EXPECT_FALSE(clock.Place(SampleClock::kVideo, true, INT64_MAX, true, INT64_MIN, 0, &t));
    EXPECT_EQ(clock.DroppedWithoutTimestamp(), 3u);
    EXPECT_EQ(countContaining(capture, "without a timestamp are dropped"), 1u);

    // Only one of the two: used for both. The first packet with a time is the origin.
    ASSERT_TRUE(clock.Place(SampleClock::kVideo, true, 7 * kSecond, false, 0, 0, &t));
    EXPECT_EQ(t.dtsUs, 0);
    EXPECT_EQ(t.ptsUs, 0);
    ASSERT_TRUE(clock.Place(SampleClock::kVideo, false, 0, true, 7 * kSecond + kFrame, 0, &t));
    EXPECT_EQ(t.dtsUs, kFrame);
    EXPECT_EQ(t.ptsUs, kFrame);
}

TEST(SampleClockTest, BackwardJumpOfAllTracksIsOneRebaseAndStaysContinuous) {
    LogCapture capture;
    SampleClock clock;
    int64_t src = 100 * kSecond;
    SampleClock::Times last{};
    // 3 s of a camera whose audio is muxed 150 ms ahead of its video.
    for (int i = 0; i < 90; ++i) {
        const int64_t t = src + i * kFrame;
        place(clock, SampleClock::kVideo, t, t, kFrame);
        last = place(clock, SampleClock::kAudio, t + 150000, t + 150000).times;
    }
    // The camera restarts its clock at 0 (reconnect).
    auto v = place(clock, SampleClock::kVideo, 0, kFrame, kFrame);
    auto a = place(clock, SampleClock::kAudio, 5000, 5000);
    ASSERT_TRUE(v.ok && a.ok);
    EXPECT_EQ(v.times.dtsUs, last.dtsUs + kFrame);  // one frame after the newest time
    EXPECT_EQ(v.times.ptsUs - v.times.dtsUs, kFrame);
    EXPECT_GE(a.times.dtsUs, last.dtsUs);            // audio follows the same new offset
    EXPECT_EQ(a.times.dtsUs - v.times.dtsUs, 5000);  // and stays in sync with the video
    EXPECT_EQ(clock.Rebases(), 1u);
    EXPECT_EQ(countContaining(capture, "jumped by"), 1u);
}

TEST(SampleClockTest, ForwardJumpsBeyondTenSecondsAreRebasedGapsBelowAreKept) {
    SampleClock clock;
    place(clock, SampleClock::kVideo, 0, 0, kFrame);
    auto gap = place(clock, SampleClock::kVideo, 8 * kSecond, 8 * kSecond, kFrame);
    EXPECT_EQ(gap.times.dtsUs, 8 * kSecond);  // a real gap in the media stays
    EXPECT_EQ(clock.Rebases(), 0u);
    auto hours = place(clock, SampleClock::kVideo, 3 * 3600 * kSecond, 3 * 3600 * kSecond, kFrame);
    EXPECT_EQ(hours.times.dtsUs, 8 * kSecond + kFrame);
    EXPECT_EQ(clock.Rebases(), 1u);
}

TEST(SampleClockTest, MpegTsWrapIsContinuous) {
    SampleClock clock;
    const int64_t wrap = (int64_t{1} << 33) * kSecond / 90000;
    int64_t previous = 0;
    int64_t src = wrap - kSecond;
    for (int i = 0; i < 60; ++i) {
        int64_t t = (src + i * kFrame) % wrap;
        auto v = place(clock, SampleClock::kVideo, t, t);
        auto a = place(clock, SampleClock::kAudio, t, t);
        ASSERT_TRUE(v.ok && a.ok);
        if (i > 0) {
            EXPECT_GE(v.times.dtsUs, previous);
            EXPECT_LE(v.times.dtsUs - previous, 2 * kFrame) << "frame " << i;
        }
        previous = v.times.dtsUs;
    }
    EXPECT_EQ(clock.Rebases(), 1u);
}

TEST(SampleClockTest, SparseMetaTrackIsNotRebasedAndDecodeTimeNeverDecreases) {
    SampleClock clock;
    SampleClock::Times meta{};
    for (int i = 0; i <= 40 * 30; ++i) {
        place(clock, SampleClock::kVideo, i * kFrame, i * kFrame, kFrame);
        if (i % (15 * 30) == 0) {  // a meta packet every 15 s
            meta = place(clock, SampleClock::kMeta, i * kFrame, i * kFrame).times;
            EXPECT_EQ(meta.dtsUs, i * kFrame);
        }
    }
    EXPECT_EQ(clock.Rebases(), 0u);

    // A single track stepping back a little: re-based forward, never handed out decreasing.
    auto a1 = place(clock, SampleClock::kAudio, 40 * kSecond, 40 * kSecond, kAudioFrame);
    auto a2 =
        place(clock, SampleClock::kAudio, 40 * kSecond - 5000, 40 * kSecond - 5000, kAudioFrame);
    EXPECT_GE(a2.times.dtsUs, a1.times.dtsUs + kAudioFrame);
}

TEST(SampleClockTest, TrackStartingFarFromTheOthersIsPulledToTheSharedClock) {
    SampleClock clock;
    place(clock, SampleClock::kVideo, 0, 0, kFrame);
    place(clock, SampleClock::kVideo, kFrame, kFrame, kFrame);
    // An audio track whose clock is two hours off: joins at the newest time instead.
    auto a = place(clock, SampleClock::kAudio, 7200 * kSecond, 7200 * kSecond);
    EXPECT_EQ(a.times.dtsUs, kFrame);
    EXPECT_EQ(clock.Rebases(), 1u);
    // The video is not dragged along: its own offset still fits.
    auto v = place(clock, SampleClock::kVideo, 2 * kFrame, 2 * kFrame, kFrame);
    EXPECT_EQ(v.times.dtsUs, 2 * kFrame);
}

}  // namespace
