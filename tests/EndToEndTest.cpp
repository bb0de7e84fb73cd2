// The real stream-file-recorder binary on real media: what it stores must decode to exactly the
// input's frames; credentials from a credential process against s3rver; a live UDP input that
// stops and starts again; SIGINT; inputs it cannot record; sources with broken clocks.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/AwsStandIns.h"
#include "tests/support/S3rver.h"
#include "tests/support/ScriptedHttpServer.h"
#include "tests/support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using testsupport::BuildPath;
using testsupport::FreePort;
using testsupport::MediaClip;
using testsupport::ReadFile;
using testsupport::RunProcess;
using testsupport::Words;
using Child = testsupport::ChildProcess;
using Args = std::vector<std::string>;

Args operator+(Args a, const Args& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// A fresh directory per test under the build tree.
std::string Scratch(const std::string& name) {
    std::string dir = BuildPath("e2e/" + name + "-" + std::to_string(getpid()));
    fs::remove_all(dir);
    fs::create_directories(dir);
    return dir;
}

// A local store under `dir` with the bucket "rec"; its -endpoint.
std::string Store(const std::string& dir) {
    fs::create_directories(dir + "/store/rec");
    return "file://" + dir + "/store";
}

Args RecorderArgs(const std::string& input, const std::string& dir, const Args& extra) {
    return Args{BuildPath("stream-file-recorder"), "-input", input} +
           Words(
               "-uploadinterval 1 -bufferfullsize 100 -authretrytime 3000 -kct h264 "
               "-bucketname rec") +
           Args{"-status", dir + "/status.jsonl", "-logfile", dir + "/log.txt"} + extra;
}

// `seconds` of 30 fps test pattern (through `filter`, if any) and a 48 kHz tone, the video
// encoded with `video`.
std::string Clip(const std::string& name, int seconds, const std::string& video,
                 const std::string& filter = "") {
    const std::string length = "duration=" + std::to_string(seconds);
    return MediaClip(name, Words("-f lavfi -i testsrc2=size=320x240:rate=30:" + length + filter +
                                 " -f lavfi -i sine=frequency=440:sample_rate=48000:" + length +
                                 " -pix_fmt yuv420p -c:a aac -b:a 64k " + video));
}
const char kX264Gop30[] =
    "-c:v libx264 -preset ultrafast -g 30 -keyint_min 30 -sc_threshold 0 -bf 0";

std::string ShortClip() {
    return Clip("e2e_short.ts", 4, kX264Gop30);
}

// Sends `clip` in real time as MPEG-TS to `url`.
Args Sender(const std::string& clip, const std::string& url) {
    return Words("ffmpeg -v error -re -i") + Args{clip} + Words("-c copy -f mpegts") +
           Args{url + "?pkt_size=1316"};
}

// The stored objects in the order of their sequence numbers.
std::vector<std::string> Objects(const std::string& dir) {
    std::vector<std::pair<long, std::string>> found;
    if (!fs::exists(dir)) return {};
    std::regex name(".*_([0-9]+)\\.ts$");
    for (const auto& entry : fs::recursive_directory_iterator(dir)) {
        std::smatch m;
        std::string path = entry.path().string();
        if (entry.is_regular_file() && std::regex_match(path, m, name))
            found.emplace_back(std::stol(m[1]), path);
    }
    std::sort(found.begin(), found.end());
    std::vector<std::string> paths;
    for (auto& f : found) paths.push_back(f.second);
    return paths;
}

std::string Concatenate(const std::vector<std::string>& objects, const std::string& out) {
    std::ofstream o(out, std::ios::binary);
    for (const auto& object : objects) o << ReadFile(object);
    return out;
}

// The non-empty, non-comment lines of a program's output.
std::vector<std::string> OutputLines(const Args& argv) {
    std::istringstream in(RunProcess(argv, 120000).output);
    std::vector<std::string> lines;
    for (std::string line; std::getline(in, line);)
        if (!line.empty() && line[0] != '#') lines.push_back(line);
    return lines;
}

// The MD5 of every decoded video frame, in output order.
std::vector<std::string> FrameHashes(const std::string& path) {
    auto hashes = OutputLines(Words("ffmpeg -v error -i") + Args{path} +
                              Words("-map 0:v -fps_mode passthrough -f framemd5 -"));
    for (auto& line : hashes) line = line.substr(line.find_last_of(", ") + 1);
    return hashes;
}

double Duration(const std::string& path) {
    auto r = RunProcess(Words("ffprobe -v error -show_entries format=duration -of csv=p=0") +
                        Args{path});
    return std::atof(r.output.c_str());
}

// The sequence numbers and durations of the LastSequenceNumNotify lines.
struct Notified {
    std::vector<long> sequence;
    std::vector<long> durations;
    size_t tokenRequests = 0;
    size_t uploadInfos = 0;
};
Notified ReadStatus(const std::string& path) {
    Notified n;
    std::istringstream lines(ReadFile(path));
    std::regex seq("\"sequenceNumber\":([0-9]+),\"succeeded\":true.*\"duration\":([0-9]+)");
    for (std::string line; std::getline(lines, line);) {
        std::smatch m;
        if (line.find("\"LastSequenceNumNotify\"") != std::string::npos &&
            std::regex_search(line, m, seq)) {
            n.sequence.push_back(std::stol(m[1]));
            n.durations.push_back(std::stol(m[2]));
        }
        n.tokenRequests += line.find("\"GetAWSSecureTokenRequest\"") != std::string::npos;
        n.uploadInfos += line.find("\"UploadInfo\"") != std::string::npos;
    }
    return n;
}

// Records each clip into a local directory and checks the objects against the input's frames.
// The upload interval must be longer than the clip's longest GOP, so that every object begins
// with an IDR and decodes on its own (a longer GOP is split, and the object holding its rest
// does not).
TEST(EndToEndTest, StoredObjectsDecodeToTheInputsFrames) {
    const struct {
        std::string clip, codec, interval;
        int gop;           // 0: IDRs at scene cuts, B-frames (3 at most)
        std::string rate;  // -readrate; 0 reads as fast as the recorder stores
    } cases[] = {{Clip("e2e_h264.mp4", 5, kX264Gop30), "h264", "1", 30, "10"},
                 {Clip("e2e_h264.mp4", 5, kX264Gop30), "h264", "1", 30, "0"},
                 {Clip("e2e_h264_bframes.ts", 6,
                       "-c:v libx264 -preset veryfast -g 90 -keyint_min 15 -sc_threshold 40 -bf 3",
                       ",negate=enable='lt(mod(t,3.7),1.3)'"),
                  "h264", "4", 0, "10"},
                 {Clip("e2e_h265.mp4", 5,
                       "-c:v libx265 -preset ultrafast -x265-params "
                       "keyint=30:min-keyint=30:scenecut=0:open-gop=0:bframes=0:log-level=error"),
                  "h265", "1", 30, "10"}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.clip + " -readrate " + c.rate);
        ASSERT_FALSE(c.clip.empty());
        const std::string dir =
            Scratch("frames-" + c.codec + "-" + std::to_string(c.gop) + "-" + c.rate);
        auto r = RunProcess(RecorderArgs(c.clip, dir,
                                         {"-kct", c.codec, "-readrate", c.rate, "-uploadinterval",
                                          c.interval, "-endpoint", Store(dir)}),
                            120000);
        const std::string log = ReadFile(dir + "/log.txt");
        ASSERT_EQ(r.exitStatus, 0) << r.output << log;
        auto objects = Objects(dir + "/store/rec");
        ASSERT_GE(objects.size(), 2u) << log;
        Notified status = ReadStatus(dir + "/status.jsonl");
        ASSERT_EQ(status.sequence.size(), objects.size());
        for (size_t i = 0; i < status.sequence.size(); ++i)
            EXPECT_EQ(status.sequence[i], static_cast<long>(i + 1));
        EXPECT_EQ(status.uploadInfos, objects.size());

        const auto input = FrameHashes(c.clip);
        const auto stored = FrameHashes(Concatenate(objects, dir + "/all.ts"));
        ASSERT_FALSE(stored.empty());
        const size_t k = std::find(input.begin(), input.end(), stored.front()) - input.begin();
        ASSERT_LT(k, input.size());
        EXPECT_TRUE(c.gop == 0 || k % c.gop == 0) << "the first stored frame is not an IDR";
        // A file waits for room in the module's queues however busy the machine is.
        EXPECT_EQ(log.find("queue overflow"), std::string::npos) << log;
        // The end of the file is drained: the stored frames run from there to the input's last.
        ASSERT_EQ(k + stored.size(), input.size());
        EXPECT_TRUE(std::equal(stored.begin(), stored.end(), input.begin() + k));
        // Durations run on decode times: with B-frames the first IDR is decoded `reorder`
        // frames before it is shown, and the audio runs on to the end of the last shown frame.
        const double frameMs = 1000.0 / 30;
        const int reorder = c.gop > 0 ? 0 : 2;
        long reported = 0;
        for (long d : status.durations) reported += d;
        EXPECT_NEAR(static_cast<double>(reported), (input.size() - k) * frameMs,
                    (1 + reorder) * frameMs + 1)
            << "frames " << k << ".." << input.size();
        for (const auto& object : objects) {
            auto decode = RunProcess(Words("ffmpeg -v error -i") + Args{object, "-f", "null", "-"});
            EXPECT_TRUE(decode.output.empty()) << object << ": " << decode.output;
        }
    }
}

