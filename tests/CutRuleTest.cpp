// The cut rule as a table. Guards: a file that does not end just before an IDR (or splits a GOP
// it could have kept whole), a boundary off by one, samples at exactly the cut taken instead of
// kept, a late sample behind the cut taken, a split GOP's remainder not taken whole, a gap in the
// video that stalls filing, 32-bit duration wrap, and IsIDR asked for GOPs the rule never needs.
#include <gtest/gtest.h>

#include <optional>
#include <set>
#include <tuple>
#include <vector>

#include "src/CutRule.h"

namespace Orvane {
namespace {

using Times = std::vector<uint64_t>;
using Gops = std::vector<Times>;

// Frames at origin + k * 100 / 3 ms (30 fps) below `end`, an IDR every `gopFrames` frames.
Gops Video(uint64_t origin, uint64_t end, uint64_t gopFrames) {
    Gops gops;
    for (uint64_t k = 0; origin + k * 100 / 3 < end; ++k) {
        if (k % gopFrames == 0) gops.emplace_back();
        gops.back().push_back(origin + k * 100 / 3);
    }
    return gops;
}
Times Every(uint64_t from, uint64_t to, uint64_t step) {  // from..to inclusive
    Times times;
    for (uint64_t t = from; t <= to; t += step) times.push_back(t);
    return times;
}

struct Case {
    const char* name;
    Gops gops;
    std::set<size_t> remainders;  // GOPs that do not begin with an IDR
    Times audio, meta;
    uint64_t fileStart;
    int32_t interval;
    std::optional<uint64_t> fixedCut;  // PlanCut with this cut instead of the rule
    // Expected plan.
    uint64_t cut;
    uint32_t duration;
    size_t wholeGops, splitTaken, audioTaken, metaTaken;
};

Case Row(const char* name, Gops gops, std::set<size_t> remainders, Times audio, Times meta,
         uint64_t fileStart, int32_t interval, std::optional<uint64_t> fixedCut, uint64_t cut,
         uint32_t duration, size_t wholeGops, size_t splitTaken, size_t audioTaken,
         size_t metaTaken) {
    return {name,     gops, remainders, audio,     meta,       fileStart,  interval,
            fixedCut, cut,  duration,   wholeGops, splitTaken, audioTaken, metaTaken};
}

TEST(CutRule, Table) {
    constexpr uint64_t k4G = uint64_t{1} << 32;
    const Case cases[] = {
        // IDR every 2 s, one on the boundary: the file ends just before it; audio at exactly
        // the cut stays.
        Row("boundary on an IDR", Video(0, 60001, 60), {}, Every(0, 60000, 20),
            Every(0, 60000, 1000), 0, 60000, {}, 59999, 59999, 30, 0, 3000, 60),
        // IDR every 7 s: the last IDR at or before the boundary is at 56000.
        Row("IDR before the boundary", Video(0, 60001, 210), {}, {}, {}, 0, 60000, {}, 55999, 55999,
            8, 0, 0, 0),
        Row("growing GOP opened before the boundary", {Every(0, 900, 100), {950, 1050}}, {}, {}, {},
            0, 1000, {}, 949, 949, 1, 0, 0, 0),
        // Older GOPs all end before the boundary: the cut is not limited by it.
        Row("growing GOP opened after the boundary", {Every(0, 400, 100), {2000}}, {}, {}, {}, 0,
            1000, {}, 1999, 1999, 1, 0, 0, 0),
        // No IDR between the oldest GOP's start and the boundary: split at the boundary.
        Row("oldest GOP past the boundary", {Every(0, 1000, 100), {1100}}, {}, {500, 999, 1000}, {},
            0, 1000, {}, 1000, 1000, 0, 10, 2, 0),
        Row("single GOP reaching the boundary", {Every(0, 1000, 100)}, {}, {}, {}, 0, 1000, {}, 0,
            0, 0, 0, 0, 0),
        Row("single GOP past the boundary", {Every(0, 1100, 100)}, {}, {}, {}, 0, 1000, {}, 1000,
            1000, 0, 10, 0, 0),
        // The held video spans more than an interval: end before the GOP that passes it.
        Row("GOP past the boundary after a long span",
            {Every(0, 900, 100), Every(1000, 2100, 100), {2200}}, {}, {}, {}, 0, 1000, {}, 999, 999,
            1, 0, 0, 0),
        // Held video that began late (10 s in): run into the GOP 58000..61966, its last sample
        // stays as a one-sample remainder.
        Row("held video began late", Video(10000, 62501, 120), {}, {}, {}, 0, 60000, {}, 61966,
            61966, 12, 119, 0, 0),
        // The remainder of a split GOP is taken whole, even though the boundary is later.
        Row("remainder of a split GOP", {Every(6000, 6990, 33), {7000, 7033}}, {0},
            Every(6000, 7040, 20), {6000, 6500}, 5000 + 1000, 1000, {}, 6991, 991, 1, 0, 50, 2),
        // A gap: the video resumes after the boundary; the audio below it is filed alone.
        Row("video resumes after a gap", {{5000, 5100}, {6000}}, {}, {500, 900, 1000, 1500}, {}, 0,
            1000, {}, 1000, 1000, 0, 0, 2, 0),
        Row("no video", {}, {}, Every(0, 5000, 20), {100}, 0, 1000, {}, 0, 0, 0, 0, 0, 0),
        // A late audio sample below the cut behind one past it waits for the next file.
        Row("late sample behind the cut", {Every(0, 900, 100), {1000}}, {}, {100, 1000, 500}, {900},
            0, 1000, {}, 999, 999, 1, 0, 1, 1),
        // Duration in 32-bit arithmetic across the 2^32 ms mark.
        Row("32-bit wrap", {Every(k4G - 500, k4G + 600, 100)}, {}, {}, {}, k4G - 500, 1000, {},
            k4G + 500, 1000, 0, 10, 0, 0),
        // The end of the stream: a cut past the newest sample takes everything.
        Row("fixed cut past the newest", {Every(0, 900, 100), {1000, 1100}}, {}, {50, 1150}, {1200},
            0, 1000, 1201, 1201, 1201, 2, 0, 2, 1),
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        std::vector<size_t> asked;
        CutInput in;
        in.gops = c.gops;
        in.startsWithIdr = [&](size_t i) {
            asked.push_back(i);
            return c.remainders.count(i) == 0;
        };
        in.audio = c.audio;
        in.meta = c.meta;
        in.fileStart = c.fileStart;
        in.interval = c.interval;
        const CutPlan plan = c.fixedCut ? PlanCut(in, *c.fixedCut) : DecideCut(in);
        EXPECT_EQ(
            std::tie(plan.cut, plan.duration, plan.wholeGops, plan.splitTaken, plan.audio,
                     plan.meta),
            std::tie(c.cut, c.duration, c.wholeGops, c.splitTaken, c.audioTaken, c.metaTaken));
        // IsIDR only for GOPs the rule passed over: each once, in order, never the growing one.
        for (size_t k = 0; k < asked.size(); ++k) {
            EXPECT_EQ(asked[k], k);
            EXPECT_LT(asked[k] + 1, c.gops.size());
        }
    }
}

}  // namespace
}  // namespace Orvane
