// The TS objects of real clips: what ffprobe and ffmpeg read back, continuity across objects,
// keys, and the results of requests the writer cannot or need not turn into an object.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <fstream>
#include <sstream>

#include "platform/transfer/LocalDirectoryStore.h"
#include "platform/transfer/ObjectKey.h"
#include "platform/transfer/SegmentTransfer.h"
#include "tests/support/ClipSamples.h"
#include "tests/support/LogCapture.h"
#include "tests/support/StoreRoot.h"
#include "tests/support/TestSupport.h"

using namespace testsupport;

namespace {

using StoreDirectory = StoreRoot;

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        if (!line.empty()) lines.push_back(line);
    return lines;
}

// "codec_name,codec_type" of each stream of `path` (ffprobe lists them once per program too).
std::vector<std::string> Streams(const std::string& path) {
    ProcessResult r = RunProcess({"ffprobe", "-v", "quiet", "-show_entries",
                                  "stream=codec_name,codec_type", "-of", "csv=p=0", path});
    std::vector<std::string> unique;
    for (const std::string& line : Lines(r.output))
        if (std::find(unique.begin(), unique.end(), line) == unique.end()) unique.push_back(line);
    return unique;
}

// The frame hashes of `path`'s video, in order (the framemd5 lines without their times).
std::vector<std::string> VideoFrameHashes(const std::string& path) {
    ProcessResult r =
        RunProcess({"ffmpeg", "-v", "error", "-i", path, "-map", "0:v", "-f", "framemd5", "-"});
    std::vector<std::string> hashes;
    for (const std::string& line : Lines(r.output))
        if (line[0] != '#') hashes.push_back(line.substr(line.rfind(',') + 1));
    return hashes;
}

// Presentation times of `path`'s packets of one stream type ("v", "a", "d"), in file order.
std::vector<int64_t> PacketPts(const std::string& path, const std::string& type) {
    ProcessResult r = RunProcess({"ffprobe", "-v", "error", "-select_streams", type,
                                  "-show_entries", "packet=pts", "-of", "csv=p=0", path});
    std::vector<int64_t> pts;
    for (const std::string& line : Lines(r.output)) pts.push_back(std::stoll(line));
    return pts;
}

struct ClipCase {
    const char* name;
    const char* mp4;        // file name of the encoded clip
    std::string videoArgs;  // ffmpeg's video encoding options
    const char* codec;      // what ffprobe must call the video
    bool withMeta;          // read through the TS copy with a timed ID3 track
};

void PrintTo(const ClipCase& c, std::ostream* os) {
    *os << c.name;
}

std::vector<std::string> Words(const std::string& text) {
    std::vector<std::string> words;
    std::istringstream in(text);
    for (std::string word; in >> word;) words.push_back(word);
    return words;
}

std::string MakeClip(const ClipCase& c) {
    const bool bframes = std::string(c.name).find("bframes") != std::string::npos;
    std::vector<std::string> args =
        Words(std::string("-f lavfi -i testsrc2=size=320x240:rate=30:duration=6") +
              (bframes ? ",negate=enable='lt(mod(t,3.7),1.3)'" : "") +
              " -f lavfi -i sine=frequency=440:sample_rate=48000:duration=6 -pix_fmt yuv420p " +
              c.videoArgs + " -c:a aac -b:a 64k");
    std::string mp4 = MediaClip(c.mp4, args);
    if (mp4.empty() || !c.withMeta) return mp4;
    return ClipWithId3(mp4, std::string(c.mp4) + ".id3.ts");
}

const char kH264[] =
    "-c:v libx264 -preset ultrafast -g 60 -keyint_min 60 -sc_threshold 0 -bf 0 -b:v 200k";
const char kH264BFrames[] =
    "-c:v libx264 -preset veryfast -g 90 -keyint_min 15 -sc_threshold 40 -bf 3 -b:v 300k";
const char kH265[] =
    "-c:v libx265 -x265-params "
    "keyint=60:min-keyint=60:scenecut=0:open-gop=0:bframes=0:log-level=error";

class SegmentWriterClipTest : public ::testing::TestWithParam<ClipCase> {
  protected:
    void SetUp() override {
        path_ = MakeClip(GetParam());
        ASSERT_FALSE(path_.empty());
        std::string error;
        ASSERT_TRUE(LoadClipSamples(path_, &clip_, &error)) << error;
        ASSERT_GT(clip_.video.size(), 100u);
        ASSERT_GT(clip_.audio.size(), 100u);
        if (GetParam().withMeta) {
            ASSERT_GT(clip_.meta.size(), 5u);
        }
    }

    // Stores `request` and returns the object's path (empty when nothing was stored).
    std::string Store(SegmentTransfer& transfer, const FileTransferRequest& request) {
        FileTransferInfo info;
        EXPECT_EQ(Success, transfer.Transfer(request, &info));
        std::string key = ObjectKey("", request.streamingId, request.sequenceNumber,
                                    FirstCaptureTime(request), ".ts");
        EXPECT_EQ(ReadFile(dir_.Path(key)).size(), info.fileSize);
        return dir_.Path(key);
    }

