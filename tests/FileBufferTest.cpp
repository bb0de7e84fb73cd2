// FileBuffer. Guards: the fill limit off by one or wrong for a zero or negative full size, a
// full buffer that refuses files, files out of order or copied payloads, a Pop that does not
// wait or is not woken by the wake-up record (which must not count), and a count that wraps
// below zero while pushes and pops race.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>
#include <vector>

#include "src/FileBuffer.h"
#include "tests/support/LogCapture.h"
#include "tests/support/TestSupport.h"

namespace Orvane {
namespace {

using testsupport::MakeSample;

VqStreamFileData File(uint32_t duration, uint64_t marker = 0) {
    VqStreamFileData file;
    file.duration = duration;
    file.video.push_back(*MakeSample(marker, marker));
    return file;
}

TEST(FileBuffer, FullOnceTheCountReachesTheFullSize) {
    struct Case {
        int fullSize;
        std::vector<uint32_t> below;  // durations that leave it one short of full
        const char* line;
    };
    for (const Case& c : {Case{20000, {10000, 9999}, "Buffer Over. 20000/20000"},
                          Case{0, {999}, "Buffer Over. 1000/1000"},
                          Case{-20000, {999}, "Buffer Over. 1000/1000"}}) {
        SCOPED_TRACE(c.fullSize);
        LogCapture log;
        FileBuffer buffer(c.fullSize);
        for (uint32_t duration : c.below) buffer.Push(File(duration));
        EXPECT_FALSE(buffer.IsBufferFull());
        EXPECT_TRUE(log.Records().empty());
        buffer.Push(File(1));
        EXPECT_TRUE(buffer.IsBufferFull());
        EXPECT_EQ(log.Count(c.line), 1u);
    }
    // Over the limit is not refused: the count goes on growing and falls as files leave.
    FileBuffer buffer(20000);
    buffer.Push(File(20000));
    buffer.Push(File(5000));
    EXPECT_EQ(buffer.GetBufferCount(), 25000u);
    buffer.Pop();
    EXPECT_EQ(buffer.GetBufferCount(), 5000u);
    EXPECT_FALSE(buffer.IsBufferFull());
}

TEST(FileBuffer, FilesComeOutInOrderAndPopWaitsForAPush) {
    FileBuffer buffer(1000);
    const auto sample = MakeSample(7, 7, "payload");
    VqStreamFileData first = File(5);
    first.audio.push_back(*sample);
    buffer.Push(first);
    buffer.Push(File(1, 2));
    EXPECT_EQ(buffer.Pop().audio[0].PayloadData(), sample->PayloadData());
    EXPECT_EQ(buffer.Pop().video[0].timestamp, 2u);

    auto popped = std::async(std::launch::async, [&] { return buffer.Pop(); });
    EXPECT_EQ(popped.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    buffer.Push(File(40, 9));
    ASSERT_EQ(popped.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(popped.get().video[0].timestamp, 9u);

    // The wake-up record: an empty file, which changes nothing in the count.
    auto wakeUp = std::async(std::launch::async, [&] { return buffer.Pop(); });
    buffer.Push(VqStreamFileData());
    ASSERT_EQ(wakeUp.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_TRUE(wakeUp.get().IsEmpty());
    buffer.Push(File(500));
    buffer.Push(VqStreamFileData());
    EXPECT_EQ(buffer.GetBufferCount(), 500u);
}

TEST(FileBufferConcurrency, CountNeverFallsBelowTheQueuedDurations) {
    FileBuffer buffer(1000);
    constexpr int kPerPusher = 2000;
    constexpr uint64_t kPushed = 2ull * (kPerPusher / 5) * 15;  // ms: durations 1..5, cycling
    std::atomic<bool> done{false};
    std::atomic<uint64_t> worst{0};
    std::thread sampler([&] {
        while (!done) worst = std::max<uint64_t>(worst, buffer.GetBufferCount());
    });
    const auto pusher = [&buffer] {
        VqStreamFileData file;
        for (int i = 0; i < kPerPusher; ++i) {
            file.duration = 1 + i % 5;
            buffer.Push(file);
        }
    };
    std::thread first(pusher), second(pusher);
    uint64_t popped = 0;
    for (int i = 0; i < 2 * kPerPusher; ++i) popped += buffer.Pop().duration;
    first.join();
    second.join();
    done = true;
    sampler.join();
    // A subtraction before its addition would have wrapped below zero to a huge count.
    EXPECT_LE(worst.load(), kPushed);
    EXPECT_EQ(popped, kPushed);
    EXPECT_EQ(buffer.GetBufferCount(), 0u);
}

}  // namespace
}  // namespace Orvane