TEST(EndToEndTest, ToS3rverWithCredentialsFromACredentialProcess) {
    using testsupport::S3rver;
    S3rver server;
    ASSERT_TRUE(server.Start(std::string(SFR_SOURCE_DIR) + "/scripts/s3rver.sh", BuildPath("node")))
        << server.Error();
    const std::string dir = Scratch("s3");
    // The first answer carries a wrong secret; every later one the right key pair.
    const std::string script = dir + "/credentials.sh";
    std::ofstream(script) << "#!/bin/sh\ncount=" << dir << "/count\necho x >> \"$count\"\n"
                          << "secret=" << S3rver::kSecretKey << "\n"
                          << "[ \"$(wc -l < \"$count\")\" -eq 1 ] && secret=wrong-secret\n"
                          << "printf '{\"Version\":1,\"AccessKeyId\":\"%s\",\"SecretAccessKey\":"
                             "\"%s\",\"SessionToken\":\"token\"}' "
                          << S3rver::kAccessKey << " \"$secret\"\n";
    chmod(script.c_str(), 0755);
    auto r = RunProcess(RecorderArgs(ShortClip(), dir,
                                     {"-readrate", "20", "-endpoint", server.Endpoint(),
                                      "-credentialprocess", script, "-region", "us-east-1"}),
                        120000);
    const std::string log = ReadFile(dir + "/log.txt");
    ASSERT_EQ(r.exitStatus, 0) << r.output << log;
    EXPECT_EQ(log.find("wrong-secret"), std::string::npos);
    EXPECT_EQ(log.find(S3rver::kSecretKey), std::string::npos);

    Notified status = ReadStatus(dir + "/status.jsonl");
    ASSERT_GE(status.sequence.size(), 2u) << log;
    EXPECT_GE(status.tokenRequests, 1u);  // after the wrong key was refused
    const std::string asked = ReadFile(dir + "/count");
    EXPECT_GE(std::count(asked.begin(), asked.end(), '\n'), 2);  // asked again after the refusal

    auto listing = RunProcess(
        Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=secretTEST "
              "AWS_DEFAULT_REGION=us-east-1 AWS_EC2_METADATA_DISABLED=true "
              "AWS_CONFIG_FILE=/dev/null AWS_SHARED_CREDENTIALS_FILE=/dev/null /usr/bin/aws "
              "--endpoint-url") +
            Args{server.Endpoint()} + Words("s3 ls --recursive s3://rec/"),
        120000);
    ASSERT_EQ(listing.exitStatus, 0) << listing.output;
    size_t objects = 0;
    for (size_t at = 0; (at = listing.output.find(".ts", at)) != std::string::npos; ++at) ++objects;
    EXPECT_EQ(objects, status.sequence.size()) << listing.output;
}

