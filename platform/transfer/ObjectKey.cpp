#include "platform/transfer/ObjectKey.h"

#include <time.h>

#include <cstdio>

#include "platform/transfer/HttpText.h"

namespace {

struct UtcParts {
    struct tm calendar {};
    unsigned milliseconds = 0;
};

UtcParts split(uint64_t micros) {
    UtcParts parts;
    time_t seconds = static_cast<time_t>(micros / 1000000);
    parts.milliseconds = static_cast<unsigned>((micros / 1000) % 1000);
    gmtime_r(&seconds, &parts.calendar);
    return parts;
}

bool printableNotPercent(unsigned char c) {
    return c >= 0x20 && c < 0x7f && c != '%';
}

}  // namespace

uint64_t FirstCaptureTime(const FileTransferRequest& request) {
    bool found = false;
    uint64_t earliest = 0;
    for (const auto* list : {&request.video, &request.audio, &request.meta}) {
        if (list->empty()) continue;
        uint64_t capture = list->front().attribute1;
        if (!found || capture < earliest) earliest = capture;
        found = true;
    }
    return earliest;
}

std::string CompactUtcTime(uint64_t micros) {
    UtcParts t = split(micros);
    char text[64];
    std::snprintf(text, sizeof(text), "%04d%02d%02dT%02d%02d%02d.%03uZ", t.calendar.tm_year + 1900,
                  t.calendar.tm_mon + 1, t.calendar.tm_mday, t.calendar.tm_hour, t.calendar.tm_min,
                  t.calendar.tm_sec, t.milliseconds);
    return text;
}

std::string IsoUtcTime(uint64_t micros) {
    UtcParts t = split(micros);
    char text[64];
    std::snprintf(text, sizeof(text), "%04d-%02d-%02dT%02d:%02d:%02d.%03uZ",
                  t.calendar.tm_year + 1900, t.calendar.tm_mon + 1, t.calendar.tm_mday,
                  t.calendar.tm_hour, t.calendar.tm_min, t.calendar.tm_sec, t.milliseconds);
    return text;
}

std::string ObjectKey(const std::string& keyPrefix, const std::string& streamingId,
                      int64_t sequenceNumber, uint64_t captureMicros,
                      const std::string& extension) {
    UtcParts t = split(captureMicros);
    char day[32];
    std::snprintf(day, sizeof(day), "%04d/%02d/%02d", t.calendar.tm_year + 1900,
                  t.calendar.tm_mon + 1, t.calendar.tm_mday);
    return keyPrefix + streamingId + "/" + day + "/" + streamingId + "_" +
           CompactUtcTime(captureMicros) + "_" + std::to_string(sequenceNumber) + extension;
}

std::map<std::string, std::string> ObjectMetadata(const std::string& streamingId,
                                                  int64_t sequenceNumber, uint32_t durationMs,
                                                  uint64_t captureMicros) {
    return {
        {"streaming-id", httptext::PercentEncode(streamingId, printableNotPercent)},
        {"sequence-number", std::to_string(sequenceNumber)},
        {"duration-ms", std::to_string(durationMs)},
        {"capture-time", IsoUtcTime(captureMicros)},
    };
}
