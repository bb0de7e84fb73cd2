// Appending, allocation-free writer of the crash report file (see ReportFile.h).
#include "crashreport/ReportFile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace Tracewright {

bool ReportFile::Open(const char* path) {
    Close();
    // Never through a symbolic link at the last component (a link planted beside the
    // executable would make a crash append to any file), and readable by the group only.
    int fd = open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW, 0640);
    if (fd < 0) return false;
    // Another crashing process may be writing its report; wait for it rather than mixing
    // lines. A lock holder that never finishes is ended by the handler's deadline.
    while (flock(fd, LOCK_EX) != 0 && errno == EINTR) {
    }
    fd_ = fd;
    used_ = 0;
    return true;
}

void ReportFile::Write(const ReportLine& line) {
    append(line.Data(), line.Size());
}

void ReportFile::Write(const char* text) {
    append(text, std::strlen(text));
}

void ReportFile::Close() {
    if (fd_ < 0) return;
    Flush();
    fdatasync(fd_);
    close(fd_);  // also releases the flock
    fd_ = -1;
}

void ReportFile::append(const char* text, size_t size) {
    if (fd_ < 0) return;
    while (size > 0) {
        if (used_ == sizeof(buffer_)) Flush();
        size_t part = sizeof(buffer_) - used_;
        if (part > size) part = size;
        std::memcpy(buffer_ + used_, text, part);
        used_ += part;
        text += part;
        size -= part;
    }
}

void ReportFile::Flush() {
    if (fd_ < 0) return;
    size_t done = 0;
    while (done < used_) {
        ssize_t n = write(fd_, buffer_ + done, used_ - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;  // write errors are ignored: the rest of the buffer is dropped
        done += static_cast<size_t>(n);
    }
    used_ = 0;
}

}  // namespace Tracewright
