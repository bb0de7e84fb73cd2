// SampleClock: the one clock that the media host puts on every track of an input.
//
// Sources are not always sound: packets come without timestamps (RTSP's first packets), a
// 33-bit MPEG-TS clock wraps, a camera restarts its clock after a reconnect, a file is spliced.
// The clock turns the source's decode and presentation times into times on a shared timeline,
// in microseconds since the input's first packet, that the recorder can cut on:
//   - a packet without any timestamp is dropped (counted; the first one is logged);
//   - a packet with only one of pts/dts uses it for both;
//   - within a track, the decode time never decreases;
//   - a jump of the source's clock backwards (any amount) or forwards by more than
//     kMaxForwardJumpUs beyond the newest time of any track is re-based: the track goes on
//     one packet step after the newest time of any track, with one log line per jump. The other
//     tracks take the same new offset when it fits them (one jump of the source is one log line,
//     not one per track), else they re-base on their own.
// Presentation times move with their decode times, so B-frame reordering is kept.
//
// The clock lives as long as the host's input, across reopenings of a live input, so that a
// reconnect continues the timeline instead of restarting it.
//
// Threads: not thread-safe; the host's receive thread owns it. Only Rebases may be read on any
// thread (for monitoring).
#pragma once

#include <atomic>
#include <cstdint>

class SampleClock {
  public:
    // Tracks as the host selects them.
    enum Track { kVideo = 0, kAudio = 1, kMeta = 2, kTrackCount = 3 };

    // A forward step of the source's clock larger than this (beyond the newest time seen on
    // any track) is a jump, not a gap in the media.
    static constexpr int64_t kMaxForwardJumpUs = 10 * 1000 * 1000;

    // One packet's times on the shared clock, µs since the input's first packet. Negative for
    // packets that begin before the first one read (MP4 B-frame delay, AAC priming).
    struct Times {
        int64_t ptsUs = 0;
        int64_t dtsUs = 0;
    };

    // The source's times of one packet in µs of the source's clock; `hasPts`/`hasDts` false
    // when the container gave none. `durationUs` is the packet's duration when known, else 0.
    // False: the packet has no timestamp and must be dropped.
    bool Place(Track track, bool hasPts, int64_t ptsUs, bool hasDts, int64_t dtsUs,
               int64_t durationUs, Times* out);

    // The newest decode time handed out on any track (µs since the first packet); 0 before the
    // first packet.
    int64_t NewestUs() const { return newestUs_; }
    uint64_t DroppedWithoutTimestamp() const { return dropped_; }
    uint64_t Rebases() const { return rebases_.load(std::memory_order_relaxed); }

  private:
    struct TrackState {
        bool started = false;
        int64_t offsetUs = 0;   // added to the source's times of this track
        int64_t lastDtsUs = 0;  // newest decode time handed out, shared clock
        int64_t stepUs = 0;     // typical distance between two packets; 0 unknown
    };

    bool fits(const TrackState& state, int64_t dtsUs) const;

    bool haveOrigin_ = false;
    int64_t epochOffsetUs_ = 0;  // the offset of the newest re-basing (or of the origin)
    int64_t newestUs_ = 0;
    uint64_t dropped_ = 0;
    std::atomic<uint64_t> rebases_{0};  // relaxed: a count, orders nothing
    TrackState tracks_[kTrackCount];
};