    std::string path_;
    ClipSamples clip_;
    StoreDirectory dir_;
};

TEST_P(SegmentWriterClipTest, WholeClipIsOneObjectThatProbesAndDecodes) {
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir_.Root()), "");
    std::string object = Store(transfer, ClipRequest(clip_, 0, 1000000, 1));

    std::vector<std::string> expected = {std::string(GetParam().codec) + ",video", "aac,audio"};
    if (GetParam().withMeta) expected.push_back("timed_id3,data");
    EXPECT_EQ(expected, Streams(object));

    ProcessResult decode = RunProcess({"ffmpeg", "-v", "error", "-i", object, "-f", "null", "-"});
    EXPECT_EQ(0, decode.exitStatus);
    EXPECT_EQ("", decode.output);

    EXPECT_EQ(VideoFrameHashes(path_), VideoFrameHashes(object));
    EXPECT_EQ(clip_.audio.size(), PacketPts(object, "a").size());
    EXPECT_EQ(clip_.meta.size(), PacketPts(object, "d").size());
}

TEST_P(SegmentWriterClipTest, ConsecutiveObjectsConcatenateIntoTheSourceFrames) {
    std::vector<uint64_t> idrs = IdrTimes(clip_);
    ASSERT_GE(idrs.size(), 2u);
    uint64_t cut = idrs[idrs.size() / 2];
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir_.Root()), "");
    std::string first = Store(transfer, ClipRequest(clip_, 0, cut, 1));
    std::string second = Store(transfer, ClipRequest(clip_, cut, 1000000, 2));
    std::string joined = dir_.Root() + "/joined.ts";
    std::ofstream(joined, std::ios::binary) << ReadFile(first) << ReadFile(second);

    std::vector<std::string> sourceFrames = VideoFrameHashes(path_);
    ASSERT_EQ(clip_.video.size(), sourceFrames.size());
    EXPECT_EQ(sourceFrames, VideoFrameHashes(joined));

    // Neither object is shifted on its own: every presentation time keeps its distance to the
    // run's first one, across the cut.
    std::vector<int64_t> pts = PacketPts(joined, "v");
    ASSERT_EQ(clip_.video.size(), pts.size());
    const auto sourceStart = static_cast<int64_t>(clip_.video[0].rtpTime);
    for (size_t i = 0; i < pts.size(); ++i)
        ASSERT_EQ(static_cast<int64_t>(clip_.video[i].rtpTime) - sourceStart, pts[i] - pts[0])
            << "frame " << i;
    std::vector<int64_t> audioPts = PacketPts(joined, "a");
    ASSERT_EQ(clip_.audio.size(), audioPts.size());
    EXPECT_TRUE(std::is_sorted(audioPts.begin(), audioPts.end()));
}

INSTANTIATE_TEST_SUITE_P(
    Clips, SegmentWriterClipTest,
    ::testing::Values(ClipCase{"h264", "seg_h264.mp4", kH264, "h264", true},
                      ClipCase{"h264_mp4", "seg_h264.mp4", kH264, "h264", false},
                      ClipCase{"h264_bframes", "seg_h264_bframes.mp4", kH264BFrames, "h264", true},
                      ClipCase{"hevc", "seg_hevc.mp4", kH265, "hevc", true}),
    [](const ::testing::TestParamInfo<ClipCase>& info) { return std::string(info.param.name); });

std::shared_ptr<TrackDescription> Track(TrackDescription::Kind kind, const std::string& codec,
                                        uint32_t clock) {
    auto track = std::make_shared<TrackDescription>();
    track->kind = kind;
    track->codecName = codec;
    track->clockRate = clock;
    return track;
}

StreamData Sample(const std::shared_ptr<TrackDescription>& track, uint64_t ms, std::string bytes) {
    SampleAttributes a;
    a.timestamp = ms;
    a.rtpTime = a.attribute2 = ms * track->clockRate / 1000;
    a.attribute5 = track->clockRate;
    a.attribute1 = kClipCaptureStart + ms * 1000;
    return StreamData(MakeReceivedSample(a, std::move(bytes), track));
}

TEST(SegmentTransferTest, RequestWithoutSamplesStoresNothing) {
    StoreDirectory dir;
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir.Root()), "");
    FileTransferRequest request = ClipRequest(ClipSamples(), 0, 10000, 3);
    FileTransferInfo info;
    info.fileSize = info.responseTime = 99;
    EXPECT_EQ(Success, transfer.Transfer(request, &info));
    EXPECT_EQ(0u, info.fileSize);
    EXPECT_EQ(0u, info.responseTime);
    EXPECT_TRUE(dir.Files().empty());
}

