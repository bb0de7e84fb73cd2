// Writing one 10 s, 4 Mbit/s stream file (H.264 at 30 fps with an IDR every 2 s, AAC at 48 kHz,
// a meta record every 500 ms) into a TS object in memory, as the transfer does once per file:
// into the transfer's one reused buffer, and, for comparison, into a fresh buffer per object.
// The page faults per object show what a fresh ~5 MB buffer costs in first touches.
#include <benchmark/benchmark.h>
#include <sys/resource.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/transfer/SegmentWriter.h"

namespace {

const std::string kStart("\x00\x00\x00\x01", 4);

std::string Filled(std::string head, size_t bytes) {
    head.reserve(bytes);
    for (size_t i = head.size(); i < bytes; ++i) head.push_back(static_cast<char>(0x40 + i % 61));
    return head;
}

std::string AdtsFrame(size_t bytes) {  // AAC-LC, 48 kHz, stereo
    std::string frame(7, '\0');
    frame[0] = static_cast<char>(0xff);
    frame[1] = static_cast<char>(0xf1);
    frame[2] = static_cast<char>(0x4c);
    frame[3] = static_cast<char>(0x80 | ((bytes >> 11) & 3));
    frame[4] = static_cast<char>((bytes >> 3) & 0xff);
    frame[5] = static_cast<char>(((bytes & 7) << 5) | 0x1f);
    frame[6] = static_cast<char>(0xfc);
    return Filled(frame, bytes);
}

struct Segment {
    std::vector<StreamData> video, audio, meta;
    size_t payloadBytes = 0;
};

Segment MakeSegment() {
    auto track = [](TrackDescription::Kind kind, const char* codec, uint32_t clock) {
        auto t = std::make_shared<TrackDescription>();
        t->kind = kind;
        t->codecName = codec;
        t->clockRate = clock;
        return t;
    };
    auto video = track(TrackDescription::Kind::Video, "h264", 90000);
    auto audio = track(TrackDescription::Kind::Audio, "aac", 48000);
    auto meta = track(TrackDescription::Kind::Meta, "timed_id3", 90000);
    Segment s;
    auto add = [&s](std::vector<StreamData>& list, const std::shared_ptr<TrackDescription>& t,
                    uint64_t time, std::string payload) {
        SampleAttributes a;
        a.rtpTime = a.attribute2 = time;
        a.attribute5 = t->clockRate;
        a.timestamp = time * 1000 / t->clockRate;
        s.payloadBytes += payload.size();
        list.push_back(StreamData(MakeReceivedSample(a, std::move(payload), t)));
    };
    // 4 Mbit/s: 500 000 bytes a second, 8000 of them audio (64 kbit/s, 47 frames); video has
    // 29 P frames and one IDR of five times their size a second.
    const size_t audioFrame = 8000 / 47;
    const size_t pFrame = (500000 - 8000) / (29 + 5);
    for (int i = 0; i < 300; ++i) {
        bool idr = i % 60 == 0;
        std::string head = idr ? kStart + std::string("\x67\x42\x00\x1e\x95\xa8\x28", 7) + kStart +
                                     std::string("\x68\xce\x3c\x80", 4) + kStart +
                                     std::string("\x65\x88\x84", 3)
                               : kStart + std::string("\x41\x9a\x02", 3);
        add(s.video, video, static_cast<uint64_t>(i) * 3000,
            Filled(head, idr ? 5 * pFrame : pFrame));
    }
    for (int i = 0; i < 469; ++i)
        add(s.audio, audio, static_cast<uint64_t>(i) * 1024, AdtsFrame(audioFrame));
    for (int i = 0; i < 20; ++i)
        add(s.meta, meta, static_cast<uint64_t>(i) * 45000, Filled("ID3", 120));
    return s;
}

long MinorFaults() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_minflt;
}

// state.range(0): 1 to reuse one buffer for every object (as SegmentTransfer does), 0 for a
// fresh buffer per object.
void BM_WriteTenSecondSegment(benchmark::State& state) {
    const bool reuse = state.range(0) == 1;
    Segment segment = MakeSegment();
    SegmentWriter writer;
    std::vector<uint8_t> kept;
    size_t objectBytes = 0;
    const long faultsBefore = MinorFaults();
    for (auto _ : state) {
        std::vector<uint8_t> fresh;
        std::vector<uint8_t>& out = reuse ? kept : fresh;
        SegmentWriter::Report report;
        std::string error;
        if (!writer.Write(segment.video, segment.audio, segment.meta, &out, &report, &error)) {
            state.SkipWithError(error.c_str());
            break;
        }
        benchmark::DoNotOptimize(out.data());
        objectBytes = out.size();
    }
    const double objects = static_cast<double>(state.iterations());
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * segment.payloadBytes));
    state.counters["payload_MB"] = static_cast<double>(segment.payloadBytes) / 1e6;
    state.counters["object_MB"] = static_cast<double>(objectBytes) / 1e6;
    state.counters["overhead_%"] =
        100.0 * (static_cast<double>(objectBytes) / static_cast<double>(segment.payloadBytes) - 1);
    state.counters["faults/object"] = static_cast<double>(MinorFaults() - faultsBefore) / objects;
}
BENCHMARK(BM_WriteTenSecondSegment)
    ->ArgName("reuse")
    ->Arg(1)
    ->Arg(0)
    ->Unit(benchmark::kMillisecond);

}  // namespace
