#include "platform/framework/SignalHandling.h"

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/framework/SignalHandling";
constexpr char kQuit = 0;  // written by the destructor: the watcher ends

// Process-wide state of the handler; only async-signal-safe operations touch it there.
int g_pipe[2] = {-1, -1};
std::atomic<int> g_signals{0};
struct sigaction g_previousInt;
struct sigaction g_previousTerm;

void onSignal(int signo) {
    const int saved = errno;
    if (g_signals.fetch_add(1) > 0) _exit(128 + signo);
    const char byte = static_cast<char>(signo);
    ssize_t ignored = write(g_pipe[1], &byte, 1);
    (void)ignored;
    errno = saved;
}

}  // namespace

SignalHandling::SignalHandling(std::function<void(int)> onFirstSignal)
    : onFirstSignal_(std::move(onFirstSignal)) {
    if (g_pipe[0] >= 0 || pipe2(g_pipe, O_CLOEXEC) != 0) {
        Logger::Put(4, kFile, "SignalHandling::SignalHandling", __LINE__,
                    "cannot install the SIGINT/SIGTERM handlers");
        return;
    }
    g_signals = 0;
    struct sigaction action {};
    action.sa_handler = onSignal;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_RESTART;
    sigaction(SIGINT, &action, &g_previousInt);
    sigaction(SIGTERM, &action, &g_previousTerm);
    installed_ = true;
    watcher_ = std::thread([this] { watch(); });
}

SignalHandling::~SignalHandling() {
    if (!installed_) return;
    // After this, a signal takes its previous action again.
    sigaction(SIGINT, &g_previousInt, nullptr);
    sigaction(SIGTERM, &g_previousTerm, nullptr);
    const char quit = kQuit;
    ssize_t ignored = write(g_pipe[1], &quit, 1);
    (void)ignored;
    watcher_.join();
    close(g_pipe[0]);
    close(g_pipe[1]);
    g_pipe[0] = g_pipe[1] = -1;
}

void SignalHandling::watch() {
    while (true) {
        char byte = 0;
        ssize_t n = read(g_pipe[0], &byte, 1);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0 || byte == kQuit) return;
        onFirstSignal_(static_cast<int>(byte));
    }
}