// An IAM user's long-term keys in a profile file and nothing else: the recorder has STS (the
// stand-in, which checks that the keys signed the request) turn them into temporary ones, which
// s3rver accepts.
TEST(EndToEndTest, ToS3rverWithOnlyAStaticKeyProfile) {
    using testsupport::S3rver;
    S3rver server;
    ASSERT_TRUE(server.Start(std::string(SFR_SOURCE_DIR) + "/scripts/s3rver.sh", BuildPath("node")))
        << server.Error();
    testsupport::ScriptedHttpServer sts([](const testsupport::HttpRequestSeen& request) {
        if (testsupport::FormValue(request.body, "Action") != "GetSessionToken" ||
            request.Header("Authorization").find("Credential=AKIALONGTERM/") == std::string::npos)
            return testsupport::StsErrorAnswer("403 Forbidden", "AccessDenied", "wrong caller");
        return testsupport::StsCredentialsAnswer(
            "GetSessionToken", S3rver::kAccessKey, S3rver::kSecretKey, "session-token",
            std::chrono::system_clock::now() + std::chrono::hours(12));
    });
    const std::string dir = Scratch("profile");
    std::ofstream(dir + "/credentials") << "[recorder]\naws_access_key_id = AKIALONGTERM\n"
                                           "aws_secret_access_key = long-term-secret\n";
    auto r = RunProcess(
        Words("env -u AWS_ACCESS_KEY_ID -u AWS_SECRET_ACCESS_KEY -u AWS_SESSION_TOKEN "
              "AWS_PROFILE=recorder AWS_CONFIG_FILE=/dev/null AWS_EC2_METADATA_DISABLED=true") +
            Args{"AWS_SHARED_CREDENTIALS_FILE=" + dir + "/credentials",
                 "AWS_ENDPOINT_URL_STS=" + sts.Endpoint()} +
            RecorderArgs(
                ShortClip(), dir,
                {"-readrate", "20", "-endpoint", server.Endpoint(), "-region", "us-east-1", "-sse",
                 "AES256", "-storageclass", "STANDARD_IA", "-tagging", "site=north 1&cam=1"}),
        120000);
    const std::string log = ReadFile(dir + "/log.txt");
    ASSERT_EQ(r.exitStatus, 0) << r.output << log;
    EXPECT_NE(log.find("AWS credentials from shared config files via STS GetSessionToken"),
              std::string::npos)
        << log;
    for (const char* secret : {"long-term-secret", S3rver::kSecretKey, "session-token"})
        EXPECT_EQ(log.find(secret), std::string::npos) << secret;
    Notified status = ReadStatus(dir + "/status.jsonl");
    ASSERT_GE(status.sequence.size(), 2u) << log;

    auto copy = RunProcess(
        Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=secretTEST "
              "AWS_DEFAULT_REGION=us-east-1 AWS_EC2_METADATA_DISABLED=true "
              "AWS_CONFIG_FILE=/dev/null AWS_SHARED_CREDENTIALS_FILE=/dev/null /usr/bin/aws "
              "--endpoint-url") +
            Args{server.Endpoint(), "s3", "cp", "--recursive", "s3://rec/", dir + "/back"},
        120000);
    ASSERT_EQ(copy.exitStatus, 0) << copy.output;
    size_t objects = 0;
    std::string key;  // of one object
    for (const auto& entry : fs::recursive_directory_iterator(dir + "/back")) {
        if (entry.path().extension() != ".ts") continue;
        ++objects;
        key = fs::relative(entry.path(), dir + "/back").string();
        auto decode =
            RunProcess(Words("ffmpeg -v error -i") + Args{entry.path(), "-f", "null", "-"});
        EXPECT_TRUE(decode.output.empty()) << entry.path() << ": " << decode.output;
    }
    EXPECT_EQ(objects, status.sequence.size());
    // The upload options reached the store (s3rver keeps the storage class of the headers).
    auto head = RunProcess(
        Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=secretTEST "
              "AWS_DEFAULT_REGION=us-east-1 AWS_EC2_METADATA_DISABLED=true "
              "AWS_CONFIG_FILE=/dev/null AWS_SHARED_CREDENTIALS_FILE=/dev/null "
              "/usr/bin/aws --endpoint-url") +
            Args{server.Endpoint(), "s3api", "head-object", "--bucket", "rec", "--key", key},
        120000);
    EXPECT_NE(head.output.find("\"StorageClass\": \"STANDARD_IA\""), std::string::npos)
        << head.output;
}

