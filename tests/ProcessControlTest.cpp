#include <gtest/gtest.h>

#include "platform/logger/LogCapture.h"
#include "src/FileRecorderModule.h"
#include "src/ProcessControl.h"
#include "tests/support/ProcessHarness.h"
#include "tests/support/TestSupport.h"

using testsupport::ProcessHarness;
using testsupport::RecorderArgs;

namespace {

std::vector<std::string> without(std::vector<std::string> args, const std::string& option) {
    for (size_t i = 0; i + 1 < args.size(); ++i) {
        if (args[i] == option) {
            args.erase(args.begin() + static_cast<long>(i),
                       args.begin() + static_cast<long>(i) + 2);
            break;
        }
    }
    return args;
}

std::string recorderBinary() {
    return testsupport::BuildPath("src/stream-file-recorder");
}

}  // namespace

TEST(ProcessControlOptions, MissingBucketStopsAtTheFirstOption) {
    LogCapture log;
    ProcessHarness h(without(RecorderArgs(), "-bucketname"));
    EXPECT_FALSE(h.Initialize());
    EXPECT_EQ(log.Count("get bucketName fail."), 1u);
    auto line = log.Find("get bucketName fail.")[0];
    EXPECT_EQ(line.priority, 4);
    EXPECT_EQ(line.function, "Orvane::ProcessControl::getArgument");
    EXPECT_FALSE(log.Contains("ST: start ignore time: 0 [ms]"));
    EXPECT_EQ(h.Process().Module(), nullptr);
}

TEST(ProcessControlOptions, EachRequiredOptionHasItsOwnMessage) {
    const std::pair<const char*, const char*> cases[] = {
        {"-uploadinterval", "get uploadInterval fail."},
        {"-authretrytime", "get authRetryTime fail."},
        {"-bufferfullsize", "get bufferFUllSize fail."},
        {"-kct", "get CodecType fail."},
    };
    for (const auto& [option, message] : cases) {
        LogCapture log;
        ProcessHarness h(without(RecorderArgs(), option));
        EXPECT_FALSE(h.Initialize()) << option;
        EXPECT_TRUE(log.Contains(message)) << option;
    }
    // Without -kct the four options before it were stored.
    ProcessHarness h(without(RecorderArgs(), "-kct"));
    h.Initialize();
    EXPECT_EQ(h.Process().Settings().bucketName, "rec");
    EXPECT_EQ(h.Process().Settings().uploadInterval, 10);
    EXPECT_EQ(h.Process().Settings().authRetryTime, 1000);
    EXPECT_EQ(h.Process().Settings().bufferFullSize, 3);
}

TEST(ProcessControlOptions, NumbersMustBeWholeAndInRange) {
    for (const char* bad : {"10s", "", "1.5", "2147483648", "-2147483649", "0x10", " 10",
                            "99999999999999999999999999999999"}) {
        LogCapture log;
        auto args = without(RecorderArgs(), "-uploadinterval");
        args.insert(args.end(), {"-uploadinterval", bad});
        ProcessHarness h(args);
        EXPECT_FALSE(h.Initialize()) << "\"" << bad << "\"";
        EXPECT_TRUE(log.Contains("get uploadInterval fail.")) << bad;
    }
    auto args = without(RecorderArgs(), "-uploadinterval");
    args.insert(args.end(), {"-uploadinterval", "-2147483648"});
    ProcessHarness h(args);
    EXPECT_TRUE(h.Initialize());
    EXPECT_EQ(h.Process().Settings().uploadInterval, INT32_MIN);
}

TEST(ProcessControlOptions, CodecTextContaining264AnywhereIsH264) {
    const std::pair<const char*, uint32_t> cases[] = {
        {"h264", 0}, {"H264", 0}, {"AVC264", 0}, {"x264-main", 0},
        {"h265", 1}, {"HEVC", 1}, {"", 1},       {"26 4", 1},
    };
    for (const auto& [text, expected] : cases) {
        auto args = without(RecorderArgs(), "-kct");
        args.insert(args.end(), {"-kct", text});
        ProcessHarness h(args);
        ASSERT_TRUE(h.Initialize()) << text;
        EXPECT_EQ(h.Process().Settings().codecType, expected) << text;
    }
}

