// BoundedQueue<T>: a bounded FIFO shared by producer threads and one consumer.
//
// With drop-when-full (always set here) a full queue refuses the newest item and Push never
// blocks. Pop blocks until an item is there. Clear filters the queue through the removal
// predicate (true = remove). Every member takes the queue's own mutex; no callback but the
// predicate runs under it.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <utility>
#include <vector>

template <typename T>
class BoundedQueue {
  public:
    explicit BoundedQueue(uint64_t capacity)
        : capacity_(capacity), removePredicate_([](T) { return true; }) {}

    BoundedQueue(const BoundedQueue&) = delete;
    BoundedQueue& operator=(const BoundedQueue&) = delete;

    // True when appended; false when refused (full), the item is then released.
    bool Push(T item) {
        std::unique_lock<std::mutex> lock(mutex_);
        if (items_.size() >= capacity_) {
            if (dropWhenFull_) return false;  // `item` is released when this frame ends
            notFull_.wait(lock, [this] { return items_.size() < capacity_; });
        }
        items_.push_back(std::move(item));
        notEmpty_.notify_one();
        return true;
    }

    // Blocks until an item is there, then takes the oldest.
    T Pop() {
        std::unique_lock<std::mutex> lock(mutex_);
        notEmpty_.wait(lock, [this] { return !items_.empty(); });
        T item = std::move(items_.front());
        items_.pop_front();
        notFull_.notify_one();
        return item;
    }

    // Removes the items the predicate selects; the others keep their order. An empty
    // predicate raises std::bad_function_call.
    void Clear() {
        std::lock_guard<std::mutex> lock(mutex_);
        std::vector<T> kept;
        while (!items_.empty()) {
            T front = items_.front();
            if (!removePredicate_(front)) kept.push_back(std::move(front));
            items_.pop_front();
        }
        for (auto& item : kept) items_.push_back(std::move(item));
        notFull_.notify_one();
    }

    BoundedQueue& operator=(std::function<bool(T)> predicate) {
        std::lock_guard<std::mutex> lock(mutex_);
        removePredicate_ = std::move(predicate);
        return *this;
    }

    size_t Size() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return items_.size();
    }

  private:
    std::deque<T> items_;  // oldest at the front
    const uint64_t capacity_;
    bool dropWhenFull_ = true;
    mutable std::mutex mutex_;
    std::condition_variable notFull_;
    std::condition_variable notEmpty_;
    std::function<bool(T)> removePredicate_;
};
