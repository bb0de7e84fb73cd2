#include "platform/transfer/SegmentFormat.h"

namespace {

const SegmentFormat* const* Formats() {
    static const SegmentFormat ts{
        "ts",
        "MPEG-TS",
        "mpegts",
        ".ts",
        "video/mp2t",
        {"aac", "aac_latm", "mp2", "mp3", "ac3", "eac3", "dts", "truehd", "opus", "s302m"}};
    static const SegmentFormat* const formats[] = {&ts, nullptr};
    return formats;
}

}  // namespace

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
