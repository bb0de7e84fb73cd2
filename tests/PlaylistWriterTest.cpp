// The playlist writer over a store that records what it is given: which playlists follow an
// object, where the breaks fall, the hour's closing, relative URIs.
#include <gtest/gtest.h>

#include <map>

#include "platform/playback/PlaylistWriter.h"
#include "tests/support/TestSupport.h"

namespace {

using testsupport::CountOf;

constexpr uint64_t kHour = 3600000000ULL;
constexpr uint64_t kNoon = 1796558400000000ULL;  // 2026-12-06T12:00:00.000Z

class RecordingStore : public IObjectStore {
  public:
    FileTransferResult Put(const ObjectToStore& object, const StoreCredentials&,
                           FileTransferInfo*) override {
        order.push_back(object.key);
        if (refuse) return NetworkError;
        texts[object.key] = std::string(reinterpret_cast<const char*>(object.data), object.size);
        return Success;
    }
    void Cancel() override {}

    bool refuse = false;
    std::vector<std::string> order;
    std::map<std::string, std::string> texts;
};

class PlaylistWriterTest : public ::testing::Test {
  protected:
    void Stored(uint64_t run, int64_t sequence, uint64_t capture, bool newInput = false) {
        StoredObject o;
        o.streamingId = "cam1";
        o.sequenceNumber = sequence;
        o.bucket = "rec";
        o.key = "p/cam1/2026/12/06/cam1_" + std::to_string(run) + "_" + std::to_string(sequence) +
                ".ts";
        o.durationMs = 10000;
        o.captureMicros = capture;
        o.runId = run;
        o.newInput = newInput;
        o.store = &store_;
        o.credentials = &credentials_;
        writer_.OnObject(o);
    }

    RecordingStore store_;
    StoreCredentials credentials_;
    PlaylistWriter writer_{"p/"};
};

TEST_F(PlaylistWriterTest, BreaksWhereObjectsDoNotFollowEachOther) {
    const uint64_t s = 10000000;  // one object's length in µs
    Stored(1, 1, kNoon);
    EXPECT_EQ(store_.order,
              (std::vector<std::string>{"p/cam1/2026/12/06/12.m3u8", "p/cam1/live.m3u8"}));
    Stored(1, 2, kNoon + s);                         // follows
    Stored(1, 4, kNoon + 3 * s);                     // 3 was given up
    Stored(1, 5, kNoon + 4 * s, true);               // the input was opened again
    Stored(1, 6, kNoon + 5 * s + 3000000);           // the capture clock jumped
    Stored(1, 7, kNoon + 6 * s + 3000000 + 900000);  // within the slack
    const std::string live = store_.texts["p/cam1/live.m3u8"];
    EXPECT_EQ(CountOf(live, "#EXTINF:10.000,"), 6u);
    EXPECT_EQ(CountOf(live, "#EXT-X-DISCONTINUITY\n"), 3u);
    EXPECT_NE(live.find("\n2026/12/06/cam1_1_1.ts\n"), std::string::npos) << live;
    EXPECT_EQ(CountOf(store_.texts["p/cam1/2026/12/06/12.m3u8"], "#EXT-X-DISCONTINUITY\n"), 3u);

    // A new run starts the live playlist afresh and breaks the hour's.
    Stored(2, 1, kNoon + 8 * s);
    EXPECT_EQ(CountOf(store_.texts["p/cam1/live.m3u8"], "#EXTINF"), 1u);
    const std::string hour = store_.texts["p/cam1/2026/12/06/12.m3u8"];
    EXPECT_EQ(CountOf(hour, "#EXTINF"), 7u);
    EXPECT_EQ(CountOf(hour, "#EXT-X-DISCONTINUITY\n"), 4u);
    EXPECT_NE(hour.find("\ncam1_2_1.ts\n"), std::string::npos) << hour;
}

TEST_F(PlaylistWriterTest, HourClosesOnceALaterHourBegins) {
    Stored(1, 1, kNoon + kHour - 5000000);  // 12:59:55, ends 13:00:05
    EXPECT_EQ(store_.texts["p/cam1/2026/12/06/12.m3u8"].find("ENDLIST"), std::string::npos);

    // The store refuses everything while the hour ends: the closing is tried again later.
    store_.refuse = true;
    Stored(1, 2, kNoon + kHour + 5000000);
    store_.refuse = false;
    store_.order.clear();
    Stored(1, 3, kNoon + kHour + 15000000);
    EXPECT_EQ(store_.order,
              (std::vector<std::string>{"p/cam1/2026/12/06/12.m3u8", "p/cam1/2026/12/06/13.m3u8",
                                        "p/cam1/live.m3u8"}));
    const std::string closed = store_.texts["p/cam1/2026/12/06/12.m3u8"];
    EXPECT_NE(closed.find("#EXT-X-PLAYLIST-TYPE:VOD\n"), std::string::npos) << closed;
    EXPECT_EQ(closed.substr(closed.size() - 15), "#EXT-X-ENDLIST\n");
    EXPECT_EQ(CountOf(closed, "#EXTINF"), 1u);
    EXPECT_EQ(CountOf(store_.texts["p/cam1/2026/12/06/13.m3u8"], "#EXTINF"), 2u);
    EXPECT_EQ(CountOf(store_.texts["p/cam1/live.m3u8"], "#EXTINF"), 3u);

    // Once taken, a closed hour is not written again.
    store_.order.clear();
    Stored(1, 4, kNoon + kHour + 25000000);
    EXPECT_EQ(store_.order.size(), 2u);
}

TEST(PlaylistWriterUriTest, RelativeUris) {
    struct Case {
        const char* from;
        const char* to;
        const char* uri;
    } cases[] = {
        {"cam1/live.m3u8", "cam1/2026/12/06/cam1_x_1.ts", "2026/12/06/cam1_x_1.ts"},
        {"cam1/2026/12/06/12.m3u8", "cam1/2026/12/06/cam1_x_1.ts", "cam1_x_1.ts"},
        {"cam1/2026/12/06/12.m3u8", "cam1/2026/12/05/a.ts", "../05/a.ts"},
        {"live.m3u8", "a b/c#1.ts", "a%20b/c%231.ts"},
    };
    for (const Case& c : cases) EXPECT_EQ(PlaylistWriter::RelativeUri(c.from, c.to), c.uri);
}

}  // namespace
