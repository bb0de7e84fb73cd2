// DataController's upload loop. Guards: files reported out of order or with gaps in their
// numbers, a warning not cleared by a success (or an error cleared), credentials not renewed
// after an authentication error, retry and wait rules per result, the give-up table (names and
// warning codes, overflow dropping), OtherError ending the loop, and Stop racing a transfer
// (a cancelled transfer is no error; one that succeeded is still reported).
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "src/DataController.h"
#include "src/DataUploader.h"
#include "src/FileBuffer.h"
#include "src/TimeManager.h"
#include "tests/support/LogCapture.h"
#include "tests/support/RecordingObserver.h"
#include "tests/support/ScriptedTransfer.h"
#include "tests/support/TestSupport.h"

using namespace Orvane;
using testsupport::WaitUntil;

namespace {

AwsInfo credentials(const std::string& tag) {
    return {"AK" + tag, "SK" + tag, "TK" + tag, "eu-west-1"};
}

// One controller over a real file buffer, a scripted transfer (none when `withTransfer` is
// false) and a recording observer, given credentials "1" unless `withCredentials` is false.
// Settings: no upload interval, 50 ms auth retry.
struct Rig {
    explicit Rig(int bufferFullSize = 100000, int uploadInterval = 0, bool withTransfer = true,
                 bool withCredentials = true)
        : transfer(std::make_shared<testsupport::ScriptedTransfer>()),
          fileBuffer(std::make_shared<FileBuffer>(bufferFullSize)) {
        ModuleSettings s;
        s.bucketName = "rec";
        s.streamingId = "cam1";
        s.uploadInterval = uploadInterval;
        s.authRetryTime = 50;
        s.bufferFullSize = 3;
        controller = std::make_shared<DataController>(
            &observer, fileBuffer, std::make_shared<TimeManager>(),
            std::make_shared<DataUploader>(withTransfer ? transfer : nullptr), s);
        if (withCredentials) controller->SetAwsInfo(credentials("1"));
    }
    ~Rig() { controller->Stop(); }

    // Pushes `count` files of `duration` ms, each with one video and one audio sample.
    void Push(int count, uint32_t duration) {
        for (int i = 0; i < count; ++i) {
            VqStreamFileData f;
            f.duration = duration;
            f.video.push_back(*testsupport::MakeVideo(0, true));
            f.audio.push_back(*testsupport::MakeSample(0));
            fileBuffer->Push(std::move(f));
        }
    }
    std::vector<SequenceEntry> entries() const { return observer.Entries(); }
    bool WaitEntries(size_t n) {
        return WaitUntil([&] { return entries().size() == n; });
    }

    testsupport::RecordingObserver observer;
    std::shared_ptr<testsupport::ScriptedTransfer> transfer;
    std::shared_ptr<FileBuffer> fileBuffer;
    std::shared_ptr<DataController> controller;
};

}  // namespace

TEST(DataControllerReports, SuccessIsReportedWithItsUploadInfoLineAndClearsOnlyAWarning) {
    Rig rig;
    rig.transfer->SetInfo({1048576, 850});
    rig.observer.SetState(Warning);
    rig.Push(3, 1);
    rig.Push(1, 20000);
    rig.controller->Start();
    ASSERT_TRUE(rig.WaitEntries(4));
    EXPECT_EQ(rig.observer.UploadInfos()[2],
              "FileIndex, 3, ErrorCode, Success, ResponseTime, 850, FileSize, 1048576, "
              "BufferCount, 20000");
    auto entries = rig.entries();
    for (uint32_t i = 0; i < 4; ++i) {
        EXPECT_EQ(entries[i].sequenceNumber, i + 1);
        EXPECT_TRUE(entries[i].succeeded);
        EXPECT_EQ(entries[i].streamingId, "cam1");
    }
    EXPECT_EQ(entries[3].duration, 20000u);
    auto request = rig.transfer->Requests()[0];
    EXPECT_EQ(request.bucketName, "rec");
    EXPECT_EQ(request.accessKey, "AK1");
    EXPECT_EQ(request.sessionToken, "TK1");
    EXPECT_EQ(rig.observer.State(), Executing);

    size_t executes = rig.observer.ExecuteCalls();
    rig.observer.SetState(Error);
    rig.Push(1, 10);
    ASSERT_TRUE(rig.WaitEntries(5));
    EXPECT_EQ(rig.observer.State(), Error);
    EXPECT_EQ(rig.observer.ExecuteCalls(), executes);
}

