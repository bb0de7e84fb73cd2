// StreamBuffer through its public surface: samples in through the receive operations, files out
// through a recording IFileBuffer, a hand-moved tick source for wall time and the real 500 ms
// filing tick. Waits are for log lines or files, with generous deadlines.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/logger/LogCapture.h"
#include "src/NalAnalyzer.h"
#include "src/StreamBuffer.h"
#include "tests/support/TestSupport.h"

namespace Orvane {
namespace {

using testsupport::H264Idr;
using testsupport::H264NonIdr;
using testsupport::MakeSample;
using testsupport::MakeVideo;
using testsupport::WaitUntil;

// Tick source the test moves by hand.
class FakeTime : public ITimeManager {
  public:
    static constexpr uint32_t kBase = 1000000;
    uint32_t GetTime() override { return now_.load(); }
    void Set(uint32_t now) { now_ = now; }
    void Advance(uint32_t ms) { now_ += ms; }

  private:
    std::atomic<uint32_t> now_{kBase};
};

// Records the pushed files. Its buffer count is set by the test; GetBufferCount can be made to
// hold the filing thread inside `filing` (HoldNextCount) until the test releases it.
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
        if (hold_) {
            held_ = true;
            changed_.wait(lock, [this] { return !hold_; });
            held_ = false;
        }
        return count_;
    }

    void SetCount(uint64_t count) {
        std::lock_guard<std::mutex> lock(mutex_);
        count_ = count;
    }
    void HoldNextCount() {
        std::lock_guard<std::mutex> lock(mutex_);
        hold_ = true;
    }
    bool WaitHeld() {
        return WaitUntil([this] {
            std::lock_guard<std::mutex> lock(mutex_);
            return held_;
        });
    }
    void Release() {
        std::lock_guard<std::mutex> lock(mutex_);
        hold_ = false;
        changed_.notify_all();
    }
    std::vector<VqStreamFileData> Files() {
        std::lock_guard<std::mutex> lock(mutex_);
        return files_;
    }
    size_t Size() {
        std::lock_guard<std::mutex> lock(mutex_);
        return files_.size();
    }
    bool WaitFiles(size_t n) {
        return WaitUntil([this, n] { return Size() >= n; });
    }

  private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<VqStreamFileData> files_;
    uint64_t count_ = 0;
    bool hold_ = false;
    bool held_ = false;
};

class RecordingObserver : public INotifyObserver {
  public:
    VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest&) override { return VqResult(); }
    VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify&) override { return VqResult(); }
    void notifyModuleError(unsigned int) override {}
    void notifyModuleWarn(unsigned int code) override {
        std::lock_guard<std::mutex> lock(mutex_);
        warnings_.push_back(code);
    }
    void notifyModuleExecute() override {}
    VqProcessState GetModuleStatus() override { return VqProcessState(); }
    void notifyTransmissionStatus(const std::map<std::string, std::string>& entries) override {
        std::lock_guard<std::mutex> lock(mutex_);
        statuses_.push_back(entries);
    }

    std::vector<unsigned int> Warnings() {
        std::lock_guard<std::mutex> lock(mutex_);
        return warnings_;
    }
    std::vector<std::map<std::string, std::string>> Statuses() {
        std::lock_guard<std::mutex> lock(mutex_);
        return statuses_;
    }

  private:
    std::mutex mutex_;
    std::vector<unsigned int> warnings_;
    std::vector<std::map<std::string, std::string>> statuses_;
};

std::shared_ptr<StreamData> Audio(uint64_t ts) {
    return MakeSample(ts, ts * 48);
}
std::shared_ptr<StreamData> Meta(uint64_t ts, uint64_t rtpTime) {
    return MakeSample(ts, rtpTime);
}

