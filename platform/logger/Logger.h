// Logger: the one log channel of every component.
//
// Put() formats printf-style and writes one line:
//   2026-12-06 11:00:10.012 [tid] <11> src/StreamBuffer:123 Orvane::StreamBuffer::Start: Start
//   enter.
// File, function and line are left out when null/0. Lines whose priority number is above the
// level are dropped before any formatting, so trace lines cost one atomic load when off.
// Every written text has its control characters as \xNN and its URL secrets masked
// (SecretMask.h); a failure or warning line that repeats is condensed (LineCondenser.h).
// Further destinations (LogSink) may be added; each has a level of its own.
// Thread-safe: any thread may call any member at any time.
#pragma once

#include <memory>
#include <string>

#include "platform/logger/LogSink.h"

class Logger {
  public:
    // Default level: lines with a priority number above it are not written.
    static constexpr int kDefaultLevel = 11;

    static void Put(int priority, const char* file, const char* function, int line,
                    const char* format, ...) __attribute__((format(printf, 5, 6)));

    // Lines with a priority number above `level` are dropped.
    static void SetLevel(int level);
    static int GetLevel();
    // True when a line of this priority would be written somewhere (destination or sink).
    static bool Enabled(int priority);

    // Sends the lines to `path` (appended) instead of stderr. False if it cannot be opened;
    // the previous destination then stays.
    static bool SetFile(const std::string& path);

    // Opens `path` for appending the way the log and the status output are: created 0640
    // (the lines name streams and objects), and never through a symbolic link at the last
    // component, which someone else may have planted, except the system's own links to this
    // process's streams: /dev/stdout, /dev/stderr, /dev/fd/N, /proc/self/fd/N. A descriptor
    // the caller owns, or -1 with errno set.
    static int OpenAppend(const std::string& path);

    // Also hands every line with a priority number up to `level` to `sink`, whatever the level
    // of the destination (SetLevel). The sink is held until RemoveSink.
    static void AddSink(std::shared_ptr<LogSink> sink, int level);
    // Ends what AddSink began; lines of Put calls under way may still reach the sink.
    static void RemoveSink(const LogSink* sink);
};
