#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <vector>

#include "modulebase/Module.h"
#include "platform/framework/StreamData.h"
#include "platform/logger/LogCapture.h"
#include "platform/logger/Logger.h"
#include "tests/support/TestSupport.h"

using testsupport::MakeSample;
using testsupport::WaitUntil;

namespace {

// Records what reaches the hooks; the video hook can be held up to let the queue fill.
class RecordingModule : public Module {
  public:
    ~RecordingModule() override { StopThreads(); }
    bool OnInitialize(std::shared_ptr<void>) override { return true; }
    void OnStop() override {}
    void OnStart() override {}
    void ProcessVideo(std::shared_ptr<StreamData> s) override {
        std::unique_lock<std::mutex> lock(mutex);
        videoEntered = true;
        changed.notify_all();
        changed.wait(lock, [&] { return !holdVideo; });
        video.push_back(s->timestamp);
    }
    void ProcessAudio(std::shared_ptr<StreamData> s) override { record(audio, s); }
    void ProcessMeta(std::shared_ptr<StreamData> s) override { record(meta, s); }

    void record(std::vector<uint64_t>& list, const std::shared_ptr<StreamData>& s) {
        std::lock_guard<std::mutex> lock(mutex);
        if (s->payloadSize == 0) markerReachedHook = true;
        list.push_back(s->timestamp);
    }
    void Release() {
        std::lock_guard<std::mutex> lock(mutex);
        holdVideo = false;
        changed.notify_all();
    }
    size_t Count(std::vector<uint64_t>& list) {
        std::lock_guard<std::mutex> lock(mutex);
        return list.size();
    }
    std::vector<uint64_t> Copy(std::vector<uint64_t>& list) {
        std::lock_guard<std::mutex> lock(mutex);
        return list;
    }

    std::mutex mutex;
    std::condition_variable changed;
    bool holdVideo = false;
    bool videoEntered = false;
    bool markerReachedHook = false;
    std::vector<uint64_t> video, audio, meta;
};

}  // namespace

TEST(ModuleQueues, FullVideoQueueDropsTheNewestSampleWithOneLineAndKeepsOrder) {
    LogCapture log;
    RecordingModule module;
    module.Initialize(nullptr);
    module.holdVideo = true;
    module.StartThreads();
    module.PushVideo(MakeSample(0));
    ASSERT_TRUE(WaitUntil([&] {
        std::lock_guard<std::mutex> lock(module.mutex);
        return module.videoEntered;
    }));
    for (uint64_t t = 1; t <= 50; ++t) module.PushVideo(MakeSample(t));  // fills the queue
    EXPECT_EQ(log.Count("queue overflow (video)"), 0u);
    module.PushVideo(MakeSample(999));
    auto overflow = log.Find("queue overflow (video)");
    ASSERT_EQ(overflow.size(), 1u);
    EXPECT_EQ(overflow[0].priority, 5);
    EXPECT_TRUE(overflow[0].file.empty());
    EXPECT_EQ(overflow[0].line, 0);

    module.Release();
    ASSERT_TRUE(WaitUntil([&] { return module.Count(module.video) == 51; }));
    auto got = module.Copy(module.video);
    for (uint64_t t = 0; t <= 50; ++t) EXPECT_EQ(got[t], t);
}

TEST(ModuleQueues, AudioAndMetaQueuesHoldTwentySamples) {
    LogCapture log;
    RecordingModule module;  // workers not started: nothing is taken out
    for (int i = 0; i < 21; ++i) module.PushAudio(MakeSample(i));
    for (int i = 0; i < 22; ++i) module.PushMeta(MakeSample(i));
    EXPECT_EQ(log.Count("queue overflow (audio)"), 1u);
    EXPECT_EQ(log.Count("queue overflow (meta)"), 2u);
}

TEST(ModuleWorkers, MarkersNeverReachTheHooks) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StartThreads();
    module.PushAudio(std::make_shared<StreamData>());
    module.PushAudio(MakeSample(7));
    module.FlushQueues();
    EXPECT_EQ(module.Copy(module.audio), std::vector<uint64_t>{7});
    EXPECT_FALSE(module.markerReachedHook);
}

