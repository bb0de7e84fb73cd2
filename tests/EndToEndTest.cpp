// The real stream-file-recorder binary on real media. Guards: stored objects that do not decode
// to exactly the input's frames (H.264, H.265, B-frames, a source clock that jumps) or whose
// durations are wrong; a credential process's refused answer not asked again, upload options
// not reaching the store, a secret in the log (against s3rver); a live UDP input that stops and
// starts again not recorded across the gap or not a playlist discontinuity, its tail lost on
// SIGTERM; SIGINT not ending a run in order; /metrics and /healthz disagreeing with the status
// lines; a refused secret making a storm of requests or log lines; runs that cannot record or
// store ending with the wrong status or without the reason.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/S3rver.h"
#include "tests/support/ScriptedHttpServer.h"
#include "tests/support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using namespace testsupport;

// What ffprobe says of `path`'s `entries`, a line each (some empty).
std::istringstream Probe(const std::string& path, const std::string& entries) {
    return std::istringstream(
        RunProcess(Words("ffprobe -v error " + entries + " -of csv=p=0") + Args{path}, 120000)
            .output);
}

// What the ffmpeg CLI complains of when it decodes `path`.
std::string DecodeErrors(const std::string& path) {
    return RunProcess(Words("ffmpeg -v error -i") + Args{path, "-f", "null", "-"}).output;
}

// What the status lines in `dir` said.
struct Status {
    std::vector<long> sequence, durations;  // of the stored files, in order
    size_t givenUp = 0, tokenRequests = 0, uploadInfos = 0;
    double bytes = 0;  // FileSize of the UploadInfo lines with ErrorCode Success
    int state = 0;     // the last ProcessStatus
    unsigned code = 0;
};
Status ReadStatus(const std::string& dir) {
    Status s;
    std::istringstream lines(ReadFile(dir + "/status.jsonl"));
    const std::regex seq("\"sequenceNumber\":([0-9]+),\"succeeded\":true.*\"duration\":([0-9]+)");
    const std::regex upload("ErrorCode, Success, ResponseTime, [0-9]+, FileSize, ([0-9]+)");
    const std::regex state("\"state\":([0-9]+),\"code\":([0-9]+)");
    for (std::string line; std::getline(lines, line);) {
        std::smatch m;
        if (line.find("\"LastSequenceNumNotify\"") != std::string::npos &&
            std::regex_search(line, m, seq)) {
            s.sequence.push_back(std::stol(m[1]));
            s.durations.push_back(std::stol(m[2]));
        }
        if (line.find("\"ProcessStatus\"") != std::string::npos &&
            std::regex_search(line, m, state)) {
            s.state = std::stoi(m[1]);
            s.code = static_cast<unsigned>(std::stoul(m[2]));
        }
        if (std::regex_search(line, m, upload)) s.bytes += std::stod(m[1]);
        s.givenUp += line.find("\"succeeded\":false") != std::string::npos;
        s.tokenRequests += line.find("\"GetAWSSecureTokenRequest\"") != std::string::npos;
        s.uploadInfos += line.find("\"UploadInfo\"") != std::string::npos;
    }
    return s;
}

