// StreamBuffer costs: intake per sample (with and without the H.264 IDR test) and cutting one
// 60 s stream file of 30 fps video and 50 audio frames per second (about 4,800 samples).
//
// createStreamFileData is private and normally runs on the filing thread after a 500 ms tick;
// StreamBufferProbe (a friend that only bench/test code defines) calls it directly so that the
// measurement holds the assembly alone. Log lines are kept below the level (10) so that the
// per-IDR "IDR:" line does not measure the terminal.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/logger/Logger.h"
#include "src/NalAnalyzer.h"
#include "src/StreamBuffer.h"

namespace Orvane {

class StreamBufferProbe {
  public:
    // What the filing thread sets up when it starts.
    static void PrepareFiling(StreamBuffer& buffer) {
        buffer.intervalLength_ = buffer.settings_.uploadInterval * 1000;
    }
    static void CreateStreamFileData(StreamBuffer& buffer, VqStreamFileData& file) {
        buffer.createStreamFileData(file);
    }
};

namespace {

class FixedTime : public ITimeManager {
  public:
    uint32_t GetTime() override { return 0; }
};

class NullFileBuffer : public IFileBuffer {
  public:
    void Push(const VqStreamFileData&) override {}
    VqStreamFileData Pop() override { return {}; }
    bool IsBufferFull() override { return false; }
    uint64_t GetBufferCount() override { return 0; }
};

// Tells IDRs by a flag the sample carries (attribute7 = 1): intake cost without parsing.
class FlagAnalyzer : public INalAnalyzer {
  public:
    bool IsIDR(const std::shared_ptr<StreamData>& sample) override {
        return sample->attribute7 == 1;
    }
};

std::string AnnexB(const std::string& header, size_t bytes) {
    std::string unit = std::string("\x00\x00\x00\x01", 4) + header;
    unit.resize(bytes, static_cast<char>(0x5A));
    return unit;
}

std::shared_ptr<StreamData> Sample(uint64_t timestamp, uint64_t rtpTime, std::string payload,
                                   bool idrFlag = false) {
    SampleAttributes attributes;
    attributes.timestamp = timestamp;
    attributes.rtpTime = rtpTime;
    attributes.payloadSize = payload.size();
    attributes.attribute7 = idrFlag ? 1 : 0;
    return std::make_shared<StreamData>(
        MakeReceivedSample(attributes, std::move(payload), nullptr));
}

// One GOP of 2 s at 30 fps: an IDR (SPS, PPS, IDR slice) then 59 P slices.
std::vector<std::shared_ptr<StreamData>> OneGop() {
    const std::string idr = std::string("\x00\x00\x00\x01\x67\x42\x00\x1e\x95\xa8\x28", 11) +
                            std::string("\x00\x00\x00\x01\x68\xce\x3c\x80", 8) +
                            AnnexB("\x65\x88\x84", 4000);
    std::vector<std::shared_ptr<StreamData>> gop;
    for (uint64_t k = 0; k < 60; ++k) {
        gop.push_back(
            Sample(k * 100 / 3, k * 3000, k == 0 ? idr : AnnexB("\x41\x9a\x02", 1500), k == 0));
    }
    return gop;
}

std::unique_ptr<StreamBuffer> MakeBuffer(std::shared_ptr<INalAnalyzer> analyzer) {
    ModuleSettings settings;
    settings.uploadInterval = 60;
    settings.bufferFullSize = 10;
    return std::make_unique<StreamBuffer>(nullptr, std::make_shared<NullFileBuffer>(),
                                          std::make_shared<FixedTime>(), std::move(analyzer),
                                          settings);
}

void ReceiveVideo(benchmark::State& state, std::shared_ptr<INalAnalyzer> analyzer) {
    Logger::SetLevel(10);
    const auto gop = OneGop();
    auto buffer = MakeBuffer(analyzer);
    size_t held = 0;
    for (auto _ : state) {
        buffer->ReceiveVideo(gop[held % gop.size()]);
        if (++held == 18000) {  // ten minutes of video: start over so memory stays flat
            state.PauseTiming();
            buffer = MakeBuffer(analyzer);
            held = 0;
            state.ResumeTiming();
        }
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_ReceiveVideo_H264IdrTest(benchmark::State& state) {
    ReceiveVideo(state, std::make_shared<NalAnalyzer>(0));
}
BENCHMARK(BM_ReceiveVideo_H264IdrTest);

void BM_ReceiveVideo_FlagIdrTest(benchmark::State& state) {
    ReceiveVideo(state, std::make_shared<FlagAnalyzer>());
}
BENCHMARK(BM_ReceiveVideo_FlagIdrTest);

void BM_ReceiveAudio(benchmark::State& state) {
    Logger::SetLevel(10);
    const auto sample = Sample(0, 0, std::string(400, 'a'));
    auto buffer = MakeBuffer(std::make_shared<FlagAnalyzer>());
    size_t held = 0;
    for (auto _ : state) {
        buffer->ReceiveAudio(sample);
        if (++held == 30000) {
            state.PauseTiming();
            buffer = MakeBuffer(std::make_shared<FlagAnalyzer>());
            held = 0;
            state.ResumeTiming();
        }
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ReceiveAudio);

// One 60 s file: video 0..60033 with an IDR every 2 s (cut 59999), audio every 20 ms.
void BM_CreateStreamFileData_60s(benchmark::State& state) {
    Logger::SetLevel(10);
    const auto analyzer = std::make_shared<NalAnalyzer>(0);
    std::vector<std::shared_ptr<StreamData>> video;
    std::vector<std::shared_ptr<StreamData>> audio;
    for (uint64_t k = 0; k <= 1801; ++k) {
        video.push_back(Sample(k * 100 / 3, k * 3000,
                               k % 60 == 0 ? std::string("\x00\x00\x00\x01\x65\x88\x84", 7)
                                           : std::string("\x00\x00\x00\x01\x41\x9a\x02", 7)));
    }
    for (uint64_t ts = 0; ts <= 60020; ts += 20)
        audio.push_back(Sample(ts, ts * 48, std::string(300, 'a')));

    size_t samples = 0;
    for (auto _ : state) {
        state.PauseTiming();
        auto buffer = MakeBuffer(analyzer);
        StreamBufferProbe::PrepareFiling(*buffer);
        for (const auto& sample : video) buffer->ReceiveVideo(sample);
        for (const auto& sample : audio) buffer->ReceiveAudio(sample);
        auto file = std::make_unique<VqStreamFileData>();
        state.ResumeTiming();

        StreamBufferProbe::CreateStreamFileData(*buffer, *file);

        state.PauseTiming();
        samples = file->video.size() + file->audio.size();
        if (file->duration != 59999 || samples != 4800) state.SkipWithError("unexpected file");
        file.reset();
        buffer.reset();
        state.ResumeTiming();
    }
    state.counters["samples"] = static_cast<double>(samples);
}
BENCHMARK(BM_CreateStreamFileData_60s)->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace Orvane
