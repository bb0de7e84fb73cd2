#include "platform/logger/Logger.h"

#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/spdlog.h>

#include <algorithm>
#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace {

// Where lines go. Never changed once published: a change publishes a new one, so Put reads
// a consistent set with one atomic load and holds it (and its sinks) while it writes.
struct Destinations {
    std::shared_ptr<spdlog::logger> main;                         // stderr or the log file
    std::vector<std::pair<std::shared_ptr<LogSink>, int>> sinks;  // with the level of each
};

// The highest priority number any destination takes; Put drops the rest before formatting.
std::atomic<int> g_level{Logger::kDefaultLevel};
// The level of `main` (SetLevel).
std::atomic<int> g_userLevel{Logger::kDefaultLevel};

std::mutex g_changeMutex;  // serialises changes of the destinations and the levels

std::shared_ptr<spdlog::logger> makeLogger(spdlog::sink_ptr sink) {
    auto logger = std::make_shared<spdlog::logger>("recorder", std::move(sink));
    // The priority and location are part of our own message text.
    logger->set_pattern("%Y-%m-%d %H:%M:%S.%e [%t] %v");
    logger->set_level(spdlog::level::trace);
    logger->flush_on(spdlog::level::trace);
    return logger;
}

// Read with std::atomic_load; replaced with std::atomic_store under g_changeMutex.
std::shared_ptr<const Destinations>& destinations() {
    static std::shared_ptr<const Destinations> current = std::make_shared<const Destinations>(
        Destinations{makeLogger(std::make_shared<spdlog::sinks::stderr_sink_mt>()), {}});
    return current;
}

// Caller holds g_changeMutex.
void publish(Destinations next) {
    int level = g_userLevel.load();
    for (const auto& sink : next.sinks) level = std::max(level, sink.second);
    std::atomic_store(&destinations(), std::make_shared<const Destinations>(std::move(next)));
    g_level = level;
}

}  // namespace

void Logger::SetLevel(int level) {
    std::lock_guard<std::mutex> lock(g_changeMutex);
    g_userLevel = level;
    publish(*std::atomic_load(&destinations()));
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
        std::lock_guard<std::mutex> lock(g_changeMutex);
        Destinations next = *std::atomic_load(&destinations());
        next.main = makeLogger(sink);
        publish(std::move(next));
        return true;
    } catch (const spdlog::spdlog_ex&) {
        return false;
    }
}

void Logger::AddSink(std::shared_ptr<LogSink> sink, int level) {
    std::lock_guard<std::mutex> lock(g_changeMutex);
    Destinations next = *std::atomic_load(&destinations());
    next.sinks.emplace_back(std::move(sink), level);
    publish(std::move(next));
}

void Logger::RemoveSink(const LogSink* sink) {
    std::lock_guard<std::mutex> lock(g_changeMutex);
    Destinations next = *std::atomic_load(&destinations());
    next.sinks.erase(std::remove_if(next.sinks.begin(), next.sinks.end(),
                                    [sink](const auto& s) { return s.first.get() == sink; }),
                     next.sinks.end());
    publish(std::move(next));
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

    const auto current = std::atomic_load(&destinations());
    if (priority <= g_userLevel.load(std::memory_order_relaxed)) {
        const auto& logger = current->main;
        if (file != nullptr && function != nullptr) {
            logger->info("<{}> {}:{} {}: {}", priority, file, line, function, text);
        } else if (function != nullptr) {
            logger->info("<{}> {}: {}", priority, function, text);
        } else {
            logger->info("<{}> {}", priority, text);
        }
    }
    for (const auto& [sink, level] : current->sinks)
        if (priority <= level) sink->Write(LogLine{priority, file, function, line, text});
}
