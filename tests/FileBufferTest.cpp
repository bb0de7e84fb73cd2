// FileBuffer: the fill in milliseconds, the order, the blocking Pop and the count under racing
// pushes and pops.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>
#include <vector>

#include "platform/logger/LogCapture.h"
#include "src/FileBuffer.h"
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

TEST(FileBuffer, FullSizeDefaultsTo1000WhenNotPositive) {
    for (int fullSize : {0, -1, -20000}) {
        LogCapture log;
        FileBuffer buffer(fullSize);
        buffer.Push(File(999));
        EXPECT_FALSE(buffer.IsBufferFull());
        buffer.Push(File(1));
        EXPECT_TRUE(buffer.IsBufferFull());
        EXPECT_TRUE(log.Contains("Buffer Over. 1000/1000")) << fullSize;
    }
}

TEST(FileBuffer, FullOnceTheCountReachesTheFullSize) {
    LogCapture log;
    FileBuffer buffer(20000);
    buffer.Push(File(10000));
    buffer.Push(File(9999));
    EXPECT_EQ(buffer.GetBufferCount(), 19999u);
    EXPECT_FALSE(buffer.IsBufferFull());
    EXPECT_TRUE(log.Records().empty());

    buffer.Push(File(1));
    EXPECT_TRUE(buffer.IsBufferFull());
    const auto lines = log.Find("Buffer Over. 20000/20000");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].priority, 5);
    EXPECT_EQ(lines[0].file, "src/FileBuffer");
    EXPECT_EQ(lines[0].function, "Orvane::FileBuffer::IsBufferFull");
    EXPECT_TRUE(buffer.IsBufferFull());  // every true answer logs
    EXPECT_EQ(log.Count("Buffer Over. 20000/20000"), 2u);

    // Over the limit is not refused: the count goes on growing and falls as files leave.
    buffer.Push(File(5000));
    EXPECT_EQ(buffer.GetBufferCount(), 25000u);
    buffer.Pop();
    EXPECT_EQ(buffer.GetBufferCount(), 15000u);
    EXPECT_FALSE(buffer.IsBufferFull());
}

TEST(FileBuffer, FilesComeOutInOrderSharingTheirPayloads) {
    FileBuffer buffer(1000);
    const auto sample = MakeSample(7, 7, "payload");
    VqStreamFileData first;
    first.duration = 5;
    first.audio.push_back(*sample);
    buffer.Push(first);
    buffer.Push(File(1, 2));
    buffer.Push(File(3, 3));

    const VqStreamFileData out = buffer.Pop();
    EXPECT_EQ(out.duration, 5u);
    ASSERT_EQ(out.audio.size(), 1u);
    EXPECT_EQ(out.audio[0].PayloadData(), sample->PayloadData());
    EXPECT_EQ(buffer.Pop().video[0].timestamp, 2u);
    EXPECT_EQ(buffer.Pop().video[0].timestamp, 3u);
    EXPECT_EQ(buffer.GetBufferCount(), 0u);
}

TEST(FileBuffer, PopWaitsForTheNextPushAndAnEmptyFileWakesIt) {
    FileBuffer buffer(1000);
    auto popped = std::async(std::launch::async, [&] { return buffer.Pop(); });
    EXPECT_EQ(popped.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    buffer.Push(File(40, 9));
    ASSERT_EQ(popped.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(popped.get().video[0].timestamp, 9u);

    // The wake-up record: an empty file, which changes nothing in the count.
    buffer.Push(File(300));
    buffer.Pop();
    auto woken = std::async(std::launch::async, [&] { return buffer.Pop(); });
    buffer.Push(File(250));
    ASSERT_EQ(woken.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    woken.get();
    auto wakeUp = std::async(std::launch::async, [&] { return buffer.Pop(); });
    buffer.Push(VqStreamFileData());
    ASSERT_EQ(wakeUp.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_TRUE(wakeUp.get().IsEmpty());
    EXPECT_EQ(buffer.GetBufferCount(), 0u);
    buffer.Push(File(500));
    buffer.Push(VqStreamFileData());
    EXPECT_EQ(buffer.GetBufferCount(), 500u);
}

TEST(FileBuffer, DestroyingReleasesTheQueuedFiles) {
    std::weak_ptr<ReceivedSample> payload;
    {
        FileBuffer buffer(1000);
        auto sample = MakeSample(1, 1);
        payload = sample->source;
        VqStreamFileData file;
        file.duration = 10;
        file.video.push_back(*sample);
        buffer.Push(file);
    }
    EXPECT_TRUE(payload.expired());
}

TEST(FileBufferConcurrency, CountNeverFallsBelowTheQueuedDurations) {
    FileBuffer buffer(1000);
    constexpr int kPerPusher = 2000;
    constexpr uint64_t kPushed = 2ull * (kPerPusher / 5) * 15;  // ms: durations 1..5, cycling
    std::atomic<bool> done{false};
    std::atomic<uint64_t> worst{0};
    std::thread sampler([&] {
        while (!done) {
            const uint64_t count = buffer.GetBufferCount();
            if (count > worst) worst = count;
        }
    });
    std::vector<std::thread> pushers;
    for (int p = 0; p < 2; ++p) {
        pushers.emplace_back([&buffer] {
            VqStreamFileData file;
            for (int i = 0; i < kPerPusher; ++i) {
                file.duration = 1 + i % 5;
                buffer.Push(file);
            }
        });
    }
    uint64_t popped = 0;
    for (int i = 0; i < 2 * kPerPusher; ++i) popped += buffer.Pop().duration;
    for (auto& pusher : pushers) pusher.join();
    done = true;
    sampler.join();
    // A subtraction before its addition would have wrapped below zero to a huge count.
    EXPECT_LE(worst.load(), kPushed);
    EXPECT_EQ(popped, kPushed);
    EXPECT_EQ(buffer.GetBufferCount(), 0u);
}

}  // namespace
}  // namespace Orvane
