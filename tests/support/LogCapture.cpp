#include "tests/support/LogCapture.h"

#include "platform/logger/Logger.h"

struct LogCapture::Sink : LogSink {
    void Write(const LogLine& line) override {
        std::lock_guard<std::mutex> lock(mutex);
        records.push_back(LogRecord{line.priority, line.file ? line.file : "",
                                    line.function ? line.function : "", line.line, line.message});
    }

    mutable std::mutex mutex;
    std::vector<LogRecord> records;
};

LogCapture::LogCapture() : sink_(std::make_shared<Sink>()) {
    Logger::AddSink(sink_, 1000);  // every priority
}

LogCapture::~LogCapture() {
    Logger::RemoveSink(sink_.get());
}

std::vector<LogRecord> LogCapture::Records() const {
    std::lock_guard<std::mutex> lock(sink_->mutex);
    return sink_->records;
}

std::vector<LogRecord> LogCapture::Find(const std::string& message) const {
    std::vector<LogRecord> found;
    for (const auto& r : Records())
        if (r.message == message) found.push_back(r);
    return found;
}

size_t LogCapture::Count(const std::string& message) const {
    return Find(message).size();
}

size_t LogCapture::CountContaining(const std::string& part, const std::string& also) const {
    size_t n = 0;
    for (const auto& r : Records())
        n += r.message.find(part) != std::string::npos && r.message.find(also) != std::string::npos;
    return n;
}

std::vector<std::string> LogCapture::Messages() const {
    std::vector<std::string> messages;
    for (const auto& r : Records()) messages.push_back(r.message);
    return messages;
}

void LogCapture::Clear() {
    std::lock_guard<std::mutex> lock(sink_->mutex);
    sink_->records.clear();
}