// Records each clip into a local directory and checks the objects against the input's frames.
// The upload interval must be longer than the clip's longest GOP, so that every object begins
// with an IDR and decodes on its own (a longer GOP is split, and the object holding its rest
// does not).
TEST(EndToEndTest, StoredObjectsDecodeToTheInputsFrames) {
    const std::string h264 = TestClip("clip_5s.mp4", 5), short4s = TestClip("clip_4s.ts", 4);
    // The same 4 s three times in one TS: the second two hours later, the third back at 0.
    const std::string later = MediaClip(
        "clip_4s_2h.ts", Args{"-i", short4s} + Words("-c copy -output_ts_offset 7200 -f mpegts"));
    ASSERT_FALSE(later.empty());
    const struct {
        std::string clip, codec, interval;
        int gop;           // 0: IDRs at scene cuts, B-frames (3 at most)
        std::string rate;  // -readrate; 0 reads as fast as the recorder stores
        int slack;         // frames the durations may be off by beyond one: see below
    } cases[] = {
        {h264, "h264", "1", 30, "10", 0},
        {h264, "h264", "1", 30, "0", 0},
        {TestClip("clip_6s_bframes.ts", 6,
                  "-c:v libx264 -preset veryfast -g 90 -keyint_min 15 -sc_threshold 40 -bf 3",
                  ",negate=enable='lt(mod(t,3.7),1.3)'"),
         "h264", "4", 0, "10", 2},
        {TestClip("clip_5s_h265.mp4", 5,
                  "-c:v libx265 -preset ultrafast -x265-params "
                  "keyint=30:min-keyint=30:scenecut=0:open-gop=0:bframes=0:log-level=error"),
         "h265", "1", 30, "10", 0},
        // At five times real time a filing tick (500 ms) covers 2.5 s of input, far
        // below the 10 s the input buffer holds, even when a busy machine delays it.
        {Concatenate({short4s, later, short4s}, BuildPath("media/clip_jumps.ts")), "h264", "1", 30,
         "5", 2}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.clip + " -readrate " + c.rate);
        ASSERT_FALSE(c.clip.empty());
        const std::string dir = ScratchDir("e2e-frames");
        auto r = RunProcess(Recorder(c.clip, dir,
                                     {"-kct", c.codec, "-readrate", c.rate, "-uploadinterval",
                                      c.interval, "-endpoint", LocalStore(dir)}),
                            120000);
        const std::string log = ReadFile(dir + "/log.txt");
        ASSERT_EQ(r.exitStatus, 0) << r.output << log;
        auto objects = StoredFiles(dir + "/store/rec");
        ASSERT_GE(objects.size(), 2u) << log;
        Status status = ReadStatus(dir);
        ASSERT_EQ(status.sequence.size(), objects.size());
        for (size_t i = 0; i < status.sequence.size(); ++i)
            EXPECT_EQ(status.sequence[i], static_cast<long>(i + 1));
        EXPECT_EQ(status.uploadInfos, objects.size());

        const auto input = FrameHashes(c.clip);
        const std::string all = Concatenate(objects, dir + "/all.ts");
        const auto stored = FrameHashes(all);
        ASSERT_FALSE(stored.empty());
        const size_t k = std::find(input.begin(), input.end(), stored.front()) - input.begin();
        ASSERT_LT(k, input.size());
        EXPECT_TRUE(c.gop == 0 || k % c.gop == 0) << "the first stored frame is not an IDR";
        // A file waits for room in the module's queues however busy the machine is.
        EXPECT_EQ(log.find("queue overflow"), std::string::npos) << log;
        // The end of the file is drained: the stored frames run from there to the input's last.
        ASSERT_EQ(k + stored.size(), input.size());
        EXPECT_TRUE(std::equal(stored.begin(), stored.end(), input.begin() + k));
        // Durations run on decode times: with B-frames the first IDR is decoded two frames
        // before it is shown, and the audio runs on to the end of the last shown frame; a jump
        // of the source clock is re-based to about one frame's step.
        const double frameMs = 1000.0 / 30;
        long reported = 0;
        for (long d : status.durations) reported += d;
        EXPECT_NEAR(static_cast<double>(reported), (input.size() - k) * frameMs,
                    (1 + c.slack) * frameMs + 1)
            << "frames " << k << ".." << input.size();
        // The objects' own times agree (a jump of the source clock is not stored).
        double duration = 0;
        Probe(all, "-show_entries format=duration") >> duration;
        EXPECT_NEAR(duration, reported / 1000.0, 0.5);
        for (const auto& object : objects) EXPECT_EQ(DecodeErrors(object), "") << object;
    }
}

