#include "src/FileBuffer.h"

#include <exception>

#include "platform/logger/Logger.h"

namespace Orvane {

FileBuffer::FileBuffer(int fullSize)
    : queue_(kCapacity),
      bufferFullSize_(fullSize >= 1 ? static_cast<uint64_t>(fullSize) : kDefaultFullSize) {}

FileBuffer::~FileBuffer() {
    try {
        queue_.Clear();
    } catch (const std::exception& e) {
        Logger::Put(5, "src/FileBuffer", "Orvane::FileBuffer::~FileBuffer", __LINE__, "%s",
                    e.what());
    }
}

void FileBuffer::Push(const VqStreamFileData& record) {
    const uint64_t duration = record.duration;
    // Counted before it becomes visible to Pop, so the count never drops below the queue's sum.
    bufferCount_.fetch_add(duration);
    if (!queue_.Push(record)) {
        bufferCount_.fetch_sub(duration);
    } else if (!record.IsEmpty()) {
        filesPushed_.fetch_add(1);
    }
}

uint64_t FileBuffer::FilesPushed() {
    return filesPushed_.load();
}

VqStreamFileData FileBuffer::Pop() {
    VqStreamFileData record = queue_.Pop();
    bufferCount_.fetch_sub(record.duration);
    if (popHook_) popHook_();
    return record;
}

bool FileBuffer::IsBufferFull() {
    const uint64_t count = bufferCount_.load();
    if (count < bufferFullSize_) return false;
    Logger::Put(5, "src/FileBuffer", "Orvane::FileBuffer::IsBufferFull", __LINE__,
                "Buffer Over. %zu/%zu", static_cast<size_t>(count),
                static_cast<size_t>(bufferFullSize_));
    return true;
}

uint64_t FileBuffer::GetBufferCount() {
    return bufferCount_.load();
}

}  // namespace Orvane
