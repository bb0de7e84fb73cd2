// LogCapture: a test sink that records every line Logger::Put writes while it lives.
//
// While at least one capture exists the level is raised to capture every priority and lines
// still go to the normal destination only if their priority is within the level set before.
// Thread-safe; records keep the order in which Put calls finished formatting.
#pragma once

#include <cstddef>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

struct LogRecord {
    int priority = 0;
    std::string file;      // empty when Put was given null
    std::string function;  // empty when Put was given null
    int line = 0;
    std::string message;  // the formatted text, without prefix
};

class LogCapture {
  public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::vector<LogRecord> Records() const;
    // Records whose message equals `message` exactly.
    std::vector<LogRecord> Find(const std::string& message) const;
    size_t Count(const std::string& message) const;
    bool Contains(const std::string& message) const { return Count(message) > 0; }
    // Messages only, in order.
    std::vector<std::string> Messages() const;
    void Clear();

    // Internal: called by Logger for every line.
    void Add(const LogRecord& record);

  private:
    mutable std::mutex mutex_;
    std::vector<LogRecord> records_;
};
