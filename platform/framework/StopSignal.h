// StopSignal: a one-way "stop now" flag that blocked waits can be woken by.
//
// The media host's receive thread waits on it while it paces a file (Pacer) and reads it from
// libavformat's interrupt callback; whoever ends the run (the signal watcher, the host's
// message thread) raises it. Once raised it stays raised. Thread-safe.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>

class StopSignal {
  public:
    void Raise() {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            raised_.store(true);
        }
        changed_.notify_all();
    }
    // Lock-free: safe to call from libavformat's interrupt callback as often as it likes.
    bool Raised() const { return raised_.load(std::memory_order_relaxed); }

    // Waits until `deadline` or until raised; true when raised.
    bool WaitUntil(std::chrono::steady_clock::time_point deadline) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_until(lock, deadline, [this] { return raised_.load(); });
    }

  private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::atomic<bool> raised_{false};
};
