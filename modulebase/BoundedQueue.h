// BoundedQueue<T>: a bounded FIFO shared by producer threads and one consumer.
//
// With drop-when-full (always set here) a full queue refuses the newest item and Push never
// blocks. Pop blocks until an item is there. Clear filters the queue through the removal
// predicate (true = remove). Every member takes the queue's own mutex; no callback but the
// predicate runs under it.
//
// Each accepted item gets a ticket: 1 for the first Push, one more for each later one. Items
// leave in ticket order (Clear only removes), so a consumer that has handled the item with
// ticket t has seen everything pushed before it.
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

    // True when appended; false when refused (full), the item is then released. `ticket`
    // (optional) receives the item's ticket when appended.
    bool Push(T item, uint64_t* ticket = nullptr) {
        std::unique_lock<std::mutex> lock(mutex_);
        if (items_.size() >= capacity_) {
            if (dropWhenFull_) return false;  // `item` is released when this frame ends
            notFull_.wait(lock, [this] { return items_.size() < capacity_; });
        }
        items_.push_back(Entry{std::move(item), ++lastTicket_});
        if (ticket) *ticket = lastTicket_;
        notEmpty_.notify_one();
        return true;
    }

    // Blocks until an item is there, then takes the oldest; `ticket` (optional) receives its
    // ticket.
    T Pop(uint64_t* ticket = nullptr) {
        std::unique_lock<std::mutex> lock(mutex_);
        notEmpty_.wait(lock, [this] { return !items_.empty(); });
        Entry entry = std::move(items_.front());
        items_.pop_front();
        notFull_.notify_one();
        if (ticket) *ticket = entry.ticket;
        return std::move(entry.item);
    }

    // Removes the items the predicate selects; the others keep their order. An empty
    // predicate raises std::bad_function_call.
    void Clear() {
        std::lock_guard<std::mutex> lock(mutex_);
        std::vector<Entry> kept;
        while (!items_.empty()) {
            Entry& front = items_.front();
            if (!removePredicate_(front.item)) kept.push_back(std::move(front));
            items_.pop_front();
        }
        for (auto& entry : kept) items_.push_back(std::move(entry));
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
    struct Entry {
        T item;
        uint64_t ticket;
    };
    std::deque<Entry> items_;  // oldest at the front
    const uint64_t capacity_;
    bool dropWhenFull_ = true;
    uint64_t lastTicket_ = 0;  // ticket of the newest accepted item
    mutable std::mutex mutex_;
    std::condition_variable notFull_;
    std::condition_variable notEmpty_;
    std::function<bool(T)> removePredicate_;
};