// One StreamBuffer with recording collaborators; the real H.264 IDR test.
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
    // Messages logged after the first record that equals `message`.
    std::vector<std::string> MessagesAfter(const std::string& message) {
        auto all = log.Messages();
        auto it = std::find(all.begin(), all.end(), message);
        return it == all.end() ? std::vector<std::string>()
                               : std::vector<std::string>(it, all.end());
    }

    LogCapture log;
    std::shared_ptr<FakeTime> time = std::make_shared<FakeTime>();
    std::shared_ptr<RecordingFileBuffer> files = std::make_shared<RecordingFileBuffer>();
    RecordingObserver observer;
    std::unique_ptr<StreamBuffer> buffer;
};

// A stream of video frames (frame k at origin + k * num / den ms, an IDR every `gopFrames`
// frames) and audio every 20 ms from the origin, fed in timestamp order.
struct Stream {
    Rig& rig;
    uint64_t origin;
    uint64_t gopFrames;
    uint64_t num = 100;  // 30 fps
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
// The cut rule.

TEST(StreamBufferCut, CutsBeforeTheLastIdrAtOrBeforeTheBoundary) {
    Rig rig(60, 10);
    rig.buffer->Start();
    Stream stream{rig, 0, 60};  // IDR every 2 s
    stream.FeedUntil(60000);
    rig.buffer->ReceiveAudio(Audio(59999));  // at the coming cut: stays for the next file
    for (uint64_t ts = 0; ts < 60000; ts += 1000) rig.buffer->ReceiveMeta(Meta(ts, ts));
    rig.buffer->ReceiveMeta(Meta(59999, 59999));
    stream.nextAudio = 60000;

    // Not yet at the boundary: every tick says so and files nothing.
    ASSERT_TRUE(rig.WaitLog("59966 < 60000"));
    stream.FeedVideoUntil(60001);               // the IDR at 60000
    ASSERT_TRUE(rig.WaitLog("59999 < 60000"));  // now the audio holds it back
    EXPECT_EQ(rig.files->Size(), 0u);
    stream.FeedAudioUntil(60001);
    ASSERT_TRUE(rig.files->WaitFiles(1));

    VqStreamFileData file = rig.files->Files()[0];
    EXPECT_EQ(file.duration, 59999u);
    ASSERT_EQ(file.video.size(), 1800u);
    EXPECT_EQ(file.video.front().timestamp, 0u);
    EXPECT_EQ(file.video.back().timestamp, 59966u);
    ASSERT_EQ(file.audio.size(), 3000u);
    EXPECT_EQ(file.audio.back().timestamp, 59980u);
    ASSERT_EQ(file.meta.size(), 60u);
    EXPECT_EQ(file.meta.back().timestamp, 59000u);
    EXPECT_TRUE(rig.log.Contains("ST: V:1800, A:3000, M:60, d:59999, max:59999 "));
    // The dump lines follow the push.
    EXPECT_TRUE(rig.WaitLog("ST: DUMP LEN [59999, 0]."));
    EXPECT_TRUE(rig.WaitLog("DUMP: [V] [1800, 0 - 5396940/5396940(59966)]."));

    // The next boundary moves on from the cut: 59999 + 60000.
    stream.FeedUntil(119999);
    ASSERT_TRUE(rig.WaitLog("119966 < 119999"));
    stream.FeedUntil(120001);
    ASSERT_TRUE(rig.files->WaitFiles(2));
    file = rig.files->Files()[1];
    EXPECT_EQ(file.duration, 60000u);
    ASSERT_FALSE(file.audio.empty());
    EXPECT_EQ(file.audio.front().timestamp, 59999u);
    ASSERT_FALSE(file.meta.empty());
    EXPECT_EQ(file.meta.front().timestamp, 59999u);
    EXPECT_EQ(file.video.front().timestamp, 60000u);
    EXPECT_TRUE(rig.WaitLog("ST: DUMP LEN [60000, 59999]."));
}

TEST(StreamBufferCut, LongGopsEndTheFileEarlier) {
    Rig rig(60, 10);
    rig.buffer->Start();
    Stream stream{rig, 0, 210};  // IDR every 7 s
    stream.FeedUntil(60001);
    ASSERT_TRUE(rig.files->WaitFiles(1));
    const VqStreamFileData file = rig.files->Files()[0];
    EXPECT_EQ(file.duration, 55999u);
    EXPECT_EQ(file.video.size(), 1680u);
    EXPECT_EQ(file.video.back().timestamp, 55966u);
    EXPECT_TRUE(rig.log.Contains("ST: V:1680, A:2800, M:0, d:55999, max:55999 "));
}

TEST(StreamBufferCut, GopLongerThanTheIntervalIsSplitAndItsRemainderTakenWhole) {
    Rig rig(1, 10);
    rig.buffer->Start();
    std::shared_ptr<StreamData> firstIdr = MakeVideo(5000, true);
    std::weak_ptr<ReceivedSample> firstPayload = firstIdr->source;
    // 30 frames below the boundary 6000, then 31 more (6000..6990) of the same GOP, then an
    // IDR at 7000. Audio and meta, with samples exactly at the cut.
    std::vector<std::pair<uint64_t, std::function<void()>>> events;
    events.push_back({5000, [&] { rig.buffer->ReceiveVideo(firstIdr); }});
    for (uint64_t k = 1; k < 30; ++k) {
        const uint64_t ts = 5000 + k * 100 / 3;
        events.push_back({ts, [&rig, ts] { rig.buffer->ReceiveVideo(MakeVideo(ts, false)); }});
    }
    for (uint64_t j = 0; j <= 30; ++j) {
        const uint64_t ts = 6000 + j * 33;
        events.push_back({ts, [&rig, ts] { rig.buffer->ReceiveVideo(MakeVideo(ts, false)); }});
    }
    events.push_back({7000, [&] { rig.buffer->ReceiveVideo(MakeVideo(7000, true)); }});
    events.push_back({7033, [&] { rig.buffer->ReceiveVideo(MakeVideo(7033, false)); }});
    for (uint64_t ts = 5000; ts <= 7040; ts += 20)
        events.push_back({ts, [&rig, ts] { rig.buffer->ReceiveAudio(Audio(ts)); }});
    for (uint64_t ts : {5500, 6000, 6500})
        events.push_back({ts, [&rig, ts] { rig.buffer->ReceiveMeta(Meta(ts, ts)); }});
    std::stable_sort(events.begin(), events.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    for (auto& event : events) event.second();
    firstIdr.reset();

    ASSERT_TRUE(rig.files->WaitFiles(2));
    const auto files = rig.files->Files();
    // Split at the boundary: one interval, the sample at 6000 stays in every list.
    EXPECT_EQ(files[0].duration, 1000u);
    ASSERT_EQ(files[0].video.size(), 30u);
    EXPECT_EQ(files[0].video.back().timestamp, 5966u);
    EXPECT_EQ(files[0].audio.size(), 50u);
    EXPECT_EQ(files[0].audio.back().timestamp, 5980u);
    ASSERT_EQ(files[0].meta.size(), 1u);
    // The remainder, whole, and no more.
    EXPECT_EQ(files[1].duration, 991u);
    ASSERT_EQ(files[1].video.size(), 31u);
    EXPECT_EQ(files[1].video.front().timestamp, 6000u);
    EXPECT_EQ(files[1].video.back().timestamp, 6990u);
    EXPECT_EQ(files[1].audio.front().timestamp, 6000u);
    EXPECT_EQ(files[1].audio.back().timestamp, 6980u);
    ASSERT_EQ(files[1].meta.size(), 2u);
    EXPECT_EQ(files[1].meta.front().timestamp, 6000u);

    // The split is logged once, when the remainder is filed, with both files' counts.
    const auto records = rig.log.Find("FRAGMENT GOP: 450000, 61 (30/31)");
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].priority, 11);
    EXPECT_TRUE(records[0].file.empty());
    const auto afterFirst = rig.MessagesAfter("ST: V:30, A:50, M:1, d:1000, max:6000 ");
    EXPECT_NE(std::find(afterFirst.begin(), afterFirst.end(), "FRAGMENT GOP: 450000, 61 (30/31)"),
              afterFirst.end());
    EXPECT_EQ(rig.log.Count("FRAGMENT GOP: 450000, 61 (30/31)"), 1u);

