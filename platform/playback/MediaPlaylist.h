// MediaPlaylist: the text of one HLS media playlist (RFC 8216) over stored objects.
//
// A pure builder: entries are appended oldest first and Text() renders the whole playlist each
// time, since a playlist in an object store is rewritten whole. What it writes:
//   #EXT-X-VERSION          3 (decimal #EXTINF), 6 once an entry needs an init segment
//                           (#EXT-X-MAP outside an I-frame playlist)
//   #EXT-X-TARGETDURATION   the longest #EXTINF rounded up to whole seconds (at least 1), so
//                           that every duration, rounded to the nearest second, fits under it
//   #EXT-X-PLAYLIST-TYPE    EVENT (entries are only ever appended) or VOD (finished)
//   per entry               #EXT-X-DISCONTINUITY when it does not continue the entry before it
//                           (never before the first), #EXT-X-MAP when its init segment differs
//                           from the one before, #EXT-X-PROGRAM-DATE-TIME from its capture
//                           time (UTC, ms), #EXTINF in seconds with ms precision, its URI
//   #EXT-X-ENDLIST          once Close() was called: no entry follows
//
// Not thread-safe: one owner builds it.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct PlaylistEntry {
    std::string uri;             // relative to the playlist's own location
    uint32_t durationMs = 0;     // the object's real duration
    uint64_t captureMicros = 0;  // capture time of its first sample, µs since the epoch
    bool discontinuity = false;  // does not continue the entry before it
    std::string mapUri;          // its init segment, relative like `uri`; "" for none (TS)
};

class MediaPlaylist {
  public:
    enum class Type { kEvent, kVod };

    explicit MediaPlaylist(Type type) : type_(type) {}

    void Add(PlaylistEntry entry) { entries_.push_back(std::move(entry)); }
    // No entry follows: the text ends with #EXT-X-ENDLIST; `type` is what it is listed as from
    // now on (an EVENT playlist that ends stays EVENT to clients that followed it).
    void Close(Type type) {
        type_ = type;
        closed_ = true;
    }

    bool Empty() const { return entries_.empty(); }
    const std::vector<PlaylistEntry>& Entries() const { return entries_; }

    std::string Text() const;

  private:
    Type type_;
    bool closed_ = false;
    std::vector<PlaylistEntry> entries_;
};
