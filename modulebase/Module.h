// Module: decouples the host's receive callbacks from a module's media processing.
//
// Owns three bounded queues (video 50, audio 20, meta 20 samples) and one worker thread per
// queue. Producers (any thread) only enqueue and never block: a full queue drops the newest
// sample with one "queue overflow (...)" line. That suits a live input, where waiting would only
// move the loss into the socket; an input that can wait (a file) asks WaitForRoom before it
// pushes and so never loses a sample. Every push is counted per media (one relaxed atomic
// increment, and one more when the queue was full), for monitoring. Each worker takes everything
// queued in one go and calls the derived class's Process* hook for each sample in order; no Module
// lock is held while a hook runs, so the three hooks run concurrently and the derived class
// synchronises what they share.
//
// Shutdown and flushing use marker samples (payloadSize 0), which never reach the hooks.
// StartThreads/StopThreads/FlushQueues are called from one controlling thread, never from a
// worker. A Module must not be destroyed while its workers run.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <thread>

#include "modulebase/BoundedQueue.h"
#include "modulebase/ModuleInterface.h"

class Module : public ModuleInterface {
  public:
    Module();
    ~Module() override;

    void PushVideo(std::shared_ptr<StreamData> sample) override;
    void PushAudio(std::shared_ptr<StreamData> sample) override;
    void PushMeta(std::shared_ptr<StreamData> sample) override;
    void Restart() override;
    // Pushes a marker into each queue in turn and waits until its worker has handled that
    // marker, identified by its queue ticket, so every flush waits for what was queued before
    // it (an earlier flush or stop does not satisfy a later one). A queue whose worker is not
    // running is not waited for.
    void FlushQueues() override;
    // Between BeginBurst and EndBurst, pushes from the calling producer do not wake the
    // workers; EndBurst wakes each once. Called by the one producer thread that pushes.
    void BeginBurst() override;
    void EndBurst() override;
    // Removes every queued real sample; markers stay.
    void ClearQueues() override;
    // Blocks until the video, audio and meta queues have room for `video`, `audio` and `meta`
    // more samples (each at most its queue's capacity), woken by the workers as they take
    // samples; false at `deadline`, or at once when the workers are not running or being
    // stopped (StopThreads ends a wait at once). One producer waits at a time.
    bool WaitForRoom(size_t video, size_t audio, size_t meta,
                     std::chrono::steady_clock::time_point deadline) override;

    // Samples pushed (accepted or not) and refused for a full queue since construction, per
    // media: [0] video, [1] audio, [2] meta. Any thread; the three media are read one after the
    // other, not as one snapshot.
    struct QueueCounts {
        uint64_t received[3] = {0, 0, 0};
        uint64_t overflows[3] = {0, 0, 0};
    };
    QueueCounts Counts() const;

    // Makes Clear keep markers and drop samples, then calls OnInitialize.
    bool Initialize(std::shared_ptr<void> parameter);
    // Starts the three workers. Only when none runs. Throws std::system_error when a thread
    // cannot be created.
    void StartThreads();
    // Discards queued samples, wakes each worker with a marker and joins it. Safe to call
    // again or before StartThreads.
    void StopThreads();

  private:
    using Queue = BoundedQueue<std::shared_ptr<StreamData>>;
    enum Media { kVideo, kAudio, kMeta, kMediaCount };

    // One media type's queue and the worker that empties it.
    struct Lane {
        explicit Lane(uint64_t capacity) : queue(capacity) {}
        Queue queue;
        std::shared_ptr<std::thread> worker;
        std::condition_variable markerHandled;  // a marker was handled; FlushQueues waits
        uint64_t markerTicket = 0;  // queue ticket of the newest marker handled; markerMutex_
        std::atomic<bool> running{false};
        std::atomic<uint64_t> received{0};   // relaxed: a count, orders nothing
        std::atomic<uint64_t> overflows{0};  // relaxed
    };

    // Counts the push and appends `sample`; a full queue drops it, counted, with the overflow line.
    void push(Media media, std::shared_ptr<StreamData> sample);

    void workerLoop(Media media);
    void process(Media media, std::shared_ptr<StreamData> sample);

    Lane lanes_[kMediaCount]{Lane(50), Lane(20), Lane(20)};
    std::mutex markerMutex_;              // guards every lane's markerTicket
    std::atomic<bool> burstOpen_{false};  // pushes leave the workers asleep; relaxed
};
