// Module's worker queues. Guards: a full queue that blocks or reorders instead of dropping the
// newest sample, StopThreads that hangs on a held hook or leaks queued samples, ClearQueues
// removing flush markers, a flush returning before the samples queued ahead of it were handled
// (also where the allocator reuses an earlier marker's address; this runs without sanitizer
// quarantine thanks to the recycling allocator below), and producers racing StopThreads.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <new>
#include <numeric>
#include <vector>

#include "modulebase/Module.h"
#include "platform/framework/StreamData.h"
#include "platform/logger/Logger.h"
#include "tests/support/LogCapture.h"
#include "tests/support/TestSupport.h"

using testsupport::MakeSample;
using testsupport::WaitUntil;

namespace {

// While on, a freed block is handed out again for the next allocation of its size, newest
// first, as glibc's per-thread cache does, but deterministically and also under the
// sanitizers, whose quarantine keeps a freed address out of use for a long time.
std::atomic<bool> recycling{false};
std::mutex recycleMutex;  // guards freeBlocks
constexpr size_t kHeader = alignof(std::max_align_t);
constexpr size_t kSizeClasses = 64;  // blocks up to 1 KiB, in steps of kHeader bytes
void* freeBlocks[kSizeClasses];      // per size class, a list linked through the blocks

size_t sizeClass(size_t bytes) {
    return (bytes + kHeader - 1) / kHeader;
}

struct Recycling {
    Recycling() { recycling = true; }
    ~Recycling() { recycling = false; }
};

}  // namespace

void* operator new(size_t bytes) {
    const size_t cls = sizeClass(bytes);
    if (recycling && cls < kSizeClasses) {
        std::lock_guard<std::mutex> lock(recycleMutex);
        if (void* block = freeBlocks[cls]) {
            freeBlocks[cls] = *static_cast<void**>(block);
            return block;
        }
    }
    auto* raw = static_cast<char*>(std::malloc(cls * kHeader + kHeader));
    if (!raw) throw std::bad_alloc();
    *reinterpret_cast<size_t*>(raw) = cls;
    return raw + kHeader;
}

// GCC's -O3 array-bounds check takes the header read below for an access before a vector's
// storage; the header is ours, written by operator new above.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Warray-bounds"
void operator delete(void* block) noexcept {
    if (!block) return;
    char* raw = static_cast<char*>(block) - kHeader;
    const size_t cls = *reinterpret_cast<size_t*>(raw);
    if (recycling && cls < kSizeClasses) {
        std::lock_guard<std::mutex> lock(recycleMutex);
        *static_cast<void**>(block) = freeBlocks[cls];
        freeBlocks[cls] = block;
        return;
    }
    std::free(raw);
}

void operator delete(void* block, size_t) noexcept {
    operator delete(block);
}
#pragma GCC diagnostic pop

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
        list.push_back(s->timestamp);
    }
    void Release() {
        std::lock_guard<std::mutex> lock(mutex);
        holdVideo = false;
        changed.notify_all();
    }
    // Pushes video sample `t` and waits until the video hook holds it.
    bool HoldVideoAt(uint64_t t) { return HoldVideo(MakeSample(t)); }
    bool HoldVideo(std::shared_ptr<StreamData> sample) {
        {
            std::lock_guard<std::mutex> lock(mutex);
            holdVideo = true;
            videoEntered = false;
        }
        PushVideo(std::move(sample));
        return WaitUntil([&] { return Copy(videoEntered); });
    }
    template <typename T>
    T Copy(const T& member) {
        std::lock_guard<std::mutex> lock(mutex);
        return member;
    }
    size_t Count(const std::vector<uint64_t>& list) { return Copy(list).size(); }

    std::mutex mutex;
    std::condition_variable changed;
    bool holdVideo = false;
    bool videoEntered = false;
    std::vector<uint64_t> video, audio, meta;
};

}  // namespace

