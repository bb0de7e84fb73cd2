#include "platform/framework/FfmpegLog.h"

extern "C" {
#include <libavutil/error.h>
#include <libavutil/log.h>
}

#include <cstdarg>
#include <mutex>
#include <string>

#include "platform/logger/Logger.h"

namespace {

int priorityOf(int level) {
    if (level <= AV_LOG_ERROR) return 5;
    if (level <= AV_LOG_WARNING) return 6;
    if (level <= AV_LOG_INFO) return 11;
    if (level <= AV_LOG_VERBOSE) return 12;
    return 13;
}

void forward(void* avClass, int level, const char* format, va_list args) {
    const int priority = priorityOf(level);
    if (!Logger::Enabled(priority)) return;
    thread_local std::string pending;  // a line FFmpeg has not ended yet
    thread_local int printPrefix = 1;  // FFmpeg's state: 1 when the next piece starts a line
    char piece[1024];
    av_log_format_line2(avClass, level, format, args, piece, sizeof piece, &printPrefix);
    pending.append(piece);
    // A line never ended is written once it grows long rather than held for ever.
    const bool ended = !pending.empty() && pending.back() == '\n';
    if (!ended && pending.size() < 4096) return;
    if (ended) pending.pop_back();
    if (!pending.empty()) Logger::Put(priority, nullptr, "ffmpeg", 0, "%s", pending.c_str());
    pending.clear();
}

}  // namespace

void RouteFfmpegLogToLogger() {
    static std::once_flag once;
    std::call_once(once, [] { av_log_set_callback(&forward); });
}

std::string FfmpegErrorText(int code) {
    char text[AV_ERROR_MAX_STRING_SIZE] = {0};
    av_strerror(code, text, sizeof text);
    return text;
}
