// Recordings played back through their playlists by the ffmpeg CLI, as a viewer would: the
// frames that come out of live.m3u8 and of the hour's playlist are exactly the stored objects'
// frames (MPEG-TS and fragmented MP4), and an input that was opened again shows as a
// discontinuity.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

#include "tests/support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using testsupport::BuildPath;
using testsupport::ReadFile;
using testsupport::RunProcess;
using testsupport::Words;
using Args = std::vector<std::string>;

Args operator+(Args a, const Args& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// A fresh directory under the build tree with a local store (bucket "rec") in it.
std::string Scratch(const std::string& name) {
    std::string dir = BuildPath("playback/" + name + "-" + std::to_string(getpid()));
    fs::remove_all(dir);
    fs::create_directories(dir + "/store/rec");
    return dir;
}

Args Recorder(const std::string& input, const std::string& dir, const Args& extra) {
    return Args{BuildPath("stream-file-recorder"), "-input", input, "-streamingid", "cam1"} +
           Words(
               "-uploadinterval 1 -bufferfullsize 100 -authretrytime 3000 -kct h264 "
               "-bucketname rec") +
           Args{"-endpoint", "file://" + dir + "/store",
                "-status",   dir + "/status.jsonl",
                "-logfile",  dir + "/log.txt"} +
           extra;
}

// `seconds` of 30 fps test pattern with a 48 kHz AAC tone, an IDR every second.
std::string Clip(int seconds) {
    const std::string length = "duration=" + std::to_string(seconds);
    return testsupport::MediaClip(
        "playback_" + std::to_string(seconds) + "s.ts",
        Words("-f lavfi -i testsrc2=size=320x240:rate=30:" + length +
              " -f lavfi -i sine=frequency=440:sample_rate=48000:" + length +
              " -pix_fmt yuv420p -c:a aac -b:a 64k -c:v libx264 -preset ultrafast -g 30 "
              "-keyint_min 30 -sc_threshold 0 -bf 0"));
}

// The stored files whose names match `pattern`, in the order of their sequence numbers.
std::vector<std::string> Stored(const std::string& dir, const std::string& pattern) {
    std::vector<std::pair<long, std::string>> found;
    const std::regex name(".*_([0-9]+)" + pattern);
    for (const auto& entry : fs::recursive_directory_iterator(dir + "/store/rec")) {
        std::smatch m;
        const std::string path = entry.path().string();
        if (entry.is_regular_file() && std::regex_match(path, m, name))
            found.emplace_back(std::stol(m[1]), path);
    }
    std::sort(found.begin(), found.end());
    std::vector<std::string> paths;
    for (auto& f : found) paths.push_back(f.second);
    return paths;
}

std::string Concatenate(const std::vector<std::string>& files, const std::string& out) {
    std::ofstream o(out, std::ios::binary);
    for (const auto& file : files) o << ReadFile(file);
    return out;
}

// The MD5 of every decoded video frame of `input` (a file or a playlist), in output order. A
// playlist without #EXT-X-ENDLIST is read from its first entry and given up once reloads
// bring nothing new.
std::vector<std::string> FrameHashes(const std::string& input) {
    const Args playlist = Words("-live_start_index 0 -m3u8_hold_counters 2");
    const bool m3u8 = input.size() > 5 && input.substr(input.size() - 5) == ".m3u8";
    auto r = RunProcess(Words("ffmpeg -v error") + (m3u8 ? playlist : Args{}) + Args{"-i", input} +
                            Words("-map 0:v -fps_mode passthrough -f framemd5 -"),
                        120000);
    std::istringstream in(r.output);
    std::vector<std::string> hashes;
    for (std::string line; std::getline(in, line);)
        if (!line.empty() && line[0] != '#') hashes.push_back(line.substr(line.rfind(' ') + 1));
    return hashes;
}

size_t Count(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
    return n;
}

// The hour playlists of the recording (one unless the run crossed an hour).
std::vector<std::string> HourPlaylists(const std::string& dir) {
    std::vector<std::string> found;
    for (const auto& entry : fs::recursive_directory_iterator(dir + "/store/rec/cam1")) {
        const std::string path = entry.path().string();
        if (std::regex_match(path, std::regex(".*/[0-9]{4}/[0-9]{2}/[0-9]{2}/[0-9]{2}\\.m3u8")))
            found.push_back(path);
    }
    std::sort(found.begin(), found.end());
    return found;
}

// Each object format: the run's objects (behind the run's one init segment for fragmented MP4)
// decode to the same frames as the playlists.
TEST(PlaybackTest, RecordedRunPlaysThroughItsPlaylists) {
    const std::string clip = Clip(5);
    ASSERT_FALSE(clip.empty());
    for (const std::string format : {"ts", "fmp4"}) {
        SCOPED_TRACE(format);
        const std::string dir = Scratch(format);
        auto r = RunProcess(Recorder(clip, dir, Args{"-readrate", "5", "-segmentformat", format}),
                            120000);
        ASSERT_EQ(r.exitStatus, 0) << r.output << ReadFile(dir + "/log.txt");

        const auto objects = Stored(dir, format == "ts" ? "\\.ts" : "\\.m4s");
        const auto inits = Stored(dir, "_init\\.mp4");
        ASSERT_GE(objects.size(), 3u);
        ASSERT_EQ(inits.size(), format == "ts" ? 0u : 1u);
        const std::string live = dir + "/store/rec/cam1/live.m3u8";
        const std::string text = ReadFile(live);
        EXPECT_EQ(Count(text, "#EXTINF:"), objects.size()) << text;
        EXPECT_EQ(Count(text, "#EXT-X-DISCONTINUITY"), 0u) << text;
        EXPECT_EQ(Count(text, "#EXT-X-PROGRAM-DATE-TIME:"), objects.size()) << text;
        EXPECT_EQ(Count(text, "#EXT-X-MAP:URI="), inits.size()) << text;

        std::vector<std::string> files = inits;
        files.insert(files.end(), objects.begin(), objects.end());
        const auto stored = FrameHashes(Concatenate(files, dir + "/all." + format));
        ASSERT_GT(stored.size(), 60u);
        EXPECT_EQ(FrameHashes(live), stored);
        std::vector<std::string> hours;
        for (const auto& hour : HourPlaylists(dir)) {
            const auto frames = FrameHashes(hour);
            hours.insert(hours.end(), frames.begin(), frames.end());
        }
        EXPECT_EQ(hours, stored);
    }
}

TEST(PlaybackTest, InputOpenedAgainIsADiscontinuity) {
    const std::string clip = Clip(3);
    ASSERT_FALSE(clip.empty());
    const std::string dir = Scratch("reopen");
    const std::string url = "udp://127.0.0.1:" + std::to_string(testsupport::FreePort(SOCK_DGRAM));
    const Args sender = Words("ffmpeg -v error -re -i") + Args{clip} + Words("-c copy -f mpegts") +
                        Args{url + "?pkt_size=1316"};
    // Ends by itself 5 s of input in: 3 s of the first sending and 2 s of the second.
    testsupport::ChildProcess recorder(Recorder(url, dir, Words("-duration 5")),
                                       dir + "/output.txt");
    EXPECT_EQ(testsupport::ChildProcess(sender).Wait(60000), 0);
    ASSERT_TRUE(testsupport::WaitUntil(
        [&] { return ReadFile(dir + "/log.txt").find("reopening in") != std::string::npos; },
        60000));
    testsupport::ChildProcess second(sender);
    ASSERT_EQ(recorder.Wait(90000), 0) << ReadFile(dir + "/log.txt");

    const std::string live = dir + "/store/rec/cam1/live.m3u8";
    const std::string text = ReadFile(live);
    EXPECT_EQ(Count(text, "#EXT-X-DISCONTINUITY\n"), 1u) << text;
    const auto stored = FrameHashes(Concatenate(Stored(dir, "\\.ts"), dir + "/all.ts"));
    ASSERT_GT(stored.size(), 60u);
    EXPECT_EQ(FrameHashes(live), stored);
}

}  // namespace
