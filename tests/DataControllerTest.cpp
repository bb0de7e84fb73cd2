#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "platform/logger/LogCapture.h"
#include "src/DataController.h"
#include "src/DataUploader.h"
#include "src/FileBuffer.h"
#include "src/TimeManager.h"
#include "tests/support/RecordingObserver.h"
#include "tests/support/ScriptedTransfer.h"
#include "tests/support/TestSupport.h"

using namespace Orvane;
using testsupport::RecordingObserver;
using testsupport::ScriptedTransfer;
using testsupport::WaitUntil;

namespace {

VqStreamFileData fileOf(uint32_t duration, uint64_t firstTimestamp = 0) {
    VqStreamFileData f;
    f.duration = duration;
    f.video.push_back(*testsupport::MakeVideo(firstTimestamp, true));
    f.audio.push_back(*testsupport::MakeSample(firstTimestamp));
    return f;
}

AwsInfo credentials(const std::string& tag) {
    return {"AK" + tag, "SK" + tag, "TK" + tag, "eu-west-1"};
}

// One controller over a real file buffer, a scripted transfer and a recording observer.
struct Rig {
    explicit Rig(int bufferFullSize = 100000, ModuleSettings s = settings())
        : transfer(std::make_shared<ScriptedTransfer>()),
          fileBuffer(std::make_shared<FileBuffer>(bufferFullSize)),
          controller(std::make_shared<DataController>(
              &observer, fileBuffer, std::make_shared<TimeManager>(),
              std::make_shared<DataUploader>(transfer), s)) {}
    ~Rig() { controller->Stop(); }

    static ModuleSettings settings() {
        ModuleSettings s;
        s.bucketName = "rec";
        s.streamingId = "cam1";
        s.uploadInterval = 0;
        s.authRetryTime = 50;
        s.bufferFullSize = 3;
        return s;
    }
    std::vector<SequenceEntry> entries() const { return observer.Entries(); }

    RecordingObserver observer;
    std::shared_ptr<ScriptedTransfer> transfer;
    std::shared_ptr<FileBuffer> fileBuffer;
    std::shared_ptr<DataController> controller;
};

}  // namespace

TEST(DataControllerReports, SuccessIsReportedWithItsUploadInfoLine) {
    Rig rig;
    rig.transfer->SetInfo({1048576, 850});
    rig.controller->SetAwsInfo(credentials("1"));
    rig.fileBuffer->Push(fileOf(1));
    rig.fileBuffer->Push(fileOf(1));
    rig.fileBuffer->Push(fileOf(1));
    rig.fileBuffer->Push(fileOf(20000));
    rig.controller->Start();
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.UploadInfos().size() >= 4; }));
    auto infos = rig.observer.UploadInfos();
    EXPECT_EQ(infos[2],
              "FileIndex, 3, ErrorCode, Success, ResponseTime, 850, FileSize, 1048576, "
              "BufferCount, 20000");
    EXPECT_EQ(
        infos[3],
        "FileIndex, 4, ErrorCode, Success, ResponseTime, 850, FileSize, 1048576, BufferCount, 0");
    auto entries = rig.entries();
    ASSERT_EQ(entries.size(), 4u);
    for (uint32_t i = 0; i < 4; ++i) {
        EXPECT_EQ(entries[i].sequenceNumber, i + 1);
        EXPECT_TRUE(entries[i].succeeded);
        EXPECT_EQ(entries[i].errorName, "");
        EXPECT_EQ(entries[i].streamingId, "cam1");
    }
    EXPECT_EQ(entries[3].duration, 20000u);
    auto request = rig.transfer->Requests()[0];
    EXPECT_EQ(request.bucketName, "rec");
    EXPECT_EQ(request.sequenceNumber, 1);
    EXPECT_EQ(request.accessKey, "AK1");
    EXPECT_EQ(request.sessionToken, "TK1");
    EXPECT_EQ(request.region, "eu-west-1");
    EXPECT_EQ(request.video.size(), 1u);
}

TEST(DataControllerReports, SuccessClearsAWarningButNeverAnError) {
    Rig rig;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.observer.SetState(Warning, 29);
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 1; }));
    EXPECT_EQ(rig.observer.State(), Executing);
    EXPECT_EQ(rig.observer.ExecuteCalls(), 1u);

    rig.observer.SetState(Error, 21);
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 2; }));
    EXPECT_EQ(rig.observer.State(), Error);
    EXPECT_EQ(rig.observer.ExecuteCalls(), 1u);
}

