// The playlist text: header, target duration, discontinuities, init segments, the end.
#include <gtest/gtest.h>

#include "platform/playback/MediaPlaylist.h"

namespace {

constexpr uint64_t kNoon = 1796558400000000ULL;  // 2026-12-06T12:00:00.000Z

TEST(MediaPlaylistTest, Texts) {
    struct Case {
        const char* name;
        MediaPlaylist::Type type;
        std::vector<PlaylistEntry> entries;
        bool close;
        std::string text;
    };
    const std::string head = "#EXTM3U\n#EXT-X-VERSION:3\n";
    const std::string tail = "#EXT-X-MEDIA-SEQUENCE:0\n";
    const Case cases[] = {
        // 10.001 s needs 11; the discontinuity flag of the first entry means nothing.
        {"vod with a break",
         MediaPlaylist::Type::kVod,
         {{"a.ts", 9966, kNoon, true, ""},
          {"b.ts", 10001, kNoon + 9966000, false, ""},
          {"c.ts", 40, kNoon + 60000000, true, ""}},
         true,
         head + "#EXT-X-TARGETDURATION:11\n" + tail +
             "#EXT-X-PLAYLIST-TYPE:VOD\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:00:00.000Z\n#EXTINF:9.966,\na.ts\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:00:09.966Z\n#EXTINF:10.001,\nb.ts\n"
             "#EXT-X-DISCONTINUITY\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:01:00.000Z\n#EXTINF:0.040,\nc.ts\n"
             "#EXT-X-ENDLIST\n"},
        // The map is repeated only where it changes; a map asks for version 6.
        {"init segments",
         MediaPlaylist::Type::kEvent,
         {{"a.m4s", 2000, kNoon, false, "i1.mp4"},
          {"b.m4s", 2000, kNoon + 2000000, false, "i1.mp4"},
          {"c.m4s", 2000, kNoon + 9000000, true, "i2.mp4"}},
         false,
         "#EXTM3U\n#EXT-X-VERSION:6\n#EXT-X-TARGETDURATION:2\n" + tail +
             "#EXT-X-PLAYLIST-TYPE:EVENT\n"
             "#EXT-X-MAP:URI=\"i1.mp4\"\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:00:00.000Z\n#EXTINF:2.000,\na.m4s\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:00:02.000Z\n#EXTINF:2.000,\nb.m4s\n"
             "#EXT-X-DISCONTINUITY\n#EXT-X-MAP:URI=\"i2.mp4\"\n"
             "#EXT-X-PROGRAM-DATE-TIME:2026-12-06T12:00:09.000Z\n#EXTINF:2.000,\nc.m4s\n"},
    };
    for (const Case& c : cases) {
        MediaPlaylist playlist(c.type);
        for (const PlaylistEntry& e : c.entries) playlist.Add(e);
        if (c.close) playlist.Close(c.type);
        EXPECT_EQ(playlist.Text(), c.text) << c.name;
    }
}

}  // namespace
