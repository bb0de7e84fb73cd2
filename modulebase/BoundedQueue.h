// BoundedQueue<T>: a bounded FIFO shared by producer threads and one consumer.
//
// A full queue refuses the newest item: Push never blocks. A producer that would rather wait
// than lose an item (a file input) asks WaitForRoom first; the consumer wakes it only once the
// room it asked for is there, so a waiting producer wakes once per drained stretch, not once
// per item. Pop and PopAll block until an item is there; PopAll takes every queued item in one
// lock, so a consumer handles a burst with one wake-up. A producer pushing a burst may push
// without waking the consumer and call Wake once at the end. Clear filters the queue through the
// removal predicate (true = remove). Every member takes the queue's own mutex; no callback but the
// predicate runs under it.
//
// Each accepted item gets a ticket: 1 for the first Push, one more for each later one. Items
// leave in ticket order (Clear only removes), so a consumer that has handled the item with
// ticket t has seen everything pushed before it.
#pragma once

#include <algorithm>
#include <chrono>
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

    struct Entry {
        T item;
        uint64_t ticket;
    };

    // True when appended; false when refused (full), the item is then released. `ticket`
    // (optional) receives the item's ticket when appended. `wake` false leaves the consumer
    // asleep: the producer then owes a Wake.
    bool Push(T item, uint64_t* ticket = nullptr, bool wake = true) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            if (items_.size() >= capacity_) return false;  // `item` is released at return
            items_.push_back(Entry{std::move(item), ++lastTicket_});
            if (ticket) *ticket = lastTicket_;
        }
        if (wake) notEmpty_.notify_one();
        return true;
    }

    // Appends `item` even when the queue is full (a control item that must not be refused,
    // such as a flush marker); `ticket` as for Push.
    void PushAlways(T item, uint64_t* ticket) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            items_.push_back(Entry{std::move(item), ++lastTicket_});
            *ticket = lastTicket_;
        }
        notEmpty_.notify_one();
    }

    // Wakes the consumer for the items pushed without waking it.
    void Wake() { notEmpty_.notify_one(); }

    // Blocks until an item is there, then takes the oldest; `ticket` (optional) receives its
    // ticket.
    T Pop(uint64_t* ticket = nullptr) {
        std::unique_lock<std::mutex> lock(mutex_);
        notEmpty_.wait(lock, [this] { return !items_.empty(); });
        Entry entry = std::move(items_.front());
        items_.pop_front();
        wakeRoomWaiter();
        if (ticket) *ticket = entry.ticket;
        return std::move(entry.item);
    }

    // Blocks until an item is there, then moves every queued item, oldest first, into `out`
    // (which the caller has emptied; its storage is reused).
    void PopAll(std::deque<Entry>& out) {
        std::unique_lock<std::mutex> lock(mutex_);
        notEmpty_.wait(lock, [this] { return !items_.empty(); });
        out.swap(items_);
        wakeRoomWaiter();
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
        wakeRoomWaiter();
    }

    // Blocks until the queue has room for `room` more items (at most its capacity), until
    // `deadline`, or until waits are ended; true when the room is there. One waiter at a time:
    // the room is only guaranteed to the single producer that waited for it.
    bool WaitForRoom(uint64_t room, std::chrono::steady_clock::time_point deadline) {
        std::unique_lock<std::mutex> lock(mutex_);
        const uint64_t wanted = std::min(std::max<uint64_t>(room, 1), capacity_);
        const auto roomy = [&] { return freePlaces() >= wanted; };
        if (roomy()) return true;
        roomWanted_ = wanted;
        notFull_.wait_until(lock, deadline, [&] { return waitsEnded_ || roomy(); });
        roomWanted_ = 0;
        return roomy();
    }

    // EndWaits makes every WaitForRoom, current or later, return at once (with the room as it
    // is) until AllowWaits. A queue starts with waits ended: there is no consumer yet.
    void EndWaits() {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            waitsEnded_ = true;
        }
        notFull_.notify_all();
    }
    void AllowWaits() {
        std::lock_guard<std::mutex> lock(mutex_);
        waitsEnded_ = false;
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
    // Caller holds mutex_. Wakes the waiting producer once the room it asked for is there.
    void wakeRoomWaiter() {
        if (roomWanted_ != 0 && freePlaces() >= roomWanted_) notFull_.notify_one();
    }
    // Caller holds mutex_. Free places; none while PushAlways has filled the queue beyond.
    uint64_t freePlaces() const {
        return items_.size() >= capacity_ ? 0 : capacity_ - items_.size();
    }

    std::deque<Entry> items_;  // oldest at the front
    const uint64_t capacity_;
    uint64_t roomWanted_ = 0;  // room the waiting producer asked for; 0: nobody waits
    bool waitsEnded_ = true;
    uint64_t lastTicket_ = 0;  // ticket of the newest accepted item
    mutable std::mutex mutex_;
    std::condition_variable notFull_;  // WaitForRoom's wait
    std::condition_variable notEmpty_;
    std::function<bool(T)> removePredicate_;
};