TEST(EndToEndTest, LiveUdpInputThatStopsAndStartsAgainIsRecordedAcrossTheGap) {
    const std::string clip = ShortClip();
    const std::string dir = Scratch("udp");
    const std::string url = "udp://127.0.0.1:" + std::to_string(FreePort(SOCK_DGRAM));
    // Ends by itself 6 s of input in: 4 s of the first sending and 2 s of the second.
    Child recorder(RecorderArgs(url, dir, {"-duration", "6", "-endpoint", Store(dir)}),
                   dir + "/output.txt");
    EXPECT_EQ(Child(Sender(clip, url)).Wait(60000), 0);
    // After 10 s of silence the recorder gives the input up and reopens it.
    ASSERT_TRUE(testsupport::WaitUntil(
        [&] { return ReadFile(dir + "/log.txt").find("reopening in") != std::string::npos; },
        60000))
        << ReadFile(dir + "/log.txt");
    Child second(Sender(clip, url));
    ASSERT_EQ(recorder.Wait(90000), 0) << ReadFile(dir + "/log.txt");
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_NE(log.find("reopened"), std::string::npos);
    EXPECT_NE(log.find("jumped by"), std::string::npos);  // the second sending restarts at 0

    auto objects = Objects(dir + "/store/rec");
    ASSERT_FALSE(objects.empty()) << log;
    std::vector<double> dts;
    for (const auto& line :
         OutputLines(Words("ffprobe -v error -select_streams v:0 -show_entries packet=dts_time "
                           "-of csv=p=0") +
                     Args{Concatenate(objects, dir + "/all.ts")}))
        dts.push_back(std::atof(line.c_str()));
    ASSERT_GT(dts.size(), 60u);
    for (size_t i = 1; i < dts.size(); ++i) {
        EXPECT_GT(dts[i], dts[i - 1]) << i;
        // At the reconnect the video goes on after the newest audio (muxed up to ~0.7 s
        // ahead), so that both stay in sync: a short step, never the 10 s of silence.
        EXPECT_LT(dts[i] - dts[i - 1], 1.0) << "gap at packet " << i;
    }
    // Both sendings are in the recording: more than the first one alone could give.
    EXPECT_GT(dts.back() - dts.front(), 3.5);
}

