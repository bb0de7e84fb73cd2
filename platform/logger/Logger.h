// Logger: the one log channel of every component.
//
// Put() formats printf-style and writes one line:
//   2026-12-06 11:00:10.012 [tid] <11> src/StreamBuffer:123 Orvane::StreamBuffer::Start: Start
//   enter.
// File, function and line are left out when null/0. Lines whose priority number is above the
// level are dropped before any formatting, so trace lines cost one atomic load when off.
// Thread-safe: any thread may call any member at any time.
#pragma once

#include <string>

class Logger {
  public:
    // Default level: lines with a priority number above it are not written.
    static constexpr int kDefaultLevel = 11;

    static void Put(int priority, const char* file, const char* function, int line,
                    const char* format, ...) __attribute__((format(printf, 5, 6)));

    // Lines with a priority number above `level` are dropped.
    static void SetLevel(int level);
    static int GetLevel();
    // True when a line of this priority would be written (or captured).
    static bool Enabled(int priority);

    // Sends the lines to `path` (appended) instead of stderr. False if it cannot be opened;
    // the previous destination then stays.
    static bool SetFile(const std::string& path);
};
