// ReportLine: one line of a crash report, formatted into a fixed buffer without the heap.
//
// The crash handler may not call printf or malloc (the crash can happen inside them), so the
// report's lines are put together from these pieces. A line holds at most kCapacity - 1
// characters; whatever does not fit is cut off, the way a fixed printf buffer would cut it.
// Not thread-safe; meant to live on the crashing thread's stack.
#pragma once

#include <cstddef>
#include <cstdint>

namespace Tracewright {

class ReportLine {
  public:
    static constexpr size_t kCapacity = 1024;  // characters, including the terminating NUL

    ReportLine() { text_[0] = '\0'; }

    // Appends `text` (NUL-terminated; null appends nothing).
    ReportLine& Text(const char* text);
    // Appends at most `length` characters of `text`.
    ReportLine& Text(const char* text, size_t length);
    // Appends `value` in upper-case hexadecimal, padded with zeros to `width` digits; a wider
    // value is printed in full (never truncated). Width 0: no leading zeros.
    ReportLine& Hex(uint64_t value, int width);
    // Appends `value` in decimal, padded with zeros to `width` digits.
    ReportLine& Dec(int64_t value, int width = 0);

    const char* Data() const { return text_; }
    size_t Size() const { return size_; }

  private:
    char text_[kCapacity];
    size_t size_ = 0;  // characters in text_, without the NUL
};

// Copies `source` into `target` (capacity `size`, always NUL-terminated when size > 0);
// returns false if it had to be cut.
bool CopyText(char* target, size_t size, const char* source);

}  // namespace Tracewright
