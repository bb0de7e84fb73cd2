#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <thread>

#include "platform/logger/LogCapture.h"
#include "platform/logger/Logger.h"
#include "platform/nal/StreamAnalyzer.h"
#include "src/FileRecorderModule.h"
#include "tests/support/ProcessHarness.h"
#include "tests/support/ScriptedTransfer.h"
#include "tests/support/TestSupport.h"

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
    // Samples of `seconds` of stream from `fromMs`: 30 fps video with an IDR every
    // `idrEveryMs`, 50 audio frames and one meta sample per second. Flushes the module's queues
    // every few samples so that nothing is dropped for a full queue.
    void Stream(uint64_t fromMs, uint64_t toMs, uint64_t idrEveryMs) {
        const uint64_t framesPerIdr = idrEveryMs * 30 / 1000;
        uint64_t frame = (fromMs * 30 + 999) / 1000, audioFrame = (fromMs + 19) / 20;
        int sent = 0;
        while (true) {
            uint64_t videoMs = frame * 100 / 3, audioMs = audioFrame * 20;
            if (videoMs >= toMs && audioMs >= toMs) break;
            if (videoMs <= audioMs && videoMs < toMs) {
                bool idr = frame % framesPerIdr == 0;
                h.Host().Video(testsupport::MakeReceived(
                    videoMs, videoMs * 90,
                    idr ? testsupport::H264Idr() : testsupport::H264NonIdr()));
                ++frame;
            } else {
                h.Host().Audio(testsupport::MakeReceived(audioMs, audioMs * 48, "aac"));
                if (audioMs % 1000 == 0) {
                    h.Host().Meta(testsupport::MakeReceived(audioMs, audioMs * 90, "meta"));
                }
                ++audioFrame;
            }
            if (++sent % 16 == 0) h.Process().Module()->FlushQueues();
        }
        h.Process().Module()->FlushQueues();
    }

    ProcessHarness h;
    std::shared_ptr<ScriptedTransfer> transfer;
};

bool isIdr(const StreamData& s) {
    return nal_access::StreamAnalyzer::IsIdrH264(s.PayloadData(), s.PayloadBytes());
}

size_t countFrom(const LogCapture& log, const std::string& file, const std::string& message) {
    size_t n = 0;
    for (const auto& r : log.Records()) n += (r.file == file && r.message == message);
    return n;
}

}  // namespace

