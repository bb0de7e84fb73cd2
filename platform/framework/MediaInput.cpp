#include "platform/framework/MediaInput.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavcodec/bsf.h>
#include <libavformat/avformat.h>
#include <libavutil/mathematics.h>
#include <libavutil/time.h>
}

#include <algorithm>

#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/framework/MediaInput";
const AVRational kMicros{1, 1000000};

std::string avError(int code) {
    char text[AV_ERROR_MAX_STRING_SIZE] = {0};
    av_strerror(code, text, sizeof text);
    return text;
}

int64_t steadyNs() {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

const char* kindName(SampleClock::Track track) {
    return track == SampleClock::kVideo ? "video" : track == SampleClock::kAudio ? "audio" : "meta";
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
    size_t scheme = url.find("://");
    if (scheme == std::string::npos) return url;
    size_t hostStart = scheme + 3;
    size_t hostEnd = url.find_first_of("/?#", hostStart);
    size_t at = url.rfind('@', hostEnd == std::string::npos ? std::string::npos : hostEnd);
    if (at == std::string::npos || at < hostStart) return url;
    return url.substr(0, hostStart) + "***@" + url.substr(at + 1);
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
    constexpr const char* fn = "MediaInput::Open";
    state_ = std::make_unique<State>();
    State& s = *state_;
    s.packet = av_packet_alloc();
    s.context = avformat_alloc_context();
    if (!s.packet || !s.context) {
        *error = "out of memory";
        return false;
    }
    s.context->interrupt_callback.callback = &MediaInput::interrupted;
    s.context->interrupt_callback.opaque = this;
    const std::string shown = Redacted(url_);

    armSilenceDeadline();
    int rc = avformat_open_input(&s.context, url_.c_str(), nullptr, nullptr);
    if (rc < 0) {
        // avformat_open_input frees the context on failure.
        s.context = nullptr;
        *error = "cannot open input \"" + shown + "\": " +
                 (stop_.Raised() ? std::string("stopped")
                  : rc == AVERROR_EXIT
                      ? "nothing arrived within " + std::to_string(kSilenceTimeout.count()) + " s"
                      : avError(rc));
        return false;
    }
    rc = avformat_find_stream_info(s.context, nullptr);
    if (rc < 0) {
        *error = "cannot read the tracks of input \"" + shown + "\": " + avError(rc);
        return false;
    }
    deadlineNs_.store(0);
    realStartMicros_ =
        s.context->start_time_realtime != AV_NOPTS_VALUE && s.context->start_time_realtime > 0
            ? s.context->start_time_realtime
            : av_gettime();

    std::string found;
    for (unsigned i = 0; i < s.context->nb_streams; ++i) {
        AVStream* stream = s.context->streams[i];
        const AVCodecParameters* par = stream->codecpar;
        const char* type = av_get_media_type_string(par->codec_type);
        found += std::string(found.empty() ? "" : ", ") + std::to_string(i) + " " +
                 (type ? type : "unknown") + " " + avcodec_get_name(par->codec_id);
        SampleClock::Track role = SampleClock::kTrackCount;
        if (par->codec_id == AV_CODEC_ID_H264 || par->codec_id == AV_CODEC_ID_HEVC) {
            role = SampleClock::kVideo;
        } else if (par->codec_type == AVMEDIA_TYPE_AUDIO) {
            role = SampleClock::kAudio;
        } else if (par->codec_type == AVMEDIA_TYPE_DATA ||
                   par->codec_type == AVMEDIA_TYPE_SUBTITLE) {
            role = SampleClock::kMeta;
        }
        if (role == SampleClock::kTrackCount || s.tracks[role].streamIndex >= 0) {
            stream->discard = AVDISCARD_ALL;
            Logger::Put(11, kFile, fn, __LINE__, "input track %u (%s %s) is ignored", i,
                        type ? type : "unknown", avcodec_get_name(par->codec_id));
            continue;
        }
        Selected& selected = s.tracks[role];
        selected.streamIndex = static_cast<int>(i);
        selected.timeBase = stream->time_base;
        auto description = std::make_shared<TrackDescription>();
        description->kind = role == SampleClock::kVideo   ? TrackDescription::Kind::Video
                            : role == SampleClock::kAudio ? TrackDescription::Kind::Audio
                                                          : TrackDescription::Kind::Meta;
        description->codecName = avcodec_get_name(par->codec_id);
        description->trackIndex = static_cast<int>(i);
        description->clockRate = role == SampleClock::kAudio && par->sample_rate > 0
                                     ? static_cast<uint32_t>(par->sample_rate)
                                     : 90000;
        const AVCodecParameters* described = par;
        if (role == SampleClock::kVideo) {
            const char* name =
                par->codec_id == AV_CODEC_ID_H264 ? "h264_mp4toannexb" : "hevc_mp4toannexb";
            const AVBitStreamFilter* filter = av_bsf_get_by_name(name);
            if (!filter || av_bsf_alloc(filter, &s.filter) < 0 ||
                avcodec_parameters_copy(s.filter->par_in, par) < 0) {
                *error = std::string("cannot set up the ") + name + " filter";
                return false;
            }
            s.filter->time_base_in = stream->time_base;
            rc = av_bsf_init(s.filter);
            if (rc < 0) {
                *error = std::string("cannot set up the ") + name + " filter: " + avError(rc);
                return false;
            }
            described = s.filter->par_out;
        }
        AVCodecParameters* copy = avcodec_parameters_alloc();
        if (!copy || avcodec_parameters_copy(copy, described) < 0) {
            avcodec_parameters_free(&copy);
            *error = "out of memory";
            return false;
        }
        description->codecParameters = std::shared_ptr<const void>(copy, [](const void* p) {
            auto* owned = static_cast<AVCodecParameters*>(const_cast<void*>(p));
            avcodec_parameters_free(&owned);
        });
        selected.description = std::move(description);
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

MediaInput::Status MediaInput::Read(Packet* packet, std::string* error) {
    State& s = *state_;
    while (true) {
        if (stop_.Raised()) return Status::kStopped;
        SampleClock::Track role = SampleClock::kTrackCount;
        AVPacket* out = nullptr;
        if (s.filterHasOutput) {
            out = av_packet_alloc();
            if (!out) {
                *error = "out of memory";
                return Status::kFailed;
            }
            int rc = av_bsf_receive_packet(s.filter, out);
            if (rc < 0) {
                av_packet_free(&out);
                s.filterHasOutput = false;
                if (rc != AVERROR(EAGAIN) && rc != AVERROR_EOF) {
                    Logger::Put(5, kFile, "MediaInput::Read", __LINE__,
                                "the Annex B filter dropped a video packet: %s",
                                avError(rc).c_str());
                }
                continue;
            }
            role = SampleClock::kVideo;
        } else {
            armSilenceDeadline();
            int rc = av_read_frame(s.context, s.packet);
            if (rc < 0) {
                if (stop_.Raised()) return Status::kStopped;
                if (rc == AVERROR_EOF) return Status::kEnd;
                *error = rc == AVERROR_EXIT
                             ? "no packet for " + std::to_string(kSilenceTimeout.count()) + " s"
                             : avError(rc);
                return Status::kFailed;
            }
            for (int t = 0; t < SampleClock::kTrackCount; ++t)
                if (s.tracks[t].streamIndex == s.packet->stream_index)
                    role = static_cast<SampleClock::Track>(t);
            if (role == SampleClock::kTrackCount) {
                av_packet_unref(s.packet);
                continue;
            }
            if (role == SampleClock::kVideo) {
                int sent = av_bsf_send_packet(s.filter, s.packet);  // takes the reference
                if (sent < 0) {
                    av_packet_unref(s.packet);
                    Logger::Put(5, kFile, "MediaInput::Read", __LINE__,
                                "the Annex B filter refused a video packet: %s",
                                avError(sent).c_str());
                    continue;
                }
                s.filterHasOutput = true;
                continue;
            }
            out = av_packet_alloc();
            if (!out) {
                av_packet_unref(s.packet);
                *error = "out of memory";
                return Status::kFailed;
            }
            av_packet_move_ref(out, s.packet);
        }

        const Selected& track = s.tracks[role];
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
        if (packet->size == 0) continue;  // nothing to record
        return Status::kPacket;
    }
}
