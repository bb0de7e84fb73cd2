// Guarded: the one mutex of a thread-safe test fake and whole-field reads and writes under it.
#pragma once

#include <mutex>
#include <utility>

namespace testsupport {

class Guarded {
  protected:
    template <typename T>
    T Get(const T& member) const {
        std::lock_guard<std::mutex> lock(mutex_);
        return member;
    }
    template <typename T>
    void Set(T& member, T value) {
        std::lock_guard<std::mutex> lock(mutex_);
        member = std::move(value);
    }

    mutable std::mutex mutex_;  // guards every field of the derived fake
};

}  // namespace testsupport