TEST(DataControllerReports, DisabledUploaderIsNotRetriedAndNamedUnknown) {
    Rig rig;
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->Script({UploaderDisabled});
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 1; }));
    EXPECT_FALSE(rig.entries()[0].succeeded);
    EXPECT_EQ(rig.entries()[0].errorName, "");
    EXPECT_EQ(rig.observer.UploadInfos()[0].find("FileIndex, 1, ErrorCode, Unknown,"), 0u);
    EXPECT_EQ(rig.transfer->RequestCount(), 1u);
    EXPECT_TRUE(log.Contains("ST: File Uploader is Disabled."));
}

TEST(DataControllerCredentials, WithoutCredentialsEachWaitSendsOneTokenRequest) {
    Rig rig;
    LogCapture log;
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.observer.TokenRequests() >= 3; }));
    rig.controller->Stop();
    EXPECT_EQ(rig.transfer->RequestCount(), 0u);  // the uploader is never called
    size_t waits = log.Count("waitAuthInfo.");
    size_t notReceived = log.Count("Not Received Authentication Info.");
    EXPECT_GE(notReceived, 2u);
    EXPECT_EQ(rig.observer.TokenRequests(), waits);
    EXPECT_EQ(log.Find("Not Received Authentication Info.")[0].priority, 5);
    EXPECT_TRUE(rig.entries().empty());  // stopped before giving up: nothing reported
}

TEST(DataControllerCredentials, AuthenticationErrorFetchesFreshCredentialsIntoTheRequest) {
    Rig rig;
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("old"));
    rig.transfer->Script({AuthenticationError, Success});
    rig.observer.OnTokenRequest([&] { rig.controller->SetAwsInfo(credentials("new")); });
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 1; }));
    auto requests = rig.transfer->Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(requests[0].accessKey, "AKold");
    EXPECT_EQ(requests[1].accessKey, "AKnew");
    EXPECT_EQ(requests[1].secretKey, "SKnew");
    EXPECT_EQ(requests[1].sessionToken, "TKnew");
    EXPECT_TRUE(rig.entries()[0].succeeded);
    EXPECT_TRUE(log.Contains("ST: Authentication Error."));
    EXPECT_TRUE(log.Contains("Received Authentication Info."));
}

// A file buffer that runs an action the first time the upload thread asks whether it is full,
// i.e. right after a wait for credentials has ended and before the next attempt.
class HookedFileBuffer : public FileBuffer {
  public:
    using FileBuffer::FileBuffer;
    std::function<void()> onFirstFullTest;
    bool IsBufferFull() override {
        if (onFirstFullTest) {
            auto action = std::move(onFirstFullTest);
            onFirstFullTest = nullptr;
            action();
        }
        return FileBuffer::IsBufferFull();
    }
};

TEST(DataControllerCredentials, CredentialsAfterAWaitGaveUpDoNotReachTheFileInHand) {
    RecordingObserver observer;
    auto transfer = std::make_shared<ScriptedTransfer>();
    auto fileBuffer = std::make_shared<HookedFileBuffer>(100000);
    auto controller =
        std::make_shared<DataController>(&observer, fileBuffer, std::make_shared<TimeManager>(),
                                         std::make_shared<DataUploader>(transfer), Rig::settings());
    // No credentials: the first attempt is an authentication error without a transfer; the
    // credentials arrive after that wait gave up, so the next attempt keeps the empty ones.
    fileBuffer->onFirstFullTest = [&] { controller->SetAwsInfo(credentials("late")); };
    fileBuffer->Push(fileOf(10));
    controller->Start();
    ASSERT_TRUE(WaitUntil([&] { return observer.Entries().size() == 1; }));
    controller->Stop();
    auto requests = transfer->Requests();
    ASSERT_EQ(requests.size(), 1u);
    EXPECT_EQ(requests[0].accessKey, "");
    EXPECT_EQ(observer.TokenRequests(), 1u);
}

TEST(DataControllerRetries, NetworkErrorWaitsOneIntervalThenRetries) {
    auto s = Rig::settings();
    s.uploadInterval = 1;
    Rig rig(100000, s);
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->Script({NetworkError, Success});
    auto start = std::chrono::steady_clock::now();
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 1; }));
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(950));
    EXPECT_EQ(rig.transfer->RequestCount(), 2u);
    EXPECT_TRUE(rig.entries()[0].succeeded);
}

TEST(DataControllerRetries, StopDuringTheNetworkWaitEndsAtOnceWithoutReporting) {
    auto s = Rig::settings();
    s.uploadInterval = 3600;
    Rig rig(100000, s);
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->SetFallback(NetworkError);
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("wait enter."); }));
    auto start = std::chrono::steady_clock::now();
    rig.controller->Stop();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    EXPECT_TRUE(rig.entries().empty());
    EXPECT_TRUE(rig.observer.UploadInfos().empty());
    EXPECT_TRUE(log.Contains("fileUpload exit."));
}

