// StreamBuffer at the end of the stream: everything still held becomes stream files, so that
// a stream that ends is stored to its last sample. Runs on the caller's thread under the
// filing mutex, so it never interleaves with a tick of the filing thread.
#include <algorithm>

#include "platform/logger/Logger.h"
#include "src/StreamBuffer.h"

namespace Orvane {

bool StreamBuffer::newestHeld(uint64_t& newest) {
    bool any = false;
    auto consider = [&](uint64_t timestamp) {
        newest = any ? std::max(newest, timestamp) : timestamp;
        any = true;
    };
    {
        std::lock_guard<std::mutex> lock(gopMutex_);
        for (const GOP& gop : gops_) {
            if (!gop.empty()) consider(gop.back()->timestamp);
        }
    }
    {
        std::lock_guard<std::mutex> lock(audioMutex_);
        if (!audio_.empty()) consider(audio_.back()->timestamp);
    }
    {
        std::lock_guard<std::mutex> lock(metaMutex_);
        if (!meta_.empty()) consider(meta_.back()->timestamp);
    }
    return any;
}

void StreamBuffer::CutRemaining() {
    boost::unique_lock<boost::mutex> lock(filingMutex_);
    // Nothing is recorded before the first IDR, and nothing more after a stop.
    if (stop_.load() || firstIdrPending_.load() || !filingStarted_) return;
    Logger::Put(11, "src/StreamBuffer", "Orvane::StreamBuffer::CutRemaining", __LINE__,
                "CutRemaining enter.");
    // Files that are due already are cut by the usual rule first, as the next tick would.
    if (isFilingDue()) {
        filing();
        catchUp();
    }
    uint64_t newest = 0;
    if (newestHeld(newest)) {
        VqStreamFileData file;
        takeSamplesBelow(file, newest + 1);  // the newest sample is part of the last file
        if (!file.IsEmpty()) {
            fileBuffer_->Push(file);
            dumpStreamFile(file);
        }
        filedTime_ += file.duration;
    }
    Logger::Put(11, "src/StreamBuffer", "Orvane::StreamBuffer::CutRemaining", __LINE__,
                "CutRemaining exit.");
}

}  // namespace Orvane