TEST(EndToEndTest, LiveInputWhoseSenderStopsKeepsItsTailOnSigterm) {
    const std::string clip = ShortClip();
    const std::string dir = Scratch("udp-tail");
    const std::string url = "udp://127.0.0.1:" + std::to_string(FreePort(SOCK_DGRAM));
    Child recorder(RecorderArgs(url, dir, {"-uploadinterval", "2", "-endpoint", Store(dir)}),
                   dir + "/output.txt");
    EXPECT_EQ(Child(Sender(clip, url)).Wait(60000), 0);
    recorder.Signal(SIGTERM);
    ASSERT_EQ(recorder.Wait(60000), 0) << ReadFile(dir + "/log.txt");
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_NE(log.find("SIGTERM received"), std::string::npos) << log;
    auto objects = Objects(dir + "/store/rec");
    ASSERT_FALSE(objects.empty()) << log;
    // The tail after the last regular cut is stored: the recording ends with the sent frames,
    // but for the last one or two, which MPEG-TS over UDP leaves in the demuxer (a video PES
    // ends only when the next one begins, and none comes).
    const auto input = FrameHashes(clip);
    const auto stored = FrameHashes(Concatenate(objects, dir + "/all.ts"));
    ASSERT_FALSE(stored.empty());
    auto last = std::find(input.begin(), input.end(), stored.back());
    ASSERT_NE(last, input.end());
    EXPECT_GE(last - input.begin(), static_cast<long>(input.size()) - 3) << log;
}

