// A repeated failure line is written once per window with the count of those left out; other
// lines are not held back, and the oldest keys are forgotten beyond the capacity.
#include <gtest/gtest.h>

#include "platform/logger/LineCondenser.h"

namespace {

using std::chrono::seconds;

TEST(LineCondenserTest, OneLinePerWindowWithTheCountOfTheRest) {
    LineCondenser condenser(seconds(30), 2);
    const LineCondenser::Clock::time_point t0;
    const struct {
        const char* key;
        int atSecond;
        bool written;
        uint64_t repeats;
    } steps[] = {
        {"A", 0, true, 0},   {"A", 1, false, 0},  {"B", 2, true, 0},  {"A", 29, false, 0},
        {"A", 30, true, 2},  {"A", 31, false, 0}, {"A", 90, true, 1}, {"A", 91, false, 0},
        {"C", 92, true, 0},   // a third key: B, the least recently seen, is forgotten
        {"A", 93, false, 0},  // A is still known
        {"B", 94, true, 0},   // B comes as new (and C, now the oldest, is forgotten)
        {"A", 95, false, 0},
    };
    for (const auto& s : steps) {
        uint64_t repeats = 99;
        EXPECT_EQ(condenser.Offer(s.key, t0 + seconds(s.atSecond), &repeats), s.written)
            << s.key << " at " << s.atSecond;
        EXPECT_EQ(repeats, s.repeats) << s.key << " at " << s.atSecond;
    }
}

}  // namespace
