// ProcessControl and the process entry. Guards: a required option missing or malformed that is
// not refused (or refused with the wrong message), the codec and s3accel text rules, a
// connection reply out of order not turning into error 2, re-initialising a running process,
// warning/execute/error states, and every start that can never record exiting with status 1 and
// its reason (including injection attempts and huge values) instead of running or crashing.
#include <gtest/gtest.h>

#include <algorithm>
#include <tuple>

#include "src/FileRecorderModule.h"
#include "src/ProcessControl.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ProcessHarness.h"
#include "tests/support/TestSupport.h"

using testsupport::ProcessHarness;
using testsupport::RecorderArgs;
using Args = std::vector<std::string>;

namespace {

// The recorder's arguments without `option` and its value.
std::vector<std::string> without(std::vector<std::string> args, const std::string& option) {
    auto it = std::find(args.begin(), args.end(), option);
    if (it != args.end()) args.erase(it, it + 2);
    return args;
}

// The recorder's arguments with `option` set to `value` (appended after removing it).
std::vector<std::string> with(const std::string& option, const std::string& value) {
    auto args = without(RecorderArgs(), option);
    args.insert(args.end(), {option, value});
    return args;
}

// Runs the real binary with `args`.
testsupport::ProcessResult runRecorder(const std::vector<std::string>& args) {
    using testsupport::operator+;
    return testsupport::RunProcess(Args{testsupport::BuildPath("stream-file-recorder")} + args);
}

}  // namespace

// A missing required option or a number that is not whole or out of range.
TEST(ProcessControlOptions, EachBadRequiredOptionHasItsOwnMessage) {
    std::vector<std::pair<std::vector<std::string>, const char*>> cases = {
        {without(RecorderArgs(), "-bucketname"), "get bucketName fail."},
        {without(RecorderArgs(), "-uploadinterval"), "get uploadInterval fail."},
        {without(RecorderArgs(), "-authretrytime"), "get authRetryTime fail."},
        {without(RecorderArgs(), "-bufferfullsize"), "get bufferFUllSize fail."},
        {without(RecorderArgs(), "-kct"), "get CodecType fail."},
    };
    for (const char* bad : {"10s", "", "1.5", "2147483648", "-2147483649", "0x10", " 10",
                            "99999999999999999999999999999999"}) {
        cases.push_back({with("-uploadinterval", bad), "get uploadInterval fail."});
    }
    for (const auto& [args, message] : cases) {
        SCOPED_TRACE(args.back());
        LogCapture log;
        ProcessHarness h(args);
        EXPECT_FALSE(h.Initialize());
        EXPECT_EQ(log.Count(message), 1u);
        EXPECT_EQ(h.Process().Module(), nullptr);
    }
}

// -kct: any text containing "264" is H.264 (0), anything else H.265 (1); -s3accel: true only
// for "true" in any case; -startignoretime: optional, 0 unless whole, always logged.
TEST(ProcessControlOptions, CodecS3AccelAndStartIgnoreTimeTexts) {
    const std::string ignore = "-startignoretime";
    const std::tuple<std::string, const char*, int> cases[] = {
        {"-kct", "h264", 0},      {"-kct", "H264", 0},    {"-kct", "AVC264", 0},
        {"-kct", "x264-main", 0}, {"-kct", "h265", 1},    {"-kct", "HEVC", 1},
        {"-kct", "", 1},          {"-kct", "26 4", 1},    {"-s3accel", "TrUe", 1},
        {"-s3accel", "TRUE", 1},  {"-s3accel", "yes", 0}, {"-s3accel", "1", 0},
        {"-s3accel", "true ", 0}, {"-s3accel", "", 0},    {ignore, "oops", 0},
        {ignore, "-7", -7},
    };
    for (const auto& [option, text, expected] : cases) {
        SCOPED_TRACE(option + " '" + text + "'");
        LogCapture log;
        ProcessHarness h(with(option, text));
        ASSERT_TRUE(h.Initialize());
        const auto& settings = h.Process().Settings();
        EXPECT_EQ(option == "-kct"       ? static_cast<int>(settings.codecType)
                  : option == "-s3accel" ? settings.s3Accel
                                         : settings.startIgnoreTime,
                  expected);
        if (option == ignore) {
            EXPECT_EQ(log.Count("ST: start ignore time: " + std::to_string(expected) + " [ms]"),
                      1u);
        }
    }
}

TEST(ProcessControlLifecycle, ConnectionReplyBeforeStartOrAfterDisconnectionIsErrorTwo) {
    for (bool afterDisconnection : {false, true}) {
        SCOPED_TRACE(afterDisconnection ? "after disconnection" : "before start");
        ProcessHarness h(RecorderArgs());
        ASSERT_TRUE(h.Initialize());
        if (afterDisconnection) {
            ASSERT_TRUE(h.Process().startProcess());
            h.Host().Disconnection();
            EXPECT_FALSE(h.Process().IsRunning());
        } else {
            auto sample = testsupport::MakeReceived(0, 0, "x");
            std::weak_ptr<ReceivedSample> watch = sample;
            h.Process().notifyVideoData(std::move(sample));
            EXPECT_TRUE(watch.expired());  // samples before the start are dropped at once
        }
        h.Host().ConnectionReply();
        EXPECT_EQ(h.Process().GetProcessStatus(), Error);
        EXPECT_EQ(h.Process().GetProcessStatusCode(), 2u);
    }
}