TEST(ProcessControlOptions, S3AccelIsCaseInsensitiveEqualityWithTrue) {
    const std::pair<const char*, bool> cases[] = {
        {"TrUe", true}, {"TRUE", true},   {"true", true}, {"yes", false},
        {"1", false},   {"true ", false}, {"", false},
    };
    for (const auto& [text, expected] : cases) {
        ProcessHarness h(RecorderArgs({"-s3accel", text}));
        ASSERT_TRUE(h.Initialize());
        EXPECT_EQ(h.Process().Settings().s3Accel, expected) << text;
    }
    ProcessHarness absent(RecorderArgs());
    ASSERT_TRUE(absent.Initialize());
    EXPECT_FALSE(absent.Process().Settings().s3Accel);
}

TEST(ProcessControlOptions, StartIgnoreTimeIsOptionalAndAlwaysLogged) {
    {
        LogCapture log;
        ProcessHarness h(RecorderArgs());
        ASSERT_TRUE(h.Initialize());
        auto lines = log.Find("ST: start ignore time: 0 [ms]");
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].priority, 11);
        EXPECT_TRUE(lines[0].function.empty());
    }
    {
        LogCapture log;
        ProcessHarness h(RecorderArgs({"-startignoretime", "oops"}));
        ASSERT_TRUE(h.Initialize());
        EXPECT_TRUE(log.Contains("ST: start ignore time: 0 [ms]"));
    }
    {
        LogCapture log;
        ProcessHarness h(RecorderArgs({"-startignoretime", "5000", "-startignoretime", "-7"}));
        ASSERT_TRUE(h.Initialize());
        EXPECT_TRUE(log.Contains("ST: start ignore time: -7 [ms]"));  // the last one wins
        EXPECT_EQ(h.Process().Settings().streamingId, "cam1");
    }
}

TEST(ProcessControlLifecycle, SamplesBeforeStartAreDroppedAtOnce) {
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    auto sample = testsupport::MakeReceived(0, 0, "x");
    std::weak_ptr<ReceivedSample> watch = sample;
    h.Process().notifyVideoData(std::move(sample));
    EXPECT_TRUE(watch.expired());
}

TEST(ProcessControlLifecycle, ConnectionReplyBeforeStartIsAnErrorWithCodeTwo) {
    LogCapture log;
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    h.Host().ConnectionReply();
    EXPECT_EQ(h.Process().GetProcessStatus(), Error);
    EXPECT_EQ(h.Process().GetProcessStatusCode(), 2u);
    auto line = log.Find("second connection request received. change module status error");
    ASSERT_EQ(line.size(), 1u);
    EXPECT_EQ(line[0].priority, 4);
    EXPECT_TRUE(log.Contains("NotifyModuleError enter."));
}

TEST(ProcessControlLifecycle, ConnectionReplyAfterDisconnectionIsAnError) {
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    ASSERT_TRUE(h.Process().startProcess());
    h.Host().Disconnection();
    EXPECT_FALSE(h.Process().IsRunning());
    h.Host().ConnectionReply();
    EXPECT_EQ(h.Process().GetProcessStatus(), Error);
    EXPECT_EQ(h.Process().GetProcessStatusCode(), 2u);
}

TEST(ProcessControlLifecycle, InitializeWhileRunningKeepsTheRunningModule) {
    LogCapture log;
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    auto module = h.Process().Module();
    ASSERT_TRUE(h.Process().startProcess());
    EXPECT_FALSE(h.Process().initializeProcess(""));
    EXPECT_EQ(h.Process().Module(), module);
    EXPECT_TRUE(h.Process().IsRunning());
    h.Process().stopProcess();
    // Once stopped, a new initialisation may replace it.
    EXPECT_TRUE(h.Process().initializeProcess(""));
    EXPECT_NE(h.Process().Module(), module);
}

