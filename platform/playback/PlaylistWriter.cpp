#include "platform/playback/PlaylistWriter.h"

#include <time.h>

#include <cinttypes>
#include <cstdio>
#include <vector>

#include "platform/logger/Logger.h"
#include "platform/transfer/HttpText.h"

namespace {

constexpr const char* kFile = "platform/playback/PlaylistWriter";

bool unreservedOrSlash(unsigned char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' ||
           c == '_' || c == '.' || c == '~' || c == '/';
}

std::vector<std::string> split(const std::string& key) {
    std::vector<std::string> parts;
    size_t start = 0;
    while (true) {
        size_t slash = key.find('/', start);
        parts.push_back(key.substr(start, slash - start));
        if (slash == std::string::npos) return parts;
        start = slash + 1;
    }
}

}  // namespace

PlaylistWriter::PlaylistWriter(std::string keyPrefix) : keyPrefix_(std::move(keyPrefix)) {}

PlaylistWriter::~PlaylistWriter() {
    subscription_.Reset();
}

std::unique_ptr<PlaylistWriter> PlaylistWriter::Subscribed(std::string keyPrefix) {
    auto writer = std::make_unique<PlaylistWriter>(std::move(keyPrefix));
    PlaylistWriter* self = writer.get();
    writer->subscription_ =
        ObjectEvents::Subscribe([self](const StoredObject& object) { self->OnObject(object); });
    return writer;
}

std::string PlaylistWriter::RelativeUri(const std::string& fromKey, const std::string& toKey) {
    const std::vector<std::string> from = split(fromKey);
    const std::vector<std::string> to = split(toKey);
    // Directories both keys share (the last part of each is the object's own name).
    size_t common = 0;
    while (common + 1 < from.size() && common + 1 < to.size() && from[common] == to[common])
        ++common;
    std::string uri;
    for (size_t i = common; i + 1 < from.size(); ++i) uri += "../";
    for (size_t i = common; i < to.size(); ++i) uri += (i == common ? "" : "/") + to[i];
    return httptext::PercentEncode(uri, unreservedOrSlash);
}

std::string PlaylistWriter::HourKey(const std::string& keyPrefix, const std::string& streamingId,
                                    uint64_t captureMicros) {
    time_t seconds = static_cast<time_t>(captureMicros / 1000000);
    struct tm t {};
    gmtime_r(&seconds, &t);
    char hour[64];
    std::snprintf(hour, sizeof(hour), "%04d/%02d/%02d/%02d.m3u8", t.tm_year + 1900, t.tm_mon + 1,
                  t.tm_mday, t.tm_hour);
    return keyPrefix + streamingId + "/" + hour;
}

void PlaylistWriter::OnObject(const StoredObject& object) {
    if (object.result != Success || !object.store || !object.credentials) return;
    std::lock_guard<std::mutex> lock(mutex_);
    Stream& stream = streams_[object.streamingId];
    append(stream, object);

    // Closed hours first, then the open hour, then the live playlist: a reader that follows
    // the live playlist finds every hour it has passed already closed.
    for (auto it = stream.closing.begin(); it != stream.closing.end();)
        it = put(object, it->first, it->second) ? stream.closing.erase(it) : std::next(it);
    put(object, stream.hourKey, stream.hour.Text());
    put(object, stream.liveKey, stream.live.Text());
}

void PlaylistWriter::append(Stream& stream, const StoredObject& object) {
    const int64_t slackMicros = kCaptureSlackMs * 1000;
    const int64_t jump = static_cast<int64_t>(object.captureMicros - stream.lastEndMicros);
    const bool continues = stream.hasLast && object.runId == stream.lastRun &&
                           object.sequenceNumber == stream.lastSequence + 1 && !object.newInput &&
                           jump <= slackMicros && jump >= -slackMicros;
    if (!stream.hasLast || object.runId != stream.lastRun) {
        stream.liveKey = keyPrefix_ + object.streamingId + "/live.m3u8";
        stream.live = MediaPlaylist(MediaPlaylist::Type::kEvent);
    }
    const std::string hourKey = HourKey(keyPrefix_, object.streamingId, object.captureMicros);
    if (hourKey != stream.hourKey) {
        if (!stream.hour.Empty()) {
            stream.hour.Close(MediaPlaylist::Type::kVod);
            stream.closing[stream.hourKey] = stream.hour.Text();
        }
        stream.hourKey = hourKey;
        stream.hour = MediaPlaylist(MediaPlaylist::Type::kEvent);
        stream.closing.erase(hourKey);  // the hour is open again (the capture clock went back)
    }
    for (auto* list : {&stream.hour, &stream.live}) {
        const std::string& at = list == &stream.hour ? stream.hourKey : stream.liveKey;
        PlaylistEntry entry;
        entry.uri = RelativeUri(at, object.key);
        entry.durationMs = object.durationMs;
        entry.captureMicros = object.captureMicros;
        entry.discontinuity = !continues;
        if (!object.initKey.empty()) entry.mapUri = RelativeUri(at, object.initKey);
        list->Add(std::move(entry));
    }
    stream.hasLast = true;
    stream.lastRun = object.runId;
    stream.lastSequence = object.sequenceNumber;
    stream.lastEndMicros = object.captureMicros + uint64_t{object.durationMs} * 1000;
}

bool PlaylistWriter::put(const StoredObject& object, const std::string& key,
                         const std::string& text) {
    ObjectToStore playlist;
    playlist.bucket = object.bucket;
    playlist.key = key;
    playlist.contentType = kContentType;
    playlist.data = reinterpret_cast<const uint8_t*>(text.data());
    playlist.size = text.size();
    FileTransferInfo info;
    const FileTransferResult result = object.store->Put(playlist, *object.credentials, &info);
    if (result == Success) return true;
    Logger::Put(5, kFile, "PlaylistWriter::put", __LINE__,
                "playlist %s/%s not stored (result %x): the next object rewrites it",
                object.bucket.c_str(), key.c_str(), static_cast<unsigned>(result));
    return false;
}
