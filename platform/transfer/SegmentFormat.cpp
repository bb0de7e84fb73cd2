#include "platform/transfer/SegmentFormat.h"

namespace {

const SegmentFormat* const* Formats() {
    static const SegmentFormat ts{
        "ts",
        "MPEG-TS",
        "mpegts",
        ".ts",
        "video/mp2t",
        {"aac", "aac_latm", "mp2", "mp3", "ac3", "eac3", "dts", "truehd", "opus", "s302m"},
        "",
        true,
        true,
        "",
        ""};
    // Fragmented MP4 (CMAF): every object a run of fragments that each begin with a key frame,
    // times absolute (baseMediaDecodeTime of the run, no edit list), so that the objects of a run
    // follow each other behind one init segment as HLS needs it.
    static const SegmentFormat fmp4{
        "fmp4",
        "fragmented MP4",
        "mp4",
        ".m4s",
        "video/iso.segment",
        {"aac", "mp3", "ac3", "eac3"},
        "movflags=frag_keyframe+empty_moov+default_base_moof+frag_discont+skip_trailer:"
        "use_editlist=0",
        false,
        false,
        "_init.mp4",
        "video/mp4"};
    static const SegmentFormat* const formats[] = {&ts, &fmp4, nullptr};
    return formats;
}

}  // namespace

size_t SegmentFormat::FirstFragment(const uint8_t* bytes, size_t size) {
    size_t at = 0;
    while (size - at >= 8) {
        uint64_t boxSize = (uint64_t{bytes[at]} << 24) | (uint64_t{bytes[at + 1]} << 16) |
                           (uint64_t{bytes[at + 2]} << 8) | bytes[at + 3];
        if (bytes[at + 4] == 'm' && bytes[at + 5] == 'o' && bytes[at + 6] == 'o' &&
            bytes[at + 7] == 'f')
            return at;
        if (boxSize < 8 || boxSize > size - at) return 0;  // 64-bit sizes never precede a moof
        at += boxSize;
    }
    return 0;
}

const SegmentFormat& SegmentFormat::Ts() {
    return *Formats()[0];
}

const SegmentFormat* SegmentFormat::Find(const std::string& name) {
    for (const SegmentFormat* const* format = Formats(); *format; ++format)
        if ((*format)->name == name) return *format;
    return nullptr;
}

std::string SegmentFormat::Names() {
    std::string names;
    for (const SegmentFormat* const* format = Formats(); *format; ++format)
        names += (names.empty() ? "\"" : ", \"") + (*format)->name + "\"";
    return names;
}