    // The file refers to the very bytes the received sample holds, and keeps them alive.
    ASSERT_FALSE(firstPayload.expired());
    EXPECT_EQ(files[0].video.front().source, firstPayload.lock());
    EXPECT_EQ(files[0].video.front().PayloadData(), firstPayload.lock()->Data());
}

TEST(StreamBufferCut, GopOverThreeFilesLogsItsFirstAndLastCounts) {
    Rig rig(1, 10);
    rig.buffer->Start();
    Stream stream{rig, 0, 75};  // IDRs at 0 and 2500
    stream.FeedUntil(3001);
    ASSERT_TRUE(rig.files->WaitFiles(3));
    const auto files = rig.files->Files();
    EXPECT_EQ(files[0].video.size(), 30u);
    EXPECT_EQ(files[1].duration, 1000u);
    EXPECT_EQ(files[1].video.size(), 30u);
    EXPECT_EQ(files[1].video.front().timestamp, 1000u);
    EXPECT_EQ(files[2].duration, 467u);
    EXPECT_EQ(files[2].video.size(), 15u);
    EXPECT_EQ(files[2].video.back().timestamp, 2466u);
    EXPECT_TRUE(rig.log.Contains("FRAGMENT GOP: 0, 45 (30/15)"));
}

TEST(StreamBufferCut, HeldVideoThatBeganLateRunsIntoItsGop) {
    // Origin 0, nothing filed, video held from 10000 with an IDR every 4 s, asked at 62500.
    Rig rig(60, 1);
    rig.files->SetCount(UINT64_MAX);
    rig.buffer->Start();
    rig.buffer->ReceiveVideo(MakeVideo(0, true));  // fixes the origin at 0
    rig.buffer->ReceiveVideo(MakeVideo(60000, false));
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.Statuses().size() >= 1; }));  // cleared

    // Hold the filing thread inside its next attempt (wall time) while the stream arrives.
    rig.files->HoldNextCount();
    rig.files->SetCount(0);
    rig.time->Advance(60000);
    ASSERT_TRUE(rig.files->WaitHeld());
    rig.time->Set(FakeTime::kBase);
    Stream stream{rig, 10000, 120};
    stream.FeedUntil(62501);
    rig.files->Release();

    ASSERT_TRUE(rig.files->WaitFiles(1));
    VqStreamFileData file = rig.files->Files()[0];
    // The GOP 58000..61966 reaches the boundary but the held video spans less than an
    // interval: the cut is its last sample, which stays behind alone.
    EXPECT_EQ(file.duration, 61966u);
    EXPECT_EQ(file.video.size(), 1559u);
    EXPECT_EQ(file.video.front().timestamp, 10000u);
    EXPECT_EQ(file.video.back().timestamp, 61933u);
    EXPECT_TRUE(rig.log.Contains("ST: V:1559, A:2599, M:0, d:61966, max:61966 "));

    stream.FeedUntil(122001);
    ASSERT_TRUE(rig.files->WaitFiles(3));
    const auto files = rig.files->Files();
    // The one-sample remainder, whole.
    EXPECT_EQ(files[1].duration, 1u);
    ASSERT_EQ(files[1].video.size(), 1u);
    EXPECT_EQ(files[1].video.front().timestamp, 61966u);
    EXPECT_TRUE(files[1].audio.empty());
    EXPECT_EQ(files[2].video.front().timestamp, 62000u);
}

