// ClipSamples: a media file turned into the samples a media host would deliver, for tests that
// need real video, audio and meta payloads.
//
// LoadClipSamples demuxes with libavformat, puts H.264/H.265 through the *_mp4toannexb filters
// (parameter sets in band before each IDR) and fills each sample's attribute block as the
// framework does: rtpTime = pts and attribute2 = dts in the track's media clock (90 kHz for video
// and meta, the sample rate for audio; negative values of MP4 input are kept in two's
// complement), timestamp = decode time in ms since the first packet (never decreasing within a
// track), attribute1 = capture time in µs since the epoch (`captureStartMicros` plus the decode
// time since the first packet), attribute4 = track index, attribute5 = clock rate,
// attribute6 = true, attribute7 = packet number within the track. The payload is the packet's
// own reference-counted buffer (owned by the ReceivedSample); each track's TrackDescription
// carries a copy of its AVCodecParameters (for video: the Annex B filter's output parameters).
//
// Tracks, as the host picks them: the first H.264/H.265 stream, the first audio stream, the first
// data or subtitle stream.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/framework/StreamData.h"
#include "platform/transfer/FileTransfer.h"

namespace testsupport {

struct ClipSamples {
    std::vector<StreamData> video;  // decode order
    std::vector<StreamData> audio;
    std::vector<StreamData> meta;
    std::shared_ptr<const TrackDescription> videoTrack;  // null when the clip has no such track
    std::shared_ptr<const TrackDescription> audioTrack;
    std::shared_ptr<const TrackDescription> metaTrack;
};

// 2026-12-06T11:00:00Z in µs since the epoch.
constexpr uint64_t kClipCaptureStart = 1796554800000000ull;

// Reads the whole of `path`. False with a reason in `error` when it cannot be read.
bool LoadClipSamples(const std::string& path, ClipSamples* clip, std::string* error,
                     uint64_t captureStartMicros = kClipCaptureStart);

// Decode times (`timestamp`, ms) of the clip's IDR video samples, in order.
std::vector<uint64_t> IdrTimes(const ClipSamples& clip);

// A request with every sample whose timestamp is in [fromMs, toMs), as the recorder's cut
// makes them: streamingId "cam1", bucket "rec", the given sequence number, duration to - from.
FileTransferRequest ClipRequest(const ClipSamples& clip, uint64_t fromMs, uint64_t toMs,
                                int64_t sequenceNumber);

// Makes (once, cached beside MediaClip's clips) an MPEG-TS copy of `source` with one more
// track: timed ID3 metadata (a TXXX frame) every `periodMs` along the video. The ffmpeg CLI
// cannot make a data track from lavfi sources, so this muxes one with libavformat. Returns the
// path; empty on failure.
std::string ClipWithId3(const std::string& source, const std::string& fileName, int periodMs = 500);

}  // namespace testsupport