TEST(DataControllerCredentials, WithoutCredentialsEachWaitSendsOneTokenRequest) {
    Rig rig(100000, 0, true, false);
    LogCapture log;
    rig.controller->Start();
    rig.Push(1, 10);
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.TokenRequests() >= 3; }));
    rig.controller->Stop();
    EXPECT_EQ(rig.transfer->RequestCount(), 0u);
    EXPECT_GE(log.Count("Not Received Authentication Info."), 2u);
    EXPECT_EQ(rig.observer.TokenRequests(), log.Count("waitAuthInfo."));
    EXPECT_EQ(log.Find("Not Received Authentication Info.")[0].priority, 5);
    EXPECT_TRUE(rig.entries().empty());  // stopped before giving up: nothing reported
}

TEST(DataControllerCredentials, AuthenticationErrorFetchesFreshCredentialsIntoTheRequest) {
    Rig rig;
    rig.controller->SetAwsInfo(credentials("old"));
    rig.transfer->Script({AuthenticationError, Success});
    rig.observer.OnTokenRequest([&] { rig.controller->SetAwsInfo(credentials("new")); });
    rig.controller->Start();
    rig.Push(1, 10);
    ASSERT_TRUE(rig.WaitEntries(1));
    auto requests = rig.transfer->Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(requests[0].accessKey, "AKold");
    EXPECT_EQ(requests[1].accessKey, "AKnew");
    EXPECT_EQ(requests[1].secretKey, "SKnew");
    EXPECT_EQ(requests[1].sessionToken, "TKnew");
    EXPECT_TRUE(rig.entries()[0].succeeded);
}

TEST(DataControllerRetries, NetworkErrorWaitsOneIntervalThenRetries) {
    Rig rig(100000, 1);
    rig.transfer->Script({NetworkError, Success});
    auto start = std::chrono::steady_clock::now();
    rig.controller->Start();
    rig.Push(1, 10);
    ASSERT_TRUE(rig.WaitEntries(1));
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(950));
    EXPECT_EQ(rig.transfer->RequestCount(), 2u);
    EXPECT_TRUE(rig.entries()[0].succeeded);
}

TEST(DataControllerRetries, StopDuringTheNetworkWaitEndsAtOnceWithoutReporting) {
    Rig rig(100000, 3600);
    LogCapture log;
    rig.transfer->SetFallback(NetworkError);
    rig.controller->Start();
    rig.Push(1, 10);
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("wait enter."); }));
    auto start = std::chrono::steady_clock::now();
    rig.controller->Stop();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    EXPECT_TRUE(rig.entries().empty());
    EXPECT_TRUE(rig.observer.UploadInfos().empty());
}

TEST(DataControllerRetries, ErrorResultsAreRetriedAtOnceADisabledUploaderNever) {
    Rig rig;
    LogCapture log;
    rig.transfer->Script({FileBroken, TimeOut, InternalError, RequestTimeTooSkewed, FilePathError,
                          static_cast<FileTransferResult>(0x80000099), Success, UploaderDisabled});
    rig.controller->Start();
    rig.Push(2, 10);
    ASSERT_TRUE(rig.WaitEntries(2));
    EXPECT_EQ(rig.transfer->RequestCount(), 8u);
    EXPECT_TRUE(rig.entries()[0].succeeded);
    EXPECT_TRUE(rig.observer.Warnings().empty());
    // The disabled uploader's file is reported as failed at once, named "Unknown".
    EXPECT_FALSE(rig.entries()[1].succeeded);
    EXPECT_EQ(rig.observer.UploadInfos()[1].find("FileIndex, 2, ErrorCode, Unknown,"), 0u);
    EXPECT_TRUE(log.Contains("ST: File Uploader is Disabled."));
}

