// MediaInput: one opening of the host's input with libavformat.
//
// Open demuxes the input's header, picks the tracks the module gets (video: the first H.264 or
// H.265 stream; audio: the first audio stream; meta: the first data or subtitle stream; every
// other stream is discarded with one log line) and sets up the Annex B filter for the video
// (h264_mp4toannexb / hevc_mp4toannexb: MP4, MKV and FLV framing become start codes with the
// parameter sets in band before each IDR; Annex B input passes through unchanged). Read then
// hands out one packet at a time, as FFmpeg's reference-counted packet: the bytes are never
// copied.
//
// Blocking: Open and Read block inside libavformat. They return early when the StopSignal is
// raised, and, for a live input, when the input stays silent for kSilenceTimeout (libavformat's
// interrupt callback checks both; the callback itself is cheap and never sleeps).
//
// Threads: one thread (the host's receive thread, or the message thread before that thread
// starts) uses an instance. The StopSignal may be raised from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/framework/ReceivedSample.h"
#include "platform/framework/SampleClock.h"
#include "platform/framework/StopSignal.h"

struct AVPacket;
struct AVStream;

class MediaInput {
  public:
    // A live input that delivers no packet for this long is given up (and reopened).
    static constexpr std::chrono::seconds kSilenceTimeout{10};

    // One packet of a selected track, with the source's times in µs.
    struct Packet {
        SampleClock::Track track = SampleClock::kVideo;
        std::shared_ptr<const TrackDescription> description;
        const uint8_t* data = nullptr;  // valid while `owner` lives
        size_t size = 0;
        std::shared_ptr<const void> owner;  // the AVPacket that holds the bytes
        bool hasPts = false;
        bool hasDts = false;
        int64_t ptsUs = 0;
        int64_t dtsUs = 0;
        int64_t durationUs = 0;  // 0 unknown
    };

    enum class Status {
        kPacket,   // *packet is filled
        kEnd,      // the input ended
        kFailed,   // a read error or silence; *error says which
        kStopped,  // the StopSignal was raised
    };

    // `url`: a path or any URL libavformat opens. `live` inputs have the silence timeout.
    MediaInput(std::string url, bool live, StopSignal& stop);
    ~MediaInput();
    MediaInput(const MediaInput&) = delete;
    MediaInput& operator=(const MediaInput&) = delete;

    // Opens the input and selects the tracks. False with a plain reason in `error` when it
    // cannot be opened, or has no H.264/H.265 video.
    bool Open(std::string* error);
    Status Read(Packet* packet, std::string* error);

    // The video's codec as people write it, "H.264" or "H.265"; valid after a successful Open.
    const char* VideoCodec() const;

    // When the input began, µs since the Unix epoch: the source's own real start time when it
    // gives one (RTSP with RTCP sender reports), else the wall clock at Open.
    int64_t RealStartMicros() const { return realStartMicros_; }

    // A file (no URL scheme, or file:) is not live; every other URL is.
    static bool IsLive(const std::string& url);
    // The URL with its user information and query secrets masked (SecretMask.h), for messages.
    static std::string Redacted(const std::string& url);

  private:
    struct State;  // the FFmpeg objects
    static int interrupted(void* opaque);
    void armSilenceDeadline();

    // Steps of Open, in order; each false with the reason in `error`. `shown` is the URL as
    // log lines and errors may show it.
    bool allocate(std::string* error);
    bool openDemuxer(const std::string& shown, std::string* error);
    bool selectTracks(const std::string& shown, std::string* error);
    bool selectTrack(unsigned index, SampleClock::Track role, std::string* error);
    bool setUpAnnexBFilter(const AVStream& stream, std::string* error);

    // Steps of Read. Each returns kPacket to go on, with `*out` the next packet (owned by the
    // caller) or left null when this step yielded none; any other status ends the Read.
    Status takeFiltered(AVPacket** out, std::string* error);
    Status takeDemuxed(SampleClock::Track* role, AVPacket** out, std::string* error);
    // Hands `out` over to `packet` (which then owns it); false when it holds no bytes.
    bool fill(Packet* packet, SampleClock::Track role, AVPacket* out);

    std::string url_;
    bool live_;
    StopSignal& stop_;
    std::unique_ptr<State> state_;
    int64_t realStartMicros_ = 0;
    // steady_clock nanoseconds after which a blocking call gives up; 0 none. Read by the
    // interrupt callback on the same thread, atomic only to keep the callback trivially safe.
    std::atomic<int64_t> deadlineNs_{0};
};
