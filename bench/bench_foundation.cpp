// Queue hand-over and IDR test costs.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "modulebase/BoundedQueue.h"
#include "platform/framework/ReceivedSample.h"
#include "platform/framework/StreamData.h"
#include "platform/nal/StreamAnalyzer.h"

namespace {

void BM_BoundedQueuePushPop(benchmark::State& state) {
    BoundedQueue<std::shared_ptr<StreamData>> queue(50);
    auto sample = std::make_shared<StreamData>();
    for (auto _ : state) {
        queue.Push(sample);
        benchmark::DoNotOptimize(queue.Pop());
    }
}
BENCHMARK(BM_BoundedQueuePushPop);

// An IDR access unit of about `bytes`: SPS, PPS, SEI, then one large slice.
std::shared_ptr<StreamData> idrUnit(size_t bytes) {
    const std::string start("\x00\x00\x00\x01", 4);
    std::string au = start + std::string("\x67\x64\x00\x1f\xac\xd9\x40", 7) + start +
                     std::string("\x68\xeb\xe3\xcb", 4) + start + "\x06\x05" +
                     std::string(200, '\x11') + start + "\x65\x88\x84";
    while (au.size() < bytes) au.push_back(static_cast<char>(0x3C + au.size() % 7));
    SampleAttributes a;
    return std::make_shared<StreamData>(MakeReceivedSample(a, au, nullptr));
}

void BM_IsIDR(benchmark::State& state) {
    auto sample = idrUnit(static_cast<size_t>(state.range(0)));
    nal_access::StreamAnalyzer analyzer;
    for (auto _ : state) benchmark::DoNotOptimize(analyzer.IsIDR(sample));
}
BENCHMARK(BM_IsIDR)->Arg(4 * 1024)->Arg(400 * 1024);

}  // namespace
