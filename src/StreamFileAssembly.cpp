// StreamBuffer's cut rule and stream file assembly: where the next file ends, and moving the
// held samples below that point into it. Runs only on the filing thread.
#include <algorithm>
#include <string>

#include "platform/logger/Logger.h"
#include "src/StreamBuffer.h"

namespace Orvane {

namespace {
const char kFile[] = "src/StreamBuffer";
const char kCreateStreamFileData[] = "Orvane::StreamBuffer::createStreamFileData";
}  // namespace

uint64_t StreamBuffer::calculateCutTime() {
    std::lock_guard<std::mutex> lock(gopMutex_);
    if (gops_.empty()) return 0;  // no file without video, even if audio is held
    const uint64_t boundary = fileBoundary();
    const uint64_t interval = static_cast<uint64_t>(static_cast<int64_t>(intervalLength_));
    const size_t n = gops_.size();
    bool firstSet = false;
    uint64_t first = 0;  // timestamp of the oldest held GOP's first sample

    for (size_t i = 0; i + 1 < n; ++i) {
        const GOP& gop = gops_[i];
        const uint64_t last = gop.back()->timestamp;
        if (last >= boundary) {
            // The oldest GOP already reaches past the boundary: split it there.
            if (!firstSet) return boundary;
            // The held video began well after the previous cut: run on into this GOP.
            if (last - first < interval) return last;
            // Otherwise end just before this GOP.
            return std::min(gop.front()->timestamp - 1, boundary);
        }
        if (!firstSet) {
            first = gop.front()->timestamp;
            firstSet = true;
        }
        // The remainder of a split GOP: this file takes it whole and no more.
        if (!nalAnalyzer_->IsIDR(gop.front())) return std::min(last + 1, boundary);
    }

    const GOP& growing = gops_.back();
    // Every older GOP ends before the boundary: take them all, end before the growing GOP.
    if (firstSet) return growing.front()->timestamp - 1;
    // A single GOP: split it at the boundary once it reaches past it.
    return growing.back()->timestamp > boundary ? boundary : 0;
}

void StreamBuffer::createStreamFileData(VqStreamFileData& file) {
    Logger::Put(12, kFile, kCreateStreamFileData, __LINE__, "createStreamFileData.");
    const uint64_t cut = calculateCutTime();
    if (cut == 0) return;  // no file now; `file` stays empty
    takeSamplesBelow(file, cut);
}

void StreamBuffer::takeSamplesBelow(VqStreamFileData& file, uint64_t cut) {
    file.duration = static_cast<uint32_t>(cut) - static_cast<uint32_t>(recordingOrigin_.load()) -
                    static_cast<uint32_t>(filedTime_);

    {
        // Video: the GOP lock for the whole step, so ReceiveVideo never sees a half-moved GOP.
        std::lock_guard<std::mutex> lock(gopMutex_);
        size_t visited = 0;
        while (!gops_.empty()) {
            GOP& gop = gops_.front();
            ++visited;
            size_t taken = 0;
            while (taken < gop.size() && gop[taken]->timestamp < cut) {
                file.video.push_back(*gop[taken]);
                ++taken;
            }
            gop.erase(gop.begin(), gop.begin() + static_cast<std::ptrdiff_t>(taken));
            if (!gop.empty()) {
                // The cut fell inside this GOP or at its start.
                Logger::Put(13, kFile, kCreateStreamFileData, __LINE__, "push complete[v].");
                if (visited == 1 && !file.video.empty() && !fragment_.open) {
                    fragment_.open = true;
                    fragment_.firstRtpTime = file.video.front().rtpTime;
                    fragment_.total = file.video.size();
                    fragment_.counts.assign(1, file.video.size());
                }
                break;
            }
            if (fragment_.open && !file.video.empty()) {
                fragment_.total += file.video.size();
                fragment_.counts.push_back(file.video.size());
                if (Logger::Enabled(11)) {
                    std::string counts;
                    for (uint64_t count : fragment_.counts) {
                        if (!counts.empty()) counts += '/';
                        counts += std::to_string(count);
                    }
                    Logger::Put(11, nullptr, nullptr, 0, "FRAGMENT GOP: %llu, %zu (%s)",
                                static_cast<unsigned long long>(fragment_.firstRtpTime),
                                static_cast<size_t>(fragment_.total), counts.c_str());
                }
                fragment_ = Fragment();
            }
            gops_.erase(gops_.begin());
        }
    }

    takeListBelow(audioMutex_, audio_, file.audio, cut, "push complete[a].");
    takeListBelow(metaMutex_, meta_, file.meta, cut, "push complete[m].");

    Logger::Put(11, nullptr, nullptr, 0, "ST: V:%zu, A:%zu, M:%zu, d:%u, max:%llu ",
                file.video.size(), file.audio.size(), file.meta.size(), file.duration,
                static_cast<unsigned long long>(cut));
}

void StreamBuffer::takeListBelow(std::mutex& mutex, SampleList& list, std::vector<StreamData>& out,
                                 uint64_t cut, const char* doneMessage) {
    // One lock per moved sample, so the receive operation waits at most one move. Only this
    // thread removes from the list and intake only appends, so the index stays valid between
    // the holdings; the moved references are released together at the end.
    size_t taken = 0;
    for (;;) {
        std::lock_guard<std::mutex> lock(mutex);
        if (taken == list.size()) break;
        if (list[taken]->timestamp >= cut) {
            Logger::Put(13, kFile, kCreateStreamFileData, __LINE__, "%s", doneMessage);
            break;
        }
        out.push_back(*list[taken]);
        ++taken;
    }
    if (taken == 0) return;
    std::lock_guard<std::mutex> lock(mutex);
    list.erase(list.begin(), list.begin() + static_cast<std::ptrdiff_t>(taken));
}

void StreamBuffer::dumpStreamFile(const VqStreamFileData& file) {
    Logger::Put(12, nullptr, nullptr, 0, "ST: DUMP LEN [%u, %llu].", file.duration,
                static_cast<unsigned long long>(filedTime_));
    const auto dump = [](const char* label, const std::vector<StreamData>& list) {
        if (list.empty()) return;
        const StreamData& first = list.front();
        const StreamData& last = list.back();
        Logger::Put(12, nullptr, nullptr, 0, "DUMP: [%s] [%llu, %llu - %llu/%llu(%llu)].", label,
                    static_cast<unsigned long long>(list.size()),
                    static_cast<unsigned long long>(first.rtpTime),
                    static_cast<unsigned long long>(last.rtpTime),
                    static_cast<unsigned long long>(last.rtpTime - first.rtpTime),
                    static_cast<unsigned long long>(last.timestamp - first.timestamp));
    };
    dump("A", file.audio);
    dump("V", file.video);
    dump("M", file.meta);
}

}  // namespace Orvane
