#include "platform/transfer/LocalDirectoryStore.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <random>

#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/transfer/LocalDirectoryStore";
constexpr const char* kFunction = "LocalDirectoryStore::Put";
constexpr size_t kChunk = 1 << 20;  // bytes per write between checks for Cancel

// Closes a file descriptor when it goes out of scope.
class Fd {
  public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd() { Reset(-1); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int Get() const { return fd_; }
    void Reset(int fd) {
        if (fd_ >= 0) close(fd_);
        fd_ = fd;
    }
    // Gives the descriptor away.
    int Release() {
        int fd = fd_;
        fd_ = -1;
        return fd;
    }
    // Closes now; the result of close().
    int Close() {
        int rc = close(fd_);
        fd_ = -1;
        return rc;
    }

  private:
    int fd_;
};

// Splits a key into its '/'-separated parts; false when a part is empty, "." or "..", or the
// name holds a NUL byte: such a key could leave the bucket directory or name a directory.
bool splitKey(const std::string& key, std::vector<std::string>* parts) {
    if (key.empty() || key.find('\0') != std::string::npos) return false;
    size_t start = 0;
    while (true) {
        size_t slash = key.find('/', start);
        std::string part = key.substr(start, slash == std::string::npos ? slash : slash - start);
        if (part.empty() || part == "." || part == "..") return false;
        parts->push_back(part);
        if (slash == std::string::npos) return true;
        start = slash + 1;
    }
}

// Errors of the file system that may pass by themselves.
bool transient(int error) {
    switch (error) {
        case EIO:
        case ENOSPC:
        case EDQUOT:
        case EMFILE:
        case ENFILE:
        case ENOMEM:
        case EAGAIN:
        case EBUSY:
            return true;
        default:
            return false;
    }
}

// An attempt that failed with `error` (an errno), as InternalError.
AttemptOutcome failedWith(int error) {
    return {InternalError, transient(error)};
}

// A unique hidden temporary name, without the extension that ends every key the transfer writes.
std::string temporaryName() {
    static std::atomic<unsigned> counter{0};
    thread_local std::mt19937_64 random{std::random_device{}()};
    return ".sfr-upload-" + std::to_string(getpid()) + "-" + std::to_string(counter++) + "-" +
           std::to_string(random() % 1000000000);
}

// Opens (creating when missing) the directory `name` in `parent` without following a symbolic
// link; `path` is its path for log lines.
AttemptOutcome openSubdirectory(int parent, const std::string& name, const std::string& path,
                                Fd& out) {
    const int flags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    int fd = openat(parent, name.c_str(), flags);
    if (fd < 0 && errno == ENOENT && (mkdirat(parent, name.c_str(), 0755) == 0 || errno == EEXIST))
        fd = openat(parent, name.c_str(), flags);
    if (fd >= 0) {
        out.Reset(fd);
        return {Success, false};
    }
    const int error = errno;
    struct stat st {};
    if ((error == ELOOP || error == ENOTDIR) &&
        fstatat(parent, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
        Logger::Put(5, kFile, kFunction, __LINE__, "%s is %s", path.c_str(),
                    S_ISLNK(st.st_mode) ? "a symbolic link" : "not a directory");
        return {FilePathError, false};
    }
    Logger::Put(5, kFile, kFunction, __LINE__, "cannot create %s: %s", path.c_str(),
                std::strerror(error));
    return error == ENOTDIR ? AttemptOutcome{FilePathError, false} : failedWith(error);
}

// Writes all of `data` to `fd`; stops early (false, errno 0) when `cancel` is raised.
bool writeAll(int fd, const uint8_t* data, size_t size, const CancelSignal& cancel) {
    size_t done = 0;
    while (done < size) {
        if (cancel.Raised()) {
            errno = 0;
            return false;
        }
        ssize_t n = write(fd, data + done, std::min(kChunk, size - done));
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) {
            if (n == 0) errno = ENOSPC;
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

// Fills the temporary file `temporary` (open in `file`) in the directory `dir` with the object,
// flushes it and renames it to `name`. Leaves no temporary file behind when it fails.
AttemptOutcome fillAndRename(int dir, Fd& file, const std::string& temporary,
                             const std::string& name, const std::string& path,
                             const ObjectToStore& object, const CancelSignal& cancel) {
    auto abandon = [&](AttemptOutcome outcome, const char* what, int error) {
        if (error != 0)
            Logger::Put(5, kFile, kFunction, __LINE__, "cannot %s %s: %s", what, path.c_str(),
                        std::strerror(error));
        file.Reset(-1);
        unlinkat(dir, temporary.c_str(), 0);
        return outcome;
    };
    if (!writeAll(file.Get(), object.data, object.size, cancel)) {
        const int error = errno;
        return abandon(error == 0 ? AttemptOutcome{TimeOut, false} : failedWith(error), "write",
                       error);
    }
    if (fsync(file.Get()) != 0) return abandon(failedWith(errno), "flush", errno);
    if (file.Close() != 0) return abandon(failedWith(errno), "close", errno);
    if (cancel.Raised()) return abandon({TimeOut, false}, "write", 0);
    if (renameat(dir, temporary.c_str(), dir, name.c_str()) != 0) {
        const int error = errno;
        return abandon(error == EISDIR ? AttemptOutcome{FilePathError, false} : failedWith(error),
                       "rename into", error);
    }
    fsync(dir);  // best effort: the object itself is already on disk
    Logger::Put(13, kFile, kFunction, __LINE__, "stored %s (%zu bytes)", path.c_str(), object.size);
    return {Success, false};
}

}  // namespace

LocalDirectoryStore::LocalDirectoryStore(std::string root, RetryPolicy retry)
    : root_(std::move(root)), retry_(retry) {}

void LocalDirectoryStore::Cancel() {
    cancel_.Raise();
}

bool LocalDirectoryStore::ValidKey(const std::string& key, std::string& why) {
    std::vector<std::string> parts;
    if (splitKey(key, &parts)) return true;
    why = "key \"" + key + "\" has an empty, \".\" or \"..\" part, or a NUL byte";
    return false;
}

FileTransferResult LocalDirectoryStore::Put(const ObjectToStore& object,
                                            const StoreCredentials& /*credentials*/,
                                            FileTransferInfo* info) {
    const auto start = std::chrono::steady_clock::now();
    const FileTransferResult result = store(object);
    if (info) {
        info->fileSize = result == Success ? object.size : 0;
        info->responseTime =
            static_cast<uint32_t>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                      std::chrono::steady_clock::now() - start)
                                      .count());
    }
    return result;
}

FileTransferResult LocalDirectoryStore::store(const ObjectToStore& object) {
    if (cancel_.Raised()) return TimeOut;
    std::vector<std::string> parts;
    if (object.bucket.empty() || object.bucket.find('/') != std::string::npos ||
        object.bucket == "." || object.bucket == ".." || !splitKey(object.key, &parts)) {
        Logger::Put(5, kFile, kFunction, __LINE__, "not a storable bucket/key: \"%s\" \"%s\"",
                    object.bucket.c_str(), object.key.c_str());
        return FilePathError;
    }
    return RunAttempts(retry_, cancel_, [&] { return writeOnce(object, parts); });
}

AttemptOutcome LocalDirectoryStore::writeOnce(const ObjectToStore& object,
                                              const std::vector<std::string>& parts) {
    std::string directory = root_ + "/" + object.bucket;
    Fd dir(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (dir.Get() < 0) {
        const int error = errno;
        if (error != ENOENT && error != ENOTDIR) {
            Logger::Put(5, kFile, kFunction, __LINE__, "cannot open %s: %s", directory.c_str(),
                        std::strerror(error));
            return failedWith(error);
        }
        Logger::Put(5, kFile, kFunction, __LINE__, "bucket directory %s does not exist",
                    directory.c_str());
        return {FilePathError, false};
    }
    for (size_t i = 0; i + 1 < parts.size(); ++i) {
        directory += "/" + parts[i];
        Fd sub;
        const AttemptOutcome opened = openSubdirectory(dir.Get(), parts[i], directory, sub);
        if (opened.result != Success) return opened;
        dir.Reset(sub.Release());
    }
    std::string temporary;
    Fd file;
    for (int tries = 0; file.Get() < 0 && tries < 16; ++tries) {
        temporary = temporaryName();
        file.Reset(openat(dir.Get(), temporary.c_str(),
                          O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0644));
        if (file.Get() < 0 && errno != EEXIST) break;
    }
    if (file.Get() < 0) {
        const int error = errno;
        Logger::Put(5, kFile, kFunction, __LINE__, "cannot create a file in %s: %s",
                    directory.c_str(), std::strerror(error));
        return failedWith(error);
    }
    return fillAndRename(dir.Get(), file, temporary, parts.back(), directory + "/" + parts.back(),
                         object, cancel_);
}
