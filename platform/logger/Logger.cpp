#include "platform/logger/Logger.h"

#include <fcntl.h>
#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/spdlog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/logger/LineCondenser.h"
#include "platform/logger/SecretMask.h"

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

// A log file written through a descriptor of our own, so that it is opened without following a
// symbolic link at its last component and created with mode 0640 (spdlog's file sink opens by
// name, through links).
class DescriptorSink : public spdlog::sinks::base_sink<std::mutex> {
  public:
    explicit DescriptorSink(int fd) : fd_(fd) {}
    ~DescriptorSink() override { close(fd_); }

  protected:
    void sink_it_(const spdlog::details::log_msg& message) override {
        spdlog::memory_buf_t formatted;
        formatter_->format(message, formatted);
        const char* data = formatted.data();
        size_t left = formatted.size();
        while (left > 0) {
            ssize_t n = write(fd_, data, left);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) return;  // a full disk loses lines, never the process
            data += n;
            left -= static_cast<size_t>(n);
        }
    }
    void flush_() override {}

  private:
    const int fd_;
};

// Failure and warning lines (priority 5 or less) that repeat are condensed.
constexpr int kCondensedPriority = 5;
LineCondenser& condenser() {
    static LineCondenser instance;
    return instance;
}

// `text` with every control character as \xNN, so that a value in a line (a stream id, a key,
// an answer's text) can never start a line of its own; false (and `escaped` untouched) when
// it holds none. A line break that ends the text is left as it is: some of the recorder's own
// texts end with one.
bool escapeControls(const char* text, std::string* escaped) {
    auto isControl = [](const char* p) {
        const auto c = static_cast<unsigned char>(*p);
        return (c < 0x20 || c == 0x7f) && !(c == '\n' && p[1] == '\0');
    };
    const char* p = text;
    while (*p != '\0' && !isControl(p)) ++p;
    if (*p == '\0') return false;
    escaped->assign(text, p);
    for (; *p != '\0'; ++p) {
        if (!isControl(p)) {
            escaped->push_back(*p);
            continue;
        }
        char hex[8];
        std::snprintf(hex, sizeof hex, "\\x%02x", static_cast<unsigned char>(*p));
        escaped->append(hex);
    }
    return true;
}

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

int Logger::OpenAppend(const std::string& path) {
    // Not all of /dev/: /dev/shm is writable by anyone.
    const bool systemLink = path == "/dev/stdout" || path == "/dev/stderr" ||
                            path.rfind("/dev/fd/", 0) == 0 || path.rfind("/proc/self/fd/", 0) == 0;
    const int flags = O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | (systemLink ? 0 : O_NOFOLLOW);
    return open(path.c_str(), flags, 0640);
}

bool Logger::SetFile(const std::string& path) {
    const int fd = OpenAppend(path);
    if (fd < 0) return false;
    auto sink = std::make_shared<DescriptorSink>(fd);
    std::lock_guard<std::mutex> lock(g_changeMutex);
    Destinations next = *std::atomic_load(&destinations());
    next.main = makeLogger(sink);
    publish(std::move(next));
    return true;
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
    std::string escaped;
    if (escapeControls(text, &escaped)) text = escaped.c_str();
    std::string masked;
    if (MaskSecrets(text, &masked)) text = masked.c_str();

    const auto current = std::atomic_load(&destinations());
    uint64_t repeats = 0;
    if (priority <= g_userLevel.load(std::memory_order_relaxed) &&
        (priority > kCondensedPriority ||
         condenser().Offer(std::string(file ? file : "") + ":" + std::to_string(line) + " " + text,
                           LineCondenser::Clock::now(), &repeats))) {
        std::string counted;
        if (repeats > 0) {
            counted = std::string(text) + " (and " + std::to_string(repeats) +
                      " more like it in the last " +
                      std::to_string(LineCondenser::kWindow.count()) + " s)";
        }
        const char* written = repeats > 0 ? counted.c_str() : text;
        const auto& logger = current->main;
        if (file != nullptr && function != nullptr) {
            logger->info("<{}> {}:{} {}: {}", priority, file, line, function, written);
        } else if (function != nullptr) {
            logger->info("<{}> {}: {}", priority, function, written);
        } else {
            logger->info("<{}> {}", priority, written);
        }
    }
    for (const auto& [sink, level] : current->sinks)
        if (priority <= level) sink->Write(LogLine{priority, file, function, line, text});
}
