// ReportFile: the log file a crash report is appended to, written without the heap.
//
// Open() appends to the file (created with mode 0640 if absent, never through a symbolic link at
// its last component) and takes an exclusive flock so that reports of processes crashing at the
// same time beside the same executable do not interleave. Lines are gathered in a fixed buffer and
// written with write(2); Close() flushes, syncs the data to disk and closes. Write errors are
// ignored: a report is best effort and must never stop the process from ending. Used only by the
// thread that holds the crash handler's busy flag.
#pragma once

#include <cstddef>

#include "crashreport/ReportLine.h"

namespace Tracewright {

class ReportFile {
  public:
    ReportFile() = default;
    ~ReportFile() { Close(); }
    ReportFile(const ReportFile&) = delete;
    ReportFile& operator=(const ReportFile&) = delete;

    // False when the file cannot be opened; the report is then not written.
    bool Open(const char* path);
    bool IsOpen() const { return fd_ >= 0; }
    // Appends the line's text; nothing when the file is not open.
    void Write(const ReportLine& line);
    void Write(const char* text);
    // Writes the buffered lines now, so that they survive a crash later in the report.
    void Flush();
    void Close();

  private:
    void append(const char* text, size_t size);

    int fd_ = -1;
    char buffer_[4096];
    size_t used_ = 0;  // bytes of buffer_ not yet written
};

}  // namespace Tracewright
