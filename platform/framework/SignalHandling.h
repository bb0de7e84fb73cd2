// SignalHandling: SIGINT and SIGTERM for the standalone host.
//
// The first SIGINT or SIGTERM asks for an orderly end: the handler only writes a byte to a
// pipe (async-signal-safe); a watcher thread blocked on that pipe calls the host's callback.
// A second one ends the process at once with _exit(128 + signal number), as a user who
// presses Ctrl-C twice expects; nothing is stored then.
//
// One instance at a time per process (the handlers are process-wide). The destructor restores
// the previous handlers and joins the watcher; the callback must not destroy the instance.
// Threads: constructed and destroyed on one thread (the host's message thread); the callback
// runs on the watcher thread.
#pragma once

#include <functional>
#include <thread>

class SignalHandling {
  public:
    // Installs the handlers. `onFirstSignal` gets the signal number.
    explicit SignalHandling(std::function<void(int)> onFirstSignal);
    ~SignalHandling();
    SignalHandling(const SignalHandling&) = delete;
    SignalHandling& operator=(const SignalHandling&) = delete;

    bool Installed() const { return installed_; }

  private:
    void watch();

    std::function<void(int)> onFirstSignal_;
    bool installed_ = false;
    std::thread watcher_;
};
