#include "platform/transfer/UtcTime.h"

#include <time.h>

#include <chrono>
#include <cstdio>

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

}  // namespace

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

std::string UtcDatePath(uint64_t micros) {
    UtcParts t = split(micros);
    char text[32];
    std::snprintf(text, sizeof(text), "%04d/%02d/%02d", t.calendar.tm_year + 1900,
                  t.calendar.tm_mon + 1, t.calendar.tm_mday);
    return text;
}

std::string FormatUtc(std::chrono::system_clock::time_point time, const char* format) {
    time_t seconds = std::chrono::system_clock::to_time_t(time);
    struct tm utc {};
    gmtime_r(&seconds, &utc);
    char text[64];
    return strftime(text, sizeof text, format, &utc) != 0 ? std::string(text) : std::string();
}

uint64_t UtcNowMicros() {
    return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(
                                     std::chrono::system_clock::now().time_since_epoch())
                                     .count());
}
