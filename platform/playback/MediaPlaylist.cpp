#include "platform/playback/MediaPlaylist.h"

#include <algorithm>
#include <cstdio>

#include "platform/transfer/UtcTime.h"

std::string MediaPlaylist::Text() const {
    uint32_t longestMs = 0;
    bool needsMap = false;
    for (const PlaylistEntry& entry : entries_) {
        longestMs = std::max(longestMs, entry.durationMs);
        needsMap = needsMap || !entry.mapUri.empty();
    }
    const uint32_t targetSeconds = std::max<uint32_t>(1, (longestMs + 999) / 1000);

    std::string text = "#EXTM3U\n";
    text += needsMap ? "#EXT-X-VERSION:6\n" : "#EXT-X-VERSION:3\n";
    text += "#EXT-X-TARGETDURATION:" + std::to_string(targetSeconds) + "\n";
    text += "#EXT-X-MEDIA-SEQUENCE:0\n";
    text += type_ == Type::kEvent ? "#EXT-X-PLAYLIST-TYPE:EVENT\n" : "#EXT-X-PLAYLIST-TYPE:VOD\n";
    const std::string* map = nullptr;
    for (size_t i = 0; i < entries_.size(); ++i) {
        const PlaylistEntry& entry = entries_[i];
        if (i > 0 && entry.discontinuity) text += "#EXT-X-DISCONTINUITY\n";
        if (!entry.mapUri.empty() && (!map || *map != entry.mapUri))
            text += "#EXT-X-MAP:URI=\"" + entry.mapUri + "\"\n";
        map = &entry.mapUri;
        text += "#EXT-X-PROGRAM-DATE-TIME:" + IsoUtcTime(entry.captureMicros) + "\n";
        char duration[32];
        std::snprintf(duration, sizeof(duration), "#EXTINF:%u.%03u,\n", entry.durationMs / 1000,
                      entry.durationMs % 1000);
        text += duration;
        text += entry.uri + "\n";
    }
    if (closed_) text += "#EXT-X-ENDLIST\n";
    return text;
}
