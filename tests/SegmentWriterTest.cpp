// The TS objects of real clips (H.264 with and without B-frames, H.265; with and without a timed
// ID3 track) and of hand-made samples. Faults guarded: an object ffprobe or ffmpeg cannot read,
// a stream missing or of the wrong codec; a frame lost or altered, or presentation times shifted
// across two consecutive objects; samples the muxer refuses stored as an object or reported as
// anything but FileBroken; Cancel not ending every later transfer; audio that TS cannot carry
// failing the object or warned of more than once; object events missing or after the end of a
// subscription; keys and metadata not named after the first sample's capture time.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
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

// The non-empty lines of `command`'s output.
std::vector<std::string> Lines(const std::vector<std::string>& command) {
    std::vector<std::string> lines;
    std::istringstream in(RunProcess(command).output);
    for (std::string line; std::getline(in, line);)
        if (!line.empty()) lines.push_back(line);
    return lines;
}

// ffprobe's csv lines of `entries` of `path`, of the streams `select` picks ("v", "a", "d").
std::vector<std::string> Probe(const std::string& path, const std::string& entries,
                               const std::string& select = "") {
    std::vector<std::string> command =
        Words("ffprobe -v quiet -of csv=p=0 -show_entries " + entries +
              (select.empty() ? "" : " -select_streams " + select));
    command.push_back(path);
    return Lines(command);
}

// "codec_name,codec_type" of each stream of `path` (ffprobe lists them once per program too).
std::vector<std::string> Streams(const std::string& path) {
    std::vector<std::string> unique;
    for (const std::string& line : Probe(path, "stream=codec_name,codec_type"))
        if (std::find(unique.begin(), unique.end(), line) == unique.end()) unique.push_back(line);
    return unique;
}

// Presentation times of `path`'s packets of one stream type ("v", "a", "d"), in file order.
std::vector<int64_t> PacketPts(const std::string& path, const std::string& type) {
    std::vector<int64_t> pts;
    for (const std::string& line : Probe(path, "packet=pts", type)) pts.push_back(std::stoll(line));
    return pts;
}

// The frame hashes of `path`'s video, in order (the framemd5 lines without their times).
std::vector<std::string> VideoFrameHashes(const std::string& path) {
    std::vector<std::string> hashes;
    for (const std::string& line :
         Lines({"ffmpeg", "-v", "error", "-i", path, "-map", "0:v", "-f", "framemd5", "-"}))
        if (line[0] != '#') hashes.push_back(line.substr(line.rfind(',') + 1));
    return hashes;
}

// A 6 s clip of H.264 with B-frames and IDRs at scene cuts, AAC audio and a timed ID3 track, cut
// at an IDR into two consecutive objects: each probes as the clip's streams, and together they
// decode without a message to exactly the source's frames, times unshifted across the cut.
// (The end-to-end test records H.264 and H.265 clips without a meta track through the binary.)
TEST(SegmentWriterClipTest, ConsecutiveObjectsProbeAndDecodeToTheSourceFrames) {
    const std::string path = ClipWithId3(
        MediaClip("seg_h264_bframes.mp4",
                  Words("-f lavfi -i testsrc2=size=320x240:rate=30:duration=6,negate=enable='lt("
                        "mod(t,3.7),1.3)' -f lavfi -i sine=frequency=440:sample_rate=48000:"
                        "duration=6 -pix_fmt yuv420p -c:v libx264 -preset veryfast -g 90 "
                        "-keyint_min 15 -sc_threshold 40 -bf 3 -b:v 300k -c:a aac -b:a 64k")),
        "seg_h264_bframes.mp4.id3.ts");
    ASSERT_FALSE(path.empty());
    ClipSamples clip;
    std::string error;
    ASSERT_TRUE(LoadClipSamples(path, &clip, &error)) << error;
    ASSERT_TRUE(clip.video.size() > 100 && clip.audio.size() > 100 && clip.meta.size() > 5);
    std::vector<uint64_t> idrs = IdrTimes(clip);
    ASSERT_GE(idrs.size(), 2u);
    const uint64_t cut = idrs[idrs.size() / 2];
    StoreRoot dir;
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir.Root()), "");
    std::string objects;
    for (const auto& request : {ClipRequest(clip, 0, cut, 1), ClipRequest(clip, cut, 1000000, 2)}) {
        FileTransferInfo info;
        EXPECT_EQ(Success, transfer.Transfer(request, &info));
        const std::string object = dir.Path(ObjectKey(
            "", request.streamingId, request.sequenceNumber, FirstCaptureTime(request), ".ts"));
        EXPECT_EQ(ReadFile(object).size(), info.fileSize);
        EXPECT_EQ(Streams(object), Words("h264,video aac,audio timed_id3,data"));
        objects += ReadFile(object);
    }
    const std::string joined = WriteFile(dir.Root() + "/joined.ts", objects);
    ProcessResult decode = RunProcess({"ffmpeg", "-v", "error", "-i", joined, "-f", "null", "-"});
    EXPECT_EQ(0, decode.exitStatus);
    EXPECT_EQ("", decode.output);
    std::vector<std::string> sourceFrames = VideoFrameHashes(path);
    ASSERT_EQ(clip.video.size(), sourceFrames.size());
    EXPECT_EQ(sourceFrames, VideoFrameHashes(joined));
    // Every presentation time keeps its distance to the run's first one, across the cut.
    std::vector<int64_t> pts = PacketPts(joined, "v");
    ASSERT_EQ(clip.video.size(), pts.size());
    const auto sourceStart = static_cast<int64_t>(clip.video[0].rtpTime);
    for (size_t i = 0; i < pts.size(); ++i)
        ASSERT_EQ(static_cast<int64_t>(clip.video[i].rtpTime) - sourceStart, pts[i] - pts[0]) << i;
    std::vector<int64_t> audioPts = PacketPts(joined, "a");
    ASSERT_EQ(clip.audio.size(), audioPts.size());
    EXPECT_TRUE(std::is_sorted(audioPts.begin(), audioPts.end()));
    EXPECT_EQ(clip.meta.size(), PacketPts(joined, "d").size());
}

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

// Subscribers hear of every stream file that got a key, with what became of it.
struct EventLog {
    std::vector<StoredObject> events;
    ObjectEvents::Subscription subscription =
        ObjectEvents::Subscribe([this](const StoredObject& e) { events.push_back(e); });
};

// No samples: nothing stored, success. Samples the muxer refuses: FileBroken. Then Cancel.
TEST(SegmentTransferTest, EmptyAndRefusedRequestsStoreNothingAndCancelEndsEveryLaterTransfer) {
    StoreRoot dir;
    EventLog log;
    SegmentTransfer transfer(std::make_shared<LocalDirectoryStore>(dir.Root()), "");
    auto h264 = Track(TrackDescription::Kind::Video, "h264", 90000);
    auto mpeg4 = Track(TrackDescription::Kind::Video, "mpeg4", 90000);
    FileTransferRequest request = ClipRequest(ClipSamples(), 0, 1, 1);
    FileTransferInfo info;
    info.fileSize = info.responseTime = 99;
    EXPECT_EQ(Success, transfer.Transfer(request, &info));
    EXPECT_EQ(0u, info.fileSize + info.responseTime);
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
    StoreRoot dir;
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
    EXPECT_EQ(1u, log.CountContaining("audio is left out"));
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
