// LogSink: a further destination for the lines Logger::Put writes (Logger::AddSink).
//
// Logger calls Write on the thread that called Put, possibly on several threads at once, with
// no Logger lock held; a sink synchronises itself. A sink removed with Logger::RemoveSink may
// still get the lines of Put calls that were under way; Logger holds a reference until they end.
#pragma once

struct LogLine {
    int priority = 0;
    const char* file = nullptr;      // null when Put was given none
    const char* function = nullptr;  // null when Put was given none
    int line = 0;
    const char* message = "";  // the formatted text without prefix; valid during Write only
};

class LogSink {
  public:
    virtual ~LogSink() = default;
    virtual void Write(const LogLine& line) = 0;
};