// ---------------------------------------------------------------------------------------------
// The filing thread.

TEST(StreamBufferFiling, CatchesUpAfterAGapWithOneIntervalPerFileInOneTick) {
    Rig rig(1, 5);
    rig.files->SetCount(UINT64_MAX);
    rig.buffer->Start();
    rig.buffer->ReceiveVideo(MakeVideo(0, true));
    rig.buffer->ReceiveVideo(MakeVideo(1000, false));
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.Statuses().size() >= 1; }));
    EXPECT_EQ(rig.observer.Statuses()[0],
              (std::map<std::string, std::string>{{"UploadInfo", "BufferOver"}}));
    const auto clear = rig.log.Find("Queue Clear.");
    ASSERT_FALSE(clear.empty());
    EXPECT_EQ(clear[0].priority, 5);
    EXPECT_EQ(clear[0].function, "Orvane::StreamBuffer::clearMediaData");

    // The stream resumes far past the boundary (1000): audio from 10000, video from 12000.
    rig.files->HoldNextCount();
    rig.files->SetCount(0);
    rig.buffer->ReceiveAudio(Audio(10000));  // audio alone at the boundary: an attempt
    ASSERT_TRUE(rig.files->WaitHeld());
    Stream stream{rig, 12000, 300};
    stream.nextAudio = 10020;
    stream.FeedAudioUntil(12000);
    stream.FeedUntil(13501);
    rig.files->Release();

    ASSERT_TRUE(rig.files->WaitFiles(13));
    const auto files = rig.files->Files();
    ASSERT_EQ(files.size(), 13u);
    for (size_t i = 0; i < files.size(); ++i) EXPECT_EQ(files[i].duration, 1000u) << i;
    for (size_t i = 0; i < 10; ++i) {  // boundaries 1000..10000: nothing below them
        EXPECT_TRUE(files[i].video.empty() && files[i].audio.empty() && files[i].meta.empty());
    }
    // Video begins after the boundary: the audio below it, no video.
    EXPECT_TRUE(files[10].video.empty());
    ASSERT_EQ(files[10].audio.size(), 50u);
    EXPECT_EQ(files[10].audio.front().timestamp, 10000u);
    EXPECT_TRUE(files[11].video.empty());  // the IDR at 12000 equals the cut: it stays
    EXPECT_EQ(files[11].audio.back().timestamp, 11980u);
    ASSERT_EQ(files[12].video.size(), 30u);
    EXPECT_EQ(files[12].video.front().timestamp, 12000u);
    EXPECT_EQ(files[12].audio.size(), 50u);

    // All in the one tick that was held: no tick line between the first and the last file.
    ASSERT_TRUE(rig.WaitLog("ST: DUMP LEN [1000, 12000]."));
    const auto after = rig.MessagesAfter("ST: DUMP LEN [1000, 0].");
    auto last = std::find(after.begin(), after.end(), "ST: DUMP LEN [1000, 12000].");
    ASSERT_NE(last, after.end());
    EXPECT_EQ(std::count_if(after.begin(), last,
                            [](const std::string& m) { return m.rfind("buffer_length", 0) == 0; }),
              0);
}