TEST(ModuleQueues, AFullQueueDropsTheNewestSampleWithOneLineCountedAndKeepsOrder) {
    LogCapture log;
    RecordingModule module;
    module.Initialize(nullptr);
    // Workers not started: audio and meta queues hold twenty samples.
    for (int i = 0; i < 21; ++i) module.PushAudio(MakeSample(i));
    for (int i = 0; i < 22; ++i) module.PushMeta(MakeSample(i));
    EXPECT_EQ(log.Count("queue overflow (audio)"), 1u);
    EXPECT_EQ(log.Count("queue overflow (meta)"), 2u);
    module.StartThreads();
    ASSERT_TRUE(module.HoldVideoAt(0));
    for (uint64_t t = 1; t <= 50; ++t) module.PushVideo(MakeSample(t));  // fills the queue
    EXPECT_EQ(log.Count("queue overflow (video)"), 0u);
    module.PushVideo(MakeSample(999));
    EXPECT_EQ(log.Count("queue overflow (video)"), 1u);
    const Module::QueueCounts counts = module.Counts();
    EXPECT_EQ(std::vector<uint64_t>(counts.received, counts.received + 3),
              (std::vector<uint64_t>{52, 21, 22}));
    EXPECT_EQ(std::vector<uint64_t>(counts.overflows, counts.overflows + 3),
              (std::vector<uint64_t>{1, 1, 2}));

    module.Release();
    ASSERT_TRUE(WaitUntil([&] { return module.Count(module.video) == 51; }));
    std::vector<uint64_t> inOrder(51);
    std::iota(inOrder.begin(), inOrder.end(), 0);
    EXPECT_EQ(module.Copy(module.video), inOrder);
}

TEST(ModuleWorkers, StopThreadsDiscardsQueuedSamplesAndIsSafeToRepeat) {
    RecordingModule module;
    module.Initialize(nullptr);
    module.StopThreads();  // before any start: joins nothing
    module.StartThreads();
    ASSERT_TRUE(module.HoldVideoAt(1));
    std::vector<std::weak_ptr<StreamData>> queued;
    for (uint64_t t = 2; t < 10; ++t) {
        auto sample = MakeSample(t);
        queued.push_back(sample);
        module.PushVideo(std::move(sample));
    }
    std::thread stopper([&] { module.StopThreads(); });
    // Queued samples are discarded (released) while the running hook call is still held...
    ASSERT_TRUE(WaitUntil([&] {
        return std::all_of(queued.begin(), queued.end(), [](auto& q) { return q.expired(); });
    }));
    // ...and that call completes.
    module.Release();
    stopper.join();
    EXPECT_EQ(module.Copy(module.video), std::vector<uint64_t>{1});
    module.StopThreads();

    module.FlushQueues();  // without workers: must not hang

    // The module can start again and goes on working, also after a restart.
    module.StartThreads();
    module.Restart();
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

// A flush must wait for its own marker even where an earlier marker's memory is reused: the
// video hook is held while samples and the new marker queue behind it.
TEST(ModuleWorkers, AFlushWaitsForTheSamplesBeforeItWhereAnEarlierMarkerLayOrTheQueueIsFull) {
    const struct {
        const char* before;
        void (*step)(RecordingModule&);
        size_t queued;  // video samples queued behind the held one (50 fill the queue)
    } cases[] = {
        {"an earlier flush", [](RecordingModule& m) { m.FlushQueues(); }, 9},
        {"a restart", [](RecordingModule& m) { m.Restart(); }, 9},
        {"a full queue", [](RecordingModule&) {}, 50},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.before);
        // Every sample exists before the earlier marker is freed and stays alive, so the next
        // block of a sample's size that is handed out is the new flush's marker.
        std::vector<std::shared_ptr<StreamData>> samples;
        for (uint64_t t = 0; t < c.queued + 3; ++t) samples.push_back(MakeSample(t));
        RecordingModule module;
        module.Initialize(nullptr);
        module.StartThreads();
        Recycling recycling;
        c.step(module);
        // Each worker handles a sample, so it has let go of the earlier marker.
        module.PushAudio(samples[c.queued + 1]);
        module.PushMeta(samples[c.queued + 2]);
        ASSERT_TRUE(module.HoldVideo(samples[0]));
        ASSERT_TRUE(WaitUntil(
            [&] { return module.Count(module.audio) == 1 && module.Count(module.meta) == 1; }));
        for (size_t i = 1; i <= c.queued; ++i) module.PushVideo(samples[i]);

        std::atomic<bool> returned{false};
        size_t handledAtReturn = 0;
        std::thread flusher([&] {
            module.FlushQueues();
            handledAtReturn = module.Count(module.video);
            returned = true;
        });
        WaitUntil([&] { return returned.load(); }, 300);  // room to return too early
        module.Release();
        flusher.join();
        EXPECT_EQ(handledAtReturn, c.queued + 1);
        // Flush markers never reach the hooks.
        EXPECT_EQ(module.Count(module.audio) + module.Count(module.meta), 2u);
    }
}

