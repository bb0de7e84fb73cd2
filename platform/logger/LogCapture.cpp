#include "platform/logger/LogCapture.h"

void registerCapture(LogCapture* capture);
void unregisterCapture(LogCapture* capture);

LogCapture::LogCapture() {
    registerCapture(this);
}

LogCapture::~LogCapture() {
    unregisterCapture(this);
}

void LogCapture::Add(const LogRecord& record) {
    std::lock_guard<std::mutex> lock(mutex_);
    records_.push_back(record);
}

std::vector<LogRecord> LogCapture::Records() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return records_;
}

std::vector<LogRecord> LogCapture::Find(const std::string& message) const {
    std::vector<LogRecord> found;
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& r : records_)
        if (r.message == message) found.push_back(r);
    return found;
}

size_t LogCapture::Count(const std::string& message) const {
    return Find(message).size();
}

std::vector<std::string> LogCapture::Messages() const {
    std::vector<std::string> messages;
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& r : records_) messages.push_back(r.message);
    return messages;
}

void LogCapture::Clear() {
    std::lock_guard<std::mutex> lock(mutex_);
    records_.clear();
}