TEST(StreamBufferFiling, AudioAndMetaWithoutVideoCutNothingAndAreNotABacklog) {
    // Stream time far past ten intervals, but the held audio and meta span little.
    Rig rig(1, 10);
    rig.buffer->Start();
    for (uint64_t ts = 100000; ts <= 103000; ts += 20) rig.buffer->ReceiveAudio(Audio(ts));
    rig.buffer->ReceiveMeta(Meta(100500, 0));
    ASSERT_TRUE(rig.WaitLog("createStreamFileData.", 2));
    EXPECT_EQ(rig.files->Size(), 0u);
    EXPECT_FALSE(rig.log.Contains("Queue Clear."));
    EXPECT_TRUE(rig.observer.Warnings().empty());
}

TEST(StreamBufferFiling, HeldSamplesSpanningTenIntervalsAreCleared) {
    {
        // Audio and meta alone: the span is measured between their own samples.
        Rig rig(1, 10);
        rig.buffer->Start();
        rig.buffer->ReceiveAudio(Audio(100000));
        rig.buffer->ReceiveMeta(Meta(105000, 0));
        rig.buffer->ReceiveAudio(Audio(110000));
        ASSERT_TRUE(rig.WaitLog("input buffer overflow. buffer_size: 10000, threshold:10000."));
        EXPECT_EQ(
            rig.log.Find("input buffer overflow. buffer_size: 10000, threshold:10000.")[0].priority,
            5);
        ASSERT_TRUE(WaitUntil([&] { return !rig.observer.Warnings().empty(); }));
        EXPECT_EQ(rig.observer.Warnings()[0], 29u);
        EXPECT_TRUE(rig.log.Contains("Queue Clear."));
        EXPECT_EQ(rig.files->Size(), 0u);
    }
    for (uint64_t newest : {uint64_t{9999}, uint64_t{10000}}) {
        // One GOP from 0 to `newest`: exactly ten intervals is a backlog, less is filed.
        // The video goes in before the filing thread is released, so one tick sees it whole.
        Rig rig(1, 10);
        for (uint64_t ts = 0; ts < newest; ts += 100)
            rig.buffer->ReceiveVideo(MakeVideo(ts, ts == 0));
        rig.buffer->ReceiveVideo(MakeVideo(newest, false));
        rig.buffer->Start();
        rig.buffer->ReceiveMeta(Meta(5000, 0));
        if (newest == 10000) {
            ASSERT_TRUE(WaitUntil([&] { return !rig.observer.Warnings().empty(); }));
            EXPECT_TRUE(
                rig.log.Contains("input buffer overflow. buffer_size: 10000, threshold:10000."));
            EXPECT_EQ(rig.files->Size(), 0u);
        } else {
            ASSERT_TRUE(rig.files->WaitFiles(1));
            EXPECT_EQ(rig.files->Files()[0].video.size(), 10u);
            EXPECT_TRUE(rig.observer.Warnings().empty());
        }
    }
}

