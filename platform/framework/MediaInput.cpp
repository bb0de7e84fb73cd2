#include "platform/framework/MediaInput.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavcodec/bsf.h>
#include <libavformat/avformat.h>
#include <libavutil/mathematics.h>
#include <libavutil/time.h>
}

#include <algorithm>

#include "platform/framework/FfmpegLog.h"
#include "platform/logger/Logger.h"
#include "platform/logger/SecretMask.h"

namespace {

constexpr const char* kFile = "platform/framework/MediaInput";
const AVRational kMicros{1, 1000000};

int64_t steadyNs() {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

const char* kindName(SampleClock::Track track) {
    return track == SampleClock::kVideo ? "video" : track == SampleClock::kAudio ? "audio" : "meta";
}

// The role a stream of these parameters could play; kTrackCount: none.
SampleClock::Track roleOf(const AVCodecParameters& par) {
    if (par.codec_id == AV_CODEC_ID_H264 || par.codec_id == AV_CODEC_ID_HEVC)
        return SampleClock::kVideo;
    if (par.codec_type == AVMEDIA_TYPE_AUDIO) return SampleClock::kAudio;
    if (par.codec_type == AVMEDIA_TYPE_DATA || par.codec_type == AVMEDIA_TYPE_SUBTITLE)
        return SampleClock::kMeta;
    return SampleClock::kTrackCount;
}

// A copy of `par` owned by the returned pointer; null when out of memory.
std::shared_ptr<const void> ownedCopy(const AVCodecParameters* par) {
    AVCodecParameters* copy = avcodec_parameters_alloc();
    if (!copy || avcodec_parameters_copy(copy, par) < 0) {
        avcodec_parameters_free(&copy);
        return nullptr;
    }
    return std::shared_ptr<const void>(copy, [](const void* p) {
        auto* owned = static_cast<AVCodecParameters*>(const_cast<void*>(p));
        avcodec_parameters_free(&owned);
    });
}

}  // namespace

// One selected stream.
struct Selected {
    int streamIndex = -1;
    AVRational timeBase{1, 1};
    std::shared_ptr<const TrackDescription> description;
};

struct MediaInput::State {
    AVFormatContext* context = nullptr;
    AVBSFContext* filter = nullptr;  // the video's Annex B filter
    bool filterHasOutput = false;    // a packet went into the filter; more may come out
    AVPacket* packet = nullptr;      // reused for reading
    Selected tracks[SampleClock::kTrackCount];

