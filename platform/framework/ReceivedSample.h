// ReceivedSample: one media sample as the framework delivers it.
//
// Holds the 96-byte little-endian attribute block, the payload (never copied: the bytes belong
// to `owner`, e.g. FFmpeg's reference-counted packet buffer) and a shared pointer to the
// description of its track. Immutable after construction, so any thread may read it.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

// What a sample's track is, for the components that write the samples out again.
struct TrackDescription {
    enum class Kind { Video, Audio, Meta };
    Kind kind = Kind::Video;
    std::string codecName;                        // FFmpeg codec name, e.g. "h264", "hevc", "aac"
    int trackIndex = 0;                           // index of the track in the input
    uint32_t clockRate = 90000;                   // media clock of rtpTime and attribute2, Hz
    std::shared_ptr<const void> codecParameters;  // AVCodecParameters*, owned; may be empty
};

// The attribute block's fields by name; Encode() lays them out at the byte positions that
// StreamData reads (little-endian).
struct SampleAttributes {
    uint64_t rtpTime = 0;             // bytes 0..7: presentation time in the track's media clock
    uint64_t timestamp = 0;           // bytes 8..15: decode time, ms, one clock for all tracks
    uint32_t attribute4 = 0;          // bytes 24..27: track index
    uint32_t attribute5 = 0;          // bytes 28..31: media clock rate, Hz
    bool attribute6 = true;           // byte 32
    uint64_t attribute3[2] = {0, 0};  // bytes 48..63
    uint64_t attribute1 = 0;          // bytes 64..71: capture time, µs since the Unix epoch
    uint64_t attribute2 = 0;          // bytes 72..79: decode time in the media clock
    uint64_t payloadSize = 0;         // bytes 80..87
    uint64_t attribute7 = 0;          // bytes 88..95: packet number within the track

    // Byte positions of the fields in the block, the one place both the writer (Encode) and
    // the reader (StreamData) take them from.
    struct At {
        static constexpr size_t kRtpTime = 0, kTimestamp = 8, kAttribute4 = 24, kAttribute5 = 28,
                                kAttribute6 = 32, kAttribute3 = 48, kAttribute1 = 64,
                                kAttribute2 = 72, kPayloadSize = 80, kAttribute7 = 88;
    };

    using Block = std::array<uint8_t, 96>;
    Block Encode() const;
};

class ReceivedSample {
  public:
    static constexpr size_t kAttributeBlockSize = 96;

    // `data`/`size` must stay valid as long as `owner` lives.
    ReceivedSample(const SampleAttributes::Block& attributes, const uint8_t* data, size_t size,
                   std::shared_ptr<const void> owner,
                   std::shared_ptr<const TrackDescription> track);

    const uint8_t* Attributes() const { return attributes_.data(); }
    const uint8_t* Data() const { return data_; }
    size_t Size() const { return size_; }
    const std::shared_ptr<const TrackDescription>& Track() const { return track_; }

    // Reads the little-endian values of the attribute block.
    uint64_t ReadU64(size_t offset) const;
    uint32_t ReadU32(size_t offset) const;

  private:
    SampleAttributes::Block attributes_;
    const uint8_t* data_;
    size_t size_;
    std::shared_ptr<const void> owner_;  // keeps data_ alive
    std::shared_ptr<const TrackDescription> track_;
};

// Builds a sample whose payload is a copy of `payload` owned by the sample (for hosts and
// tests that do not have a reference-counted buffer of their own).
std::shared_ptr<ReceivedSample> MakeReceivedSample(SampleAttributes attributes, std::string payload,
                                                   std::shared_ptr<const TrackDescription> track);
