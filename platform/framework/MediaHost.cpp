#include "platform/framework/MediaHost.h"

extern "C" {
#include <libavutil/mathematics.h>
}

#include <algorithm>
#include <csignal>
#include <functional>
#include <utility>
#include <vector>

#include "platform/framework/FfmpegLog.h"
#include "platform/framework/HostCredentials.h"
#include "platform/framework/Pacer.h"
#include "platform/framework/SignalHandling.h"
#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/framework/MediaHost";

// µs on the shared clock → the track's media clock, in two's complement when negative.
uint64_t toMediaClock(int64_t micros, uint32_t clockRate) {
    return static_cast<uint64_t>(
        av_rescale_rnd(micros, clockRate, 1000000, static_cast<AVRounding>(AV_ROUND_NEAR_INF)));
}

}  // namespace

MediaHost::MediaHost(FrameworkOptions options, bool handleSignals)
    : options_(std::move(options)),
      live_(MediaInput::IsLive(options_.input)),
      handleSignals_(handleSignals),
      shownInput_(MediaInput::Redacted(options_.input)),
      credentials_(std::make_unique<HostCredentials>(options_)),
      tokens_(
          [this] {
              if (process_) deliverCredentials(*process_, "on a token request", true);
          },
          [] { credentials::StopCommands(); }) {
    RouteFfmpegLogToLogger();
}

MediaHost::~MediaHost() {
    Stop();
    if (receiver_.joinable()) receiver_.join();
    tokens_.Stop();
}

void MediaHost::Stop() {
    stop_.Raise();
}

bool MediaHost::Prepare(BaseProcess& process) {
    process_ = &process;
    input_ = std::make_unique<MediaInput>(options_.input, live_, stop_);
    std::string error;
    if (!input_->Open(&error)) {
        Logger::Put(4, kFile, "MediaHost::Prepare", __LINE__, "%s", error.c_str());
        input_.reset();
        return false;
    }
    if (!process.checkInput(InputInfo{input_->VideoCodec()})) {
        input_.reset();
        return false;
    }
    realStartMicros_ = input_->RealStartMicros();
    Logger::Put(11, kFile, "MediaHost::Prepare", __LINE__, "recording %s input \"%s\"",
                live_ ? "live" : "file", shownInput_.c_str());
    return true;
}

void MediaHost::Run(BaseProcess& process) {
    constexpr const char* fn = "MediaHost::Run";
    std::unique_ptr<SignalHandling> signals;
    if (handleSignals_) {
        signals = std::make_unique<SignalHandling>([this](int signo) {
            Logger::Put(11, kFile, "MediaHost::Run", __LINE__,
                        "%s received: storing what is held, then ending (send it again to end "
                        "at once)",
                        signo == SIGINT ? "SIGINT" : "SIGTERM");
            Stop();
        });
    }

    ConnectResponse reply;
    process.notifyModuleConnectionRequestReply(reply);
    deliverCredentials(process, "after the connection reply", false);
    credentials_->StartRenewing([&process](const credentials::Result& renewed) {
        handOver(process, renewed, "before the credentials expire");
    });

    if (input_) {
        receiver_ = std::thread([this, &process] { receive(process); });
        receiver_.join();
    }
    Logger::Put(11, kFile, fn, __LINE__,
                "input ends (%s): %llu samples delivered, %llu packets without timestamp "
                "dropped, %llu clock jumps re-based",
                endReason_.empty() ? "stopped" : endReason_.c_str(),
                static_cast<unsigned long long>(delivered_),
                static_cast<unsigned long long>(clock_.DroppedWithoutTimestamp()),
                static_cast<unsigned long long>(clock_.Rebases()));

    const auto timeoutMs = static_cast<int64_t>(options_.drainTimeoutSeconds * 1000.0);
    Logger::Put(11, kFile, fn, __LINE__, "end of stream: storing what is held (at most %lld ms)",
                static_cast<long long>(timeoutMs));
    if (process.drainProcess(timeoutMs)) {
        Logger::Put(11, kFile, fn, __LINE__, "end of stream: all held samples were stored");
    } else {
        Logger::Put(5, kFile, fn, __LINE__,
                    "end of stream: not everything held was stored within %lld ms",
                    static_cast<long long>(timeoutMs));
    }
    // Nothing is handed over once Run has returned: a credential process still running ends.
    tokens_.Stop();
    credentials_->Stop();
    input_.reset();
    // `signals` ends here: from now on a signal takes its previous action again, except that
    // one that arrives while the handlers are still installed counts as the second.
}

