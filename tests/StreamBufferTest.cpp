// StreamBuffer through its public surface: samples in through the receive operations, files out
// through a recording IFileBuffer, a hand-moved tick source for wall time and the real 500 ms
// filing tick. Waits are for log lines or files, with generous deadlines. The cut rule itself
// is tabled in CutRuleTest. Guards: a cut plan applied wrongly to the lists (split GOP,
// samples at the cut, payload copies), catch-up after a gap, the two overload guards and their
// order, filing held back by lagging audio or released by wall time, first-IDR trimming,
// the pre-start meta window, and (under TSan) producers racing cutting and clearing, Stop races.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "src/NalAnalyzer.h"
#include "src/StreamBuffer.h"
#include "tests/support/LogCapture.h"
#include "tests/support/RecordingObserver.h"
#include "tests/support/TestSupport.h"

namespace Orvane {
namespace {

using testsupport::MakeSample;
using testsupport::MakeVideo;
using testsupport::WaitUntil;

class FakeTime : public ITimeManager {
  public:
    static constexpr uint32_t kBase = 1000000;
    uint32_t GetTime() override { return now_.load(); }
    std::atomic<uint32_t> now_{kBase};
};

// Records the pushed files. The count it reports is set by the test; HoldNextCount parks the
// filing thread inside its next GetBufferCount until Release.
class RecordingFileBuffer : public IFileBuffer {
  public:
    void Push(const VqStreamFileData& record) override {
        std::lock_guard<std::mutex> lock(mutex_);
        files_.push_back(record);
    }
    VqStreamFileData Pop() override { return {}; }
    bool IsBufferFull() override { return false; }
    uint64_t GetBufferCount() override {
        std::unique_lock<std::mutex> lock(mutex_);
        held_ = hold_;
        changed_.wait(lock, [this] { return !hold_; });
        held_ = false;
        return count_;
    }

    void SetCount(uint64_t count) { Lock(), count_ = count; }
    void HoldNextCount() { Lock(), hold_ = true; }
    bool WaitHeld() {
        return WaitUntil([this] { return Lock(), held_; });
    }
    void Release() {
        Lock(), hold_ = false;
        changed_.notify_all();
    }
    std::vector<VqStreamFileData> Files() { return Lock(), files_; }
    size_t Size() { return Files().size(); }
    bool WaitFiles(size_t n) {
        return WaitUntil([this, n] { return Size() >= n; });
    }

  private:
    // Holds the mutex until the end of the full expression it is used in.
    std::unique_lock<std::mutex> Lock() { return std::unique_lock<std::mutex>(mutex_); }
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<VqStreamFileData> files_;
    uint64_t count_ = 0;
    bool hold_ = false;
    bool held_ = false;
};

std::shared_ptr<StreamData> Audio(uint64_t ts) {
    return MakeSample(ts, ts * 48);
}

// One StreamBuffer with recording collaborators and the real H.264 IDR test.
struct Rig {
    explicit Rig(int32_t intervalSeconds, int32_t bufferFullSize, int32_t startIgnoreTime = 0) {
        ModuleSettings settings;
        settings.uploadInterval = intervalSeconds;
        settings.bufferFullSize = bufferFullSize;
        settings.startIgnoreTime = startIgnoreTime;
        buffer = std::make_unique<StreamBuffer>(&observer, files, time,
                                                std::make_shared<NalAnalyzer>(0), settings);
    }
    ~Rig() {
        files->Release();
        buffer->Stop();
    }
    bool WaitLog(const std::string& message, size_t count = 1) {
        return WaitUntil([&] { return log.Count(message) >= count; });
    }

    LogCapture log;
    std::shared_ptr<FakeTime> time = std::make_shared<FakeTime>();
    std::shared_ptr<RecordingFileBuffer> files = std::make_shared<RecordingFileBuffer>();
    testsupport::RecordingObserver observer;
    std::unique_ptr<StreamBuffer> buffer;
};

// Video frame k at origin + k * num / den ms (30 fps by default) with an IDR every `gopFrames`
// frames, and audio every 20 ms from the origin, fed in timestamp order.
struct Stream {
    Rig& rig;
    uint64_t origin;
    uint64_t gopFrames;
    uint64_t num = 100;
    uint64_t den = 3;
    uint64_t nextFrame = 0;
    uint64_t nextAudio = origin;