    ~State() {
        av_bsf_free(&filter);
        av_packet_free(&packet);
        avformat_close_input(&context);
    }
};

MediaInput::MediaInput(std::string url, bool live, StopSignal& stop)
    : url_(std::move(url)), live_(live), stop_(stop) {}

MediaInput::~MediaInput() = default;

bool MediaInput::IsLive(const std::string& url) {
    size_t scheme = url.find("://");
    if (scheme == std::string::npos) return false;
    std::string name = url.substr(0, scheme);
    for (char& c : name) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return name != "file";
}

std::string MediaInput::Redacted(const std::string& url) {
    return MaskedSecrets(url);
}

int MediaInput::interrupted(void* opaque) {
    auto* self = static_cast<MediaInput*>(opaque);
    if (self->stop_.Raised()) return 1;
    int64_t deadline = self->deadlineNs_.load(std::memory_order_relaxed);
    return deadline != 0 && steadyNs() > deadline ? 1 : 0;
}

void MediaInput::armSilenceDeadline() {
    if (!live_) return;
    deadlineNs_.store(
        steadyNs() + std::chrono::duration_cast<std::chrono::nanoseconds>(kSilenceTimeout).count());
}

bool MediaInput::Open(std::string* error) {
    state_ = std::make_unique<State>();
    const std::string shown = Redacted(url_);
    return allocate(error) && openDemuxer(shown, error) && selectTracks(shown, error);
}

bool MediaInput::allocate(std::string* error) {
    State& s = *state_;
    s.packet = av_packet_alloc();
    s.context = avformat_alloc_context();
    if (!s.packet || !s.context) {
        *error = "out of memory";
        return false;
    }
    s.context->interrupt_callback.callback = &MediaInput::interrupted;
    s.context->interrupt_callback.opaque = this;
    return true;
}

bool MediaInput::openDemuxer(const std::string& shown, std::string* error) {
    State& s = *state_;
    armSilenceDeadline();
    int rc = avformat_open_input(&s.context, url_.c_str(), nullptr, nullptr);
    if (rc < 0) {
        // avformat_open_input frees the context on failure.
        s.context = nullptr;
        *error = "cannot open input \"" + shown + "\": " +
                 (stop_.Raised() ? std::string("stopped")
                  : rc == AVERROR_EXIT
                      ? "nothing arrived within " + std::to_string(kSilenceTimeout.count()) + " s"
                      : FfmpegErrorText(rc));
        return false;
    }
    rc = avformat_find_stream_info(s.context, nullptr);
    if (rc < 0) {
        *error = "cannot read the tracks of input \"" + shown + "\": " + FfmpegErrorText(rc);
        return false;
    }
    deadlineNs_.store(0);
    realStartMicros_ =
        s.context->start_time_realtime != AV_NOPTS_VALUE && s.context->start_time_realtime > 0
            ? s.context->start_time_realtime
            : av_gettime();
    return true;
}

bool MediaInput::selectTracks(const std::string& shown, std::string* error) {
    constexpr const char* fn = "MediaInput::Open";
    State& s = *state_;
    std::string found;  // every track, for the message when there is no video
    for (unsigned i = 0; i < s.context->nb_streams; ++i) {
        AVStream* stream = s.context->streams[i];
        const AVCodecParameters* par = stream->codecpar;
        const char* type = av_get_media_type_string(par->codec_type);
        found += std::string(found.empty() ? "" : ", ") + std::to_string(i) + " " +
                 (type ? type : "unknown") + " " + avcodec_get_name(par->codec_id);
        const SampleClock::Track role = roleOf(*par);
        if (role == SampleClock::kTrackCount || s.tracks[role].streamIndex >= 0) {
            stream->discard = AVDISCARD_ALL;
            Logger::Put(11, kFile, fn, __LINE__, "input track %u (%s %s) is ignored", i,
                        type ? type : "unknown", avcodec_get_name(par->codec_id));
            continue;
        }
        if (!selectTrack(i, role, error)) return false;
        Logger::Put(11, kFile, fn, __LINE__, "%s: input track %u, %s", kindName(role), i,
                    avcodec_get_name(par->codec_id));
    }
    if (s.tracks[SampleClock::kVideo].streamIndex < 0) {
        *error = "input \"" + shown + "\" has no H.264 or H.265 video (its tracks: " +
                 (found.empty() ? std::string("none") : found) + ")";
        return false;
    }
    return true;
}

bool MediaInput::selectTrack(unsigned index, SampleClock::Track role, std::string* error) {
    State& s = *state_;
    AVStream* stream = s.context->streams[index];
    const AVCodecParameters* par = stream->codecpar;
    Selected& selected = s.tracks[role];
    selected.streamIndex = static_cast<int>(index);
    selected.timeBase = stream->time_base;
    auto description = std::make_shared<TrackDescription>();
    description->kind = role == SampleClock::kVideo   ? TrackDescription::Kind::Video
                        : role == SampleClock::kAudio ? TrackDescription::Kind::Audio
                                                      : TrackDescription::Kind::Meta;
    description->codecName = avcodec_get_name(par->codec_id);
    description->trackIndex = static_cast<int>(index);
    description->clockRate = role == SampleClock::kAudio && par->sample_rate > 0
                                 ? static_cast<uint32_t>(par->sample_rate)
                                 : 90000;
    // The video is described as the Annex B filter hands it out.
    if (role == SampleClock::kVideo && !setUpAnnexBFilter(*stream, error)) return false;
    description->codecParameters = ownedCopy(role == SampleClock::kVideo ? s.filter->par_out : par);
    if (!description->codecParameters) {
        *error = "out of memory";
        return false;
    }
    selected.description = std::move(description);
    return true;
}

bool MediaInput::setUpAnnexBFilter(const AVStream& stream, std::string* error) {
    State& s = *state_;
    const AVCodecParameters* par = stream.codecpar;
    const char* name = par->codec_id == AV_CODEC_ID_H264 ? "h264_mp4toannexb" : "hevc_mp4toannexb";
    const AVBitStreamFilter* filter = av_bsf_get_by_name(name);
    if (!filter || av_bsf_alloc(filter, &s.filter) < 0 ||
        avcodec_parameters_copy(s.filter->par_in, par) < 0) {
        *error = std::string("cannot set up the ") + name + " filter";
        return false;
    }
    s.filter->time_base_in = stream.time_base;
    int rc = av_bsf_init(s.filter);
    if (rc < 0) {
        *error = std::string("cannot set up the ") + name + " filter: " + FfmpegErrorText(rc);
        return false;
    }
    return true;
}

const char* MediaInput::VideoCodec() const {
    const auto& video = state_->tracks[SampleClock::kVideo].description;
    return video && video->codecName == avcodec_get_name(AV_CODEC_ID_HEVC) ? "H.265" : "H.264";
}

MediaInput::Status MediaInput::Read(Packet* packet, std::string* error) {
    while (!stop_.Raised()) {
        SampleClock::Track role = SampleClock::kVideo;
        AVPacket* out = nullptr;
        const Status status =
            state_->filterHasOutput ? takeFiltered(&out, error) : takeDemuxed(&role, &out, error);
        if (status != Status::kPacket) return status;
        if (out != nullptr && fill(packet, role, out)) return Status::kPacket;
    }
    return Status::kStopped;
}

MediaInput::Status MediaInput::takeFiltered(AVPacket** out, std::string* error) {
    State& s = *state_;
    AVPacket* filtered = av_packet_alloc();
    if (!filtered) {
        *error = "out of memory";
        return Status::kFailed;
    }
    int rc = av_bsf_receive_packet(s.filter, filtered);
    if (rc < 0) {
        av_packet_free(&filtered);
        s.filterHasOutput = false;
        if (rc != AVERROR(EAGAIN) && rc != AVERROR_EOF) {
            Logger::Put(5, kFile, "MediaInput::Read", __LINE__,
                        "the Annex B filter dropped a video packet: %s",
                        FfmpegErrorText(rc).c_str());
        }
        return Status::kPacket;
    }
    *out = filtered;
    return Status::kPacket;
}

MediaInput::Status MediaInput::takeDemuxed(SampleClock::Track* role, AVPacket** out,
                                           std::string* error) {
    State& s = *state_;
    armSilenceDeadline();
    int rc = av_read_frame(s.context, s.packet);
    if (rc < 0) {
        if (stop_.Raised()) return Status::kStopped;
        if (rc == AVERROR_EOF) return Status::kEnd;
        *error = rc == AVERROR_EXIT
                     ? "no packet for " + std::to_string(kSilenceTimeout.count()) + " s"
                     : FfmpegErrorText(rc);
        return Status::kFailed;
    }
    *role = SampleClock::kTrackCount;
    for (int t = 0; t < SampleClock::kTrackCount; ++t)
        if (s.tracks[t].streamIndex == s.packet->stream_index)
            *role = static_cast<SampleClock::Track>(t);
    if (*role == SampleClock::kTrackCount) {
        av_packet_unref(s.packet);
        return Status::kPacket;
    }
    if (*role == SampleClock::kVideo) {
        // The video goes through the Annex B filter; takeFiltered collects what comes out.
        int sent = av_bsf_send_packet(s.filter, s.packet);  // takes the reference
        if (sent < 0) {
            av_packet_unref(s.packet);
            Logger::Put(5, kFile, "MediaInput::Read", __LINE__,
                        "the Annex B filter refused a video packet: %s",
                        FfmpegErrorText(sent).c_str());
            return Status::kPacket;
        }
        s.filterHasOutput = true;
        return Status::kPacket;
    }
    AVPacket* moved = av_packet_alloc();
    if (!moved) {
        av_packet_unref(s.packet);
        *error = "out of memory";
        return Status::kFailed;
    }
    av_packet_move_ref(moved, s.packet);
    *out = moved;
    return Status::kPacket;
}

bool MediaInput::fill(Packet* packet, SampleClock::Track role, AVPacket* out) {
    const Selected& track = state_->tracks[role];
    packet->track = role;
    packet->description = track.description;
    packet->data = out->data;
    packet->size = static_cast<size_t>(std::max(out->size, 0));
    packet->hasPts = out->pts != AV_NOPTS_VALUE;
    packet->hasDts = out->dts != AV_NOPTS_VALUE;
    packet->ptsUs = packet->hasPts ? av_rescale_q(out->pts, track.timeBase, kMicros) : 0;
    packet->dtsUs = packet->hasDts ? av_rescale_q(out->dts, track.timeBase, kMicros) : 0;
    packet->durationUs =
        out->duration > 0 ? av_rescale_q(out->duration, track.timeBase, kMicros) : 0;
    packet->owner = std::shared_ptr<const void>(out, [](const void* p) {
        auto* owned = static_cast<AVPacket*>(const_cast<void*>(p));
        av_packet_free(&owned);
    });
    return packet->size > 0;  // an empty packet has nothing to record
}