TEST(StreamBufferFiling, BackedUpFileBufferWinsOverTheSpanTest) {
    // bufferFullSize 0: both limits are 0, every attempt ends in "BufferOver" only.
    Rig rig(1, 0);
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(0));
    rig.buffer->ReceiveAudio(Audio(50000));
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.Statuses().size() >= 2; }));
    EXPECT_TRUE(rig.observer.Warnings().empty());
    EXPECT_TRUE(rig.log.Contains("buffer_length : 0 / 0\n"));
    EXPECT_EQ(rig.files->Size(), 0u);
}

TEST(StreamBufferFiling, StalledStreamIsFiledOnceWallTimeRunsAhead) {
    Rig rig(1, 2);  // wall-time limit 2000 ms
    rig.buffer->Start();
    Stream stream{rig, 0, 4, 50, 1};  // frames every 50 ms, IDR every 200 ms
    stream.FeedUntil(501);
    ASSERT_TRUE(rig.WaitLog("500 < 1000"));
    EXPECT_TRUE(rig.log.Contains("buffer_length : 0 / 2000\n"));
    EXPECT_EQ(rig.files->Size(), 0u);

    rig.time->Advance(2000);
    ASSERT_TRUE(rig.files->WaitFiles(1));
    EXPECT_TRUE(rig.log.Contains("buffer_length : 2000 / 2000\n"));
    EXPECT_TRUE(rig.log.Contains("Internal Buffer length : 2000"));
    const VqStreamFileData file = rig.files->Files()[0];
    EXPECT_EQ(file.duration, 399u);  // up to the IDR at 400
    EXPECT_EQ(file.video.size(), 8u);
    // The filed time counts against the wall time: behind by 1601 now, no second file.
    ASSERT_TRUE(rig.WaitLog("buffer_length : 1601 / 2000\n"));
    ASSERT_TRUE(rig.WaitLog("500 < 1399"));
    EXPECT_EQ(rig.files->Size(), 1u);
}

TEST(StreamBufferFiling, StopWhileSleepingEndsAtOnce) {
    Rig rig(1, 10);
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(0));
    ASSERT_TRUE(rig.WaitLog("buffer_length : 0 / 10000\n"));
    // The tick's work is done: the thread now sleeps about 500 ms.
    const auto begin = std::chrono::steady_clock::now();
    rig.buffer->Stop();
    const auto took = std::chrono::steady_clock::now() - begin;
    EXPECT_LT(took, std::chrono::milliseconds(300));
    EXPECT_EQ(rig.log.Count("createStreamFile exit."), 1u);
}

