// IFileBuffer: the finished stream files between the filing thread (Push) and the upload
// thread (Pop), oldest first. Its fill is the sum of the files' durations in milliseconds.
#pragma once

#include <cstdint>

#include "src/VqStreamFileData.h"

namespace Orvane {

class IFileBuffer {
  public:
    // Never waits for room and never refuses for being over the limit.
    virtual void Push(const VqStreamFileData& record) = 0;
    // Waits, without a time limit, while the buffer is empty.
    virtual VqStreamFileData Pop() = 0;
    // True (with a "Buffer Over." line) when the buffer count reached the buffer full size.
    virtual bool IsBufferFull() = 0;
    // Sum of the durations of the queued files, ms.
    virtual uint64_t GetBufferCount() = 0;
    virtual ~IFileBuffer() = default;
    // Stream files (not empty records) queued since construction, for the end-of-stream drain;
    // a buffer that is never drained (a test double) may keep the answer 0.
    virtual uint64_t FilesPushed() { return 0; }
    // The buffer count (ms) at which the buffer is full; 0 when it has no limit to tell (a
    // test double). Any thread.
    virtual uint64_t LimitMs() { return 0; }
};

}  // namespace Orvane