// The credential process's first answer carries a wrong secret, every later one the right key
// pair: the recorder asks again after the refusal. The upload options reach the store (s3rver
// keeps the storage class of the headers).
TEST(EndToEndTest, ToS3rverWithCredentialsFromACredentialProcess) {
    S3rver server;
    ASSERT_TRUE(server.Start(std::string(SFR_SOURCE_DIR) + "/scripts/s3rver.sh", BuildPath("node")))
        << server.Error();
    const std::string dir = ScratchDir("e2e-s3");
    const std::string script = dir + "/credentials.sh";
    std::ofstream(script) << "#!/bin/sh\ncount=" << dir << "/count\necho x >> \"$count\"\n"
                          << "secret=" << S3rver::kSecretKey << "\n"
                          << "[ \"$(wc -l < \"$count\")\" -eq 1 ] && secret=wrong-secret\n"
                          << "printf '{\"Version\":1,\"AccessKeyId\":\"%s\",\"SecretAccessKey\":"
                             "\"%s\",\"SessionToken\":\"token\"}' "
                          << S3rver::kAccessKey << " \"$secret\"\n";
    chmod(script.c_str(), 0755);
    auto r =
        RunProcess(Recorder(TestClip("clip_4s.ts", 4), dir,
                            {"-readrate", "20", "-endpoint", server.Endpoint(),
                             "-credentialprocess", script, "-region", "us-east-1", "-sse", "AES256",
                             "-storageclass", "STANDARD_IA", "-tagging", "site=north 1&cam=1"}),
                   120000);
    const std::string log = ReadFile(dir + "/log.txt");
    ASSERT_EQ(r.exitStatus, 0) << r.output << log;
    EXPECT_EQ(log.find("wrong-secret"), std::string::npos);
    EXPECT_EQ(log.find(S3rver::kSecretKey), std::string::npos);
    Status status = ReadStatus(dir);
    ASSERT_GE(status.sequence.size(), 2u) << log;
    EXPECT_GE(status.tokenRequests, 1u);  // after the wrong key was refused
    EXPECT_GE(CountOf(ReadFile(dir + "/count"), "\n"), 2u);

    const auto aws = [&](const Args& args) {
        return RunProcess(Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=secretTEST "
                                "AWS_DEFAULT_REGION=us-east-1 /usr/bin/aws --endpoint-url") +
                              Args{server.Endpoint()} + args,
                          120000);
    };
    auto copy = aws({"s3", "cp", "--recursive", "s3://rec/", dir + "/back"});
    ASSERT_EQ(copy.exitStatus, 0) << copy.output;
    const auto objects = StoredFiles(dir + "/back");
    EXPECT_EQ(objects.size(), status.sequence.size());
    for (const auto& object : objects) EXPECT_EQ(DecodeErrors(object), "") << object;
    ASSERT_FALSE(objects.empty());
    const std::string key = fs::relative(objects.front(), dir + "/back").string();
    auto head = aws({"s3api", "head-object", "--bucket", "rec", "--key", key});
    EXPECT_NE(head.output.find("\"StorageClass\": \"STANDARD_IA\""), std::string::npos)
        << head.output;
}

// The clip is sent once the recorder listens; after 10 s of silence it gives the input up and
// reopens it; once it listens again the clip is sent again, and when that ends, SIGTERM.
TEST(EndToEndTest, LiveUdpInputIsRecordedAcrossAGapAndItsTailKeptOnSigterm) {
    const std::string clip = TestClip("clip_4s.ts", 4);
    const std::string dir = ScratchDir("e2e-udp");
    const int port = FreePort(SOCK_DGRAM);
    const std::string url = "udp://127.0.0.1:" + std::to_string(port);
    const Args sender = Words("ffmpeg -v error -re -i") + Args{clip} + Words("-c copy -f mpegts") +
                        Args{url + "?pkt_size=1316"};
    char bound[8];  // the port as /proc/net/udp shows a socket bound to it
    std::snprintf(bound, sizeof bound, ":%04X ", port);
    const auto listens = [&] { return ReadFile("/proc/net/udp").find(bound) != std::string::npos; };
    ChildProcess recorder(Recorder(url, dir, {"-endpoint", LocalStore(dir)}), dir + "/output.txt");
    ASSERT_TRUE(WaitUntil(listens, 60000));
    EXPECT_EQ(ChildProcess(sender).Wait(60000), 0);
    ASSERT_TRUE(WaitUntil(
        [&] {
            return ReadFile(dir + "/log.txt").find("reopening in") != std::string::npos &&
                   listens();
        },
        60000))
        << ReadFile(dir + "/log.txt");
    EXPECT_EQ(ChildProcess(sender).Wait(60000), 0);
    recorder.Signal(SIGTERM);
    ASSERT_EQ(recorder.Wait(60000), 0) << ReadFile(dir + "/log.txt");
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_NE(log.find("reopened"), std::string::npos);
    EXPECT_NE(log.find("jumped by"), std::string::npos);  // the second sending restarts at 0
    EXPECT_NE(log.find("SIGTERM received"), std::string::npos);

    const auto objects = StoredFiles(dir + "/store/rec");
    ASSERT_FALSE(objects.empty()) << log;
    const std::string all = Concatenate(objects, dir + "/all.ts");
    std::vector<double> dts;
    auto probe = Probe(all, "-select_streams v:0 -show_entries packet=dts_time");
    for (std::string line; std::getline(probe, line);)
        if (!line.empty()) dts.push_back(std::atof(line.c_str()));
    ASSERT_GT(dts.size(), 60u);
    for (size_t i = 1; i < dts.size(); ++i) {
        EXPECT_GT(dts[i], dts[i - 1]) << i;
        // At the reconnect the video goes on after the newest audio (muxed up to ~0.7 s
        // ahead), so that both stay in sync: a short step, never the 10 s of silence.
        EXPECT_LT(dts[i] - dts[i - 1], 1.0) << "gap at packet " << i;
    }
    // Both sendings are in the recording: more than the first one alone could give.
    EXPECT_GT(dts.back() - dts.front(), 5.0);

    // The live playlist plays the stored frames, with the reopening as its one discontinuity.
    const std::string live = dir + "/store/rec/cam1/live.m3u8";
    EXPECT_EQ(CountOf(ReadFile(live), "#EXT-X-DISCONTINUITY\n"), 1u) << ReadFile(live);
    const auto stored = FrameHashes(all);
    EXPECT_EQ(FrameHashes(live), stored);
    // The tail after the last regular cut is stored: the recording ends with the sent frames,
    // but for the last one or two, which MPEG-TS over UDP leaves in the demuxer (a video PES
    // ends only when the next one begins, and none comes).
    const auto input = FrameHashes(clip);
    ASSERT_FALSE(stored.empty());
    auto last = std::find(input.begin(), input.end(), stored.back());
    ASSERT_NE(last, input.end());
    EXPECT_GE(last - input.begin(), static_cast<long>(input.size()) - 3) << log;
}

