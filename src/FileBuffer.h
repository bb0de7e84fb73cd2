// FileBuffer: the finished stream files between the stream buffer's filing thread (Push) and
// the data controller's upload thread (Pop), oldest first, in memory only.
//
// Its fill, the buffer count, is the sum of the queued files' durations in milliseconds, not a
// number of files. The buffer never refuses or drops a file for being over its limit; it only
// answers IsBufferFull, and the upload loop decides what to drop.
//
// Threads: Push on the filing thread (and once on the thread that stops the data controller);
// Pop and IsBufferFull on the upload thread; GetBufferCount on both. The queue's own mutex
// guards the records; the count is atomic, raised before a record becomes visible and lowered
// after it has left, so it is never below the sum of the queued durations (it may briefly
// include a record being pushed or popped). Files are held by value; their samples share the
// payloads with the stream buffer's samples, so no payload byte is copied.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>

#include "modulebase/BoundedQueue.h"
#include "src/IFileBuffer.h"

namespace Orvane {

class FileBuffer : public IFileBuffer {
  public:
    // `fullSize`: the limit for the buffer count, ms; 0 or negative gives 1000.
    explicit FileBuffer(int fullSize);
    // Releases the queued files unsent; an exception while emptying is logged, not thrown.
    ~FileBuffer() override;

    FileBuffer(const FileBuffer&) = delete;
    FileBuffer& operator=(const FileBuffer&) = delete;

    // Stores a copy at the back; never waits. An empty file (the data controller's wake-up
    // record) is queued like any other and adds nothing to the count.
    void Push(const VqStreamFileData& record) override;
    // Waits, without a time limit, until a file is there; returns the oldest.
    VqStreamFileData Pop() override;
    // True, with a "Buffer Over." line (priority 5), when the count reached the full size.
    bool IsBufferFull() override;
    uint64_t GetBufferCount() override;
    uint64_t FilesPushed() override;
    uint64_t LimitMs() override { return bufferFullSize_; }
    // `hook` runs on the popping thread after each Pop, outside the queue's lock (the count
    // has dropped). Set before the first Pop.
    void SetPopHook(std::function<void()> hook) { popHook_ = std::move(hook); }

  private:
    static constexpr uint64_t kCapacity = 2147483647;   // records; in practice unbounded
    static constexpr uint64_t kDefaultFullSize = 1000;  // ms, for a non-positive full size

    BoundedQueue<VqStreamFileData> queue_;
    const uint64_t bufferFullSize_;         // ms
    std::atomic<uint64_t> bufferCount_{0};  // ms, sum of the queued durations
    std::atomic<uint64_t> filesPushed_{0};  // non-empty records queued so far
    std::function<void()> popHook_;
};

}  // namespace Orvane
