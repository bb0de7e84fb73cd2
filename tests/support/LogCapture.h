// LogCapture: records every line Logger::Put writes while it lives, whatever the log level
// (the log destination still gets only those within its level). Thread-safe; records keep the
// order in which Put calls finished formatting.
#pragma once

#include <cstddef>
#include <memory>
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
    // Records whose message holds `part` (and `also`, when given) anywhere.
    size_t CountContaining(const std::string& part, const std::string& also = "") const;
    // Messages only, in order.
    std::vector<std::string> Messages() const;
    void Clear();

  private:
    struct Sink;                  // what Logger writes to
    std::shared_ptr<Sink> sink_;  // shared with Logger until the destructor
};