TEST(FileRecorderModuleGate, OpensAfterTheFirstSampleAndLogsInOrder) {
    LogCapture log;
    Pipeline p;
    p.Connect();
    p.h.Host().Meta(testsupport::MakeReceived(0, 0, "meta"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    auto messages = log.Messages();
    auto at = [&](const char* m) { return std::find(messages.begin(), messages.end(), m); };
    EXPECT_LT(at("ST: wait for data receive"), at("ST: data receive event detected"));
    EXPECT_LT(at("ST: data receive event detected"), at("ST: start filing"));
    EXPECT_EQ(log.Find("ST: start filing")[0].priority, 11);
    EXPECT_TRUE(log.Find("ST: start filing")[0].function.empty());
}

TEST(FileRecorderModuleGate, VideoAndAudioInTheIgnoreWindowAreDroppedMetaIsHeld) {
    LogCapture log;
    Pipeline p({"-startignoretime", "400", "-uploadinterval", "1"});
    p.h.Host().SetProperties(kCredentials);
    p.Connect();
    // During the window: an IDR, audio, and meta stamped after the later stream's first IDR.
    p.h.Host().Video(testsupport::MakeReceived(0, 111, testsupport::H264Idr()));
    p.h.Host().Audio(testsupport::MakeReceived(0, 0, "early-audio"));
    p.h.Host().Meta(testsupport::MakeReceived(1500, 1500 * 90, "window-meta"));
    p.h.Process().Module()->FlushQueues();
    EXPECT_FALSE(log.Contains("ST: start filing"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    EXPECT_FALSE(log.Contains("IDR: 111"));  // the window's video never reached the buffer

    p.Stream(1000, 3600, 1000);
    ASSERT_TRUE(WaitUntil([&] { return p.transfer->RequestCount() >= 1; }));
    auto first = p.transfer->Requests()[0];
    ASSERT_FALSE(first.video.empty());
    EXPECT_EQ(first.video[0].timestamp, 1000u);
    ASSERT_FALSE(first.meta.empty());
    bool windowMetaKept = false;
    for (const auto& m : first.meta) {
        std::string text(reinterpret_cast<const char*>(m.PayloadData()), m.PayloadBytes());
        windowMetaKept |= text == "window-meta";
    }
    EXPECT_TRUE(windowMetaKept);
    for (const auto& a : first.audio) EXPECT_GE(a.timestamp, 1000u);
}

TEST(FileRecorderModuleGate, DisconnectBeforeAnySampleOrDuringTheWindowEndsTheWaitAtOnce) {
    {
        LogCapture log;
        Pipeline p;
        p.Connect();
        p.h.Host().Disconnection();
        EXPECT_TRUE(log.Contains("ST: stop event detected"));
        EXPECT_FALSE(log.Contains("ST: start filing"));
        size_t stops = log.Count("Stop enter.");
        p.h.Process().Module()->Disconnect();  // a second one changes nothing
        EXPECT_EQ(log.Count("Stop enter."), stops);
    }
    {
        LogCapture log;
        Pipeline p({"-startignoretime", "600000"});
        p.Connect();
        p.h.Host().Meta(testsupport::MakeReceived(0, 0, "m"));
        ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: data receive event detected"); }));
        auto start = std::chrono::steady_clock::now();
        p.h.Host().Disconnection();
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
        EXPECT_TRUE(log.Contains("ST: stop event detected"));
        EXPECT_FALSE(log.Contains("ST: start filing"));
    }
}

TEST(FileRecorderModuleWiring, ARepeatedConnectionReplyNeverReplacesRunningComponents) {
    LogCapture log;
    Pipeline p;
    p.Connect();
    p.Connect();
    EXPECT_EQ(countFrom(log, "src/DataController", "Start enter."), 1u);
    EXPECT_EQ(countFrom(log, "src/StreamBuffer", "Start enter."), 1u);
    EXPECT_TRUE(log.Contains("connection reply while connected: ignored."));
    EXPECT_NE(p.h.Process().GetProcessStatus(), Error);
}

TEST(FileRecorderModuleWiring, CredentialsAreCheckedInByteOrderOfTheirKeys) {
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
        LogCapture log;
        Pipeline p;
        p.Connect();
        bool accepted = p.h.Host().SetProperties(c.properties);
        EXPECT_EQ(accepted, c.missing == nullptr);
        size_t empties = 0;
        for (const auto& m : log.Messages()) empties += m.find(" is empty") != std::string::npos;
        if (c.missing != nullptr) {
            EXPECT_EQ(empties, 1u);
            EXPECT_TRUE(log.Contains(std::string(c.missing) + " is empty")) << c.missing;
            EXPECT_TRUE(log.Contains("setProperties exit. not set property."));
            EXPECT_FALSE(log.Contains("SetAwsInfo enter."));
        } else {
            EXPECT_EQ(empties, 0u);
            EXPECT_TRUE(log.Contains("setAuth exit."));
            EXPECT_TRUE(log.Contains("SetAwsInfo enter."));
        }
    }
}

TEST(FileRecorderModuleWiring, TokenRequestCarriesOnlyTheStreamingId) {
    Pipeline p;
    GetAWSSecureTokenRequest request;
    p.h.Process().notifyGetAWSTokenRequest(request);
    auto sent = p.h.Host().TokenRequests();
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].streamingId, "cam1");
    EXPECT_EQ(sent[0].requestId, "");
    EXPECT_EQ(sent[0].roleName, "");
    EXPECT_EQ(sent[0].sessionName, "");
    EXPECT_EQ(sent[0].base, "");
}

TEST(FileRecorderModulePipeline, StreamBecomesNumberedFilesCutBeforeIdrs) {
    LogCapture log;
    // Room for the whole stream: it is fed faster than real time.
    Pipeline p({"-uploadinterval", "2", "-bufferfullsize", "10"});
    p.Connect();
    p.h.Host().SetProperties(kCredentials);
    p.transfer->SetInfo({4096, 12});
    p.h.Host().Meta(testsupport::MakeReceived(0, 0, "opens the gate"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    p.Stream(0, 10000, 1000);
    ASSERT_TRUE(WaitUntil([&] { return p.h.Host().SequenceNotifies().size() == 4; }, 20000));

    auto requests = p.transfer->Requests();
    ASSERT_EQ(requests.size(), 4u);
    const uint32_t expectedDurations[] = {1999, 2000, 2000, 2000};
    for (size_t i = 0; i < requests.size(); ++i) {
        const auto& r = requests[i];
        EXPECT_EQ(r.sequenceNumber, static_cast<int64_t>(i + 1));
        EXPECT_EQ(r.streamingId, "cam1");
        EXPECT_EQ(r.accessKey, "AK");
        EXPECT_EQ(r.secretKey, "SK");
        EXPECT_EQ(r.sessionToken, "TK");
        EXPECT_EQ(r.region, "eu-west-1");
        EXPECT_EQ(r.duration, expectedDurations[i]);
        ASSERT_FALSE(r.video.empty());
        EXPECT_TRUE(isIdr(r.video[0]));
        EXPECT_EQ(r.video[0].timestamp, 2000 * i);  // each file opens at the IDR after the cut
        uint64_t cut = 2000 * (i + 1) - 1;
        for (const auto& a : r.audio) EXPECT_LT(a.timestamp, cut);
        EXPECT_GE(r.audio.back().timestamp, cut - 20);
        for (const auto& v : r.video) EXPECT_LT(v.timestamp, cut);
    }
    auto notifies = p.h.Host().SequenceNotifies();
    auto statuses = p.h.Host().TransmissionStatuses();
    std::vector<std::string> infos;
    for (const auto& s : statuses) {
        auto it = s.statusMap.find("UploadInfo");
        if (it != s.statusMap.end()) infos.push_back(it->second);
    }
    ASSERT_EQ(infos.size(), 4u);
    for (size_t i = 0; i < 4; ++i) {
        EXPECT_EQ(notifies[i].entries.at(0).sequenceNumber, i + 1);
        EXPECT_TRUE(notifies[i].entries.at(0).succeeded);
        EXPECT_EQ(
            infos[i].find("FileIndex, " + std::to_string(i + 1) +
                          ", ErrorCode, Success, ResponseTime, 12, FileSize, 4096, BufferCount, "),
            0u)
            << infos[i];
    }
    EXPECT_FALSE(log.Contains("queue overflow (video)"));

    p.h.Host().Disconnection();
    p.h.Process().stopProcess();
    EXPECT_TRUE(log.Contains("fileUpload exit."));
    EXPECT_TRUE(log.Contains("createStreamFile exit."));
    EXPECT_EQ(p.transfer->RequestCount(), 4u);  // the held tail is dropped by a disconnection
}

TEST(FileRecorderModuleDrain, EndOfStreamStoresTheTailToTheLastSample) {
    LogCapture log;
    Pipeline p({"-uploadinterval", "2", "-bufferfullsize", "10"});
    p.Connect();
    p.h.Host().SetProperties(kCredentials);
    p.h.Host().Meta(testsupport::MakeReceived(0, 0, "opens the gate"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    p.Stream(0, 5000, 1000);
    EXPECT_TRUE(p.h.Process().drainProcess(20000));
    // Everything was reported when the drain returned.
    auto requests = p.transfer->Requests();
    ASSERT_EQ(requests.size(), 3u);
    EXPECT_EQ(p.h.Host().SequenceNotifies().size(), 3u);
    const auto& last = requests[2];
    EXPECT_EQ(last.sequenceNumber, 3);
    EXPECT_TRUE(isIdr(last.video.front()));
    EXPECT_EQ(last.video.front().timestamp, 4000u);
    EXPECT_EQ(last.video.back().timestamp, 4966u);  // the input's last frame
    EXPECT_EQ(last.audio.back().timestamp, 4980u);  // and its last audio frame
    uint32_t total = 0;
    for (const auto& r : requests) total += r.duration;
    EXPECT_EQ(total, 4981u);  // to the newest sample, inclusive
    EXPECT_EQ(p.h.Host().SequenceNotifies()[2].entries[0].duration, last.duration);
    EXPECT_TRUE(p.h.Host().SequenceNotifies()[2].entries[0].succeeded);
    p.h.Host().Disconnection();
}

TEST(FileRecorderModuleDrain, NothingHeldReturnsAtOnce) {
    Pipeline p;
    p.Connect();
    auto start = std::chrono::steady_clock::now();
    EXPECT_TRUE(p.h.Process().drainProcess(30000));
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
    EXPECT_EQ(p.transfer->RequestCount(), 0u);
}

TEST(FileRecorderModuleDrain, AStoreThatIsDownEndsAtTheDeadlineNamingWhatIsDropped) {
    LogCapture log;
    Pipeline p({"-uploadinterval", "2", "-bufferfullsize", "10"});
    p.transfer->SetFallback(NetworkError);
    p.Connect();
    p.h.Host().SetProperties(kCredentials);
    p.h.Host().Meta(testsupport::MakeReceived(0, 0, "opens the gate"));
    ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
    p.Stream(0, 5000, 1000);
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(p.h.Process().drainProcess(800));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, std::chrono::milliseconds(700));
    EXPECT_LT(took, std::chrono::seconds(10));
    bool named = false;
    for (const auto& r : log.Records()) {
        if (r.message.rfind("drain incomplete after 800 ms: 3 stream files (4981 ms of stream)",
                            0) == 0) {
            named = true;
            EXPECT_EQ(r.priority, 5);
        }
    }
    EXPECT_TRUE(named);
    auto disconnectStart = std::chrono::steady_clock::now();
    p.h.Host().Disconnection();  // drops them, as a disconnection does
    EXPECT_LT(std::chrono::steady_clock::now() - disconnectStart, std::chrono::seconds(5));
    EXPECT_TRUE(p.h.Host().SequenceNotifies().empty());
}

TEST(FileRecorderModuleConcurrency, DrainRacesDisconnectionAndModuleError) {
    for (int round = 0; round < 5; ++round) {
        LogCapture log;
        Pipeline p({"-uploadinterval", "1", "-bufferfullsize", "10"});
        p.Connect();
        p.h.Host().SetProperties(kCredentials);
        p.h.Host().Meta(testsupport::MakeReceived(0, 0, "opens the gate"));
        ASSERT_TRUE(WaitUntil([&] { return log.Contains("ST: start filing"); }));
        p.Stream(0, 1500, 500);
        std::thread drain([&] { p.h.Process().drainProcess(5000); });
        std::thread error([&] { p.h.Process().notifyModuleError(21); });
        std::thread disconnect([&] { p.h.Host().Disconnection(); });
        drain.join();
        error.join();
        disconnect.join();
        p.h.Process().stopProcess();
    }
}

TEST(FileRecorderModuleConcurrency, ModuleErrorAndDisconnectionStopTheBufferTogether) {
    for (int round = 0; round < 10; ++round) {
        Pipeline p;
        p.Connect();
        p.h.Host().Meta(testsupport::MakeReceived(0, 0, "m"));
        std::thread error([&] { p.h.Process().notifyModuleError(21); });
        std::thread disconnect([&] { p.h.Host().Disconnection(); });
        error.join();
        disconnect.join();
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
        std::thread video([&] {
            for (uint64_t t = 0; go; t += 33)
                p.h.Host().Video(testsupport::MakeReceived(
                    t, t * 90, t % 990 == 0 ? testsupport::H264Idr() : testsupport::H264NonIdr()));
        });
        std::thread audio([&] {
            for (uint64_t t = 0; go; t += 20)
                p.h.Host().Audio(testsupport::MakeReceived(t, t, "a"));
        });
        std::thread meta([&] {
            for (uint64_t t = 0; go; t += 100)
                p.h.Host().Meta(testsupport::MakeReceived(t, t, "m"));
        });
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        p.h.Host().Disconnection();
        go = false;
        video.join();
        audio.join();
        meta.join();
        p.h.Process().stopProcess();
    }
    Logger::SetLevel(Logger::kDefaultLevel);
}
