// FileRecorderModule with the whole recorder in-process (test host, scripted transfer). Guards:
// the start gate (ignore window dropping video and audio but keeping meta, a disconnection
// ending the wait at once), a repeated connection reply starting a second pipeline, the
// credential check, numbered files cut before IDRs end to end, the end-of-stream drain (tail to
// the last sample; a store that is down ends at the deadline), and (under TSan) module error,
// disconnection, drain and samples racing each other and the gate.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <thread>

#include "platform/logger/Logger.h"
#include "platform/nal/StreamAnalyzer.h"
#include "src/FileRecorderModule.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ProcessHarness.h"
#include "tests/support/ScriptedTransfer.h"
#include "tests/support/TestSupport.h"

using testsupport::H264Idr;
using testsupport::H264NonIdr;
using testsupport::MakeReceived;
using testsupport::ProcessHarness;
using testsupport::RecorderArgs;
using testsupport::ScriptedTransfer;
using testsupport::WaitUntil;

namespace {

const std::map<std::string, std::string> kCredentials = {{"awsAccessKey", "AK"},
                                                         {"awsSecretKey", "SK"},
                                                         {"sessionToken", "TK"},
                                                         {"region", "eu-west-1"},
                                                         {"unrelated", "x"}};

// A recorder process with a test host and a scripted transfer, started and connected.
struct Pipeline {
    explicit Pipeline(std::vector<std::string> extra = {}) : h(RecorderArgs(std::move(extra))) {
        transfer = std::make_shared<ScriptedTransfer>();
        EXPECT_TRUE(h.Initialize());
        h.Process().Module()->SetTransferFactory([t = transfer] { return t; });
        EXPECT_TRUE(h.Process().startProcess());
    }
    void Connect() { h.Host().ConnectionReply(); }
    // Connects, hands over credentials and opens the start gate with a meta sample.
    void Open(const LogCapture& log) {
        Connect();
        h.Host().SetProperties(kCredentials);
        h.Host().Meta(MakeReceived(0, 0, "opens the gate"));
        ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    }
    // The stream from `fromMs` to `toMs`: 30 fps video with an IDR every `idrEveryMs`, 50 audio
    // frames and one meta sample per second. Flushes the module's queues every few samples so
    // that nothing is dropped for a full queue.
    void Stream(uint64_t fromMs, uint64_t toMs, uint64_t idrEveryMs) {
        const uint64_t framesPerIdr = idrEveryMs * 30 / 1000;
        uint64_t frame = (fromMs * 30 + 999) / 1000, audioFrame = (fromMs + 19) / 20;
        int sent = 0;
        while (true) {
            uint64_t videoMs = frame * 100 / 3, audioMs = audioFrame * 20;
            if (videoMs >= toMs && audioMs >= toMs) break;
            if (videoMs <= audioMs && videoMs < toMs) {
                bool idr = frame % framesPerIdr == 0;
                h.Host().Video(MakeReceived(videoMs, videoMs * 90, idr ? H264Idr() : H264NonIdr()));
                ++frame;
            } else {
                h.Host().Audio(MakeReceived(audioMs, audioMs * 48, "aac"));
                if (audioMs % 1000 == 0) h.Host().Meta(MakeReceived(audioMs, audioMs * 90, "m"));
                ++audioFrame;
            }
            if (++sent % 16 == 0) h.Process().Module()->FlushQueues();
        }
        h.Process().Module()->FlushQueues();
    }

    std::vector<FileTransferRequest> Requests() const { return transfer->Requests(); }
    std::vector<LastSequenceNumNotify> Notifies() { return h.Host().SequenceNotifies(); }

    ProcessHarness h;
    std::shared_ptr<ScriptedTransfer> transfer;
};

bool isIdr(const StreamData& s) {
    return nal_access::StreamAnalyzer::IsIdrH264(s.PayloadData(), s.PayloadBytes());
}

size_t countFrom(const LogCapture& log, const std::string& file, const std::string& message) {
    auto records = log.Records();
    return std::count_if(records.begin(), records.end(), [&](const LogRecord& r) {
        return r.file == file && r.message == message;
    });
}

}  // namespace