    uint64_t FrameTs(uint64_t k) const { return origin + k * num / den; }
    void FeedVideoUntil(uint64_t end) {  // every frame with timestamp < end
        for (; FrameTs(nextFrame) < end; ++nextFrame)
            rig.buffer->ReceiveVideo(MakeVideo(FrameTs(nextFrame), nextFrame % gopFrames == 0));
    }
    void FeedAudioUntil(uint64_t end) {
        for (; nextAudio < end; nextAudio += 20) rig.buffer->ReceiveAudio(Audio(nextAudio));
    }
    void FeedUntil(uint64_t end) {
        while (FrameTs(nextFrame) < end || nextAudio < end) {
            if (FrameTs(nextFrame) < end && FrameTs(nextFrame) <= nextAudio)
                FeedVideoUntil(FrameTs(nextFrame) + 1);
            else
                FeedAudioUntil(nextAudio + 1);
        }
    }
};

// ---------------------------------------------------------------------------------------------
// Applying the cut rule (its table is CutRuleTest) to the holding lists.

// Feeds samples in timestamp order, and at equal times in the given order: 'I' IDR, 'V' other
// frame, 'A' audio, 'M' meta.
void FeedSorted(Rig& rig, std::vector<std::pair<uint64_t, char>> samples) {
    std::stable_sort(samples.begin(), samples.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    for (const auto& [ts, kind] : samples) {
        if (kind == 'A')
            rig.buffer->ReceiveAudio(Audio(ts));
        else if (kind == 'M')
            rig.buffer->ReceiveMeta(MakeSample(ts, ts));
        else
            rig.buffer->ReceiveVideo(MakeVideo(ts, kind == 'I'));
    }
}

TEST(StreamBufferCut, GopLongerThanTheIntervalIsSplitAndItsRemainderTakenWhole) {
    Rig rig(1, 10);
    rig.buffer->Start();
    // 30 frames below the boundary 6000, 31 more of the same GOP, an IDR at 7000; audio and
    // meta with samples exactly at the cut.
    const auto firstIdr = MakeVideo(5000, true);
    rig.buffer->ReceiveVideo(firstIdr);
    std::vector<std::pair<uint64_t, char>> samples;
    for (uint64_t k = 1; k < 30; ++k) samples.push_back({5000 + k * 100 / 3, k ? 'V' : 'I'});
    for (uint64_t j = 0; j <= 30; ++j) samples.push_back({6000 + j * 33, 'V'});
    samples.insert(samples.end(), {{7000, 'I'}, {7033, 'V'}});
    for (uint64_t ts = 5000; ts <= 7040; ts += 20) samples.push_back({ts, 'A'});
    for (uint64_t ts : {5500, 6000, 6500}) samples.push_back({ts, 'M'});
    FeedSorted(rig, samples);

    ASSERT_TRUE(rig.files->WaitFiles(2));
    const auto files = rig.files->Files();
    EXPECT_EQ(files[0].duration, 1000u);
    EXPECT_EQ(files[0].video.size(), 30u);
    EXPECT_EQ(files[0].audio.back().timestamp, 5980u);
    EXPECT_EQ(files[0].meta.size(), 1u);
    EXPECT_EQ(files[0].video.front().PayloadData(), firstIdr->source->Data());  // not copied
    EXPECT_EQ(files[1].duration, 991u);
    ASSERT_EQ(files[1].video.size(), 31u);
    EXPECT_EQ(files[1].video.front().timestamp, 6000u);
    EXPECT_EQ(files[1].audio.front().timestamp, 6000u);
    EXPECT_EQ(files[1].audio.back().timestamp, 6980u);
    ASSERT_EQ(files[1].meta.size(), 2u);
    EXPECT_EQ(files[1].meta.front().timestamp, 6000u);

    EXPECT_EQ(rig.log.Count("FRAGMENT GOP: 450000, 61 (30/31)"), 1u);
}

// ---------------------------------------------------------------------------------------------
// The filing thread.

TEST(StreamBufferFiling, CatchesUpAfterAGapWithOneIntervalPerFileInOneTick) {
    Rig rig(1, 5);
    rig.files->SetCount(UINT64_MAX);
    rig.buffer->Start();
    rig.buffer->ReceiveVideo(MakeVideo(0, true));
    rig.buffer->ReceiveVideo(MakeVideo(1000, false));
    ASSERT_TRUE(WaitUntil([&] { return !rig.observer.UploadInfos().empty(); }));
    EXPECT_EQ(rig.observer.UploadInfos()[0], "BufferOver");
    EXPECT_TRUE(rig.log.Contains("Queue Clear."));

    // The stream resumes far past the boundary (1000): audio from 10000, video from 12000.
    rig.files->HoldNextCount();
    rig.files->SetCount(0);
    rig.buffer->ReceiveAudio(Audio(10000));  // audio alone at the boundary: an attempt
    ASSERT_TRUE(rig.files->WaitHeld());
    Stream stream{rig, 12000, 300};
    stream.nextAudio = 10020;
    stream.FeedUntil(13501);
    rig.files->Release();

    ASSERT_TRUE(rig.files->WaitFiles(13));
    const auto files = rig.files->Files();
    ASSERT_EQ(files.size(), 13u);
    for (size_t i = 0; i < files.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(files[i].duration, 1000u);
        // Nothing below boundaries 1000..10000; then audio alone until the IDR at 12000.
        EXPECT_EQ(files[i].audio.size(), i < 10 ? 0u : 50u);
        EXPECT_EQ(files[i].video.size(), i < 12 ? 0u : 30u);
    }
    EXPECT_EQ(files[10].audio.front().timestamp, 10000u);
    EXPECT_EQ(files[12].video.front().timestamp, 12000u);

    // All in the one tick that was held: no tick line between the first and the last file.
    ASSERT_TRUE(rig.WaitLog("ST: DUMP LEN [1000, 12000]."));
    const auto all = rig.log.Messages();
    const auto first = std::find(all.begin(), all.end(), "ST: DUMP LEN [1000, 0].");
    ASSERT_NE(first, all.end());
    EXPECT_EQ(std::count_if(first, std::find(first, all.end(), "ST: DUMP LEN [1000, 12000]."),
                            [](const std::string& m) { return m.rfind("buffer_length", 0) == 0; }),
              0);
}

TEST(StreamBufferFiling, HeldSamplesSpanningTenIntervalsAreClearedWithAWarning) {
    using Samples = std::vector<std::pair<uint64_t, char>>;
    Samples smallAudioSpan = {{100500, 'M'}}, gop9999, gop10000;
    for (uint64_t ts = 100000; ts <= 103000; ts += 20) smallAudioSpan.push_back({ts, 'A'});
    for (uint64_t ts = 0; ts < 10000; ts += 100) gop9999.push_back({ts, ts ? 'V' : 'I'});
    gop10000 = gop9999;
    gop9999.push_back({9999, 'V'});
    gop10000.push_back({10000, 'V'});
    struct Case {
        const char* name;
        Samples beforeStart, afterStart;  // all before Start: one tick sees them whole
        size_t filedVideo;                // -1: cleared as a backlog
    };
    const Case cases[] = {
        // Without a GOP the span is measured between the audio and meta samples themselves.
        {"audio far from 0, small span", {}, smallAudioSpan, 0},
        {"audio and meta spanning 10000", {}, {{100000, 'A'}, {105000, 'M'}, {110000, 'A'}}, -1u},
        {"GOP spanning 9999", gop9999, {{5000, 'M'}}, 10},
        {"GOP spanning 10000", gop10000, {{5000, 'M'}}, -1u},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        Rig rig(1, 10);
        FeedSorted(rig, c.beforeStart);
        rig.buffer->Start();
        FeedSorted(rig, c.afterStart);
        if (c.filedVideo == -1u) {
            ASSERT_TRUE(WaitUntil([&] { return !rig.observer.Warnings().empty(); }));
            EXPECT_EQ(rig.observer.Warnings()[0], 29u);
            const auto lines =
                rig.log.Find("input buffer overflow. buffer_size: 10000, threshold:10000.");
            ASSERT_EQ(lines.size(), 1u);
            EXPECT_EQ(lines[0].priority, 5);
            EXPECT_TRUE(rig.log.Contains("Queue Clear."));
            EXPECT_EQ(rig.files->Size(), 0u);
        } else if (c.filedVideo == 0) {
            ASSERT_TRUE(rig.WaitLog("createStreamFileData.", 2));
            EXPECT_EQ(rig.files->Size(), 0u);
            EXPECT_FALSE(rig.log.Contains("Queue Clear."));
        } else {
            ASSERT_TRUE(rig.files->WaitFiles(1));
            EXPECT_EQ(rig.files->Files()[0].video.size(), c.filedVideo);
        }
        EXPECT_EQ(rig.observer.Warnings().empty(), c.filedVideo != -1u);
    }
}

TEST(StreamBufferFiling, BackedUpFileBufferWinsOverTheSpanTest) {
    Rig rig(1, 0);  // both limits 0: every attempt ends in "BufferOver" only
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(0));
    rig.buffer->ReceiveAudio(Audio(50000));
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.UploadInfos().size() >= 2; }));
    EXPECT_TRUE(rig.observer.Warnings().empty());
    EXPECT_TRUE(rig.log.Contains("buffer_length : 0 / 0\n"));
    EXPECT_EQ(rig.files->Size(), 0u);
}

