// StreamBuffer's filing thread: the tick, the decision to file, catching up, and the two
// overload guards (file buffer backlog, holding-list backlog). Runs only on the filing thread.
#include <algorithm>
#include <boost/chrono.hpp>
#include <map>
#include <string>

#include "platform/logger/Logger.h"
#include "src/StreamBuffer.h"

namespace Orvane {

namespace {
const char kFile[] = "src/StreamBuffer";
const char kCreateStreamFile[] = "Orvane::StreamBuffer::createStreamFile";
constexpr int32_t kTickMs = 500;
// Warning code sent when the held samples span ten intervals or more.
constexpr unsigned int kInputOverflowWarning = 29;

// Signed 32-bit products wrap like the tick arithmetic they are compared with (no UB).
int32_t mul32(int32_t a, int32_t b) {
    return static_cast<int32_t>(static_cast<uint32_t>(a) * static_cast<uint32_t>(b));
}
// A signed 32-bit limit compared with an unsigned 64-bit count: widened with its sign, so a
// negative limit becomes a value no count reaches.
uint64_t widen(int32_t value) {
    return static_cast<uint64_t>(static_cast<int64_t>(value));
}
}  // namespace

void StreamBuffer::publishBoundary() {
    videoNudged_.store(false, std::memory_order_relaxed);
    audioNudged_.store(false, std::memory_order_relaxed);
    nextBoundary_.store(fileBoundary(), std::memory_order_relaxed);
}

uint64_t StreamBuffer::fileBoundary() const {
    return recordingOrigin_.load() + filedTime_ + widen(intervalLength_);
}

void StreamBuffer::createStreamFile() {
    Logger::Put(11, kFile, kCreateStreamFile, __LINE__, "createStreamFile enter.");
    intervalLength_ = mul32(settings_.uploadInterval, 1000);
    bufferLengthLimit_ = mul32(intervalLength_, settings_.bufferFullSize);
    {
        boost::unique_lock<boost::mutex> lock(filingMutex_);
        dataWait_.wait(lock, [this] { return stop_.load() || dataReceived_.load(); });
        filingStarted_ = true;  // the interval and limits above are set from now on
    }
    publishBoundary();
    // Wall time counts from the first sample on.
    const uint32_t startTick = timeManager_->GetTime();
    uint32_t workTime = 0;  // ms the previous tick's work took

    for (;;) {
        if (stop_) {
            Logger::Put(11, kFile, kCreateStreamFile, __LINE__, "createStreamFile exit.");
            return;
        }
        boost::unique_lock<boost::mutex> lock(filingMutex_);
        // Shorten the sleep by the last tick's work. A tick source that stepped back would give a
        // negative work time and stretch the sleep; count it as no work instead.
        const int32_t work = std::max<int32_t>(0, static_cast<int32_t>(workTime));
        const auto deadline =
            boost::chrono::steady_clock::now() + boost::chrono::milliseconds(kTickMs - work);
        tickWait_.wait_until(lock, deadline, [this] { return stop_.load() || nudge_.load(); });
        nudge_.store(false);

        const uint32_t now = timeManager_->GetTime();
        calculateInternalBufferSize(now, startTick);
        Logger::Put(13, kFile, kCreateStreamFile, __LINE__, "buffer_length : %d / %d\n",
                    internalBufferLength_, bufferLengthLimit_);
        if (isFilingDue()) {
            filing();
            catchUp();
        }
        lock.unlock();
        publishBoundary();
        if (tickHook_) tickHook_();
        workTime = timeManager_->GetTime() - now;
    }
}

void StreamBuffer::calculateInternalBufferSize(uint32_t now, uint32_t startTick) {
    const uint32_t behind = now - startTick - static_cast<uint32_t>(filedTime_);
    internalBufferLength_ = std::max<int32_t>(0, static_cast<int32_t>(behind));
    Logger::Put(13, kFile, "Orvane::StreamBuffer::calculateInternalBufferSize", __LINE__,
                "Internal Buffer length : %d", internalBufferLength_);
}

bool StreamBuffer::isFilingDue() {
    if (internalBufferLength_ >= bufferLengthLimit_) return true;
    const uint64_t boundary = fileBoundary();

    bool videoHeld = false;
    unsigned long long newestVideo = 0;
    {
        std::lock_guard<std::mutex> lock(gopMutex_);
        if (!gops_.empty() && !gops_.back().empty()) {
            videoHeld = true;
            newestVideo = gops_.back().back()->timestamp;
        }
    }
    if (videoHeld && newestVideo < boundary) {
        Logger::Put(13, kFile, kCreateStreamFile, __LINE__, "%llu < %llu", newestVideo,
                    static_cast<unsigned long long>(boundary));
        return false;
    }

    bool audioHeld = false;
    unsigned long long newestAudio = 0;
    {
        std::lock_guard<std::mutex> lock(audioMutex_);
        if (!audio_.empty()) {
            audioHeld = true;
            newestAudio = audio_.back()->timestamp;
        }
    }
    if (!audioHeld) return videoHeld;  // nothing held at all: no file; video alone decides
    if (newestAudio < boundary) {
        Logger::Put(13, kFile, kCreateStreamFile, __LINE__, "%llu < %llu", newestAudio,
                    static_cast<unsigned long long>(boundary));
        return false;
    }
    return true;
}

void StreamBuffer::catchUp() {
    while (!stop_) {
        const uint64_t boundary = fileBoundary();
        const auto beyond = [boundary](const std::shared_ptr<StreamData>& s) {
            return s->timestamp > boundary;
        };
        {
            std::lock_guard<std::mutex> lock(audioMutex_);
            // Newest first: with ordered timestamps the answer is at the back.
            if (audio_.empty() || std::none_of(audio_.rbegin(), audio_.rend(), beyond)) return;
        }
        {
            std::lock_guard<std::mutex> lock(gopMutex_);
            if (gops_.empty() ||
                std::none_of(gops_.rbegin(), gops_.rend(), [&beyond](const GOP& gop) {
                    return !gop.empty() && beyond(gop.back());
                }))
                return;
        }
        if (!filing()) return;
    }
}

bool StreamBuffer::filing() {
    const int32_t fileBufferLimit = mul32(mul32(settings_.bufferFullSize, intervalLength_), 10);
    if (fileBuffer_->GetBufferCount() >= widen(fileBufferLimit)) {
        clearMediaData();
        if (observer_) observer_->notifyTransmissionStatus({{"UploadInfo", "BufferOver"}});
        return false;
    }

    const int32_t spanLimit = mul32(intervalLength_, 10);
    const unsigned long long span = heldSpan();
    if (span >= widen(spanLimit)) {
        Logger::Put(5, kFile, "Orvane::StreamBuffer::filing", __LINE__,
                    "input buffer overflow. buffer_size: %llu, threshold:%d.", span, spanLimit);
        clearMediaData();
        if (observer_) observer_->notifyModuleWarn(kInputOverflowWarning);
        return false;
    }

    VqStreamFileData file;
    createStreamFileData(file);
    const bool pushed = !file.IsEmpty();
    if (pushed) {
        fileBuffer_->Push(file);
        dumpStreamFile(file);
    }
    filedTime_ += file.duration;
    return pushed;
}

uint64_t StreamBuffer::heldSpan() {
    // Earliest and latest over every list that holds something. With no GOP held the earliest
    // time comes from audio and meta, so audio-only stream time far from 0 is not a backlog.
    bool any = false;
    uint64_t earliest = 0;
    uint64_t latest = 0;
    const auto include = [&](uint64_t first, uint64_t last) {
        earliest = any ? std::min(earliest, first) : first;
        latest = any ? std::max(latest, last) : last;
        any = true;
    };
    {
        std::lock_guard<std::mutex> lock(gopMutex_);
        if (!gops_.empty() && !gops_.front().empty() && !gops_.back().empty())
            include(gops_.front().front()->timestamp, gops_.back().back()->timestamp);
    }
    {
        std::lock_guard<std::mutex> lock(audioMutex_);
        if (!audio_.empty()) include(audio_.front()->timestamp, audio_.back()->timestamp);
    }
    {
        std::lock_guard<std::mutex> lock(metaMutex_);
        if (!meta_.empty()) include(meta_.front()->timestamp, meta_.back()->timestamp);
    }
    return latest - earliest;
}

void StreamBuffer::clearMediaData() {
    Logger::Put(5, kFile, "Orvane::StreamBuffer::clearMediaData", __LINE__, "Queue Clear.");
    {
        std::lock_guard<std::mutex> lock(audioMutex_);
        audio_.clear();
    }
    {
        std::lock_guard<std::mutex> lock(gopMutex_);
        gops_.clear();
    }
    {
        std::lock_guard<std::mutex> lock(metaMutex_);
        meta_.clear();
    }
}

}  // namespace Orvane
