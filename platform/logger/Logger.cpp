#include "platform/logger/Logger.h"

#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/spdlog.h>

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/logger/LogCapture.h"

namespace {

std::atomic<int> g_level{Logger::kDefaultLevel};
// Level asked for by the user; g_level is raised above it while captures exist.
std::atomic<int> g_userLevel{Logger::kDefaultLevel};

std::mutex g_sinkMutex;  // guards g_captures and the logger swap
std::vector<LogCapture*> g_captures;
std::atomic<int> g_captureCount{0};  // g_captures.size(), readable without the lock

std::shared_ptr<spdlog::logger> makeLogger(spdlog::sink_ptr sink) {
    auto logger = std::make_shared<spdlog::logger>("recorder", std::move(sink));
    // The priority and location are part of our own message text.
    logger->set_pattern("%Y-%m-%d %H:%M:%S.%e [%t] %v");
    logger->set_level(spdlog::level::trace);
    logger->flush_on(spdlog::level::trace);
    return logger;
}

std::shared_ptr<spdlog::logger>& currentLogger() {
    static std::shared_ptr<spdlog::logger> logger =
        makeLogger(std::make_shared<spdlog::sinks::stderr_sink_mt>());
    return logger;
}

}  // namespace

void Logger::SetLevel(int level) {
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    g_userLevel = level;
    g_level = g_captures.empty() ? level : 1000;
}

int Logger::GetLevel() {
    return g_userLevel.load();
}

bool Logger::Enabled(int priority) {
    return priority <= g_level.load(std::memory_order_relaxed);
}

bool Logger::SetFile(const std::string& path) {
    try {
        auto sink = std::make_shared<spdlog::sinks::basic_file_sink_mt>(path, false);
        std::lock_guard<std::mutex> lock(g_sinkMutex);
        std::atomic_store(&currentLogger(), makeLogger(sink));
        return true;
    } catch (const spdlog::spdlog_ex&) {
        return false;
    }
}

void Logger::Put(int priority, const char* file, const char* function, int line, const char* format,
                 ...) {
    if (!Enabled(priority)) return;

    char stackBuffer[1024];
    std::string heapBuffer;
    const char* text = stackBuffer;
    va_list args;
    va_start(args, format);
    va_list copy;
    va_copy(copy, args);
    int needed = std::vsnprintf(stackBuffer, sizeof stackBuffer, format, args);
    va_end(args);
    if (needed >= static_cast<int>(sizeof stackBuffer)) {
        heapBuffer.resize(static_cast<size_t>(needed) + 1);
        std::vsnprintf(heapBuffer.data(), heapBuffer.size(), format, copy);
        heapBuffer.resize(static_cast<size_t>(needed));
        text = heapBuffer.c_str();
    } else if (needed < 0) {
        stackBuffer[0] = '\0';
    }
    va_end(copy);

    if (priority <= g_userLevel.load(std::memory_order_relaxed)) {
        auto logger = std::atomic_load(&currentLogger());
        if (file != nullptr && function != nullptr) {
            logger->info("<{}> {}:{} {}: {}", priority, file, line, function, text);
        } else if (function != nullptr) {
            logger->info("<{}> {}: {}", priority, function, text);
        } else {
            logger->info("<{}> {}", priority, text);
        }
    }

    if (g_captureCount.load(std::memory_order_acquire) == 0) return;
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    {
        LogRecord record{priority, file ? file : "", function ? function : "", line, text};
        for (LogCapture* capture : g_captures) capture->Add(record);
    }
}

// Registration of captures lives here so that it shares g_sinkMutex with Put.
void registerCapture(LogCapture* capture) {
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    g_captures.push_back(capture);
    g_captureCount = static_cast<int>(g_captures.size());
    g_level = 1000;
}

void unregisterCapture(LogCapture* capture) {
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    for (auto it = g_captures.begin(); it != g_captures.end(); ++it) {
        if (*it == capture) {
            g_captures.erase(it);
            break;
        }
    }
    g_captureCount = static_cast<int>(g_captures.size());
    if (g_captures.empty()) g_level = g_userLevel.load();
}
