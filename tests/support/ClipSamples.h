// ClipSamples: a media file turned into the samples a media host would deliver. Video goes
// through the *_mp4toannexb filters; the attribute block is filled as the framework does
// (rtpTime = pts, attribute2 = dts in the track's clock, timestamp = decode ms since the first
// packet, never decreasing; attribute1 = capture µs; attribute4 track index, attribute5 clock
// rate, attribute7 packet number). Tracks as the host picks them: the first H.264/H.265, the
// first audio, the first data or subtitle stream.
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
