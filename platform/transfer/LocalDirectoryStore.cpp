#include "platform/transfer/LocalDirectoryStore.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <random>
#include <vector>

#include "platform/logger/Logger.h"

namespace {

constexpr const char* kFile = "platform/transfer/LocalDirectoryStore";
constexpr const char* kFunction = "LocalDirectoryStore::Put";
constexpr size_t kChunk = 1 << 20;  // bytes per write between checks for Cancel

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

// A unique temporary name in `directory`: hidden, and without the extension that ends every
// key the transfer writes.
std::string temporaryName(const std::string& directory) {
    static std::atomic<unsigned> counter{0};
    thread_local std::mt19937_64 random{std::random_device{}()};
    return directory + "/.sfr-upload-" + std::to_string(getpid()) + "-" +
           std::to_string(counter++) + "-" + std::to_string(random() % 1000000000);
}

void syncDirectory(const std::string& directory) {
    int fd = open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return;
    fsync(fd);  // best effort: the object itself is already on disk
    close(fd);
}

}  // namespace

LocalDirectoryStore::LocalDirectoryStore(std::string root) : root_(std::move(root)) {}

void LocalDirectoryStore::Cancel() {
    cancelled_ = true;
}

FileTransferResult LocalDirectoryStore::Put(const ObjectToStore& object,
                                            const StoreCredentials& /*credentials*/,
                                            FileTransferInfo* info) {
    const auto start = std::chrono::steady_clock::now();
    auto finish = [&](FileTransferResult result, uint64_t size) {
        if (info) {
            info->fileSize = size;
            info->responseTime =
                static_cast<uint32_t>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                          std::chrono::steady_clock::now() - start)
                                          .count());
        }
        return result;
    };
    if (cancelled_) return finish(TimeOut, 0);

    std::vector<std::string> parts;
    if (object.bucket.empty() || object.bucket.find('/') != std::string::npos ||
        object.bucket == "." || object.bucket == ".." || !splitKey(object.key, &parts)) {
        Logger::Put(5, kFile, kFunction, __LINE__, "not a storable bucket/key: \"%s\" \"%s\"",
                    object.bucket.c_str(), object.key.c_str());
        return finish(FilePathError, 0);
    }
    std::string directory = root_ + "/" + object.bucket;
    struct stat st {};
    if (stat(directory.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
        Logger::Put(5, kFile, kFunction, __LINE__, "bucket directory %s does not exist",
                    directory.c_str());
        return finish(FilePathError, 0);
    }
    for (size_t i = 0; i + 1 < parts.size(); ++i) {
        directory += "/" + parts[i];
        if (mkdir(directory.c_str(), 0755) == 0 || errno == EEXIST) {
            if (stat(directory.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) continue;
            Logger::Put(5, kFile, kFunction, __LINE__, "%s is not a directory", directory.c_str());
            return finish(FilePathError, 0);
        }
        Logger::Put(5, kFile, kFunction, __LINE__, "cannot create %s: %s", directory.c_str(),
                    std::strerror(errno));
        return finish(errno == ENOTDIR ? FilePathError : InternalError, 0);
    }
    const std::string finalPath = directory + "/" + parts.back();

    std::string temporary;
    int fd = -1;
    for (int attempt = 0; fd < 0 && attempt < 16; ++attempt) {
        temporary = temporaryName(directory);
        fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
        if (fd < 0 && errno != EEXIST) break;
    }
    if (fd < 0) {
        Logger::Put(5, kFile, kFunction, __LINE__, "cannot create a file in %s: %s",
                    directory.c_str(), std::strerror(errno));
        return finish(InternalError, 0);
    }
    auto abandon = [&](FileTransferResult result, const char* what, int error) {
        if (error != 0)
            Logger::Put(5, kFile, kFunction, __LINE__, "cannot %s %s: %s", what, finalPath.c_str(),
                        std::strerror(error));
        if (fd >= 0) close(fd);
        unlink(temporary.c_str());
        return finish(result, 0);
    };

    size_t done = 0;
    while (done < object.size) {
        if (cancelled_) return abandon(TimeOut, "write", 0);
        size_t chunk = std::min(kChunk, object.size - done);
        ssize_t n = write(fd, object.data + done, chunk);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return abandon(InternalError, "write", n < 0 ? errno : ENOSPC);
        done += static_cast<size_t>(n);
    }
    if (fsync(fd) != 0) return abandon(InternalError, "flush", errno);
    int closed = close(fd);
    fd = -1;
    if (closed != 0) return abandon(InternalError, "close", errno);
    if (cancelled_) return abandon(TimeOut, "write", 0);
    if (rename(temporary.c_str(), finalPath.c_str()) != 0)
        return abandon(errno == EISDIR ? FilePathError : InternalError, "rename into", errno);
    syncDirectory(directory);
    Logger::Put(13, kFile, kFunction, __LINE__, "stored %s (%zu bytes)", finalPath.c_str(),
                object.size);
    return finish(Success, object.size);
}
