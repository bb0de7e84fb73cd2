// Recordings played back through their playlists by the ffmpeg CLI, as a viewer would: the
// frames that come out of live.m3u8 and of the hour's playlist are exactly the stored objects'
// frames, MPEG-TS and fragmented MP4. (An input opened again as a discontinuity: EndToEndTest.)
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <regex>

#include "tests/support/TestSupport.h"

namespace {

using namespace testsupport;

// Each object format: the run's objects (behind the run's one init segment for fragmented MP4)
// decode to the same frames as the playlists.
TEST(PlaybackTest, RecordedRunPlaysThroughItsPlaylists) {
    const std::string clip = TestClip("clip_5s.ts", 5);
    ASSERT_FALSE(clip.empty());
    for (const std::string format : {"ts", "fmp4"}) {
        SCOPED_TRACE(format);
        const std::string dir = ScratchDir("playback-" + format);
        auto r = RunProcess(
            Recorder(clip, dir,
                     {"-readrate", "5", "-segmentformat", format, "-endpoint", LocalStore(dir)}),
            120000);
        ASSERT_EQ(r.exitStatus, 0) << r.output << ReadFile(dir + "/log.txt");

        const std::string rec = dir + "/store/rec";
        const auto objects = StoredFiles(rec, format == "ts" ? ".ts" : ".m4s");
        const auto inits = StoredFiles(rec, "_init.mp4");
        ASSERT_GE(objects.size(), 3u);
        ASSERT_EQ(inits.size(), format == "ts" ? 0u : 1u);
        const std::string live = rec + "/cam1/live.m3u8";
        const std::string text = ReadFile(live);
        EXPECT_EQ(CountOf(text, "#EXTINF:"), objects.size()) << text;
        EXPECT_EQ(CountOf(text, "#EXT-X-DISCONTINUITY"), 0u) << text;
        EXPECT_EQ(CountOf(text, "#EXT-X-PROGRAM-DATE-TIME:"), objects.size()) << text;
        EXPECT_EQ(CountOf(text, "#EXT-X-MAP:URI="), inits.size()) << text;

        std::vector<std::string> files = inits;
        files.insert(files.end(), objects.begin(), objects.end());
        const auto stored = FrameHashes(Concatenate(files, dir + "/all." + format));
        ASSERT_GT(stored.size(), 60u);
        EXPECT_EQ(FrameHashes(live), stored);
        // The hour playlists (one unless the run crossed an hour), in order.
        std::vector<std::string> hours, frames;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(rec + "/cam1"))
            if (std::regex_match(entry.path().string(), std::regex(".*/[0-9]{2}\\.m3u8")))
                hours.push_back(entry.path().string());
        std::sort(hours.begin(), hours.end());
        for (const auto& hour : hours) {
            const auto more = FrameHashes(hour);
            frames.insert(frames.end(), more.begin(), more.end());
        }
        EXPECT_EQ(frames, stored);
    }
}

}  // namespace