// ---------------------------------------------------------------------------------------------
// Intake.

TEST(StreamBufferIntake, FirstIdrFixesTheOriginAndTrimsOlderAudioAndMeta) {
    Rig rig(1, 10, 700);
    rig.buffer->Start();
    rig.buffer->ReceiveAudio(Audio(900));
    rig.buffer->ReceiveMeta(Meta(950, 0));
    rig.buffer->ReceiveVideo(MakeVideo(950, false));  // before any IDR: dropped
    rig.buffer->ReceiveAudio(Audio(1000));
    rig.buffer->ReceiveMeta(Meta(1000, 0));
    rig.buffer->ReceiveVideo(MakeVideo(1000, true));
    rig.buffer->ReceiveVideo(MakeVideo(1500, true));  // a second IDR only opens a GOP
    rig.buffer->ReceiveVideo(MakeVideo(2100, false));
    rig.buffer->ReceiveAudio(Audio(2100));
    ASSERT_TRUE(rig.files->WaitFiles(1));

    EXPECT_TRUE(rig.log.Contains("idr none. [950]"));
    EXPECT_EQ(rig.log.Count("ST: real skip ignore time: 1000(90000)"), 1u);
    EXPECT_TRUE(rig.log.Contains("IDR: 135000"));
    const VqStreamFileData file = rig.files->Files()[0];
    // Origin 1000 (not the start ignore time 700): boundary 2000, cut before the IDR at 1500.
    EXPECT_EQ(file.duration, 499u);
    ASSERT_EQ(file.audio.size(), 1u);
    EXPECT_EQ(file.audio[0].timestamp, 1000u);
    ASSERT_EQ(file.meta.size(), 1u);
    EXPECT_EQ(file.meta[0].timestamp, 1000u);
    ASSERT_EQ(file.video.size(), 1u);
    EXPECT_EQ(file.video[0].timestamp, 1000u);
}

TEST(StreamBufferIntake, MetaBeforeStartIsWindowedAndDoesNotReleaseTheFilingThread) {
    Rig rig(1, 10);
    rig.buffer->Start();
    for (uint64_t rtp : {uint64_t{0}, uint64_t{100000}, uint64_t{200000}})
        rig.buffer->ReceiveMetaBeforeStart(Meta(1000 + rtp / 1000, rtp));
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
    // Stream time runs 20 times faster than real time; the filing thread cuts several files per
    // tick, and clears everything while the file buffer reports a backlog.
    constexpr uint64_t kSpeed = 20;
    constexpr uint64_t kEndMs = 50000;
    const auto begin = std::chrono::steady_clock::now();
    const auto pace = [begin](uint64_t ts) {
        std::this_thread::sleep_until(begin + std::chrono::microseconds(ts * 1000 / kSpeed));
    };
    std::thread video([&] {
        for (uint64_t k = 0; k * 100 / 3 < kEndMs; ++k) {
            const uint64_t ts = k * 100 / 3;
            pace(ts);
            rig.buffer->ReceiveVideo(MakeSample(ts, k, k % 15 == 0 ? H264Idr() : H264NonIdr()));
        }
    });
    std::thread audio([&] {
        for (uint64_t ts = 0; ts < kEndMs; ts += 20) {
            pace(ts);
            rig.buffer->ReceiveAudio(Audio(ts));
        }
    });
    std::thread meta([&] {
        for (uint64_t ts = 0; ts < kEndMs; ts += 100) {
            pace(ts);
            rig.buffer->ReceiveMeta(Meta(ts, ts));
        }
    });
    pace(kEndMs / 3);
    rig.files->SetCount(UINT64_MAX);
    pace(kEndMs * 2 / 3);
    rig.files->SetCount(0);
    video.join();
    audio.join();
    meta.join();
    rig.buffer->Stop();

    const auto files = rig.files->Files();
    ASSERT_FALSE(files.empty());
    EXPECT_FALSE(rig.observer.Statuses().empty());
    // Across all files each medium is in order without repeats, and a non-IDR frame always
    // follows its own predecessor: nothing was appended to a GOP that had been cleared.
    std::vector<StreamData> allVideo, allAudio, allMeta;
    for (const auto& file : files) {
        allVideo.insert(allVideo.end(), file.video.begin(), file.video.end());
        allAudio.insert(allAudio.end(), file.audio.begin(), file.audio.end());
        allMeta.insert(allMeta.end(), file.meta.begin(), file.meta.end());
    }
    ASSERT_FALSE(allVideo.empty());
    EXPECT_EQ(allVideo.front().rtpTime % 15, 0u);
    for (size_t i = 1; i < allVideo.size(); ++i) {
        ASSERT_LT(allVideo[i - 1].rtpTime, allVideo[i].rtpTime);
        if (allVideo[i].rtpTime % 15 != 0) {
            ASSERT_EQ(allVideo[i - 1].rtpTime + 1, allVideo[i].rtpTime);
        }
    }
    for (const auto* list : {&allAudio, &allMeta}) {
        for (size_t i = 1; i < list->size(); ++i) {
            ASSERT_LT((*list)[i - 1].timestamp, (*list)[i].timestamp);
        }
    }
}

