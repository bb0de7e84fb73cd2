// Pacing after failures. Faults guarded: retry waits outside their jittered, capped bounds; a
// floor between failed transfers that does not double to its cap or is not reset by a success;
// a store that keeps refusing (a wrong signature, a missing local bucket, 503) tried without
// bound when the recorder asks again at once; Cancel not ending the wait after a failure.
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <thread>

#include "platform/transfer/LocalDirectoryStore.h"
#include "platform/transfer/RetryPacing.h"
#include "platform/transfer/S3Store.h"
#include "platform/transfer/SegmentTransfer.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ScriptedHttpServer.h"
#include "tests/support/StoreRoot.h"
#include "tests/support/TestSupport.h"

using namespace std::chrono;
using namespace testsupport;

namespace {

TEST(RetryPacingTest, RetryWaitsGrowToTheirCapAndTheFloorDoublesUntilASuccess) {
    RetryPolicy policy;         // retries: base 100 ms, cap 20 s; floor: 200 ms doubling to 30 s
    const int64_t waits[][3] = {// retry, random, wait (ms)
                                {1, 100, 100},         {1, 101, 0},       {2, 200, 200},
                                {2, 1000, 1000 % 201}, {9, 19999, 19999}, {40, 20000, 20000},
                                {40, 20001, 0}};
    for (const auto& [retry, random, ms] : waits)
        EXPECT_EQ(
            RetryDelay(policy, static_cast<int>(retry), static_cast<uint64_t>(random)).count(), ms)
            << retry << " " << random;
    policy.jitter = false;
    EXPECT_EQ(RetryDelay(policy, 3, 0).count(), 400);

    FailureFloor floor(policy);
    const auto t0 = steady_clock::now();
    EXPECT_EQ(floor.Remaining(t0).count(), 0);
    const int64_t doubling[] = {200, 400, 800, 1600, 3200, 6400, 12800, 25600, 30000, 30000};
    for (int64_t ms : doubling) {
        floor.Record(false, t0);
        EXPECT_EQ(duration_cast<milliseconds>(floor.Remaining(t0)).count(), ms);
    }
    EXPECT_EQ(floor.Remaining(t0 + seconds(30)).count(), 0);
    floor.Record(true, t0);
    EXPECT_EQ(floor.Remaining(t0).count(), 0);
    floor.Record(false, t0);
    EXPECT_EQ(duration_cast<milliseconds>(floor.Remaining(t0)).count(), 200);
}

FileTransferRequest OneSample(const std::string& bucket) {
    FileTransferRequest request;
    request.streamingId = "cam1";
    request.sequenceNumber = 1;
    request.bucketName = bucket;
    request.accessKey = "ak";
    request.secretKey = "sk";
    request.region = "us-east-1";
    request.video.push_back(*MakeVideo(0, true));
    return request;
}

// The recorder asks again at once after most failures; for 3 s here. Transfers start at 0,
// 0.2, 0.6, 1.4 and 3.0 s; each tries at most three times when the failure may pass.
TEST(RetryPacingTest, AStoreThatKeepsRefusingIsTriedABoundedNumberOfTimes) {
    ScriptedHttpServer refusing(ScriptedHttpServer::Mode::kRespond,
                                S3ErrorAnswer("403 Forbidden", "SignatureDoesNotMatch")),
        busy(ScriptedHttpServer::Mode::kRespond, S3ErrorAnswer("503 Slow Down", "SlowDown"));
    StoreRoot root;
    auto s3 = [](const std::string& endpoint) {
        S3StoreConfig config;
        std::string why;
        S3StoreConfig::Parse(endpoint, config, why);
        return std::make_shared<S3Store>(config);
    };
    const struct {
        const char* name;
        std::shared_ptr<IObjectStore> store;
        FileTransferRequest request;
        int attempts;  // per transfer
    } cases[] = {
        {"wrong signature", s3(refusing.Endpoint()), OneSample("rec"), 1},
        {"503", s3(busy.Endpoint()), OneSample("rec"), 3},
        {"missing bucket", std::make_shared<LocalDirectoryStore>(root.Root()), OneSample("missing"),
         1},
    };
    for (const auto& c : cases) {
        LogCapture log;
        SegmentTransfer transfer(c.store, "");
        int transfers = 0;
        for (auto end = steady_clock::now() + seconds(3); steady_clock::now() < end; ++transfers)
            EXPECT_NE(Success, transfer.Transfer(c.request, nullptr));
        size_t requests = 0;  // each attempt logs one warning of its store
        for (const LogRecord& r : log.Records())
            requests += r.priority == 5 && r.function.find("Store::Put") != std::string::npos;
        EXPECT_GE(transfers, 3) << c.name;
        EXPECT_LE(transfers, 6) << c.name;
        EXPECT_GE(requests, static_cast<size_t>(transfers)) << c.name;
        EXPECT_LE(requests, static_cast<size_t>(transfers * c.attempts)) << c.name;
    }
    EXPECT_LE(refusing.Connections(), 6);
    EXPECT_LE(busy.Connections(), 18);
}

// Cancel ends the wait for the floor (a minute here) at once, as it ends the transfer itself.
TEST(RetryPacingConcurrencyTest, CancelEndsTheWaitAfterAFailure) {
    StoreRoot root;
    RetryPolicy pacing;
    pacing.floorStart = minutes(1);
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(root.Root()), "",
                             SegmentFormat::Ts(), pacing);
    const FileTransferRequest request = OneSample("missing");
    ASSERT_EQ(FilePathError, transfer.Transfer(request, nullptr));
    LogCapture log;
    std::atomic<int> result{-1};
    std::thread upload([&] { result = transfer.Transfer(request, nullptr); });
    const bool waiting = WaitUntil([&] { return log.CountContaining("waits") > 0; });
    const auto cancelled = steady_clock::now();
    transfer.Cancel();
    upload.join();
    EXPECT_TRUE(waiting);
    EXPECT_EQ(static_cast<int>(TimeOut), result.load());
    EXPECT_LT(steady_clock::now() - cancelled, seconds(10));
}

}  // namespace