TEST(EndToEndTest, DrainAgainstAStoreThatIsDownEndsAtTheDrainTimeout) {
    const std::string dir = Scratch("drain-down");
    // Nothing listens on the endpoint: every transfer is a network error, waited out.
    auto start = std::chrono::steady_clock::now();
    auto r =
        RunProcess(Words("env AWS_ACCESS_KEY_ID=AKID AWS_SECRET_ACCESS_KEY=secret "
                         "AWS_SESSION_TOKEN=token") +
                       RecorderArgs(ShortClip(), dir,
                                    {"-readrate", "20", "-draintimeout", "2", "-endpoint",
                                     "http://127.0.0.1:" + std::to_string(FreePort(SOCK_STREAM))}),
                   60000);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_EQ(r.exitStatus, 0) << log;
    std::smatch m;
    ASSERT_TRUE(
        std::regex_search(log, m,
                          std::regex("drain incomplete after 2000 ms: ([0-9]+) stream files "
                                     "\\(([0-9]+) ms of stream\\) left to the disconnection")))
        << log;
    EXPECT_GE(std::stol(m[1]), 1);
    EXPECT_GE(std::stol(m[2]), 1000);
    EXPECT_NE(log.find("Call Uninitialize."), std::string::npos);
}

TEST(EndToEndTest, SigintEndsARunInOrderWithExitCodeZero) {
    const std::string dir = Scratch("sigint");
    Child recorder(RecorderArgs(ShortClip(), dir, {"-readrate", "0.5", "-endpoint", Store(dir)}),
                   dir + "/output.txt");
    ASSERT_TRUE(testsupport::WaitUntil(
        [&] { return !ReadStatus(dir + "/status.jsonl").sequence.empty(); }, 60000))
        << ReadFile(dir + "/log.txt");
    recorder.Signal(SIGINT);
    ASSERT_EQ(recorder.Wait(60000), 0) << ReadFile(dir + "/log.txt");
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_NE(log.find("SIGINT received"), std::string::npos);
    EXPECT_NE(log.find("end of stream: storing what is held"), std::string::npos);
    std::string last = log.substr(log.find_last_of('\n', log.size() - 2) + 1);
    EXPECT_NE(last.find("Call Uninitialize."), std::string::npos) << last;
    // Stopped long before the 8 s the whole clip takes at this rate.
    auto objects = Objects(dir + "/store/rec");
    EXPECT_GE(objects.size(), 1u);
    EXPECT_LT(objects.size(), 4u);
}

// Inputs the recorder cannot take end the start (status 1); a module error ends the run with
// status 2; a store that refuses every file makes the run end with status 3 after the drain.
// Each says why.
TEST(EndToEndTest, RunsThatCannotRecordEndWithTheirStatus) {
    const std::string dir = Scratch("bad");
    const std::string endpoint = Store(dir);
    // The stream's directory in the bucket is a file: every object is refused as a path error.
    std::ofstream(dir + "/store/rec/e2e_short") << "in the way";
    const struct {
        std::string input;
        Args extra;
        int status;
        std::string says;
    } cases[] = {
        {dir + "/missing.mp4", {}, 1, "cannot open input \"" + dir + "/missing.mp4\""},
        {MediaClip("e2e_audio_only.m4a", Words("-f lavfi -i sine=duration=1 -c:a aac")),
         {},
         1,
         "has no H.264 or H.265 video"},
        {ShortClip(), {"-kct", "h265"}, 1, "-kct h265 but the input's video is H.264"},
        // Keys a directory cannot hold: the module reports error 21 at the first transfer.
        {ShortClip(), Words("-streamingid .. -readrate 20"), 2,
         "recorder stopped: module error 21"},
        {ShortClip(), Words("-readrate 20 -bufferfullsize 1 -draintimeout 1"), 3,
         "nothing was stored: all "},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.says);
        fs::remove(dir + "/log.txt");
        auto r =
            RunProcess(RecorderArgs(c.input, dir, Args{"-endpoint", endpoint} + c.extra), 60000);
        EXPECT_EQ(r.exitStatus, c.status);
        const std::string log = ReadFile(dir + "/log.txt");
        EXPECT_NE(log.find(c.says), std::string::npos) << log.substr(0, 5000);
        EXPECT_EQ(log.find("Initialize Error.") != std::string::npos, c.status == 1);
    }
    EXPECT_NE(ReadFile(dir + "/log.txt").find("files were given up (last error: FilePathError)"),
              std::string::npos);
}