TEST(ProcessControlLifecycle, InitializeWhileRunningKeepsTheRunningModule) {
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
    ASSERT_FALSE(h.Host().StatusChanges().empty());
    EXPECT_EQ(h.Host().StatusChanges().back().state, Error);
}

// Everything that can never record ends the start with status 1 (never a crash), one line that
// says why, and the hint to --help after the start-up lines; --help and --version answer on
// stdout.
TEST(ProcessEntry, StartThatCannotRecordExitsWithStatusOneAndSaysWhy) {
    const std::string huge(100000, '9');
    const struct {
        std::vector<std::string> args;
        std::string reason;
    } cases[] = {
        {{}, "get bucketName fail."},
        {RecorderArgs(), "no input to record"},
        {RecorderArgs({"-inptu", "clip.ts"}), "unknown option -inptu"},
        {RecorderArgs({"-input", "clip.ts", "-duration"}), "-duration needs a value"},
        {RecorderArgs({"-uploadinterval"}), "-uploadinterval needs a value"},
        {RecorderArgs({"-input", "clip.ts", "stray"}), "unexpected argument \"stray\""},
        {with("-uploadinterval", "0"), "-uploadinterval must be at least 1 (seconds), got 0"},
        {with("-uploadinterval", "-2147483648"), "must be at least 1 (seconds), got -2147483648"},
        {RecorderArgs({"-loglevel", "x"}), "-loglevel needs a whole number, got \"x\""},
        {RecorderArgs({"-readrate", "-3"}), "-readrate needs a number of at least 0, got \"-3\""},
        {RecorderArgs({"-metrics", "127.0.0.1"}), "-metrics needs IP:PORT"},
        {RecorderArgs({"-metrics", "localhost:9464"}), "-metrics needs IP:PORT"},
        {RecorderArgs({"-endpoint", "ftp://host"}), "must start with http:// or https://"},
        {RecorderArgs({"-endpoint", "http://127.0.0.1:99999"}),
         "-endpoint \"http://127.0.0.1:99999\""},
        {RecorderArgs({"-endpoint", "file:store"}), "is not a usable file URL"},
        {RecorderArgs({"-endpoint", "file:///nonexistent-sfr-store"}),
         "the directory /nonexistent-sfr-store does not exist"},
        {RecorderArgs({"-endpoint", "file:///"}), "the bucket directory /rec does not exist"},
        {RecorderArgs({"-keyprefix", std::string(1000, 'p')}), "make object keys of up to"},
        {RecorderArgs({"-region", "eu-west-1\r\nX-Injected: 1"}),
         "the region from -region cannot be used"},
        {RecorderArgs({"-endpoint", "http://127.0.0.1:9", "-region", "eu west"}),
         "the region from -region cannot be used"},
        {with("-bucketname", "My_Recordings"), "-bucketname: bucket name \"My_Recordings\""},
        {with("-bucketname", huge), "-bucketname: bucket name \"999"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.reason);
        auto r = runRecorder(c.args);
        EXPECT_EQ(r.exitStatus, 1) << r.output.substr(0, 3000);
        EXPECT_NE(r.output.find("<6> main: VQ-VERSION:1.21.0.03290"), std::string::npos);
        EXPECT_NE(r.output.find(c.reason), std::string::npos) << r.output.substr(0, 3000);
        const size_t failed = r.output.find("Initialize Error.");
        EXPECT_NE(failed, std::string::npos);
        EXPECT_NE(r.output.find("--help lists the options", failed), std::string::npos);
        EXPECT_EQ(r.output.find("Call Uninitialize."), std::string::npos);
        EXPECT_EQ(r.output.find("X-Injected: 1\n"), std::string::npos);
    }
    const struct {
        std::vector<std::string> args;
        std::vector<const char*> says;
    } answers[] = {
        {{"--help"},
         {"Usage: stream-file-recorder -input URL -bucketname NAME", "-draintimeout S",
          "(default: 30)", "-kct h264|h265", "Exit status:", "Example:"}},
        {RecorderArgs({"-inptu", "x", "-h"}), {"Usage:"}},
        {{"--version"}, {"stream-file-recorder 1.21.0.03290\n"}},
    };
    for (const auto& a : answers) {
        auto r = runRecorder(a.args);
        EXPECT_EQ(r.exitStatus, 0) << r.output;
        for (const char* text : a.says) EXPECT_NE(r.output.find(text), std::string::npos) << text;
        EXPECT_EQ(r.output.find("VQ-VERSION"), std::string::npos);
    }
}