void MediaHost::OnTokenRequest(const GetAWSSecureTokenRequest&) {
    // The module asks after its credentials were refused (or before it has any): the answer
    // asks the sources again rather than hand over the same ones.
    tokens_.Request();
}

void MediaHost::OnLastSequenceNumNotify(const LastSequenceNumNotify& message) {
    for (const auto& entry : message.entries) {
        if (entry.succeeded) {
            tokens_.ObjectStored();
            return;
        }
    }
}

void MediaHost::OnProcessStatus(VqProcessState state, unsigned int code) {
    if (state != Error || moduleFailed_.exchange(true)) return;
    Logger::Put(5, kFile, "MediaHost::OnProcessStatus", __LINE__,
                "module error %u: the input is no longer read and what is held is dropped; ending",
                code);
    Stop();
}

void MediaHost::AddReadings(ProcessReadings& readings) const {
    readings.inputReopenings = reopenings_.load(std::memory_order_relaxed);
    readings.clockRebases = clock_.Rebases();
}

void MediaHost::deliverCredentials(BaseProcess& process, const char* occasion, bool refresh) {
    handOver(process, credentials_->Fetch(refresh), occasion);
}

void MediaHost::handOver(BaseProcess& process, const credentials::Result& credentials,
                         const char* occasion) {
    constexpr const char* fn = "MediaHost::handOver";
    if (!credentials.ok) {
        Logger::Put(5, kFile, fn, __LINE__, "no credentials to hand over %s: %s", occasion,
                    credentials.why.c_str());
        return;
    }
    Logger::Put(12, kFile, fn, __LINE__, "credentials from the %s handed over %s",
                credentials.source.c_str(), occasion);
    std::map<std::string, std::string> properties = credentials.properties;  // the hook may edit
    process.setProperties(properties);
}

bool MediaHost::reopen(std::string why) {
    constexpr const char* fn = "MediaHost::reopen";
    input_.reset();
    while (true) {
        Logger::Put(5, kFile, fn, __LINE__, "input \"%s\": %s; reopening in %lld s",
                    shownInput_.c_str(), why.c_str(), static_cast<long long>(reopenPause_.count()));
        if (stop_.WaitUntil(std::chrono::steady_clock::now() + reopenPause_)) return false;
        // The pause grows with every attempt until a reopened input delivers again.
        reopenPause_ = std::min(reopenPause_ * 2, kLongestReopenPause);
        auto input = std::make_unique<MediaInput>(options_.input, live_, stop_);
        if (input->Open(&why)) {
            input_ = std::move(input);
            reopenings_.fetch_add(1, std::memory_order_relaxed);
            Logger::Put(11, kFile, fn, __LINE__, "input \"%s\" reopened", shownInput_.c_str());
            return true;
        }
        if (stop_.Raised()) return false;
    }
}

void MediaHost::receive(BaseProcess& process) {
    constexpr const char* fn = "MediaHost::receive";
    Pacer pacer(live_ ? 0.0 : (options_.readRate < 0 ? 1.0 : options_.readRate), stop_);
    const bool limited = options_.durationSeconds >= 0;
    const auto limitUs = static_cast<int64_t>(options_.durationSeconds * 1e6);
    MediaInput::Packet packet;
    Batch batch;
    struct FlushAtExit {
        MediaHost& host;
        BaseProcess& process;
        Batch& batch;
        ~FlushAtExit() { host.flush(process, batch); }
    } flushAtExit{*this, process, batch};
    while (true) {
        std::string error;
        const MediaInput::Status status = input_->Read(&packet, &error);
        if (status != MediaInput::Status::kPacket) {
            if (readingEnds(status, error)) return;
            continue;
        }
        SampleClock::Times times;
        if (!clock_.Place(packet.track, packet.hasPts, packet.ptsUs, packet.hasDts, packet.dtsUs,
                          packet.durationUs, &times))
            continue;
        if (limited && times.dtsUs >= limitUs) {
            Logger::Put(11, kFile, fn, __LINE__, "%g s of input recorded (-duration)",
                        options_.durationSeconds);
            endReason_ = "duration reached";
            return;
        }
        if (!handOn(process, pacer, batch, packet, times)) {
            endReason_ = "stopped";
            return;
        }
        reopenPause_ = kFirstReopenPause;  // the input works again
    }
}