TEST(ModuleWorkers, StopThreadsDiscardsQueuedSamplesAndIsSafeToRepeat) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StopThreads();  // before any start: joins nothing
    module.holdVideo = true;
    module.StartThreads();
    module.PushVideo(MakeSample(1));
    ASSERT_TRUE(WaitUntil([&] {
        std::lock_guard<std::mutex> lock(module.mutex);
        return module.videoEntered;
    }));
    std::vector<std::weak_ptr<StreamData>> queued;
    for (uint64_t t = 2; t < 10; ++t) {
        auto sample = MakeSample(t);
        queued.push_back(sample);
        module.PushVideo(std::move(sample));
    }
    std::thread stopper([&] { module.StopThreads(); });
    // Queued samples are discarded (released) while the running hook call is still held...
    ASSERT_TRUE(WaitUntil([&] {
        for (auto& q : queued)
            if (!q.expired()) return false;
        return true;
    }));
    // ...and that call completes.
    module.Release();
    stopper.join();
    EXPECT_EQ(module.Copy(module.video), std::vector<uint64_t>{1});
    module.StopThreads();

    // The module can start again and goes on working.
    module.StartThreads();
    module.PushMeta(MakeSample(42));
    module.FlushQueues();
    EXPECT_EQ(module.Copy(module.meta), std::vector<uint64_t>{42});
}

TEST(ModuleWorkers, ClearQueuesBeforeInitializeEmptiesAfterItKeepsMarkers) {
    RecordingModule module;
    module.PushMeta(MakeSample(1));
    module.PushMeta(std::make_shared<StreamData>());
    module.ClearQueues();  // default predicate: everything goes, markers too
    module.Initialize(nullptr);
    module.PushMeta(MakeSample(2));
    module.PushMeta(std::make_shared<StreamData>());
    module.PushMeta(MakeSample(3));
    module.ClearQueues();  // real samples go, the marker stays
    module.StartThreads();
    module.PushMeta(MakeSample(4));
    module.FlushQueues();
    EXPECT_EQ(module.Copy(module.meta), std::vector<uint64_t>{4});
}

TEST(ModuleWorkers, EveryFlushWaitsForWhatWasQueuedBeforeIt) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StartThreads();
    module.FlushQueues();  // a first flush: markers seen
    for (int round = 0; round < 3; ++round) {
        for (int i = 0; i < 15; ++i) module.PushAudio(MakeSample(round * 100 + i));
        module.FlushQueues();
        EXPECT_EQ(module.Count(module.audio), static_cast<size_t>((round + 1) * 15));
    }
}

TEST(ModuleWorkers, FlushAfterStopReturnsWithoutWorkers) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StartThreads();
    module.StopThreads();
    module.FlushQueues();  // must not hang
    SUCCEED();
}

TEST(ModuleWorkers, RestartDiscardsQueuedSamplesAndRunsAgain) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StartThreads();
    module.Restart();
    module.PushVideo(MakeSample(5));
    module.FlushQueues();
    EXPECT_EQ(module.Copy(module.video), std::vector<uint64_t>{5});
}

TEST(ModuleConcurrency, ProducersAndStopRaceCleanly) {
    Logger::SetLevel(4);  // the overflow lines of this race are expected
    for (int round = 0; round < 5; ++round) {
        RecordingModule module;
        module.Initialize(nullptr);
        module.StartThreads();
        std::atomic<bool> go{true};
        std::vector<std::thread> producers;
        producers.emplace_back([&] {
            for (int i = 0; go; ++i) module.PushVideo(MakeSample(i));
        });
        producers.emplace_back([&] {
            for (int i = 0; go; ++i) module.PushAudio(MakeSample(i));
        });
        producers.emplace_back([&] {
            for (int i = 0; go; ++i) module.PushMeta(MakeSample(i));
        });
        WaitUntil([&] { return module.Count(module.audio) > 50; }, 5000);
        module.StopThreads();
        go = false;
        for (auto& t : producers) t.join();
        module.StopThreads();
    }
    Logger::SetLevel(Logger::kDefaultLevel);
}