// A producer that waits for room loses nothing behind a stalled worker, also when it pushes in
// bursts that wake the worker only at their end; stopping the workers ends its wait.
TEST(ModuleConcurrency, AWaitingProducerLosesNothingAndStopEndsItsWait) {
    LogCapture log;
    RecordingModule module;
    module.Initialize(nullptr);
    const auto far = [] { return std::chrono::steady_clock::now() + std::chrono::minutes(5); };
    for (int i = 0; i < 20; ++i) module.PushAudio(MakeSample(i));  // full
    EXPECT_FALSE(module.WaitForRoom(0, 1, 0, far())) << "no workers yet: no wait";
    module.StartThreads();
    ASSERT_TRUE(module.HoldVideoAt(0));
    std::atomic<uint64_t> pushed{0};
    std::thread producer([&] {
        for (uint64_t t = 1; t <= 120; t += 6) {
            if (!module.WaitForRoom(6, 0, 0, far())) return;
            module.BeginBurst();
            for (uint64_t s = t; s < t + 6; ++s) module.PushVideo(MakeSample(s));
            module.EndBurst();
            pushed = t + 5;
        }
    });
    ASSERT_TRUE(WaitUntil([&] { return pushed.load() == 48; }));  // no room for a ninth burst
    module.Release();
    producer.join();
    ASSERT_TRUE(WaitUntil([&] { return module.Count(module.video) == 121; }));
    std::vector<uint64_t> inOrder(121);
    std::iota(inOrder.begin(), inOrder.end(), 0);
    EXPECT_EQ(module.Copy(module.video), inOrder);
    EXPECT_EQ(log.Count("queue overflow"), 0u);

    ASSERT_TRUE(module.HoldVideoAt(200));
    for (uint64_t t = 201; t <= 250; ++t) module.PushVideo(MakeSample(t));
    std::atomic<int> waited{-1};
    std::thread waiter([&] { waited = module.WaitForRoom(1, 0, 0, far()); });
    std::thread stopper([&] { module.StopThreads(); });  // joins the held worker
    ASSERT_TRUE(WaitUntil([&] { return waited.load() != -1; }));
    module.Release();
    waiter.join();
    stopper.join();
}

TEST(ModuleConcurrency, ProducersAndStopRaceCleanly) {
    Logger::SetLevel(4);  // the overflow lines of this race are expected
    for (int round = 0; round < 5; ++round) {
        RecordingModule module;
        module.Initialize(nullptr);
        module.StartThreads();
        std::atomic<bool> go{true};
        std::vector<std::thread> producers;
        for (auto push : {&Module::PushVideo, &Module::PushAudio, &Module::PushMeta}) {
            producers.emplace_back([&, push] {
                for (int i = 0; go; ++i) (module.*push)(MakeSample(i));
            });
        }
        WaitUntil([&] { return module.Count(module.audio) > 50; }, 5000);
        module.StopThreads();
        go = false;
        for (auto& t : producers) t.join();
        module.StopThreads();
    }
    Logger::SetLevel(Logger::kDefaultLevel);
}