bool MediaHost::readingEnds(MediaInput::Status status, const std::string& error) {
    constexpr const char* fn = "MediaHost::receive";
    if (status == MediaInput::Status::kStopped) {
        endReason_ = "stopped";
        return true;
    }
    if (!live_) {
        if (status == MediaInput::Status::kFailed) {
            Logger::Put(4, kFile, fn, __LINE__, "reading input \"%s\" failed: %s",
                        shownInput_.c_str(), error.c_str());
            endReason_ = "read error";
        } else {
            endReason_ = "end of file";
        }
        return true;
    }
    if (!reopen(status == MediaInput::Status::kEnd ? std::string("the stream ended") : error)) {
        endReason_ = "stopped";
        return true;
    }
    return false;
}

bool MediaHost::handOn(BaseProcess& process, Pacer& pacer, Batch& batch, MediaInput::Packet& packet,
                       const SampleClock::Times& times) {
    if (live_) {
        deliver(process, packet, times);  // a live input is not paced and cannot wait
        return true;
    }
    if (!pacer.Paced()) {
        batch.emplace_back(std::move(packet), times);
        if (batch.size() >= kMaxBatch) flush(process, batch);
        return true;
    }
    if (!pacer.IsDue(times.dtsUs) || batch.size() >= kMaxBatch) flush(process, batch);
    if (!pacer.Pace(times.dtsUs)) return false;
    batch.emplace_back(std::move(packet), times);
    return true;
}

void MediaHost::flush(BaseProcess& process, Batch& batch) {
    if (!batch.empty() && (live_ || waitForRoom(process, batch))) {
        process.beginSampleBurst();
        for (const auto& [p, t] : batch) deliver(process, p, t);
        process.endSampleBurst();
    }
    batch.clear();
}

bool MediaHost::waitForRoom(BaseProcess& process, const Batch& batch) {
    size_t counts[SampleClock::kTrackCount] = {0, 0, 0};
    for (const auto& entry : batch) ++counts[entry.first.track];
    while (!stop_.Raised()) {
        const auto deadline = std::chrono::steady_clock::now() + kRoomWaitSlice;
        if (process.waitForSampleRoom(counts[SampleClock::kVideo], counts[SampleClock::kAudio],
                                      counts[SampleClock::kMeta], deadline))
            return true;
        // A module whose workers are being restarted refuses at once: no spinning meanwhile.
        if (stop_.WaitUntil(deadline)) return false;
    }
    return false;
}

void MediaHost::deliver(BaseProcess& process, const MediaInput::Packet& packet,
                        const SampleClock::Times& times) {
    const TrackDescription& track = *packet.description;
    const int64_t sinceStartUs = std::max<int64_t>(times.dtsUs, 0);
    SampleAttributes a;
    a.rtpTime = toMediaClock(times.ptsUs, track.clockRate);
    a.timestamp = static_cast<uint64_t>(sinceStartUs / 1000);
    a.attribute1 = static_cast<uint64_t>(realStartMicros_ + sinceStartUs);
    a.attribute2 = toMediaClock(times.dtsUs, track.clockRate);
    a.attribute4 = static_cast<uint32_t>(track.trackIndex);
    a.attribute5 = track.clockRate;
    a.attribute6 = true;
    a.attribute7 = packetNumbers_[packet.track]++;
    a.payloadSize = packet.size;
    auto sample = std::make_shared<ReceivedSample>(a.Encode(), packet.data, packet.size,
                                                   packet.owner, packet.description);
    ++delivered_;
    switch (packet.track) {
        case SampleClock::kVideo:
            process.notifyVideoData(std::move(sample));
            break;
        case SampleClock::kAudio:
            process.notifyAudioData(std::move(sample));
            break;
        default:
            process.notifyMetaData(std::move(sample));
            break;
    }
}

std::shared_ptr<IModuleHost> CreateMediaHost(const FrameworkOptions& options) {
    return std::make_shared<MediaHost>(options, true);
}