TEST(StreamBufferFiling, FilesOnceVideoAndAudioReachTheBoundaryOrWallTimeRunsAhead) {
    Rig rig(1, 2);  // boundary 1000, wall-time limit 2000 ms
    rig.buffer->Start();
    Stream stream{rig, 0, 4, 50, 1};  // frames every 50 ms, IDR every 200 ms
    stream.FeedUntil(501);
    ASSERT_TRUE(rig.WaitLog("500 < 1000"));
    // Video past the boundary, audio behind it: the audio holds the file back (two more
    // "500 < 1000" lines: at least one whole tick has seen the new video).
    const size_t before = rig.log.Count("500 < 1000");
    stream.FeedVideoUntil(1051);
    ASSERT_TRUE(rig.WaitLog("500 < 1000", before + 2));
    EXPECT_EQ(rig.files->Size(), 0u);

    // The stream stalls; wall time runs 2000 ms ahead: filed up to the IDR at 1000.
    rig.time->now_ += 2000;
    ASSERT_TRUE(rig.files->WaitFiles(1));
    EXPECT_EQ(rig.files->Files()[0].duration, 999u);
    // The filed time counts against the wall time: behind by 1001 now, no second file.
    ASSERT_TRUE(rig.WaitLog("buffer_length : 1001 / 2000\n"));
    ASSERT_TRUE(rig.WaitLog("1050 < 1999"));
    EXPECT_EQ(rig.files->Size(), 1u);
}