TEST(DataControllerRetries, ErrorResultsAreRetriedAtOnceUntilTheyChange) {
    Rig rig;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->Script({FileBroken, TimeOut, InternalError, RequestTimeTooSkewed, FilePathError,
                          static_cast<FileTransferResult>(0x80000099), Success});
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 1; }));
    EXPECT_EQ(rig.transfer->RequestCount(), 7u);
    EXPECT_TRUE(rig.entries()[0].succeeded);
    EXPECT_TRUE(rig.observer.Warnings().empty());
}

TEST(DataControllerGivingUp, EachResultGivesUpWithItsNameAndWarningCode) {
    const std::pair<FileTransferResult, std::pair<const char*, unsigned>> cases[] = {
        {TimeOut, {"TimeOut", 22}},
        {FilePathError, {"FilePathError", 24}},
        {FileBroken, {"FileBroken", 25}},
        {NetworkError, {"NetworkError", 26}},
        {RequestTimeTooSkewed, {"RequestTimeTooSkewed", 27}},
        {InternalError, {"InternalError", 28}},
        {static_cast<FileTransferResult>(0x80000099), {"Unknown", 0}},
    };
    for (const auto& [result, expected] : cases) {
        // Limit 1000 ms; three files of 600 ms: after the first is popped 1200 remain.
        Rig rig(1000);
        rig.controller->SetAwsInfo(credentials("1"));
        rig.transfer->SetFallback(Success);
        rig.transfer->Script({result});
        for (int i = 0; i < 3; ++i) rig.fileBuffer->Push(fileOf(600));
        rig.controller->Start();
        ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 3; })) << expected.first;
        auto entries = rig.entries();
        EXPECT_EQ(entries[0].errorName, expected.first);
        EXPECT_FALSE(entries[0].succeeded);
        EXPECT_EQ(rig.observer.Warnings(), std::vector<unsigned>{expected.second})
            << expected.first;
        EXPECT_EQ(rig.observer.UploadInfos()[0].find(std::string("FileIndex, 1, ErrorCode, ") +
                                                     expected.first + ", "),
                  0u);
        // The second file is dropped for the over-full buffer, the third uploaded.
        EXPECT_EQ(entries[1].errorName, "BufferOver");
        EXPECT_EQ(entries[1].duration, 600u);
        EXPECT_EQ(
            rig.observer.UploadInfos()[1],
            "FileIndex, 2, ErrorCode, OtherError, ResponseTime, 0, FileSize, 0, BufferCount, 600");
        EXPECT_TRUE(entries[2].succeeded);
        for (uint32_t i = 0; i < 3; ++i) EXPECT_EQ(entries[i].sequenceNumber, i + 1);
    }
}

TEST(DataControllerGivingUp, AuthenticationErrorWarnsOnlyFromTheSecondInARow) {
    {
        Rig rig(1000);
        rig.controller->SetAwsInfo(credentials("1"));
        rig.transfer->Script({AuthenticationError});
        rig.observer.OnTokenRequest([&] { rig.controller->SetAwsInfo(credentials("2")); });
        for (int i = 0; i < 3; ++i) rig.fileBuffer->Push(fileOf(600));
        rig.controller->Start();
        ASSERT_TRUE(WaitUntil([&] { return rig.entries().size() == 3; }));
        EXPECT_EQ(rig.entries()[0].errorName, "AuthenticationError");
        EXPECT_TRUE(rig.observer.Warnings().empty());  // only one in a row
    }
    {
        Rig rig(1000);
        // No credentials at all. File 1 is given up at its first authentication error, files 2
        // and 3 are dropped; file 4 then fails again (the second in a row) and is given up with
        // warning 23 once two more files have filled the buffer.
        for (int i = 0; i < 4; ++i) rig.fileBuffer->Push(fileOf(600));
        rig.observer.OnTokenRequest([&] {
            if (rig.observer.TokenRequests() == 2) {
                rig.fileBuffer->Push(fileOf(600));
                rig.fileBuffer->Push(fileOf(600));
            }
        });
        rig.controller->Start();
        ASSERT_TRUE(WaitUntil([&] { return !rig.observer.Warnings().empty(); }));
        rig.controller->Stop();
        auto entries = rig.entries();
        ASSERT_GE(entries.size(), 4u);
        EXPECT_EQ(entries[0].errorName, "AuthenticationError");
        EXPECT_EQ(entries[1].errorName, "BufferOver");
        EXPECT_EQ(entries[2].errorName, "BufferOver");
        EXPECT_EQ(entries[3].errorName, "AuthenticationError");
        EXPECT_EQ(rig.observer.Warnings(), std::vector<unsigned>{23});
    }
}