TEST(StreamBufferConcurrency, FirstIdrTrimmingKeepsSamplesAtTheIdrTimestamp) {
    for (int round = 0; round < 5; ++round) {
        Rig rig(1, 10);
        rig.buffer->Start();
        std::atomic<uint64_t> audioSent{0}, metaSent{0};
        std::thread audio([&] {
            for (uint64_t ts = 0; ts <= 2000; ts += 10) {
                rig.buffer->ReceiveAudio(Audio(ts));
                audioSent = ts;
            }
        });
        std::thread meta([&] {
            for (uint64_t ts = 0; ts <= 2000; ts += 10) {
                rig.buffer->ReceiveMeta(Meta(ts, ts));
                metaSent = ts;
            }
        });
        std::thread video([&] {
            for (uint64_t ts = 0; ts <= 2000; ts += 10) {
                // Past the boundary (1500) only once audio and meta are there too, so the first
                // file is cut with everything up to it held.
                if (ts == 1500) WaitUntil([&] { return audioSent >= 1500 && metaSent >= 1500; });
                rig.buffer->ReceiveVideo(MakeVideo(ts, ts == 500 || ts == 1200));
            }
        });
        audio.join();
        meta.join();
        video.join();
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

TEST(StreamBufferConcurrency, StopRightAfterStartReturns) {
    for (int round = 0; round < 20; ++round) {
        Rig rig(1, 10);
        auto done = std::async(std::launch::async, [&] {
            rig.buffer->Start();
            if (round % 2) rig.buffer->ReceiveAudio(Audio(0));
            rig.buffer->Stop();
        });
        ASSERT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
        EXPECT_EQ(rig.log.Count("createStreamFile exit."), 1u);
    }
}

TEST(StreamBufferConcurrency, StopFromTwoThreadsAtOnceAndOutOfOrder) {
    {
        Rig rig(1, 10);
        rig.buffer->Stop();  // before Start
        rig.buffer->Stop();
        EXPECT_EQ(rig.log.Count("Stop enter."), 2u);
        EXPECT_EQ(rig.log.Count("Stop exit."), 2u);
    }
    for (int round = 0; round < 10; ++round) {
        Rig rig(1, 10);
        rig.buffer->Start();
        if (round % 2) {
            rig.buffer->ReceiveAudio(Audio(0));
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
        rig.buffer->Stop();  // and once more, after both
        EXPECT_EQ(rig.log.Count("createStreamFile exit."), 1u);
        EXPECT_EQ(rig.log.Count("Stop exit."), 3u);
    }
}

}  // namespace
}  // namespace Orvane