TEST(StreamBufferFiling, StopWhileSleepingEndsAtOnce) {
    Rig rig(1, 10);
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(0));
    ASSERT_TRUE(rig.WaitLog("buffer_length : 0 / 10000\n"));  // now sleeping about 500 ms
    const auto begin = std::chrono::steady_clock::now();
    rig.buffer->Stop();
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::milliseconds(300));
    EXPECT_EQ(rig.log.Count("createStreamFile exit."), 1u);
}

// ---------------------------------------------------------------------------------------------
// Intake.

TEST(StreamBufferIntake, FirstIdrFixesTheOriginAndTrimsOlderAudioAndMeta) {
    Rig rig(1, 10, 700);
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(900));
    rig.buffer->ReceiveMeta(MakeSample(950, 0));
    rig.buffer->ReceiveVideo(MakeVideo(950, false));  // before any IDR: dropped
    rig.buffer->ReceiveAudio(Audio(1000));
    rig.buffer->ReceiveMeta(MakeSample(1000, 0));
    rig.buffer->ReceiveVideo(MakeVideo(1000, true));
    rig.buffer->ReceiveVideo(MakeVideo(1500, true));  // a second IDR only opens a GOP
    rig.buffer->ReceiveVideo(MakeVideo(2100, false));
    rig.buffer->ReceiveAudio(Audio(2100));
    ASSERT_TRUE(rig.files->WaitFiles(1));

    EXPECT_TRUE(rig.log.Contains("idr none. [950]"));
    EXPECT_EQ(rig.log.Count("ST: real skip ignore time: 1000(90000)"), 1u);
    // Origin 1000 (not the start ignore time 700): boundary 2000, cut before the IDR at 1500.
    const VqStreamFileData file = rig.files->Files()[0];
    EXPECT_EQ(file.duration, 499u);
    for (const auto* list : {&file.video, &file.audio, &file.meta}) {
        ASSERT_EQ(list->size(), 1u);
        EXPECT_EQ(list->front().timestamp, 1000u);
    }
}

