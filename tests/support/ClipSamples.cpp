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
#include <optional>

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

using Packet = std::unique_ptr<AVPacket, void (*)(AVPacket*)>;
Packet newPacket() {
    return Packet(av_packet_alloc(), [](AVPacket* p) { av_packet_free(&p); });
}

// `path` opened with its stream information; null when it cannot be.
std::shared_ptr<AVFormatContext> openInput(const std::string& path) {
    AVFormatContext* context = nullptr;
    if (avformat_open_input(&context, path.c_str(), nullptr, nullptr) < 0) return nullptr;
    std::shared_ptr<AVFormatContext> input(context,
                                           [](AVFormatContext* c) { avformat_close_input(&c); });
    return avformat_find_stream_info(context, nullptr) < 0 ? nullptr : input;
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

struct Readers {
    Reader all[3];  // video, audio, meta
    ~Readers() {
        for (Reader& r : all) av_bsf_free(&r.filter);
    }
};

void addSample(Reader& reader, Packet owned, int64_t originMicros, uint64_t captureStartMicros) {
    int64_t pts = owned->pts == AV_NOPTS_VALUE ? owned->dts : owned->pts;
    int64_t dts = owned->dts == AV_NOPTS_VALUE ? owned->pts : owned->dts;
    const AVRational clock{1, static_cast<int>(reader.clock)};
    int64_t sinceOrigin = std::max<int64_t>(
        av_rescale_q(dts, reader.timeBase, AVRational{1, 1000000}) - originMicros, 0);
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
    std::shared_ptr<const void> owner(std::move(owned));
    reader.samples->push_back(StreamData(
        std::make_shared<ReceivedSample>(a.Encode(), data, size, owner, reader.description)));
}

}  // namespace

bool LoadClipSamples(const std::string& path, ClipSamples* clip, std::string* error,
                     uint64_t captureStartMicros) {
    *clip = ClipSamples();
    auto input = openInput(path);
    if (!input) {
        *error = "cannot open " + path;
        return false;
    }
    Readers readers;
    Reader &video = readers.all[0], &audio = readers.all[1], &meta = readers.all[2];
    for (unsigned i = 0; i < input->nb_streams; ++i) {
        const AVStream* stream = input->streams[i];
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

    std::optional<int64_t> originMicros;
    for (Packet packet = newPacket(); av_read_frame(input.get(), packet.get()) >= 0;
         packet = newPacket()) {
        Reader* reader = nullptr;
        for (Reader& r : readers.all)
            if (r.streamIndex == packet->stream_index) reader = &r;
        if (!reader || (packet->pts == AV_NOPTS_VALUE && packet->dts == AV_NOPTS_VALUE)) continue;
        if (!originMicros) {
            int64_t t = packet->dts != AV_NOPTS_VALUE ? packet->dts : packet->pts;
            originMicros = av_rescale_q(t, reader->timeBase, AVRational{1, 1000000});
        }
        if (!reader->filter) {
            addSample(*reader, std::move(packet), *originMicros, captureStartMicros);
            continue;
        }
        if (av_bsf_send_packet(reader->filter, packet.get()) < 0) {
            *error = "the Annex B filter refused a packet";
            return false;
        }
        for (Packet out = newPacket(); av_bsf_receive_packet(reader->filter, out.get()) >= 0;
             out = newPacket())
            addSample(*reader, std::move(out), *originMicros, captureStartMicros);
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

    auto input = openInput(source);
    if (!input) return "";
    AVFormatContext* in = input.get();
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
    Packet packet = newPacket();
    int64_t nextTag90k = AV_NOPTS_VALUE;
    int tagNumber = 0;
    while (ok && av_read_frame(in, packet.get()) >= 0) {
        int target = map[packet->stream_index];
        if (target < 0) {
            av_packet_unref(packet.get());
            continue;
        }
        if (packet->stream_index == videoIndex && packet->dts != AV_NOPTS_VALUE) {
            int64_t dts90k =
                av_rescale_q(packet->dts, in->streams[videoIndex]->time_base, AVRational{1, 90000});
            if (nextTag90k == AV_NOPTS_VALUE) nextTag90k = std::max<int64_t>(dts90k, 0);
            while (nextTag90k <= dts90k) {
                std::string tag = id3Tag(tagNumber++);
                Packet tagPacket = newPacket();
                av_new_packet(tagPacket.get(), static_cast<int>(tag.size()));
                std::copy(tag.begin(), tag.end(), tagPacket->data);
                tagPacket->stream_index = id3->index;
                tagPacket->pts = tagPacket->dts = nextTag90k;  // the track's time base is 1/90000
                tagPacket->flags = AV_PKT_FLAG_KEY;
                ok = av_interleaved_write_frame(out, tagPacket.get()) >= 0;
                nextTag90k += periodMs * 90;
            }
        }
        av_packet_rescale_ts(packet.get(), in->streams[packet->stream_index]->time_base,
                             out->streams[target]->time_base);
        packet->stream_index = target;
        packet->pos = -1;
        ok = ok && av_interleaved_write_frame(out, packet.get()) >= 0;
        av_packet_unref(packet.get());
    }
    ok = ok && av_write_trailer(out) >= 0;
    if (out) avio_closep(&out->pb);
    avformat_free_context(out);
    if (!ok) {
        unlink(temporary.c_str());
        return "";
    }
    rename(temporary.c_str(), path.c_str());
    return path;
}

}  // namespace testsupport