// /healthz and /metrics scraped while the recorder records a 12 s clip in real time, the figures
// checked against the status lines of the same run; then SIGINT ends the run in order.
TEST(EndToEndTest, ScrapesAgreeWithTheStatusLinesAndSigintEndsTheRunInOrder) {
    const std::string dir = ScratchDir("e2e-metrics");
    const std::string address = "127.0.0.1:" + std::to_string(FreePort(SOCK_STREAM));
    ChildProcess recorder(
        Recorder(TestClip("clip_12s.ts", 12), dir,
                 {"-readrate", "1", "-metrics", address, "-endpoint", LocalStore(dir)}),
        dir + "/output.txt");
    // The body of a GET; /healthz's answers per state: MetricsExporterTest.
    const auto get = [&](const std::string& path) {
        return RunProcess({"curl", "-s", "-m", "10", "http://" + address + path}, 20000).output;
    };
    ASSERT_TRUE(WaitUntil([&] { return get("/healthz") == "Executing 0\n"; }, 60000))
        << get("/healthz") << ReadFile(dir + "/log.txt");

    // Objects are stored while the scrape runs: compare when the status lines did not change
    // around the scrape, and once at least two objects were stored.
    std::map<std::string, double> m;
    Status said;
    const bool agreed = WaitUntil(
        [&] {
            const std::string before = ReadFile(dir + "/status.jsonl");
            m = Samples(get("/metrics"));
            said = ReadStatus(dir);
            return said.sequence.size() >= 2 && before == ReadFile(dir + "/status.jsonl") &&
                   m["recorder_objects_total{result=\"Success\"}"] == said.sequence.size() &&
                   m["recorder_stored_bytes_total"] == said.bytes &&
                   m["recorder_process_state"] == said.state &&
                   m["recorder_process_status_code"] == said.code;
        },
        60000);
    ASSERT_TRUE(agreed) << "status lines: " << said.sequence.size() << " stored, " << said.bytes
                        << " bytes, state " << said.state << "\nscrape:\n"
                        << get("/metrics");
    EXPECT_EQ(said.state, 4);
    EXPECT_EQ(said.givenUp, 0u);
    EXPECT_GE(m["recorder_transfer_seconds_count"], said.sequence.size());
    EXPECT_EQ(m["recorder_file_buffer_limit_ms"], 100000);
    EXPECT_GT(m["recorder_samples_received_total{media=\"video\"}"], 30);
    EXPECT_GT(m["recorder_samples_received_total{media=\"audio\"}"], 30);
    EXPECT_EQ(m["recorder_queue_overflows_total{media=\"video\"}"], 0);
    EXPECT_EQ(m["recorder_input_reopenings_total"], 0);
    EXPECT_GT(m["recorder_last_object_capture_time_seconds"], 1.6e9);

    recorder.Signal(SIGINT);
    ASSERT_EQ(recorder.Wait(60000), 0) << ReadFile(dir + "/log.txt");
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_NE(log.find("SIGINT received"), std::string::npos);
    EXPECT_NE(log.find("end of stream: storing what is held"), std::string::npos);
    std::string last = log.substr(log.find_last_of('\n', log.size() - 2) + 1);
    EXPECT_NE(last.find("Call Uninitialize."), std::string::npos) << last;
    // Stopped long before the 12 s the whole clip takes, what was held stored and reported.
    const auto objects = StoredFiles(dir + "/store/rec");
    EXPECT_LT(objects.size(), 10u);
    EXPECT_EQ(ReadStatus(dir).sequence.size(), objects.size());
}