// A secret the server refuses: the stores' pacing and the host's paced token answers keep the
// PUTs, token requests and log lines few, however long it lasts (here 12 s of live-paced input;
// without pacing it was hundreds of each per second).
TEST(EndToEndTest, RefusedSecretMakesNoStormOfRequestsOrLogLines) {
    using testsupport::ScriptedHttpServer;
    ScriptedHttpServer server(ScriptedHttpServer::Mode::kRespond,
                              testsupport::S3ErrorAnswer("403 Forbidden", "SignatureDoesNotMatch"));
    const std::string dir = Scratch("storm");
    const int seconds = 12;
    auto r = RunProcess(Words("env AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=wrong "
                              "AWS_SESSION_TOKEN=token") +
                            RecorderArgs(Clip("e2e_12s.ts", seconds, kX264Gop30), dir,
                                         {"-draintimeout", "1", "-bufferfullsize", "10",
                                          "-endpoint", server.Endpoint()}),
                        120000);
    const std::string log = ReadFile(dir + "/log.txt");
    EXPECT_EQ(r.exitStatus, 0) << log.substr(0, 3000);
    const Notified status = ReadStatus(dir + "/status.jsonl");
    // Per second of input at most about two PUTs, one token request and 3 KB of log.
    EXPECT_LE(server.Connections(), 2 * seconds);
    EXPECT_GE(server.Connections(), 2);
    EXPECT_LE(status.tokenRequests, static_cast<size_t>(seconds));
    EXPECT_LT(log.size(), 3000u * seconds);
    std::cout << "refused secret, " << seconds << " s: " << server.Connections() << " PUTs, "
              << status.tokenRequests << " token requests, " << log.size() << " log bytes\n";
}

TEST(EndToEndTest, SourceClockJumpsNeverMakeAGarbageDuration) {
    const std::string clip = ShortClip();
    const std::string dir = Scratch("jumps");
    // The same 4 s three times in one TS: the second two hours later, the third back at 0.
    const std::string later = MediaClip(
        "e2e_short_2h.ts", Args{"-i", clip} + Words("-c copy -output_ts_offset 7200 -f mpegts"));
    ASSERT_FALSE(later.empty());
    const std::string jumpy = Concatenate({clip, later, clip}, dir + "/jumpy.ts");
    // At five times real time a filing tick (500 ms) covers 2.5 s of input, far below the 10 s
    // the input buffer holds, so a busy machine that delays a tick does not overflow it.
    auto r =
        RunProcess(RecorderArgs(jumpy, dir, {"-readrate", "5", "-endpoint", Store(dir)}), 120000);
    const std::string log = ReadFile(dir + "/log.txt");
    ASSERT_EQ(r.exitStatus, 0) << log;
    EXPECT_NE(log.find("jumped by"), std::string::npos);
    Notified status = ReadStatus(dir + "/status.jsonl");
    ASSERT_GE(status.sequence.size(), 6u) << log;
    for (long d : status.durations) EXPECT_LE(d, 2500) << log;
    const auto objects = Objects(dir + "/store/rec");
    for (const auto& object : objects) EXPECT_LT(Duration(object), 2.5);
    EXPECT_LT(Duration(Concatenate(objects, dir + "/all.ts")), 13.0);
}

}  // namespace
