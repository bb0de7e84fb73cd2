// Allocation-free line formatting for the crash report (see ReportLine.h).
#include "crashreport/ReportLine.h"

namespace Tracewright {

ReportLine& ReportLine::Text(const char* text) {
    if (text == nullptr) return *this;
    while (*text != '\0' && size_ + 1 < kCapacity) text_[size_++] = *text++;
    text_[size_] = '\0';
    return *this;
}

ReportLine& ReportLine::Text(const char* text, size_t length) {
    if (text == nullptr) return *this;
    for (size_t i = 0; i < length && text[i] != '\0' && size_ + 1 < kCapacity; ++i) {
        text_[size_++] = text[i];
    }
    text_[size_] = '\0';
    return *this;
}

ReportLine& ReportLine::Hex(uint64_t value, int width) {
    char digits[16];
    int count = 0;
    do {
        digits[count++] = "0123456789ABCDEF"[value & 0xF];
        value >>= 4;
    } while (value != 0);
    for (int i = count; i < width && size_ + 1 < kCapacity; ++i) text_[size_++] = '0';
    while (count > 0 && size_ + 1 < kCapacity) text_[size_++] = digits[--count];
    text_[size_] = '\0';
    return *this;
}

ReportLine& ReportLine::Dec(int64_t value, int width) {
    // Work on the magnitude as unsigned so that INT64_MIN prints correctly.
    uint64_t magnitude = value < 0 ? 0 - static_cast<uint64_t>(value) : value;
    char digits[20];
    int count = 0;
    do {
        digits[count++] = static_cast<char>('0' + magnitude % 10);
        magnitude /= 10;
    } while (magnitude != 0);
    if (value < 0 && size_ + 1 < kCapacity) text_[size_++] = '-';
    for (int i = count; i < width && size_ + 1 < kCapacity; ++i) text_[size_++] = '0';
    while (count > 0 && size_ + 1 < kCapacity) text_[size_++] = digits[--count];
    text_[size_] = '\0';
    return *this;
}

bool CopyText(char* target, size_t size, const char* source) {
    if (size == 0) return false;
    size_t i = 0;
    for (; source != nullptr && source[i] != '\0'; ++i) {
        if (i + 1 == size) {
            target[i] = '\0';
            return false;
        }
        target[i] = source[i];
    }
    target[i] = '\0';
    return true;
}

}  // namespace Tracewright
