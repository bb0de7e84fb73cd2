// StreamBuffer construction, Start/Stop and the intake side (the receive operations).
#include "src/StreamBuffer.h"

#include <algorithm>
#include <utility>

#include "platform/logger/Logger.h"

namespace Orvane {

namespace {
const char kFile[] = "src/StreamBuffer";
// rtpTime units of meta kept before filing starts.
constexpr uint64_t kMetaWindow = 180000;
}  // namespace

StreamBuffer::StreamBuffer(INotifyObserver* observer, std::shared_ptr<IFileBuffer> fileBuffer,
                           std::shared_ptr<ITimeManager> timeManager,
                           std::shared_ptr<INalAnalyzer> nalAnalyzer, ModuleSettings settings)
    : observer_(observer),
      fileBuffer_(std::move(fileBuffer)),
      timeManager_(std::move(timeManager)),
      nalAnalyzer_(std::move(nalAnalyzer)),
      settings_(std::move(settings)),
      recordingOrigin_(static_cast<uint64_t>(static_cast<int64_t>(settings_.startIgnoreTime))) {}

// A lock or join that fails here is a broken invariant with nothing sound left to do: the
// terminate (and its crash report) that an exception leaving a destructor causes is intended.
// NOLINTNEXTLINE(bugprone-exception-escape)
StreamBuffer::~StreamBuffer() {
    std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
    if (!filingThread_.joinable()) return;
    {
        boost::lock_guard<boost::mutex> lock(filingMutex_);
        stop_ = true;
    }
    dataWait_.notify_all();
    tickWait_.notify_all();
    filingThread_.join();
}

void StreamBuffer::Start() {
    Logger::Put(11, kFile, "Orvane::StreamBuffer::Start", __LINE__, "Start enter.");
    {
        std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
        if (!filingThread_.joinable()) {
            stop_ = false;
            dataReceived_ = false;
            firstIdrPending_ = true;
            filingThread_ = std::thread(&StreamBuffer::createStreamFile, this);
        }
    }
    Logger::Put(11, kFile, "Orvane::StreamBuffer::Start", __LINE__, "Start exit.");
}

void StreamBuffer::Stop() {
    Logger::Put(11, kFile, "Orvane::StreamBuffer::Stop", __LINE__, "Stop enter.");
    {
        // A concurrent Stop waits here until the first has joined, then finds nothing to join.
        std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
        {
            // Under the filing mutex: a filing thread that has just tested the flag is not yet
            // waiting, and will see it before it waits.
            boost::lock_guard<boost::mutex> lock(filingMutex_);
            stop_ = true;
        }
        if (filingThread_.joinable()) {
            dataWait_.notify_all();
            tickWait_.notify_all();
            filingThread_.join();
        }
    }
    Logger::Put(11, kFile, "Orvane::StreamBuffer::Stop", __LINE__, "Stop exit.");
}

void StreamBuffer::signalFirstSample() {
    if (dataReceived_.load(std::memory_order_acquire)) return;
    {
        boost::lock_guard<boost::mutex> lock(filingMutex_);
        dataReceived_ = true;
    }
    dataWait_.notify_all();
}

void StreamBuffer::dropOlderThan(SampleList& list, uint64_t timestamp) {
    list.erase(std::remove_if(list.begin(), list.end(),
                              [timestamp](const std::shared_ptr<StreamData>& s) {
                                  return s->timestamp < timestamp;
                              }),
               list.end());
}

void StreamBuffer::ReceiveVideo(std::shared_ptr<StreamData> sample) {
    signalFirstSample();
    // Parsing happens outside every lock of ours so that a large access unit never holds up
    // the filing thread.
    const bool idr = nalAnalyzer_->IsIDR(sample);
    const unsigned long long timestamp = sample->timestamp;

    std::unique_lock<std::mutex> gopLock(gopMutex_);
    if (!idr) {
        // The emptiness test and the append share one holding of the GOP lock: a clearing by
        // the filing thread cannot come between them.
        if (gops_.empty()) {
            Logger::Put(13, kFile, "Orvane::StreamBuffer::ReceiveVideo", __LINE__,
                        "idr none. [%llu]", timestamp);
            return;
        }
        gops_.back().push_back(std::move(sample));
        Logger::Put(13, kFile, "Orvane::StreamBuffer::ReceiveVideo", __LINE__,
                    "add non idr. [%llu]", timestamp);
        return;
    }

    const unsigned long long rtpTime = sample->rtpTime;
    Logger::Put(11, nullptr, nullptr, 0, "IDR: %llu", rtpTime);
    gops_.emplace_back();
    gops_.back().push_back(std::move(sample));
    if (firstIdrPending_.load(std::memory_order_relaxed)) {
        recordingOrigin_ = timestamp;
        Logger::Put(11, nullptr, nullptr, 0, "ST: real skip ignore time: %llu(%llu)", timestamp,
                    rtpTime);
        {
            std::lock_guard<std::mutex> audioLock(audioMutex_);
            dropOlderThan(audio_, timestamp);
        }
        {
            std::lock_guard<std::mutex> metaLock(metaMutex_);
            dropOlderThan(meta_, timestamp);
        }
        firstIdrPending_ = false;
    }
    gopLock.unlock();
    if (timestamp >= nextBoundary_.load(std::memory_order_relaxed)) nudgeFiling(videoNudged_);
}

void StreamBuffer::ReceiveAudio(std::shared_ptr<StreamData> sample) {
    signalFirstSample();
    const uint64_t timestamp = sample->timestamp;
    {
        std::lock_guard<std::mutex> lock(audioMutex_);
        audio_.push_back(std::move(sample));
    }
    if (timestamp >= nextBoundary_.load(std::memory_order_relaxed)) nudgeFiling(audioNudged_);
}

void StreamBuffer::nudgeFiling(std::atomic<bool>& nudged) {
    if (nudged.exchange(true, std::memory_order_relaxed)) return;
    // Without the filing mutex, which a tick holds throughout: the intake never waits for a
    // tick. A nudge that comes just before the filing thread waits is lost, which only costs
    // what the nudge would have saved (the wait ends at the tick's deadline anyway).
    nudge_.store(true);
    tickWait_.notify_all();
}

void StreamBuffer::ReceiveMeta(std::shared_ptr<StreamData> sample) {
    signalFirstSample();
    std::lock_guard<std::mutex> lock(metaMutex_);
    meta_.push_back(std::move(sample));
}

void StreamBuffer::ReceiveMetaBeforeStart(std::shared_ptr<StreamData> sample) {
    const uint64_t newest = sample->rtpTime;
    std::lock_guard<std::mutex> lock(metaMutex_);
    meta_.push_back(std::move(sample));
    meta_.erase(std::remove_if(meta_.begin(), meta_.end(),
                               [newest](const std::shared_ptr<StreamData>& s) {
                                   return s->rtpTime + kMetaWindow < newest;
                               }),
                meta_.end());
}

}  // namespace Orvane