TEST(StreamBufferIntake, MetaBeforeStartIsWindowedAndDoesNotReleaseTheFilingThread) {
    Rig rig(1, 10);
    rig.buffer->Start();
    for (uint64_t rtp : {uint64_t{0}, uint64_t{100000}, uint64_t{200000}})
        rig.buffer->ReceiveMetaBeforeStart(MakeSample(1000 + rtp / 1000, rtp));
    EXPECT_FALSE(WaitUntil([&] { return rig.log.Contains("Internal Buffer length : 0"); }, 1200));

    rig.buffer->ReceiveVideo(MakeVideo(1000, true));
    rig.buffer->ReceiveVideo(MakeVideo(1600, true));
    rig.buffer->ReceiveVideo(MakeVideo(2100, false));
    ASSERT_TRUE(rig.files->WaitFiles(1));
    const VqStreamFileData file = rig.files->Files()[0];
    ASSERT_EQ(file.meta.size(), 2u);
    EXPECT_EQ(file.meta[0].rtpTime, 100000u);
    EXPECT_EQ(file.meta[1].rtpTime, 200000u);
}

// ---------------------------------------------------------------------------------------------
// Threads racing (also run under ThreadSanitizer).

TEST(StreamBufferConcurrency, ProducersRaceTheFilingThreadCuttingAndClearing) {
    Rig rig(2, 2);
    rig.buffer->Start();
    // Stream time runs 20 times faster than real time: several files per tick, and everything
    // cleared while the file buffer reports a backlog.
    constexpr uint64_t kEndMs = 50000;
    const auto begin = std::chrono::steady_clock::now();
    const auto pace = [begin](uint64_t ts) {
        std::this_thread::sleep_until(begin + std::chrono::microseconds(ts * 50));
    };
    const auto producer = [&](uint64_t step, auto receive) {
        return std::thread([&, step, receive] {
            for (uint64_t k = 0; k * step / 3 < kEndMs; ++k) {
                pace(k * step / 3);
                receive(k, k * step / 3);
            }
        });
    };
    std::thread video = producer(100, [&](uint64_t k, uint64_t ts) {
        rig.buffer->ReceiveVideo(
            MakeSample(ts, k, k % 15 ? testsupport::H264NonIdr() : testsupport::H264Idr()));
    });
    std::thread audio =
        producer(60, [&](uint64_t, uint64_t ts) { rig.buffer->ReceiveAudio(Audio(ts)); });
    std::thread meta =
        producer(300, [&](uint64_t, uint64_t ts) { rig.buffer->ReceiveMeta(MakeSample(ts, ts)); });
    pace(kEndMs / 3);
    rig.files->SetCount(UINT64_MAX);
    pace(kEndMs * 2 / 3);
    rig.files->SetCount(0);
    for (auto* t : {&video, &audio, &meta}) t->join();
    rig.buffer->Stop();

    EXPECT_FALSE(rig.observer.UploadInfos().empty());
    // Across all files each medium is in order without repeats, and a non-IDR frame always
    // follows its own predecessor: nothing was appended to a GOP that had been cleared.
    std::vector<StreamData> all[3];
    for (const auto& file : rig.files->Files()) {
        all[0].insert(all[0].end(), file.video.begin(), file.video.end());
        all[1].insert(all[1].end(), file.audio.begin(), file.audio.end());
        all[2].insert(all[2].end(), file.meta.begin(), file.meta.end());
    }
    ASSERT_FALSE(all[0].empty());
    EXPECT_EQ(all[0].front().rtpTime % 15, 0u);
    for (const auto& list : all) {
        for (size_t i = 1; i < list.size(); ++i) {
            ASSERT_LT(list[i - 1].rtpTime, list[i].rtpTime);
            if (&list == &all[0] && list[i].rtpTime % 15 != 0) {
                ASSERT_EQ(list[i - 1].rtpTime + 1, list[i].rtpTime);
            }
        }
    }
}