TEST(ProcessControlNotifications, WarningIsClearedByExecuteAndErrorStopsSamples) {
    LogCapture log;
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    ASSERT_TRUE(h.Process().startProcess());
    Orvane::INotifyObserver& observer = h.Process();
    observer.notifyModuleWarn(29);
    EXPECT_EQ(observer.GetModuleStatus(), Warning);
    EXPECT_EQ(h.Process().GetProcessStatusCode(), 29u);
    observer.notifyModuleExecute();
    EXPECT_EQ(observer.GetModuleStatus(), Executing);
    EXPECT_EQ(h.Process().GetProcessStatusCode(), 0u);

    observer.notifyModuleError(21);
    EXPECT_EQ(observer.GetModuleStatus(), Error);
    EXPECT_FALSE(h.Process().IsRunning());
    observer.notifyModuleError(21);  // a second error just sets the state again
    EXPECT_EQ(h.Process().GetProcessStatusCode(), 21u);

    EXPECT_EQ(log.Count("GetModuleStatus enter."), 3u);
    EXPECT_FALSE(log.Contains("GetModuleStatus exit."));
    for (const auto& r : log.Find("NotifyModuleWarn enter.")) EXPECT_EQ(r.priority, 12);
    for (const auto& r : log.Find("NotifyModuleError exit.")) EXPECT_EQ(r.priority, 11);

    auto changes = h.Host().StatusChanges();
    ASSERT_GE(changes.size(), 4u);
    EXPECT_EQ(changes.back().state, Error);
}

TEST(ProcessControlNotifications, TransmissionStatusAndSequenceNotifyReachTheParent) {
    LogCapture log;
    ProcessHarness h(RecorderArgs());
    ASSERT_TRUE(h.Initialize());
    Orvane::INotifyObserver& observer = h.Process();
    observer.notifyTransmissionStatus({{"UploadInfo", "BufferOver"}});
    auto statuses = h.Host().TransmissionStatuses();
    ASSERT_EQ(statuses.size(), 1u);
    EXPECT_EQ(statuses[0].statusMap,
              (std::map<std::string, std::string>{{"UploadInfo", "BufferOver"}}));
    EXPECT_EQ(log.Find("notifyTransmissionStatus enter.")[0].priority, 13);

    LastSequenceNumNotify message;
    message.entries.push_back({"cam1", 3, true, "", false, 9966});
    observer.notifyLastSequenceNumNotify(message);
    auto notifies = h.Host().SequenceNotifies();
    ASSERT_EQ(notifies.size(), 1u);
    EXPECT_EQ(notifies[0].entries[0].sequenceNumber, 3u);
    EXPECT_EQ(notifies[0].entries[0].duration, 9966u);
}

TEST(ProcessEntry, NoOptionsFailsWithStatusOneAndTheVersionLine) {
    auto r = testsupport::RunProcess({recorderBinary()});
    EXPECT_EQ(r.exitStatus, 1) << r.output;
    EXPECT_NE(r.output.find("<6> main: VQ-VERSION:1.21.0.03290"), std::string::npos) << r.output;
    EXPECT_NE(r.output.find("get bucketName fail."), std::string::npos);
    EXPECT_NE(r.output.find("Initialize Error."), std::string::npos);
    EXPECT_EQ(r.output.find("Call Uninitialize."), std::string::npos);
}

TEST(ProcessEntry, MissingCodecFailsAndNoInputFailsWithAReason) {
    auto args = without(RecorderArgs(), "-kct");
    args.insert(args.begin(), recorderBinary());
    auto r = testsupport::RunProcess(args);
    EXPECT_EQ(r.exitStatus, 1);
    EXPECT_NE(r.output.find("get CodecType fail."), std::string::npos) << r.output;

    auto full = RecorderArgs();
    full.insert(full.begin(), recorderBinary());
    r = testsupport::RunProcess(full);
    EXPECT_EQ(r.exitStatus, 1);
    EXPECT_NE(r.output.find("no input to record"), std::string::npos) << r.output;
    EXPECT_NE(r.output.find("Initialize Error."), std::string::npos);
}

TEST(ProcessEntry, HugeAndOddOptionValuesNeverCrash) {
    std::string huge(100000, '9');
    for (const auto& extra : std::vector<std::vector<std::string>>{{"-uploadinterval", huge},
                                                                   {"-bucketname", huge},
                                                                   {"-kct", huge},
                                                                   {"-loglevel", "x"},
                                                                   {"-readrate", "-3"},
                                                                   {"-uploadinterval"}}) {
        auto args = RecorderArgs(extra);
        args.insert(args.begin(), recorderBinary());
        auto r = testsupport::RunProcess(args);
        EXPECT_EQ(r.exitStatus, 1) << extra[0] << r.output.substr(0, 300);
        EXPECT_EQ(r.signal, 0);
    }
}
