// PlaylistWriter: keeps HLS playlists beside the stored objects of each stream, so that a
// recording plays from the store's folder as it is (local directory or bucket).
//
// For every object stored (an ObjectEvents event with result Success) it rewrites, through the
// store that took the object and with the same credentials (so the store's own retries and
// failure results apply), after the object itself:
//   <prefix><id>/live.m3u8            EVENT playlist of the newest run: every object of the run
//                                     since this process started listing it
//   <prefix><id>/YYYY/MM/DD/HH.m3u8   the objects whose capture time falls in that UTC hour;
//                                     EVENT while the hour is open; once an object of a later
//                                     hour arrives it is written once more as VOD with
//                                     #EXT-X-ENDLIST (tried again with every object until the
//                                     store takes it)
// The URIs are the objects' keys relative to the playlist's own location, so the same folder
// plays from a local directory, a public bucket or through a proxy.
//
// An object continues the one listed before it (no #EXT-X-DISCONTINUITY) only when it is of the
// same run, has the next sequence number (a gap, a given-up or dropped file skips one), does not
// start a new opening of the input, and its capture time follows the previous object's end within
// kCaptureSlackMs. A playlist the store refused is not retried on its own: the next object
// rewrites it whole.
//
// Threads: OnObject runs on the uploading thread (ObjectEvents) and holds the writer's mutex for
// the length of its Puts, so events of concurrent publishers are taken one after the other.
// Destroying the writer ends its subscription and waits for a call in progress.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "platform/playback/MediaPlaylist.h"
#include "platform/transfer/ObjectEvents.h"

class PlaylistWriter {
  public:
    // A jump of the capture time between two objects beyond this many ms is a break.
    static constexpr int64_t kCaptureSlackMs = 1000;
    static constexpr const char* kContentType = "application/vnd.apple.mpegurl";

    // `keyPrefix` is the transfer's key prefix (put in front of "<id>/" as it is).
    explicit PlaylistWriter(std::string keyPrefix);
    ~PlaylistWriter();
    PlaylistWriter(const PlaylistWriter&) = delete;
    PlaylistWriter& operator=(const PlaylistWriter&) = delete;

    // A writer subscribed to ObjectEvents for as long as it lives.
    static std::unique_ptr<PlaylistWriter> Subscribed(std::string keyPrefix);

    // Takes one event (see the class comment); events without a store are ignored.
    void OnObject(const StoredObject& object);

    // `toKey` as a URI relative to the object at `fromKey` (both keys of one bucket),
    // percent-encoded except for unreserved characters and '/'.
    static std::string RelativeUri(const std::string& fromKey, const std::string& toKey);
    // <prefix><id>/YYYY/MM/DD/HH.m3u8 for the UTC hour of `captureMicros`.
    static std::string HourKey(const std::string& keyPrefix, const std::string& streamingId,
                               uint64_t captureMicros);

  private:
    struct Stream {
        bool hasLast = false;  // an object of this stream was listed
        uint64_t lastRun = 0;
        int64_t lastSequence = 0;
        uint64_t lastEndMicros = 0;  // capture time of the listed object's end
        std::string liveKey;
        MediaPlaylist live{MediaPlaylist::Type::kEvent};  // the newest run's
        std::string hourKey;                              // "" before the first object
        MediaPlaylist hour{MediaPlaylist::Type::kEvent};
        std::map<std::string, std::string> closing;  // closed hours' texts the store has not taken
    };

    void append(Stream& stream, const StoredObject& object);
    bool put(const StoredObject& object, const std::string& key, const std::string& text);

    const std::string keyPrefix_;
    std::mutex mutex_;  // guards streams_ and serialises the Puts
    std::map<std::string, Stream> streams_;
    ObjectEvents::Subscription subscription_;  // last: ends first
};