// A wrong secret against a store that refuses every signature: the retries, the token requests
// and the log stay paced (at most about two PUTs, one token request and 3 KB of log per second).
TEST(EndToEndTest, RefusedSecretMakesNoStormOfRequestsOrLogLines) {
    ScriptedHttpServer server(ScriptedHttpServer::Mode::kRespond,
                              S3ErrorAnswer("403 Forbidden", "SignatureDoesNotMatch"));
    const std::string dir = ScratchDir("e2e-storm");
    const int seconds = 12;
    auto r = RunProcess(Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=wrong "
                              "AWS_SESSION_TOKEN=token") +
                            Recorder(TestClip("clip_12s.ts", seconds), dir,
                                     Args{"-endpoint", server.Endpoint()} +
                                         Words("-draintimeout 1 -bufferfullsize 10")),
                        120000);
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_EQ(r.exitStatus, 0) << log.substr(0, 3000);
    EXPECT_LE(server.Connections(), 2 * seconds);
    EXPECT_GE(server.Connections(), 2);
    EXPECT_LE(ReadStatus(dir).tokenRequests, static_cast<size_t>(seconds));
    EXPECT_LT(log.size(), 3000u * seconds);
}

// Inputs the recorder cannot take end the start (status 1); a module error ends the run with
// status 2; a store that refuses every file makes the run end with status 3 after the drain; a
// store that is down ends the drain at its timeout, status 0. Each says why, in seconds.
TEST(EndToEndTest, RunsThatCannotRecordOrStoreEndWithTheirStatus) {
    const std::string dir = ScratchDir("e2e-bad");
    const std::string endpoint = LocalStore(dir), clip = TestClip("clip_4s.ts", 4);
    // The stream's directory in the bucket is a file: every object is refused as a path error.
    std::ofstream(dir + "/store/rec/cam1") << "in the way";
    const std::string down = "http://127.0.0.1:" + std::to_string(FreePort(SOCK_STREAM));
    const struct {
        std::string input;
        Args extra;
        int status;
        std::string says;
    } cases[] = {
        {dir + "/missing.mp4", {}, 1, "cannot open input \"" + dir + "/missing.mp4\""},
        // Not an address of this machine: binding fails once the input is open.
        {clip, {"-metrics", "192.0.2.1:9464"}, 1, "-metrics 192.0.2.1:9464: cannot serve there"},
        {clip, {"-kct", "h265"}, 1, "-kct h265 but the input's video is H.264"},
        // Keys a directory cannot hold: the module reports error 21 at the first transfer.
        {clip, Words("-streamingid .. -readrate 20"), 2, "recorder stopped: module error 21"},
        {clip, Words("-readrate 20 -bufferfullsize 1 -draintimeout 1"), 3,
         "nothing was stored: all "},
        // Nothing listens at the endpoint: every transfer is a network error, waited out.
        {clip, Args{"-endpoint", down} + Words("-readrate 20 -draintimeout 2"), 0,
         "drain incomplete after 2000 ms: "},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.says);
        fs::remove(dir + "/log.txt");
        const auto start = std::chrono::steady_clock::now();
        auto r = RunProcess(Words("env AWS_ACCESS_KEY_ID=AKID AWS_SECRET_ACCESS_KEY=secret "
                                  "AWS_SESSION_TOKEN=token") +
                                Recorder(c.input, dir, Args{"-endpoint", endpoint} + c.extra),
                            60000);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
        EXPECT_EQ(r.exitStatus, c.status);
        const std::string log = ReadFile(dir + "/log.txt");
        EXPECT_NE(log.find(c.says), std::string::npos) << log.substr(0, 5000);
        EXPECT_EQ(log.find("Initialize Error.") != std::string::npos, c.status == 1);
        if (c.status == 3) {
            EXPECT_NE(log.find("files were given up (last error: FilePathError)"),
                      std::string::npos);
        }
    }
    std::smatch m;
    const std::string log = ReadFile(dir + "/log.txt");
    ASSERT_TRUE(std::regex_search(
        log, m,
        std::regex("([0-9]+) stream files \\(([0-9]+) ms of stream\\) left to the "
                   "disconnection")))
        << log;
    EXPECT_GE(std::stol(m[1]), 1);
    EXPECT_GE(std::stol(m[2]), 1000);
    EXPECT_NE(log.find("Call Uninitialize."), std::string::npos);
}

}  // namespace
