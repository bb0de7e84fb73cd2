// ObjectEvents: tells whoever subscribed about each stream file the transfer handed to its
// store, so that a playlist writer or a metrics exporter can follow the stored objects without
// being part of the upload.
//
// A process-wide list of subscribers. The transfer publishes one StoredObject per stream file
// that had samples and got a key, once its attempt has ended (for a Success: after the object is
// visible in the store), on the uploading thread, before Transfer returns. Subscribers run on
// that thread one after the other, in the order they subscribed. They must be cheap (the next
// upload waits for them) and must not throw; an exception is caught and logged, and the other
// subscribers still run. A subscriber must not subscribe or unsubscribe from inside its call.
//
// Subscribe and the end of a Subscription may come from any thread at any time. Once a
// Subscription is destroyed (or reset), its subscriber is not running and is never called
// again: the end waits for a Publish that is calling it.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "platform/transfer/FileTransfer.h"
#include "platform/transfer/ObjectStore.h"
#include "platform/transfer/SegmentFormat.h"

// One stream file's object, as the transfer stored it (or tried to).
struct StoredObject {
    std::string streamingId;
    int64_t sequenceNumber = 0;
    std::string bucket;
    std::string key;  // where the object is, or would have been
    const SegmentFormat* format = nullptr;
    uint32_t durationMs = 0;      // the stream file's duration
    uint64_t captureMicros = 0;   // capture time of its first sample, µs since the epoch
    uint64_t size = 0;            // bytes stored; 0 unless result is Success
    uint32_t responseTimeMs = 0;  // the store's response time
    FileTransferResult result = Success;
    // The transfer object (one connection's run) that wrote it, unique in the process: objects
    // of two runs are never continuous (each run has its own timeline).
    uint64_t runId = 0;
    // Its first video sample comes from another opening of the input than the last video sample
    // of the run's object before: the pictures (and maybe the codec's parameters) start afresh.
    bool newInput = false;
    // The key of the init segment the object needs to play (the format's header, stored once
    // per run before the first object that needs it); "" for formats without one (TS).
    std::string initKey;
    // The store that took the object and the credentials of its Put, so that a subscriber can
    // store objects of its own beside it (playlists) the same way. Valid during the call only;
    // null for events that did not come from a transfer. Credentials are never to be logged.
    IObjectStore* store = nullptr;
    const StoreCredentials* credentials = nullptr;
};

class ObjectEvents {
  public:
    using Subscriber = std::function<void(const StoredObject&)>;

    // Keeps a subscriber on the list while it lives. Move-only.
    class Subscription {
      public:
        Subscription() = default;
        Subscription(Subscription&& other) noexcept : id_(std::exchange(other.id_, 0)) {}
        Subscription& operator=(Subscription&& other) noexcept {
            if (this != &other) {
                Reset();
                id_ = std::exchange(other.id_, 0);
            }
            return *this;
        }
        ~Subscription() { Reset(); }
        // Takes the subscriber off the list; waits while a Publish is calling it.
        void Reset();

      private:
        friend class ObjectEvents;
        explicit Subscription(uint64_t id) : id_(id) {}
        uint64_t id_ = 0;  // 0: none
    };

    // Adds `subscriber` at the end of the list.
    [[nodiscard]] static Subscription Subscribe(Subscriber subscriber);
    // Calls every subscriber with `object`. Uploading threads only.
    static void Publish(const StoredObject& object);
};
