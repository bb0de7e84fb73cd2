#include "platform/transfer/SegmentWriter.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/mathematics.h>
}

#include <climits>
#include <memory>

#include "platform/framework/ReceivedSample.h"
#include "platform/logger/Logger.h"
#include "platform/nal/StreamAnalyzer.h"

namespace {

constexpr const char* kFile = "platform/transfer/SegmentWriter";
constexpr const char* kFunction = "SegmentWriter::Write";
constexpr int kAvioBufferSize = 64 * 1024;
constexpr int64_t kTicksPerSecond = 90000;  // the TS clock
// Times beyond this many 90 kHz ticks (about 1.6 million years) cannot be offset without
// overflow and are not real stream times.
constexpr int64_t kTimeLimit = int64_t{1} << 60;

std::string avError(int code) {
    char text[AV_ERROR_MAX_STRING_SIZE] = {0};
    av_strerror(code, text, sizeof(text));
    return text;
}

// Whether `format` carries audio of codec `id` with a type its readers recognise.
bool carriesAudio(const SegmentFormat& format, AVCodecID id) {
    const std::string name = avcodec_get_name(id);
    for (const std::string& codec : format.audioCodecs)
        if (codec == name) return true;
    return false;
}

// The muxer's output, appended to the caller's buffer.
#if LIBAVFORMAT_VERSION_MAJOR >= 61
int appendToBuffer(void* opaque, const uint8_t* data, int size) {
#else
int appendToBuffer(void* opaque, uint8_t* data, int size) {
#endif
    auto* out = static_cast<std::vector<uint8_t>*>(opaque);
    out->insert(out->end(), data, data + size);
    return size;
}

// Owns one muxer and its I/O context for the length of one Write.
struct Muxer {
    AVFormatContext* context = nullptr;
    AVIOContext* io = nullptr;
    AVPacket* packet = nullptr;

    ~Muxer() {
        if (io) av_freep(&io->buffer);  // the muxer may have replaced the buffer we gave it
        avio_context_free(&io);
        avformat_free_context(context);
        av_packet_free(&packet);
    }
};

// One of the three sample lists on its way into the muxer.
struct Track {
    TrackDescription::Kind kind = TrackDescription::Kind::Video;
    const std::vector<StreamData>* samples = nullptr;
    const TrackDescription* description = nullptr;  // may be null (samples made without one)
    AVStream* stream = nullptr;                     // null: the track is left out
    AVCodecID codec = AV_CODEC_ID_NONE;
    size_t next = 0;         // index of the next sample to consider
    bool hasLast = false;    // a sample of this track is in the object
    int64_t lastDts90k = 0;  // decode time of that sample, offset applied
    bool cutAdts = false;    // AAC samples lose their ADTS header on the way into the muxer
};

// Bytes of the ADTS header that begins `data` (7, or 9 with a CRC); 0 when there is none or
// nothing would follow it.
size_t adtsHeaderBytes(const uint8_t* data, size_t size) {
    if (!data || size < 7 || data[0] != 0xff || (data[1] & 0xf6) != 0xf0) return 0;
    const size_t header = (data[1] & 0x01) ? 7 : 9;
    return size > header ? header : 0;
}

// The times of one sample in 90 kHz ticks without the run's offset; false when the sample has
// no usable clock or times.
bool sampleTimes(const StreamData& sample, TrackDescription::Kind kind,
                 const TrackDescription* description, int64_t* pts, int64_t* dts) {
    uint32_t clock = sample.attribute5;
    if (clock == 0 && description) clock = description->clockRate;
    if (clock == 0 && kind != TrackDescription::Kind::Audio) clock = kTicksPerSecond;
    if (clock == 0 || clock > static_cast<uint32_t>(INT_MAX)) return false;
    const AVRational from{1, static_cast<int>(clock)};
    const AVRational to{1, static_cast<int>(kTicksPerSecond)};
    const auto rounding = static_cast<AVRounding>(AV_ROUND_NEAR_INF | AV_ROUND_PASS_MINMAX);
    *pts = av_rescale_q_rnd(static_cast<int64_t>(sample.rtpTime), from, to, rounding);
    *dts = av_rescale_q_rnd(static_cast<int64_t>(sample.attribute2), from, to, rounding);
    auto inRange = [](int64_t t) { return t > -kTimeLimit && t < kTimeLimit; };
    return inRange(*pts) && inRange(*dts);
}

// Whether the muxer can take the payload without reading past its end. Our packets carry no
// padding, and the mpegts muxer reads the first four bytes of any H.264/H.265 access unit that
// does not begin with a start code (for a log line), so such units, which are not Annex B and
// thus malformed anyway, never reach it.
bool usablePayload(const StreamData& sample, AVCodecID codec) {
    const uint8_t* data = sample.PayloadData();
    size_t bytes = sample.PayloadBytes();
    if (!data || bytes == 0 || bytes > static_cast<size_t>(INT_MAX - AV_INPUT_BUFFER_PADDING_SIZE))
        return false;
    if (codec != AV_CODEC_ID_H264 && codec != AV_CODEC_ID_HEVC) return true;
    if (bytes < 5) return false;
    const bool startCode4 = data[0] == 0 && data[1] == 0 && data[2] == 0 && data[3] == 1;
    const bool startCode3 = data[0] == 0 && data[1] == 0 && data[2] == 1;
    return startCode4 || startCode3;
}

// Sets the stream's codec parameters from the track description, or from its codec name when
// it carries none. Returns false with a reason when the track cannot be described.
bool describeStream(Track& track, AVCodecParameters* parameters, std::string* why) {
    const TrackDescription* description = track.description;
    if (description && description->codecParameters) {
        const auto* source =
            static_cast<const AVCodecParameters*>(description->codecParameters.get());
        int rc = avcodec_parameters_copy(parameters, source);
        if (rc < 0) {
            *why = "cannot copy codec parameters: " + avError(rc);
            return false;
        }
    } else {
        std::string name = description ? description->codecName : std::string();
        if (name.empty() && track.kind == TrackDescription::Kind::Video) name = "h264";
        if (name.empty() && track.kind == TrackDescription::Kind::Meta) name = "bin_data";
        const AVCodecDescriptor* codec = avcodec_descriptor_get_by_name(name.c_str());
        if (!codec) {
            *why = "unknown codec \"" + name + "\"";
            return false;
        }
        parameters->codec_type = codec->type;
        parameters->codec_id = codec->id;
        if (codec->type == AVMEDIA_TYPE_AUDIO && description)
            parameters->sample_rate = static_cast<int>(description->clockRate);
    }
    parameters->codec_tag = 0;  // the input container's tags mean nothing in the object
    if (track.kind == TrackDescription::Kind::Meta) {
        // Whatever the input called its data, it travels as a data stream.
        if (parameters->codec_id == AV_CODEC_ID_NONE) parameters->codec_id = AV_CODEC_ID_BIN_DATA;
        if (parameters->codec_type != AVMEDIA_TYPE_SUBTITLE)
            parameters->codec_type = AVMEDIA_TYPE_DATA;
    }
    if (track.kind == TrackDescription::Kind::Video && parameters->codec_id != AV_CODEC_ID_H264 &&
        parameters->codec_id != AV_CODEC_ID_HEVC) {
        *why = std::string("video codec ") + avcodec_get_name(parameters->codec_id) +
               " is not H.264 or H.265";
        return false;
    }
    track.codec = parameters->codec_id;
    return true;
}

// One object on its way through the muxer, for the length of one Write: the three tracks, the
// muxer over the caller's buffer, and what went in. Each step returns false with the reason in
// the caller's error text.
class ObjectMuxer {
  public:
    ObjectMuxer(const SegmentFormat& format, const std::vector<StreamData>& video,
                const std::vector<StreamData>& audio, const std::vector<StreamData>& meta,
                std::vector<uint8_t>* out, SegmentWriter::Report* report, std::string* error)
        : format_(format), out_(out), report_(report), error_(error) {
        tracks_[0] = {TrackDescription::Kind::Video, &video};
        tracks_[1] = {TrackDescription::Kind::Audio, &audio};
        tracks_[2] = {TrackDescription::Kind::Meta, &meta};
    }

    // Opens the muxer over the caller's buffer and reserves room for the whole object.
    bool Open() {
        size_t payloadBytes = 0;
        for (Track& track : tracks_) {
            for (const StreamData& sample : *track.samples) {
                payloadBytes += sample.PayloadBytes();
                if (!track.description && sample.source)
                    track.description = sample.source->Track().get();
            }
        }
        int rc = avformat_alloc_output_context2(&muxer_.context, nullptr, format_.muxer.c_str(),
                                                nullptr);
        if (rc < 0 || !muxer_.context)
            return fail("cannot create the " + format_.muxer + " muxer: " + avError(rc));
        auto* ioBuffer = static_cast<unsigned char*>(av_malloc(kAvioBufferSize));
        if (!ioBuffer) return fail("out of memory");
        muxer_.io = avio_alloc_context(ioBuffer, kAvioBufferSize, 1, out_, nullptr, appendToBuffer,
                                       nullptr);
        if (!muxer_.io) {
            av_free(ioBuffer);
            return fail("out of memory");
        }
        muxer_.packet = av_packet_alloc();
        if (!muxer_.packet) return fail("out of memory");
        AVFormatContext* context = muxer_.context;
        context->pb = muxer_.io;
        context->flags |= AVFMT_FLAG_CUSTOM_IO;
        // Times are kept as they are: the run's offset already makes them non-negative, and a
        // shift of one object alone would break continuity with its neighbours. Payloads are
        // Annex B by contract; the muxer is not allowed to slip a bitstream filter (and a copy) in.
        context->avoid_negative_ts = AVFMT_AVOID_NEG_TS_DISABLED;
        context->flags &= ~AVFMT_FLAG_AUTO_BSF;
        // Container overhead (TS: headers, PES, PAT/PMT) stays well under 10 % of the payload.
        // The caller's buffer serves every object of the run: when it must grow, it grows with
        // room for larger objects to come, so that it is rarely allocated (and first touched)
        // again.
        const size_t needed = payloadBytes + payloadBytes / 10 + 4096;
        if (out_->capacity() < needed) out_->reserve(needed + needed / 4);
        return true;
    }

    // One stream per list that has samples. Audio the object cannot carry is left out and
    // counted; the first such refusal of the run is logged (`*refusalLogged` remembers it). Meta
    // samples of a format without a data track are left out (logged once: `*metaLogged`).
    bool AddStreams(bool* refusalLogged, bool* metaLogged) {
        for (Track& track : tracks_) {
            if (track.kind == TrackDescription::Kind::Meta && !format_.carriesMeta) {
                if (!track.samples->empty() && !*metaLogged) {
                    Logger::Put(5, kFile, kFunction, __LINE__,
                                "metadata is left out of the objects: %s has no data track",
                                format_.title.c_str());
                    *metaLogged = true;
                }
                continue;
            }
            if (!track.samples->empty() && !addStream(track, refusalLogged)) return false;
        }
        if (muxer_.context->nb_streams == 0) return fail("no track can be written");
        return true;
    }

    // The earliest decode time (90 kHz, no offset) among the first usable samples of the
    // tracks that are written.
    bool EarliestDecodeTime(int64_t* earliest) {
        bool found = false;
        for (Track& track : tracks_) {
            if (!track.stream) continue;
            for (const StreamData& sample : *track.samples) {
                int64_t pts = 0, dts = 0;
                if (!usablePayload(sample, track.codec) ||
                    !sampleTimes(sample, track.kind, track.description, &pts, &dts))
                    continue;
                if (!found || dts < *earliest) *earliest = dts;
                found = true;
                break;
            }
        }
        if (found) return true;
        report_->dropped =
            tracks_[0].samples->size() + tracks_[1].samples->size() + tracks_[2].samples->size();
        return fail("no sample has a payload and usable times");
    }

    // Header, every usable sample merged by decode time with `offset90k` added, trailer.
    bool WriteAll(int64_t offset90k) {
        AVDictionary* options = nullptr;
        int rc = av_dict_parse_string(&options, format_.muxerOptions.c_str(), "=", ":", 0);
        if (rc >= 0) rc = avformat_write_header(muxer_.context, &options);
        av_dict_free(&options);
        if (rc < 0) return fail("cannot start the " + format_.title + " object: " + avError(rc));
        int64_t pts = 0, dts = 0;
        while (Track* track = nextSample(offset90k, &pts, &dts)) {
            if (!writeSample(*track, pts, dts)) return false;
        }
        rc = av_write_trailer(muxer_.context);
        if (rc < 0) return fail("cannot finish the " + format_.title + " object: " + avError(rc));
        if (report_->written == 0) return fail("no sample could be written");
        return true;
    }

  private:
    bool fail(std::string why) {
        *error_ = std::move(why);
        return false;
    }

    bool addStream(Track& track, bool* refusalLogged) {
        std::unique_ptr<AVCodecParameters, void (*)(AVCodecParameters*)> parameters(
            avcodec_parameters_alloc(), [](AVCodecParameters* p) { avcodec_parameters_free(&p); });
        if (!parameters) return fail("out of memory");
        std::string why;
        bool described = describeStream(track, parameters.get(), &why);
        if (described && track.kind == TrackDescription::Kind::Audio &&
            !carriesAudio(format_, track.codec)) {
            described = false;
            why = std::string(avcodec_get_name(track.codec)) + " cannot travel in " + format_.title;
        }
        if (!described) {
            if (track.kind != TrackDescription::Kind::Audio) return fail(why);
            // Without its audio the object is still worth having.
            if (!*refusalLogged) {
                Logger::Put(5, kFile, kFunction, __LINE__, "audio is left out of the objects: %s",
                            why.c_str());
                *refusalLogged = true;
            }
            report_->dropped += track.samples->size();
            return true;
        }
        AVStream* stream = avformat_new_stream(muxer_.context, nullptr);
        if (!stream || avcodec_parameters_copy(stream->codecpar, parameters.get()) < 0)
            return fail("out of memory");
        stream->time_base = AVRational{1, static_cast<int>(kTicksPerSecond)};
        track.stream = stream;
        if (track.codec == AV_CODEC_ID_AAC && !format_.aacInAdts &&
            stream->codecpar->extradata_size == 0)
            return rawAac(track);
        return true;
    }

    // AAC in ADTS (as TS inputs give it) for a format that wants it raw: the AudioSpecificConfig
    // from the first sample's ADTS header becomes the stream's extradata, and every sample's
    // header is skipped as it is written (writeSample).
    bool rawAac(Track& track) {
        const StreamData* first = nullptr;
        for (const StreamData& sample : *track.samples) {
            if (adtsHeaderBytes(sample.PayloadData(), sample.PayloadBytes()) == 0) continue;
            first = &sample;
            break;
        }
        if (!first) return true;  // raw already: nothing to cut
        const uint8_t* h = first->PayloadData();
        const unsigned objectType = (h[2] >> 6) + 1;
        const unsigned frequencyIndex = (h[2] >> 2) & 0x0f;
        const unsigned channels = ((h[2] & 0x01) << 2) | (h[3] >> 6);
        AVCodecParameters* parameters = track.stream->codecpar;
        parameters->extradata = static_cast<uint8_t*>(av_mallocz(2 + AV_INPUT_BUFFER_PADDING_SIZE));
        if (!parameters->extradata) return fail("out of memory");
        parameters->extradata[0] = static_cast<uint8_t>((objectType << 3) | (frequencyIndex >> 1));
        parameters->extradata[1] =
            static_cast<uint8_t>(((frequencyIndex & 1) << 7) | (channels << 3));
        parameters->extradata_size = 2;
        track.cutAdts = true;
        return true;
    }

    // Whether the muxer can take `sample` as the next one of `track`; its times with the
    // offset applied in `pts` and `dts`.
    static bool usableNext(const Track& track, const StreamData& sample, int64_t offset90k,
                           int64_t* pts, int64_t* dts) {
        if (!usablePayload(sample, track.codec) ||
            !sampleTimes(sample, track.kind, track.description, pts, dts))
            return false;
        *pts += offset90k;
        *dts += offset90k;
        const bool increasing = track.kind == TrackDescription::Kind::Meta
                                    ? *dts >= track.lastDts90k
                                    : *dts > track.lastDts90k;
        return *dts >= 0 && *pts >= *dts && (!track.hasLast || increasing);
    }

    // The track whose next usable sample has the smallest decode time (ties go to video, then
    // audio, then meta), with that sample's times; null when every track is done. Samples the
    // muxer cannot take are skipped and counted on the way.
    Track* nextSample(int64_t offset90k, int64_t* chosenPts, int64_t* chosenDts) {
        Track* chosen = nullptr;
        for (Track& track : tracks_) {
            if (!track.stream) continue;
            for (; track.next < track.samples->size(); ++track.next, ++report_->dropped) {
                int64_t pts = 0, dts = 0;
                if (!usableNext(track, (*track.samples)[track.next], offset90k, &pts, &dts))
                    continue;
                if (!chosen || dts < *chosenDts) {
                    chosen = &track;
                    *chosenPts = pts;
                    *chosenDts = dts;
                }
                break;
            }
        }
        return chosen;
    }

    bool writeSample(Track& track, int64_t pts, int64_t dts) {
        const StreamData& sample = (*track.samples)[track.next];
        const uint8_t* data = sample.PayloadData();
        const size_t size = sample.PayloadBytes();
        bool key = true;
        if (track.codec == AV_CODEC_ID_H264)
            key = nal_access::StreamAnalyzer::IsIdrH264(data, size);
        else if (track.codec == AV_CODEC_ID_HEVC)
            key = nal_access::StreamAnalyzer::IsIdrH265(data, size);

        // Not reference counted: av_write_frame reads the bytes during the call and keeps no
        // reference, so the sample's own buffer is used as it is.
        const size_t skip = track.cutAdts ? adtsHeaderBytes(data, size) : 0;
        AVPacket* packet = muxer_.packet;
        av_packet_unref(packet);
        packet->data = const_cast<uint8_t*>(data + skip);
        packet->size = static_cast<int>(size - skip);
        packet->stream_index = track.stream->index;
        const AVRational ticks{1, static_cast<int>(kTicksPerSecond)};
        packet->pts = av_rescale_q(pts, ticks, track.stream->time_base);
        packet->dts = av_rescale_q(dts, ticks, track.stream->time_base);
        packet->flags = key ? AV_PKT_FLAG_KEY : 0;
        int rc = av_write_frame(muxer_.context, packet);
        packet->data = nullptr;
        packet->size = 0;
        if (rc < 0) return fail("the muxer refused a sample: " + avError(rc));
        track.hasLast = true;
        track.lastDts90k = dts;
        ++track.next;
        ++report_->written;
        return true;
    }

    const SegmentFormat& format_;
    Track tracks_[3];
    Muxer muxer_;
    std::vector<uint8_t>* const out_;
    SegmentWriter::Report* const report_;
    std::string* const error_;
};

}  // namespace

bool SegmentWriter::Write(const std::vector<StreamData>& video,
                          const std::vector<StreamData>& audio, const std::vector<StreamData>& meta,
                          std::vector<uint8_t>* out, Report* report, std::string* error) {
    Report localReport;
    if (!report) report = &localReport;
    *report = Report();
    std::string localError;
    if (!error) error = &localError;
    out->clear();

    ObjectMuxer object(format_, video, audio, meta, out, report, error);
    if (!object.Open() || !object.AddStreams(&audioRefusalLogged_, &metaRefusalLogged_))
        return false;
    // The run's origin: the earliest decode time among the first usable samples of the first
    // object lands on kRunOrigin90k. Later objects reuse the same offset.
    if (!hasOffset_) {
        int64_t earliest = 0;
        if (!object.EarliestDecodeTime(&earliest)) return false;
        offset90k_ = kRunOrigin90k - earliest;
        hasOffset_ = true;
    }
    return object.WriteAll(offset90k_);
}