TEST(DataControllerOtherError, EndsTheThreadWithModuleErrorAndLaterFilesStay) {
    Rig rig;
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->Script({OtherError});
    rig.fileBuffer->Push(fileOf(100));
    rig.fileBuffer->Push(fileOf(200));
    rig.controller->Start();
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("fileUpload exit."); }));
    EXPECT_EQ(rig.observer.Errors(), std::vector<unsigned>{21});
    EXPECT_TRUE(rig.entries().empty());
    EXPECT_EQ(rig.fileBuffer->GetBufferCount(), 200u);
    EXPECT_EQ(log.Find("Other Error.")[0].priority, 4);
    rig.controller->Stop();  // still returns
}

TEST(DataControllerOtherError, MissingTransferInterfaceIsCreateInterfaceFailed) {
    RecordingObserver observer;
    LogCapture log;
    auto fileBuffer = std::make_shared<FileBuffer>(100000);
    auto uploader = std::make_shared<DataUploader>(nullptr);
    DataController controller(&observer, fileBuffer, std::make_shared<TimeManager>(), uploader,
                              Rig::settings());
    controller.SetAwsInfo(credentials("1"));
    fileBuffer->Push(fileOf(100));
    controller.Start();
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("fileUpload exit."); }));
    EXPECT_EQ(observer.Errors(), std::vector<unsigned>{21});
    auto messages = log.Messages();
    auto enter = std::find(messages.begin(), messages.end(), "Upload enter.");
    ASSERT_NE(enter, messages.end());
    EXPECT_EQ(*(enter + 1), "create interface failed");
    EXPECT_EQ(log.Find("create interface failed")[0].priority, 4);
    for (const auto& m : messages) EXPECT_NE(m.rfind("Upload exit.", 0), 0u) << m;
    controller.Stop();
}

TEST(DataControllerUploader, ResultIsPassedOnAndLoggedInHex) {
    LogCapture log;
    auto transfer = std::make_shared<ScriptedTransfer>(NetworkError);
    DataUploader uploader(transfer);
    FileTransferInfo info;
    EXPECT_EQ(uploader.Upload(FileTransferRequest(), &info), NetworkError);
    EXPECT_TRUE(log.Contains("Upload exit. 80000014"));
    DataUploader empty(nullptr);
    empty.Cancel();  // nothing to cancel
}

TEST(DataControllerStopConcurrency, StopBeforeStartAndTwiceOnlyLogs) {
    Rig rig;
    LogCapture log;
    rig.controller->Stop();
    rig.controller->Stop();
    EXPECT_EQ(log.Count("Stop enter."), 2u);
    EXPECT_EQ(log.Count("Stop exit."), 2u);
    EXPECT_FALSE(rig.transfer->Cancelled());
    EXPECT_EQ(rig.fileBuffer->GetBufferCount(), 0u);
}

TEST(DataControllerStopConcurrency, StopWhileWaitingForAFileEndsWithoutUploading) {
    Rig rig;
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.controller->Start();
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("fileUpload enter."); }));
    rig.controller->Stop();
    EXPECT_EQ(rig.transfer->RequestCount(), 0u);
    EXPECT_TRUE(rig.entries().empty());
}

TEST(DataControllerStopConcurrency, ACancelledTransferAtShutdownIsNoModuleError) {
    Rig rig;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->Hold();
    rig.controller->Start();
    rig.fileBuffer->Push(fileOf(10));
    ASSERT_TRUE(WaitUntil([&] { return rig.transfer->InTransfer(); }));
    rig.controller->Stop();  // cancels: the transfer returns TimeOut
    EXPECT_TRUE(rig.transfer->Cancelled());
    EXPECT_TRUE(rig.observer.Errors().empty());
    EXPECT_EQ(rig.observer.State(), Executing);
    EXPECT_TRUE(rig.entries().empty());
}

TEST(DataControllerStopConcurrency, ATransferThatSucceedsDuringStopIsStillReported) {
    Rig rig(1000);
    LogCapture log;
    rig.controller->SetAwsInfo(credentials("1"));
    rig.transfer->SetCancelAborts(false);
    rig.transfer->Hold();
    for (int i = 0; i < 4; ++i) rig.fileBuffer->Push(fileOf(600));
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