TEST(DataControllerGivingUp, EachResultGivesUpWithItsNameAndWarningCode) {
    const struct {
        FileTransferResult result;
        const char* name;
        std::vector<unsigned> warnings;  // an authentication error warns only from the second
    } cases[] = {
        {TimeOut, "TimeOut", {22}},
        {FilePathError, "FilePathError", {24}},
        {FileBroken, "FileBroken", {25}},
        {NetworkError, "NetworkError", {26}},
        {RequestTimeTooSkewed, "RequestTimeTooSkewed", {27}},
        {InternalError, "InternalError", {28}},
        {static_cast<FileTransferResult>(0x80000099), "Unknown", {0}},
        {AuthenticationError, "AuthenticationError", {}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        // Limit 1000 ms; three files of 600 ms: after the first is popped 1200 remain.
        Rig rig(1000);
        rig.transfer->Script({c.result});
        rig.observer.OnTokenRequest([&] { rig.controller->SetAwsInfo(credentials("2")); });
        rig.Push(3, 600);
        rig.controller->Start();
        ASSERT_TRUE(rig.WaitEntries(3));
        auto entries = rig.entries();
        auto infos = rig.observer.UploadInfos();
        EXPECT_EQ(entries[0].errorName, c.name);
        EXPECT_FALSE(entries[0].succeeded);
        EXPECT_EQ(rig.observer.Warnings(), c.warnings);
        EXPECT_EQ(infos[0].find(std::string("FileIndex, 1, ErrorCode, ") + c.name + ", "), 0u);
        // The second file is dropped for the over-full buffer, the third uploaded.
        EXPECT_EQ(entries[1].errorName, "BufferOver");
        EXPECT_EQ(entries[1].duration, 600u);
        EXPECT_EQ(infos[1],
                  "FileIndex, 2, ErrorCode, OtherError, ResponseTime, 0, FileSize, 0, "
                  "BufferCount, 600");
        EXPECT_TRUE(entries[2].succeeded);
        for (uint32_t i = 0; i < 3; ++i) EXPECT_EQ(entries[i].sequenceNumber, i + 1);
    }
}

TEST(DataControllerGivingUp, AuthenticationErrorWarnsFromTheSecondInARow) {
    Rig rig(1000, 0, true, false);
    // No credentials at all. File 1 is given up at its first authentication error, files 2
    // and 3 are dropped; file 4 then fails again (the second in a row) and is given up with
    // warning 23 once two more files have filled the buffer.
    rig.Push(4, 600);
    rig.observer.OnTokenRequest([&] {
        if (rig.observer.TokenRequests() == 2) rig.Push(2, 600);
    });
    rig.controller->Start();
    // The warning comes before its file's report: wait for the report, which a Stop would
    // otherwise cut off.
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() >= 4; }));
    rig.controller->Stop();
    auto entries = rig.entries();
    const char* names[] = {"AuthenticationError", "BufferOver", "BufferOver",
                           "AuthenticationError"};
    for (size_t i = 0; i < 4; ++i) EXPECT_EQ(entries[i].errorName, names[i]) << i;
    EXPECT_EQ(rig.observer.Warnings(), std::vector<unsigned>{23});
}

TEST(DataControllerOtherError, EndsTheThreadWithModuleErrorAndLaterFilesStay) {
    for (bool withTransfer : {true, false}) {
        SCOPED_TRACE(withTransfer ? "OtherError" : "no transfer interface");
        Rig rig(100000, 0, withTransfer);
        LogCapture log;
        rig.transfer->Script({OtherError});
        rig.Push(1, 100);
        rig.Push(1, 200);
        rig.controller->Start();
        ASSERT_TRUE(WaitUntil([&] { return log.Contains("fileUpload exit."); }));
        EXPECT_EQ(rig.observer.Errors(), std::vector<unsigned>{21});
        EXPECT_TRUE(rig.entries().empty());
        EXPECT_EQ(rig.fileBuffer->GetBufferCount(), 200u);
        rig.controller->Stop();  // still returns
    }
}

TEST(DataControllerStopConcurrency, ACancelledTransferAtShutdownIsNoModuleError) {
    Rig rig;
    rig.transfer->Hold();
    rig.controller->Start();
    rig.Push(1, 10);
    ASSERT_TRUE(WaitUntil([&] { return rig.transfer->InTransfer(); }));
    rig.controller->Stop();  // cancels: the transfer returns TimeOut
    EXPECT_TRUE(rig.transfer->Cancelled());
    EXPECT_TRUE(rig.observer.Errors().empty());
    EXPECT_TRUE(rig.entries().empty());
}

TEST(DataControllerStopConcurrency, ATransferThatSucceedsDuringStopIsStillReported) {
    Rig rig(1000);
    LogCapture log;
    rig.transfer->SetCancelAborts(false);
    rig.transfer->Hold();
    rig.Push(4, 600);
    rig.controller->Start();
    ASSERT_TRUE(WaitUntil([&] { return rig.transfer->InTransfer(); }));
    std::thread stopper([&] { rig.controller->Stop(); });
    ASSERT_TRUE(WaitUntil([&] { return rig.transfer->Cancelled(); }));
    rig.transfer->Release();
    stopper.join();
    auto entries = rig.entries();
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_TRUE(entries[0].succeeded);
    EXPECT_EQ(log.Count("delete buffer : 2. Buffer Count : 1200."), 0u);  // no dropping on stop
}
