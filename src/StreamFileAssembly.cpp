// StreamBuffer's stream file assembly: applies the cut rule (CutRule.h) to the holding lists and
// moves the samples it names into the file. Runs only on the filing thread (or the drain, under
// the filing mutex).
#include <algorithm>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/logger/Logger.h"
#include "src/StreamBuffer.h"

namespace Orvane {

namespace {
const char kFile[] = "src/StreamBuffer";
const char kCreateStreamFileData[] = "Orvane::StreamBuffer::createStreamFileData";

std::vector<uint64_t> timestampsOf(const std::vector<std::shared_ptr<StreamData>>& samples) {
    std::vector<uint64_t> timestamps;
    timestamps.reserve(samples.size());
    for (const auto& sample : samples) timestamps.push_back(sample->timestamp);
    return timestamps;
}

// The list's timestamps, copied in one holding of its lock.
std::vector<uint64_t> heldTimestamps(std::mutex& mutex,
                                     const std::vector<std::shared_ptr<StreamData>>& list) {
    std::lock_guard<std::mutex> lock(mutex);
    return timestampsOf(list);
}
}  // namespace

void StreamBuffer::createStreamFileData(VqStreamFileData& file) {
    Logger::Put(12, kFile, kCreateStreamFileData, __LINE__, "createStreamFileData.");
    assemble(file, std::nullopt);
}

void StreamBuffer::takeSamplesBelow(VqStreamFileData& file, uint64_t cut) {
    assemble(file, cut);
}

void StreamBuffer::assemble(VqStreamFileData& file, std::optional<uint64_t> fixedCut) {
    CutInput in;
    in.interval = intervalLength_;
    in.audio = heldTimestamps(audioMutex_, audio_);
    in.meta = heldTimestamps(metaMutex_, meta_);
    CutPlan plan;
    {
        // Decision and video move in one holding of the GOP lock, so ReceiveVideo never sees a
        // half-moved GOP. Only this thread removes from the lists; intake only appends, so the
        // plan's front counts stay valid for audio and meta after their copies were taken.
        std::lock_guard<std::mutex> lock(gopMutex_);
        in.fileStart = recordingOrigin_.load() + filedTime_;
        in.gops.reserve(gops_.size());
        for (const GOP& gop : gops_) in.gops.push_back(timestampsOf(gop));
        in.startsWithIdr = [this](size_t i) { return nalAnalyzer_->IsIDR(gops_[i].front()); };
        plan = fixedCut ? PlanCut(in, *fixedCut) : DecideCut(in);
        if (!fixedCut && plan.cut == 0) return;  // no file now; `file` stays empty
        file.duration = plan.duration;
        takeVideo(file, plan);
    }

    takeListFront(audioMutex_, audio_, file.audio, plan.audio);
    if (plan.audio < in.audio.size())
        Logger::Put(13, kFile, kCreateStreamFileData, __LINE__, "push complete[a].");
    takeListFront(metaMutex_, meta_, file.meta, plan.meta);
    if (plan.meta < in.meta.size())
        Logger::Put(13, kFile, kCreateStreamFileData, __LINE__, "push complete[m].");

    Logger::Put(11, nullptr, nullptr, 0, "ST: V:%zu, A:%zu, M:%zu, d:%u, max:%llu ",
                file.video.size(), file.audio.size(), file.meta.size(), file.duration,
                static_cast<unsigned long long>(plan.cut));
}

void StreamBuffer::takeVideo(VqStreamFileData& file, const CutPlan& plan) {
    for (size_t g = 0; g < plan.wholeGops; ++g) {
        for (const auto& sample : gops_.front()) file.video.push_back(*sample);
        // A GOP that an earlier cut split is now filed to its end.
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
    if (gops_.empty()) return;

    // The cut fell inside the front GOP or at its start: it stays held with the rest.
    GOP& gop = gops_.front();
    for (size_t k = 0; k < plan.splitTaken; ++k) file.video.push_back(*gop[k]);
    gop.erase(gop.begin(), gop.begin() + static_cast<std::ptrdiff_t>(plan.splitTaken));
    Logger::Put(13, kFile, kCreateStreamFileData, __LINE__, "push complete[v].");
    if (plan.wholeGops == 0 && !file.video.empty() && !fragment_.open) {
        fragment_.open = true;
        fragment_.firstRtpTime = file.video.front().rtpTime;
        fragment_.total = file.video.size();
        fragment_.counts.assign(1, file.video.size());
    }
}

void StreamBuffer::takeListFront(std::mutex& mutex, SampleList& list, std::vector<StreamData>& out,
                                 size_t count) {
    // Only this thread removes from the list and intake only appends, so the index stays valid
    // between the holdings; the moved references are released together at the end.
    for (size_t k = 0; k < count; ++k) {
        std::lock_guard<std::mutex> lock(mutex);
        out.push_back(*list[k]);
    }
    if (count == 0) return;
    std::lock_guard<std::mutex> lock(mutex);
    list.erase(list.begin(), list.begin() + static_cast<std::ptrdiff_t>(count));
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
