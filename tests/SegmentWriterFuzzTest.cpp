// Random payloads and times through the segment writer. Faults guarded: a crash, a read past a
// payload (each ends exactly where an inaccessible page begins, so such a read, by this project's
// code or inside FFmpeg, ends the test with SIGSEGV; ASan watches the rest), an object that is not
// whole TS packets, or more samples reported than given. By default a fixed seed and a fixed
// number of runs (a few seconds), so every test run exercises the same inputs; `make fuzz` runs
// for SFR_FUZZ_SECONDS with the seed SFR_FUZZ_SEED (random there, printed) to look further and
// to replay what it found.
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavutil/log.h>
}

#include <chrono>
#include <cstdlib>
#include <random>

#include "platform/framework/ReceivedSample.h"
#include "platform/transfer/SegmentWriter.h"

namespace {

// `size` bytes that end where an inaccessible page begins.
std::shared_ptr<ReceivedSample> GuardedSample(const SampleAttributes& attributes,
                                              const std::string& bytes,
                                              std::shared_ptr<const TrackDescription> track) {
    static const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    size_t pages = (bytes.size() + page - 1) / page;
    size_t length = (pages + 1) * page;
    void* map = mmap(nullptr, length, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (map == MAP_FAILED) return nullptr;
    auto* base = static_cast<uint8_t*>(map);
    mprotect(base + pages * page, page, PROT_NONE);
    uint8_t* data = base + pages * page - bytes.size();
    std::copy(bytes.begin(), bytes.end(), data);
    mprotect(base, pages * page, PROT_READ);  // the writer only reads payloads
    std::shared_ptr<const void> owner(
        base, [length](const void* p) { munmap(const_cast<void*>(p), length); });
    SampleAttributes a = attributes;
    a.payloadSize = bytes.size();
    return std::make_shared<ReceivedSample>(a.Encode(), data, bytes.size(), owner,
                                            std::move(track));
}

std::shared_ptr<const void> AacParameters(std::mt19937_64& random) {
    AVCodecParameters* p = avcodec_parameters_alloc();
    p->codec_type = AVMEDIA_TYPE_AUDIO;
    p->codec_id = AV_CODEC_ID_AAC;
    p->sample_rate = 48000;
    av_channel_layout_default(&p->ch_layout, 2);
    if (random() % 4 != 0) {  // usually an AudioSpecificConfig, sometimes random bytes
        p->extradata_size = static_cast<int>(random() % 2 ? 2 : random() % 16);
        p->extradata = static_cast<uint8_t*>(
            av_mallocz(static_cast<size_t>(p->extradata_size) + AV_INPUT_BUFFER_PADDING_SIZE));
        for (int i = 0; i < p->extradata_size; ++i)
            p->extradata[i] = static_cast<uint8_t>(random());
        if (p->extradata_size == 2 && random() % 2) {
            p->extradata[0] = 0x11;
            p->extradata[1] = 0x90;
        }
    }
    return std::shared_ptr<const void>(p, [](const void* q) {
        auto* owned = static_cast<AVCodecParameters*>(const_cast<void*>(q));
        avcodec_parameters_free(&owned);
    });
}

std::string RandomPayload(std::mt19937_64& random, TrackDescription::Kind kind) {
    const uint64_t pick = random() % 8;  // mostly small, sometimes tiny or large
    const size_t size = random() % (pick == 0 ? 8 : pick == 1 ? 70000 : 3000);
    std::string bytes(size, '\0');
    for (char& c : bytes) c = static_cast<char>(random());
    // Often a plausible start, so the muxer goes past its first checks.
    if (kind == TrackDescription::Kind::Video && size >= 5 && random() % 4 != 0) {
        bytes.replace(0, 4, std::string("\x00\x00\x00\x01", 4));
        // A start code at the very end makes NAL scanners look for more.
        if (random() % 4 == 0) bytes.replace(size - 3, 3, std::string("\x00\x00\x01", 3));
    }
    if (kind == TrackDescription::Kind::Audio && size >= 2 && random() % 2) {
        bytes[0] = static_cast<char>(0xff);
        bytes[1] = static_cast<char>(0xf1);
    }
    return bytes;
}

TEST(SegmentWriterFuzzTest, RandomPayloadsNeverCrashOrReadPastAPayload) {
    av_log_set_level(AV_LOG_QUIET);
    const char* seedText = std::getenv("SFR_FUZZ_SEED");
    const char* secondsText = std::getenv("SFR_FUZZ_SECONDS");
    const uint64_t seed = seedText ? std::strtoull(seedText, nullptr, 10) : 20260601;
    // 0: the fixed number of runs below instead of a time limit.
    const double seconds = secondsText ? std::atof(secondsText) : 0;
    constexpr size_t kDefaultRuns = 100;
    std::printf("seed %llu\n", static_cast<unsigned long long>(seed));
    std::fflush(stdout);
    std::mt19937_64 random(seed);
    const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    const auto more = [&](size_t runs) {
        return seconds > 0 ? std::chrono::steady_clock::now() < end : runs < kDefaultRuns;
    };

    size_t runs = 0, objects = 0, written = 0;
    std::vector<uint8_t> out;
    while (more(runs)) {
        ++runs;
        SegmentWriter writer;  // one run: the offset carries over between its objects
        auto video = std::make_shared<TrackDescription>();
        video->codecName = random() % 2 ? "h264" : "hevc";
        auto audio = std::make_shared<TrackDescription>();
        audio->kind = TrackDescription::Kind::Audio;
        audio->codecName = random() % 5 == 0 ? "mp2" : "aac";
        audio->clockRate = 48000;
        if (audio->codecName == "aac") audio->codecParameters = AacParameters(random);
        auto meta = std::make_shared<TrackDescription>();
        meta->kind = TrackDescription::Kind::Meta;
        const char* metaCodecs[] = {"timed_id3", "smpte_klv", "bin_data"};
        meta->codecName = metaCodecs[random() % 3];
        std::shared_ptr<const TrackDescription> tracks[] = {video, audio, meta};
        int64_t dts[] = {static_cast<int64_t>(random() % 2000000) - 1000000, 0, 0};
        dts[1] = dts[0] * 48000 / 90000;
        dts[2] = dts[0];
        const int64_t step[] = {3000, 1024, 45000};

        for (int object = 0; object < 3; ++object) {
            std::vector<StreamData> lists[3];
            for (int t = 0; t < 3; ++t) {
                size_t count = random() % (t == 2 ? 6 : 40);
                for (size_t i = 0; i < count; ++i) {
                    // Mostly regular steps; sometimes equal, backwards or far jumps.
                    const uint64_t jump = random() % 16;
                    if (jump == 1)
                        dts[t] -= static_cast<int64_t>(random() % 100000);
                    else if (jump == 2)
                        dts[t] += static_cast<int64_t>(random() % (int64_t{1} << 40));
                    else if (jump != 0)
                        dts[t] += step[t];
                    SampleAttributes a;
                    a.attribute2 = static_cast<uint64_t>(dts[t]);
                    int64_t pts = dts[t] + static_cast<int64_t>(random() % 4) * step[t];
                    if (random() % 32 == 0) pts = dts[t] - 1;
                    a.rtpTime = static_cast<uint64_t>(pts);
                    a.attribute5 =
                        random() % 64 == 0 ? static_cast<uint32_t>(random()) : tracks[t]->clockRate;
                    a.attribute1 = static_cast<uint64_t>(random());
                    auto sample =
                        GuardedSample(a, RandomPayload(random, tracks[t]->kind), tracks[t]);
                    ASSERT_TRUE(sample);
                    lists[t].push_back(StreamData(sample));
                }
            }
            SegmentWriter::Report report;
            std::string error;
            bool ok = writer.Write(lists[0], lists[1], lists[2], &out, &report, &error);
            if (ok) {
                ++objects;
                written += report.written;
                ASSERT_GT(report.written, 0u);
                ASSERT_EQ(0u, out.size() % 188) << "seed " << seed;
            }
            ASSERT_LE(report.written + report.dropped,
                      lists[0].size() + lists[1].size() + lists[2].size());
        }
    }
    std::printf("%zu runs, %zu objects, %zu samples written\n", runs, objects, written);
    EXPECT_GT(objects, 0u);
}

}  // namespace
