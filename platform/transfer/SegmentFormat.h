// SegmentFormat: what a stored object is made of, and what follows from that: the libavformat
// muxer that writes it, the key's extension, the Content-Type it is served with, and which audio
// codecs its readers recognise.
//
// The formats are constants that live for the whole process; callers hold plain pointers or
// references to them. Safe from any thread.
#pragma once

#include <string>
#include <vector>

struct SegmentFormat {
    std::string name;         // the -segmentformat value: "ts"
    std::string title;        // for log lines: "MPEG-TS"
    std::string muxer;        // libavformat's muxer name: "mpegts"
    std::string extension;    // ends every object key: ".ts"
    std::string contentType;  // Content-Type of the stored object: "video/mp2t"
    // FFmpeg codec names of the audio the format carries with a type its readers recognise;
    // other audio is left out of the objects.
    std::vector<std::string> audioCodecs;

    // MPEG-TS, the default.
    static const SegmentFormat& Ts();
    // The format named `name` (case-sensitive); null when there is none.
    static const SegmentFormat* Find(const std::string& name);
    // The names Find knows, for messages: "\"ts\"".
    static std::string Names();
};
