// SegmentWriter: turns the samples of one stream file into one object of a segment format
// (MPEG-TS, fragmented MP4) in memory. For fragmented MP4 the object begins with the format's
// header (ftyp, moov), the same for every object of a run with the same tracks; the caller cuts
// it off (SegmentFormat::FirstFragment). AAC in ADTS goes in raw where the format wants it so.
//
// One writer serves one run of a transfer object (one connection): every Write opens a fresh
// libavformat muxer of its format over a custom AVIOContext that appends to the caller's buffer,
// and every timestamp of the run gets the same constant offset, chosen at the first Write that
// has samples. Objects are therefore never shifted on their own: written one after the other, or
// concatenated, they play as one stream.
//
// Sample contract (what the media host puts into the attribute block):
//   rtpTime     presentation time in the track's media clock
//   attribute2  decode time in the track's media clock
//   attribute5  the media clock rate in Hz (0: the track description's clockRate; without
//               either, 90 kHz for video and meta, and audio is unusable)
// Both times are read as signed 64-bit values, so a host may hand over the negative start times
// of MP4 input (AAC priming, B-frame delay) in two's complement. Each sample's track comes from
// `source->Track()`: its codecParameters (an AVCodecParameters*) when present, else the codec
// named by codecName. Video payloads are Annex B access units (H.264 or H.265).
//
// Payloads are read in place through StreamData::source and handed to the muxer without a copy
// of our own: the packets are not reference counted, so they go through av_write_frame (which
// never takes ownership) in an order this class interleaves itself, by decode time. The muxer
// still copies bytes into 188-byte TS packets (and prepends an access unit delimiter to video
// that lacks one), which is the format's nature.
//
// Samples the muxer cannot take are left out and counted instead of failing the whole object:
// a decode time that does not increase within its track (video, audio) or decreases (meta), a
// presentation time before the decode time, a time before the run's origin, an empty or
// oversized payload. Audio whose codec the format does not carry is left out of every object
// (logged once per run).
//
// Threads: not thread-safe; one thread (the transfer's caller) uses a writer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/framework/StreamData.h"
#include "platform/transfer/SegmentFormat.h"

class SegmentWriter {
  public:
    // What one Write did.
    struct Report {
        size_t written = 0;  // samples in the object
        size_t dropped = 0;  // samples left out (see the class comment)
    };

    explicit SegmentWriter(const SegmentFormat& format = SegmentFormat::Ts()) : format_(format) {}
    SegmentWriter(const SegmentWriter&) = delete;
    SegmentWriter& operator=(const SegmentWriter&) = delete;

    // Writes one object from the three lists (each oldest first) into `out` (cleared first; its
    // capacity is reused). Returns false with a reason in `error` when no usable object could
    // be made: no sample could be written, a track cannot be set up, or the muxer failed.
    // Lists that are all empty give false too; callers decide before calling what a gap means.
    bool Write(const std::vector<StreamData>& video, const std::vector<StreamData>& audio,
               const std::vector<StreamData>& meta, std::vector<uint8_t>* out, Report* report,
               std::string* error);

    // The run's offset in 90 kHz ticks, added to every time; valid once a Write had samples.
    bool HasOffset() const { return hasOffset_; }
    int64_t Offset90k() const { return offset90k_; }

    // Where the run's earliest decode time lands, in 90 kHz ticks (10 s): room for tracks that
    // begin a little before the first object's first sample.
    static constexpr int64_t kRunOrigin90k = 900000;

  private:
    const SegmentFormat& format_;  // a process-wide constant
    bool hasOffset_ = false;
    int64_t offset90k_ = 0;
    bool audioRefusalLogged_ = false;  // the "audio left out" line is written once per run
    bool metaRefusalLogged_ = false;   // so is the "metadata left out" line
};
