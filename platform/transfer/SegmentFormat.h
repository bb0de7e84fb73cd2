// SegmentFormat: what a stored object is made of (MPEG-TS, or fragmented MP4 as CMAF with an
// init segment per run), and what follows from that: the libavformat
// muxer that writes it, the key's extension, the Content-Type it is served with, and which audio
// codecs its readers recognise.
//
// The formats are constants that live for the whole process; callers hold plain pointers or
// references to them. Safe from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

struct SegmentFormat {
    std::string name;         // the -segmentformat value: "ts", "fmp4"
    std::string title;        // for log lines: "MPEG-TS"
    std::string muxer;        // libavformat's muxer name: "mpegts"
    std::string extension;    // ends every object key: ".ts"
    std::string contentType;  // Content-Type of the stored object: "video/mp2t"
    // FFmpeg codec names of the audio the format carries with a type its readers recognise;
    // other audio is left out of the objects.
    std::vector<std::string> audioCodecs;
    // libavformat options of the muxer, "key=value:key=value"; "" for none.
    std::string muxerOptions;
    bool carriesMeta = true;  // the meta track travels as a data stream; else it is left out
    bool aacInAdts = true;    // AAC travels with its ADTS headers; else raw (headers cut off)
    // Objects that need the format's header to play: the writer's output begins with that
    // header, which the transfer cuts off and stores once per run as an init segment under the
    // object's key with this ending instead of `extension`. "" when objects stand alone (TS).
    std::string initExtension;
    std::string initContentType;

    // Where the objects' media begins after the header (the first top-level "moof" box of
    // fragmented MP4); 0 when `bytes` holds none.
    static size_t FirstFragment(const uint8_t* bytes, size_t size);

    // MPEG-TS, the default.
    static const SegmentFormat& Ts();
    // The format named `name` (case-sensitive); null when there is none.
    static const SegmentFormat* Find(const std::string& name);
    // The names Find knows, for messages: "\"ts\"".
    static std::string Names();
};
