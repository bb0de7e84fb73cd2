#include "tests/support/ClipSamples.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavcodec/bsf.h>
#include <libavformat/avformat.h>
#include <libavutil/mathematics.h>
}

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "platform/nal/StreamAnalyzer.h"
#include "tests/support/TestSupport.h"

namespace testsupport {

namespace {

std::shared_ptr<const void> copyParameters(const AVCodecParameters* parameters) {
    AVCodecParameters* copy = avcodec_parameters_alloc();
    avcodec_parameters_copy(copy, parameters);
    return std::shared_ptr<const void>(copy, [](const void* p) {
        auto* owned = static_cast<AVCodecParameters*>(const_cast<void*>(p));
        avcodec_parameters_free(&owned);
    });
}

// One track being read: its description, clock and running state.
struct Reader {
    int streamIndex = -1;
    AVRational timeBase{1, 1};
    uint32_t clock = 90000;
    std::shared_ptr<TrackDescription> description;
    std::vector<StreamData>* samples = nullptr;
    AVBSFContext* filter = nullptr;  // video only
    uint64_t packetNumber = 0;
    int64_t lastTimestampMs = 0;
    int64_t lastCaptureMicros = 0;
};

struct Input {
    AVFormatContext* context = nullptr;
    AVPacket* packet = av_packet_alloc();
    Reader readers[3];
    ~Input() {
        for (Reader& r : readers) av_bsf_free(&r.filter);
        av_packet_free(&packet);
        avformat_close_input(&context);
    }
};

void addSample(Reader& reader, AVPacket* owned, bool haveOrigin, int64_t originMicros,
               uint64_t captureStartMicros) {
    int64_t pts = owned->pts == AV_NOPTS_VALUE ? owned->dts : owned->pts;
    int64_t dts = owned->dts == AV_NOPTS_VALUE ? owned->pts : owned->dts;
    const AVRational clock{1, static_cast<int>(reader.clock)};
    int64_t dtsMicros = av_rescale_q(dts, reader.timeBase, AVRational{1, 1000000});
    int64_t sinceOrigin = haveOrigin ? dtsMicros - originMicros : 0;
    if (sinceOrigin < 0) sinceOrigin = 0;

    SampleAttributes a;
    a.rtpTime = static_cast<uint64_t>(av_rescale_q(pts, reader.timeBase, clock));
    a.attribute2 = static_cast<uint64_t>(av_rescale_q(dts, reader.timeBase, clock));
    reader.lastTimestampMs = std::max(reader.lastTimestampMs, sinceOrigin / 1000);
    a.timestamp = static_cast<uint64_t>(reader.lastTimestampMs);
    reader.lastCaptureMicros = std::max(reader.lastCaptureMicros, sinceOrigin);
    a.attribute1 = captureStartMicros + static_cast<uint64_t>(reader.lastCaptureMicros);
    a.attribute4 = static_cast<uint32_t>(reader.streamIndex);
    a.attribute5 = reader.clock;
    a.attribute6 = true;
    a.attribute7 = reader.packetNumber++;
    a.payloadSize = static_cast<uint64_t>(owned->size);
    const uint8_t* data = owned->data;
    size_t size = static_cast<size_t>(owned->size);
    std::shared_ptr<const void> owner(owned, [](const void* p) {
        auto* packet = static_cast<AVPacket*>(const_cast<void*>(p));
        av_packet_free(&packet);
    });
    auto sample =
        std::make_shared<ReceivedSample>(a.Encode(), data, size, owner, reader.description);
    reader.samples->push_back(StreamData(sample));
}

}  // namespace

bool LoadClipSamples(const std::string& path, ClipSamples* clip, std::string* error,
                     uint64_t captureStartMicros) {
    *clip = ClipSamples();
    Input input;
    if (avformat_open_input(&input.context, path.c_str(), nullptr, nullptr) < 0 ||
        avformat_find_stream_info(input.context, nullptr) < 0) {
        *error = "cannot open " + path;
        return false;
    }
    Reader& video = input.readers[0];
    Reader& audio = input.readers[1];
    Reader& meta = input.readers[2];
    for (unsigned i = 0; i < input.context->nb_streams; ++i) {
        const AVStream* stream = input.context->streams[i];
        const AVCodecParameters* par = stream->codecpar;
        Reader* reader = nullptr;
        auto kind = TrackDescription::Kind::Video;
        if (video.streamIndex < 0 &&
            (par->codec_id == AV_CODEC_ID_H264 || par->codec_id == AV_CODEC_ID_HEVC)) {
            reader = &video;
        } else if (audio.streamIndex < 0 && par->codec_type == AVMEDIA_TYPE_AUDIO) {
            reader = &audio;
            kind = TrackDescription::Kind::Audio;
        } else if (meta.streamIndex < 0 && (par->codec_type == AVMEDIA_TYPE_DATA ||
                                            par->codec_type == AVMEDIA_TYPE_SUBTITLE)) {
            reader = &meta;
            kind = TrackDescription::Kind::Meta;
        }
        if (!reader) continue;
        reader->streamIndex = static_cast<int>(i);
        reader->timeBase = stream->time_base;
        reader->clock = kind == TrackDescription::Kind::Audio && par->sample_rate > 0
                            ? static_cast<uint32_t>(par->sample_rate)
                            : 90000;
        auto description = std::make_shared<TrackDescription>();
        description->kind = kind;
        description->codecName = avcodec_get_name(par->codec_id);
        description->trackIndex = static_cast<int>(i);
        description->clockRate = reader->clock;
        if (reader == &video) {
            const char* name =
                par->codec_id == AV_CODEC_ID_H264 ? "h264_mp4toannexb" : "hevc_mp4toannexb";
            if (av_bsf_alloc(av_bsf_get_by_name(name), &reader->filter) < 0 ||
                avcodec_parameters_copy(reader->filter->par_in, par) < 0 ||
                (reader->filter->time_base_in = stream->time_base, false) ||
                av_bsf_init(reader->filter) < 0) {
                *error = std::string("cannot set up ") + name;
                return false;
            }
            description->codecParameters = copyParameters(reader->filter->par_out);
        } else {
            description->codecParameters = copyParameters(par);
        }
        reader->description = description;
    }
    video.samples = &clip->video;
    audio.samples = &clip->audio;
    meta.samples = &clip->meta;

    bool haveOrigin = false;
    int64_t originMicros = 0;
    while (av_read_frame(input.context, input.packet) >= 0) {
        AVPacket* packet = input.packet;
        Reader* reader = nullptr;
        for (Reader& r : input.readers)
            if (r.streamIndex == packet->stream_index) reader = &r;
        if (!reader || (packet->pts == AV_NOPTS_VALUE && packet->dts == AV_NOPTS_VALUE)) {
            av_packet_unref(packet);
            continue;
        }
        if (!haveOrigin) {
            int64_t t = packet->dts != AV_NOPTS_VALUE ? packet->dts : packet->pts;
            originMicros = av_rescale_q(t, reader->timeBase, AVRational{1, 1000000});
            haveOrigin = true;
        }
        if (reader->filter) {
            if (av_bsf_send_packet(reader->filter, packet) < 0) {
                *error = "the Annex B filter refused a packet";
                return false;
            }
            while (true) {
                AVPacket* out = av_packet_alloc();
                if (av_bsf_receive_packet(reader->filter, out) < 0) {
                    av_packet_free(&out);
                    break;
                }
                addSample(*reader, out, haveOrigin, originMicros, captureStartMicros);
            }
        } else {
            AVPacket* owned = av_packet_alloc();
            av_packet_move_ref(owned, packet);
            addSample(*reader, owned, haveOrigin, originMicros, captureStartMicros);
        }
        av_packet_unref(packet);
    }
    clip->videoTrack = video.description;
    clip->audioTrack = audio.description;
    clip->metaTrack = meta.description;
    return true;
}

std::vector<uint64_t> IdrTimes(const ClipSamples& clip) {
    std::vector<uint64_t> times;
    bool hevc = clip.videoTrack && clip.videoTrack->codecName == "hevc";
    for (const StreamData& sample : clip.video) {
        bool idr = hevc ? nal_access::StreamAnalyzer::IsIdrH265(sample.PayloadData(),
                                                                sample.PayloadBytes())
                        : nal_access::StreamAnalyzer::IsIdrH264(sample.PayloadData(),
                                                                sample.PayloadBytes());
        if (idr) times.push_back(sample.timestamp);
    }
    return times;
}

FileTransferRequest ClipRequest(const ClipSamples& clip, uint64_t fromMs, uint64_t toMs,
                                int64_t sequenceNumber) {
    FileTransferRequest request;
    request.streamingId = "cam1";
    request.sequenceNumber = sequenceNumber;
    request.bucketName = "rec";
    request.duration = static_cast<uint32_t>(toMs - fromMs);
    auto take = [&](const std::vector<StreamData>& from, std::vector<StreamData>& to) {
        for (const StreamData& sample : from)
            if (sample.timestamp >= fromMs && sample.timestamp < toMs) to.push_back(sample);
    };
    take(clip.video, request.video);
    take(clip.audio, request.audio);
    take(clip.meta, request.meta);
    return request;
}

namespace {

std::string id3Tag(int number) {
    std::string text = std::string("\x03", 1) + "seq" + std::string("\0", 1) +
                       std::to_string(number);  // UTF-8, description "seq", value
    auto syncsafe = [](size_t n) {
        std::string s(4, '\0');
        for (int i = 3; i >= 0; --i) {
            s[i] = static_cast<char>(n & 0x7f);
            n >>= 7;
        }
        return s;
    };
    std::string frame = "TXXX" + syncsafe(text.size()) + std::string(2, '\0') + text;
    return std::string("ID3\x04\x00\x00", 6) + syncsafe(frame.size()) + frame;
}

}  // namespace

std::string ClipWithId3(const std::string& source, const std::string& fileName, int periodMs) {
    std::string dir = BuildPath("media");
    mkdir(dir.c_str(), 0755);
    std::string path = dir + "/" + fileName;
    struct stat st {};
    if (stat(path.c_str(), &st) == 0 && st.st_size > 0) return path;
    std::string temporary = path + ".tmp" + std::to_string(getpid()) + ".ts";

    AVFormatContext* in = nullptr;
    if (avformat_open_input(&in, source.c_str(), nullptr, nullptr) < 0) return "";
    if (avformat_find_stream_info(in, nullptr) < 0) {
        avformat_close_input(&in);
        return "";
    }
    AVFormatContext* out = nullptr;
    avformat_alloc_output_context2(&out, nullptr, "mpegts", temporary.c_str());
    bool ok = out != nullptr;
    int videoIndex = -1;
    std::vector<int> map(in->nb_streams, -1);
    for (unsigned i = 0; ok && i < in->nb_streams; ++i) {
        const AVCodecParameters* par = in->streams[i]->codecpar;
        if (par->codec_type != AVMEDIA_TYPE_VIDEO && par->codec_type != AVMEDIA_TYPE_AUDIO)
            continue;
        AVStream* copy = avformat_new_stream(out, nullptr);
        avcodec_parameters_copy(copy->codecpar, par);
        copy->codecpar->codec_tag = 0;
        copy->time_base = in->streams[i]->time_base;
        map[i] = copy->index;
        if (par->codec_type == AVMEDIA_TYPE_VIDEO && videoIndex < 0)
            videoIndex = static_cast<int>(i);
    }
    AVStream* id3 = ok ? avformat_new_stream(out, nullptr) : nullptr;
    if (id3) {
        id3->codecpar->codec_type = AVMEDIA_TYPE_DATA;
        id3->codecpar->codec_id = AV_CODEC_ID_TIMED_ID3;
        id3->time_base = AVRational{1, 90000};
    }
    ok = ok && id3 && videoIndex >= 0 &&
         avio_open(&out->pb, temporary.c_str(), AVIO_FLAG_WRITE) >= 0 &&
         avformat_write_header(out, nullptr) >= 0;
    AVPacket* packet = av_packet_alloc();
    int64_t nextTag90k = AV_NOPTS_VALUE;
    int tagNumber = 0;
    while (ok && av_read_frame(in, packet) >= 0) {
        int target = map[packet->stream_index];
        if (target < 0) {
            av_packet_unref(packet);
            continue;
        }
        if (packet->stream_index == videoIndex && packet->dts != AV_NOPTS_VALUE) {
            int64_t dts90k =
                av_rescale_q(packet->dts, in->streams[videoIndex]->time_base, AVRational{1, 90000});
            if (nextTag90k == AV_NOPTS_VALUE) nextTag90k = std::max<int64_t>(dts90k, 0);
            while (nextTag90k <= dts90k) {
                std::string tag = id3Tag(tagNumber++);
                AVPacket* tagPacket = av_packet_alloc();
                av_new_packet(tagPacket, static_cast<int>(tag.size()));
                std::copy(tag.begin(), tag.end(), tagPacket->data);
                tagPacket->stream_index = id3->index;
                tagPacket->pts = tagPacket->dts =
                    av_rescale_q(nextTag90k, AVRational{1, 90000}, id3->time_base);
                tagPacket->flags = AV_PKT_FLAG_KEY;
                ok = av_interleaved_write_frame(out, tagPacket) >= 0;
                av_packet_free(&tagPacket);
                nextTag90k += periodMs * 90;
            }
        }
        av_packet_rescale_ts(packet, in->streams[packet->stream_index]->time_base,
                             out->streams[target]->time_base);
        packet->stream_index = target;
        packet->pos = -1;
        ok = ok && av_interleaved_write_frame(out, packet) >= 0;
        av_packet_unref(packet);
    }
    ok = ok && av_write_trailer(out) >= 0;
    av_packet_free(&packet);
    if (out) avio_closep(&out->pb);
    avformat_free_context(out);
    avformat_close_input(&in);
    if (!ok) {
        unlink(temporary.c_str());
        return "";
    }
    rename(temporary.c_str(), path.c_str());
    return path;
}

}  // namespace testsupport