// Subscribers hear of every stream file that got a key, with what became of it.
struct EventLog {
    std::vector<StoredObject> events;
    ObjectEvents::Subscription subscription =
        ObjectEvents::Subscribe([this](const StoredObject& e) { events.push_back(e); });
};

TEST(SegmentTransferTest, RefusedSamplesAreFileBrokenAndCancelEndsEveryLaterTransfer) {
    StoreDirectory dir;
    EventLog log;
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir.Root()), "");
    auto h264 = Track(TrackDescription::Kind::Video, "h264", 90000);
    auto mpeg4 = Track(TrackDescription::Kind::Video, "mpeg4", 90000);
    FileTransferRequest request = ClipRequest(ClipSamples(), 0, 1, 1);
    // Length-prefixed, not Annex B: the muxer refuses the first access unit.
    request.video = {Sample(h264, 0, std::string("\x00\x00\x00\x09\x65\x88", 6) + "abcd")};
    EXPECT_EQ(FileBroken, transfer.Transfer(request, nullptr));
    request.video = {Sample(mpeg4, 0, H264Idr())};
    EXPECT_EQ(FileBroken, transfer.Transfer(request, nullptr));
    request.video = {Sample(h264, 0, H264Idr())};
    transfer.Cancel();
    EXPECT_EQ(TimeOut, transfer.Transfer(request, nullptr));
    EXPECT_TRUE(dir.Files().empty());
    ASSERT_EQ(2u, log.events.size());
    for (const StoredObject& e : log.events) EXPECT_EQ(FileBroken, e.result);
    EXPECT_EQ(0u, log.events[0].size);
}

TEST(SegmentTransferTest, AudioThatCannotTravelInTsIsLeftOutOnce) {
    StoreDirectory dir;
    LogCapture log;
    EventLog stored;
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir.Root()), "p/");
    auto video = Track(TrackDescription::Kind::Video, "h264", 90000);
    auto pcm = Track(TrackDescription::Kind::Audio, "pcm_s16le", 48000);
    for (int64_t seq = 1; seq <= 3; ++seq) {
        if (seq == 3) stored.subscription.Reset();  // no event after the end of a subscription
        FileTransferRequest request = ClipRequest(ClipSamples(), 0, 1, seq);
        for (uint64_t ms = 0; ms < 200; ms += 40) {
            uint64_t t = (seq - 1) * 200 + ms;
            request.video.push_back(Sample(video, t, ms == 0 ? H264Idr(500) : H264NonIdr(300)));
            request.audio.push_back(Sample(pcm, t, std::string(3840, '\x01')));
        }
        FileTransferInfo info;
        ASSERT_EQ(Success, transfer.Transfer(request, &info));
        EXPECT_GT(info.fileSize, 0u);
    }
    std::vector<std::string> files = dir.Files();
    ASSERT_EQ(3u, files.size());
    EXPECT_EQ(std::vector<std::string>{"h264,video"}, Streams(files[0]));
    ASSERT_EQ(2u, stored.events.size());
    for (int64_t seq = 1; seq <= 2; ++seq) {
        const StoredObject& e = stored.events[seq - 1];
        EXPECT_EQ(seq, e.sequenceNumber);
        EXPECT_EQ(Success, e.result);
        EXPECT_EQ(kClipCaptureStart + (seq - 1) * 200000, e.captureMicros);
        EXPECT_EQ(ReadFile(dir.Path(e.key)).size(), e.size) << e.key;
    }
    size_t refusals = 0;
    for (const auto& r : log.Records())
        refusals += r.message.find("audio is left out") != std::string::npos;
    EXPECT_EQ(1u, refusals);
}

TEST(ObjectKeyTest, KeyAndMetadataFollowTheFirstSamplesCaptureTime) {
    const uint64_t capture = 1796554810012345ull;  // 2026-12-06T11:00:10.012345Z
    EXPECT_EQ("pre/cam1/2026/12/06/cam1_20261206T110010.012Z_7.ts",
              ObjectKey("pre/", "cam1", 7, capture, SegmentFormat::Ts().extension));
    auto metadata = ObjectMetadata("cam\r\n1%", 7, 9966, capture);
    EXPECT_EQ("cam%0D%0A1%25", metadata["streaming-id"]);
    EXPECT_EQ("7", metadata["sequence-number"]);
    EXPECT_EQ("9966", metadata["duration-ms"]);
    EXPECT_EQ("2026-12-06T11:00:10.012Z", metadata["capture-time"]);

    // The earliest capture time among the lists' first samples names the object.
    auto video = Track(TrackDescription::Kind::Video, "h264", 90000);
    auto audio = Track(TrackDescription::Kind::Audio, "aac", 48000);
    FileTransferRequest request;
    request.video.push_back(Sample(video, 40, H264Idr()));
    request.audio.push_back(Sample(audio, 20, "a"));
    request.audio.push_back(Sample(audio, 10, "b"));
    EXPECT_EQ(kClipCaptureStart + 20000, FirstCaptureTime(request));
}

}  // namespace