TEST(StreamBufferConcurrency, FirstIdrTrimmingKeepsSamplesAtTheIdrTimestamp) {
    for (int round = 0; round < 5; ++round) {
        Rig rig(1, 10);
        rig.buffer->Start();
        std::atomic<uint64_t> sent[2] = {{0}, {0}};  // newest audio, meta
        const auto producer = [&](int kind) {
            for (uint64_t ts = 0; ts <= 2000; ts += 10) {
                if (kind == 0) rig.buffer->ReceiveAudio(Audio(ts));
                if (kind == 1) rig.buffer->ReceiveMeta(MakeSample(ts, ts));
                if (kind < 2) sent[kind] = ts;
                // Video past the boundary (1500) only once audio and meta are there too.
                if (kind == 2 && ts == 1500)
                    WaitUntil([&] { return sent[0] >= 1500 && sent[1] >= 1500; });
                if (kind == 2) rig.buffer->ReceiveVideo(MakeVideo(ts, ts == 500 || ts == 1200));
            }
        };
        std::thread audio(producer, 0), meta(producer, 1), video(producer, 2);
        for (auto* t : {&audio, &meta, &video}) t->join();
        ASSERT_TRUE(rig.files->WaitFiles(1));
        const VqStreamFileData file = rig.files->Files()[0];
        EXPECT_EQ(rig.log.Count("ST: real skip ignore time: 500(45000)"), 1u);
        EXPECT_EQ(file.duration, 699u);
        for (const auto* list : {&file.audio, &file.meta}) {
            EXPECT_TRUE(std::any_of(list->begin(), list->end(),
                                    [](const StreamData& s) { return s.timestamp == 500; }));
        }
    }
}

TEST(StreamBufferConcurrency, StopRightAfterStartAndFromTwoThreadsAtOnce) {
    {
        Rig rig(1, 10);
        rig.buffer->Stop();  // before Start
        rig.buffer->Stop();
        EXPECT_EQ(rig.log.Count("Stop exit."), 2u);
    }
    for (int round = 0; round < 20; ++round) {
        SCOPED_TRACE(round);
        const bool withAudio = round % 2, twoStoppers = round % 4 >= 2;
        Rig rig(1, 10);
        auto started = std::async(std::launch::async, [&] {
            rig.buffer->Start();
            if (withAudio) rig.buffer->ReceiveAudio(Audio(0));
            if (!twoStoppers) rig.buffer->Stop();  // no lost wake-up
        });
        ASSERT_EQ(started.wait_for(std::chrono::seconds(10)), std::future_status::ready);
        if (twoStoppers) {
            if (withAudio) {
                ASSERT_TRUE(rig.WaitLog("createStreamFile enter."));
            }
            std::atomic<bool> go{false};
            const auto stopper = [&] {
                while (!go) std::this_thread::yield();
                rig.buffer->Stop();
            };
            auto first = std::async(std::launch::async, stopper);
            auto second = std::async(std::launch::async, stopper);
            go = true;
            ASSERT_EQ(first.wait_for(std::chrono::seconds(10)), std::future_status::ready);
            ASSERT_EQ(second.wait_for(std::chrono::seconds(10)), std::future_status::ready);
            first.get();  // rethrows if a Stop threw
            second.get();
            rig.buffer->Stop();
            EXPECT_EQ(rig.log.Count("Stop exit."), 3u);
        }
        EXPECT_EQ(rig.log.Count("createStreamFile exit."), 1u);
    }
}

}  // namespace
}  // namespace Orvane