TEST(FileRecorderModuleGate, OpensInOrderDroppingVideoAndAudioOfTheIgnoreWindowHoldingMeta) {
    LogCapture log;
    Pipeline p({"-startignoretime", "400", "-uploadinterval", "1"});
    p.h.Host().SetProperties(kCredentials);
    p.Connect();
    // During the window: an IDR, audio, and meta stamped after the later stream's first IDR.
    p.h.Host().Video(MakeReceived(0, 111, H264Idr()));
    p.h.Host().Audio(MakeReceived(0, 0, "early-audio"));
    p.h.Host().Meta(MakeReceived(1500, 1500 * 90, "window-meta"));
    p.h.Process().Module()->FlushQueues();
    EXPECT_FALSE(log.Contains("ST: start filing"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    EXPECT_FALSE(log.Contains("IDR: 111"));  // the window's video never reached the buffer

    p.Stream(1000, 3600, 1000);
    ASSERT_TRUE(WaitUntil([&] { return p.transfer->RequestCount() >= 1; }));
    auto first = p.Requests()[0];
    ASSERT_FALSE(first.video.empty());
    EXPECT_EQ(first.video[0].timestamp, 1000u);
    EXPECT_TRUE(std::any_of(first.meta.begin(), first.meta.end(), [](const StreamData& m) {
        return std::string(reinterpret_cast<const char*>(m.PayloadData()), m.PayloadBytes()) ==
               "window-meta";
    }));
    for (const auto& a : first.audio) EXPECT_GE(a.timestamp, 1000u);
}

TEST(FileRecorderModuleGate, DisconnectBeforeAnySampleOrDuringTheWindowEndsTheWaitAtOnce) {
    for (bool inWindow : {false, true}) {
        SCOPED_TRACE(inWindow ? "during the window" : "before any sample");
        LogCapture log;
        Pipeline p(inWindow ? std::vector<std::string>{"-startignoretime", "600000"}
                            : std::vector<std::string>{});
        p.Connect();
        if (inWindow) {
            p.h.Host().Meta(MakeReceived(0, 0, "m"));
            ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: data receive event detected"); }));
        }
        auto start = std::chrono::steady_clock::now();
        p.h.Host().Disconnection();
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
        EXPECT_TRUE(log.Contains("ST: stop event detected"));
        EXPECT_FALSE(log.Contains("ST: start filing"));
        size_t stops = log.Count("Stop enter.");
        p.h.Process().Module()->Disconnect();  // a second one changes nothing
        EXPECT_EQ(log.Count("Stop enter."), stops);
    }
}

TEST(FileRecorderModuleWiring, RepeatedConnectionReplyIsIgnoredCredentialsCheckedInKeyOrder) {
    struct Case {
        std::map<std::string, std::string> properties;
        const char* missing;  // null: accepted
    };
    const Case cases[] = {
        {kCredentials, nullptr},
        {{{"awsAccessKey", "AK"}, {"awsSecretKey", "SK"}, {"region", ""}}, "region"},
        {{{"awsAccessKey", ""}, {"awsSecretKey", "SK"}, {"sessionToken", "T"}, {"region", "r"}},
         "awsAccessKey"},
        {{{"AwsAccessKey", "AK"}, {"awsSecretKey", "SK"}, {"sessionToken", "T"}, {"region", "r"}},
         "awsAccessKey"},
        {{{"awsAccessKey", "AK"}, {"awsSecretKey", "SK"}, {"region", "r"}}, "sessionToken"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.missing ? c.missing : "accepted");
        LogCapture log;
        Pipeline p;
        p.Connect();
        p.Connect();
        EXPECT_EQ(countFrom(log, "src/DataController", "Start enter."), 1u);
        EXPECT_EQ(countFrom(log, "src/StreamBuffer", "Start enter."), 1u);
        EXPECT_TRUE(log.Contains("connection reply while connected: ignored."));
        EXPECT_NE(p.h.Process().GetProcessStatus(), Error);
        EXPECT_EQ(p.h.Host().SetProperties(c.properties), c.missing == nullptr);
        // The first missing key in byte order is the one named.
        EXPECT_TRUE(!c.missing || log.Contains(std::string(c.missing) + " is empty"));
        EXPECT_EQ(log.Contains("SetAwsInfo enter."), c.missing == nullptr);
    }
}

TEST(FileRecorderModulePipeline, StreamBecomesNumberedFilesCutBeforeIdrsAndTheDrainStoresTheTail) {
    LogCapture log;
    // Room for the whole stream: it is fed faster than real time.
    Pipeline p({"-uploadinterval", "2", "-bufferfullsize", "10"});
    p.transfer->SetInfo({4096, 12});
    p.Open(log);
    EXPECT_TRUE(p.h.Process().drainProcess(30000));  // nothing held: returns at once
    EXPECT_EQ(p.transfer->RequestCount(), 0u);

    p.Stream(0, 5000, 1000);
    EXPECT_TRUE(p.h.Process().drainProcess(20000));
    // Two files cut by the rule, then the tail to the newest sample (4980), inclusive; all
    // reported when the drain returned.
    auto requests = p.Requests();
    auto notifies = p.Notifies();
    auto statuses = p.h.Host().TransmissionStatuses();
    ASSERT_EQ(requests.size(), 3u);
    ASSERT_EQ(notifies.size(), 3u);
    ASSERT_EQ(statuses.size(), 3u);
    const uint32_t durations[] = {1999, 2000, 982};
    uint64_t end = 0;
    for (size_t i = 0; i < requests.size(); ++i) {
        SCOPED_TRACE(i);
        const auto& r = requests[i];
        end += durations[i];
        EXPECT_EQ(notifies[i].entries.at(0).sequenceNumber, i + 1);
        EXPECT_TRUE(notifies[i].entries.at(0).succeeded);
        EXPECT_EQ(notifies[i].entries.at(0).duration, durations[i]);
        EXPECT_EQ(statuses[i].statusMap["UploadInfo"].find(
                      "FileIndex, " + std::to_string(i + 1) +
                      ", ErrorCode, Success, ResponseTime, 12, FileSize, 4096, BufferCount, "),
                  0u);
        EXPECT_EQ(r.accessKey, "AK");
        EXPECT_EQ(r.duration, durations[i]);
        ASSERT_FALSE(r.video.empty());
        EXPECT_TRUE(isIdr(r.video[0]));
        EXPECT_EQ(r.video[0].timestamp, 2000 * i);  // each file opens at the IDR after the cut
        for (const auto& a : r.audio) EXPECT_LT(a.timestamp, end);
        EXPECT_GE(r.audio.back().timestamp, end - 21);
        for (const auto& v : r.video) EXPECT_LT(v.timestamp, end);
    }
    EXPECT_EQ(requests[2].video.back().timestamp, 4966u);  // the input's last frame
    EXPECT_FALSE(log.Contains("queue overflow (video)"));
}

// A file input asks WaitForBacklog before each burst: a stalled store holds it back before any
// file would be given up, and once the store works again every file is stored.
TEST(FileRecorderModulePipeline, AStalledStoreHoldsAFileInputBackAndNoFileIsGivenUp) {
    LogCapture log;
    Pipeline p({"-uploadinterval", "1", "-bufferfullsize", "2"});
    p.transfer->Hold();
    p.Open(log);
    Orvane::FileRecorderModule& module = *p.h.Process().Module();
    const auto in = [](int ms) {
        return std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    };
    uint64_t fedMs = 0;
    while (fedMs < 12000 && module.WaitForBacklog(in(1500))) {
        p.Stream(fedMs, fedMs + 250, 500);
        fedMs += 250;
    }
    EXPECT_LT(fedMs, 4000u);
    EXPECT_FALSE(module.WaitForBacklog(in(1200))) << "still held back while the store stalls";
    p.transfer->Release();
    while (fedMs < 12000 && module.WaitForBacklog(in(30000))) {
        p.Stream(fedMs, fedMs + 250, 500);
        fedMs += 250;
    }
    EXPECT_EQ(fedMs, 12000u);
    EXPECT_TRUE(p.h.Process().drainProcess(30000));
    uint32_t storedMs = 0;
    for (const auto& n : p.Notifies()) {
        EXPECT_TRUE(n.entries.at(0).succeeded) << n.entries.at(0).errorName;
        storedMs += n.entries.at(0).duration;
    }
    EXPECT_GE(storedMs, 11900u);
    EXPECT_FALSE(log.Contains("Buffer Over."));
}

TEST(FileRecorderModuleDrain, AStoreThatIsDownEndsAtTheDeadlineNamingWhatIsDropped) {
    LogCapture log;
    Pipeline p({"-uploadinterval", "2", "-bufferfullsize", "10"});
    p.transfer->SetFallback(NetworkError);
    p.Open(log);
    p.Stream(0, 5000, 1000);
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(p.h.Process().drainProcess(800));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, std::chrono::milliseconds(700));
    EXPECT_LT(took, std::chrono::seconds(10));
    auto messages = log.Messages();
    EXPECT_TRUE(std::any_of(messages.begin(), messages.end(), [](const std::string& m) {
        return m.rfind("drain incomplete after 800 ms: 3 stream files (4981 ms of stream)", 0) == 0;
    }));
    auto disconnectStart = std::chrono::steady_clock::now();
    p.h.Host().Disconnection();  // drops them, as a disconnection does
    EXPECT_LT(std::chrono::steady_clock::now() - disconnectStart, std::chrono::seconds(5));
    EXPECT_TRUE(p.Notifies().empty());
}

TEST(FileRecorderModuleConcurrency, ModuleErrorRacesDisconnectionAndDrain) {
    for (int round = 0; round < 8; ++round) {
        bool drain = round % 2 == 1;
        LogCapture log;
        Pipeline p({"-uploadinterval", "1", "-bufferfullsize", "10"});
        p.Open(log);
        if (drain) p.Stream(0, 1500, 500);
        std::thread drainer([&] {
            if (drain) p.h.Process().drainProcess(5000);
        });
        std::thread error([&] { p.h.Process().notifyModuleError(21); });
        std::thread disconnect([&] { p.h.Host().Disconnection(); });
        for (auto* t : {&drainer, &error, &disconnect}) t->join();
        EXPECT_EQ(p.h.Process().GetProcessStatus(), Error);
        p.h.Process().stopProcess();
    }
}

TEST(FileRecorderModuleConcurrency, SamplesRaceTheGateAndTheDisconnection) {
    Logger::SetLevel(4);  // full queues are expected here
    for (int round = 0; round < 5; ++round) {
        Pipeline p({"-uploadinterval", "1"});
        p.Connect();
        std::atomic<bool> go{true};
        std::vector<std::thread> senders;
        for (auto send : {&TestHost::Video, &TestHost::Audio, &TestHost::Meta}) {
            senders.emplace_back([&, send] {
                for (uint64_t t = 0; go; t += 33)
                    (p.h.Host().*send)(MakeReceived(t, t, t % 990 ? H264NonIdr() : H264Idr()));
            });
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        p.h.Host().Disconnection();
        go = false;
        for (auto& t : senders) t.join();
        p.h.Process().stopProcess();
    }
    Logger::SetLevel(Logger::kDefaultLevel);
}
