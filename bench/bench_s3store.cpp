// One PUT of a 10 s segment at 4 Mbit/s (5,000,000 bytes) to s3rver on 127.0.0.1, and the
// client's share of it: the SHA-256 and MD5 every request needs.
#include <benchmark/benchmark.h>
#include <limits.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <random>
#include <string>

#include "platform/transfer/S3PutRequest.h"
#include "platform/transfer/S3Store.h"
#include "tests/support/S3rver.h"

namespace {

const size_t kSegmentBytes = 4'000'000 / 8 * 10;

const std::string& Segment() {
    static const std::string segment = [] {
        std::mt19937 random(42);
        std::string bytes(kSegmentBytes, '\0');
        for (char& c : bytes) c = static_cast<char>(random());
        return bytes;
    }();
    return segment;
}

std::string Parent(const std::string& path) {
    return path.substr(0, path.find_last_of('/'));
}

// The server, started on first use and stopped at exit. The script lives in the source tree
// (found from this file's path), the npm packages in the build tree (found from the program's
// path: BUILD/bench/bench_s3store).
testsupport::S3rver* Server() {
    static std::unique_ptr<testsupport::S3rver> server = [] {
        auto s = std::make_unique<testsupport::S3rver>();
        char exe[PATH_MAX] = {};
        ssize_t n = readlink("/proc/self/exe", exe, sizeof exe - 1);
        std::string build = n > 0 ? Parent(Parent(std::string(exe, static_cast<size_t>(n)))) : ".";
        std::string source = Parent(Parent(__FILE__));
        if (!s->Start(source + "/scripts/s3rver.sh", build + "/node")) {
            std::fprintf(stderr, "s3rver: %s\n", s->Error().c_str());
            s.reset();
        }
        return s;
    }();
    return server.get();
}

void BM_S3PutSegment(benchmark::State& state) {
    testsupport::S3rver* server = Server();
    if (server == nullptr) {
        state.SkipWithError("s3rver did not start");
        return;
    }
    S3StoreConfig config;
    std::string why;
    S3StoreConfig::Parse(server->Endpoint(), config, why);
    S3Store store(config);
    ObjectToStore object;
    object.bucket = testsupport::S3rver::kBucket;
    object.key = "bench/cam1/2026/01/02/cam1_20260102T030405.678Z_1.ts";
    object.metadata = {{"streamingid", "cam1"}, {"sequencenumber", "1"}, {"duration", "10000"}};
    object.data = reinterpret_cast<const uint8_t*>(Segment().data());
    object.size = Segment().size();
    StoreCredentials credentials{testsupport::S3rver::kAccessKey, testsupport::S3rver::kSecretKey,
                                 "token", "us-east-1", false};
    double responseMs = 0;
    for (auto _ : state) {
        FileTransferInfo info;
        if (store.Put(object, credentials, &info) != Success) {
            state.SkipWithError("PUT failed");
            return;
        }
        responseMs += info.responseTime;
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kSegmentBytes));
    state.counters["responseTime_ms"] = responseMs / static_cast<double>(state.iterations());
}
BENCHMARK(BM_S3PutSegment)->Unit(benchmark::kMillisecond)->UseRealTime()->MinTime(3.0);

// What the store hashes per object: MD5 (Content-MD5, ETag check) and, when the payload is
// signed (plain HTTP), SHA-256. state.range(0): 1 with SHA-256, 0 with UNSIGNED-PAYLOAD.
void BM_SegmentDigests(benchmark::State& state) {
    const std::string& segment = Segment();
    ObjectToStore object;
    object.data = reinterpret_cast<const uint8_t*>(segment.data());
    object.size = segment.size();
    S3Target target;
    target.url = state.range(0) == 1 ? "http://127.0.0.1/rec/k.ts" : "https://host/k.ts";
    for (auto _ : state) benchmark::DoNotOptimize(DigestS3Payload(object, target));
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kSegmentBytes));
}
BENCHMARK(BM_SegmentDigests)->ArgName("sha256")->Arg(1)->Arg(0)->Unit(benchmark::kMillisecond);

}  // namespace
