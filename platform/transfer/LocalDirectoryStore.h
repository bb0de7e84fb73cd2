// LocalDirectoryStore: a directory on the local file system as an object store (`file:///dir`).
//
// An object goes to <root>/<bucket>/<key>. It is written under a temporary name in the key's
// own directory (a hidden name that is never a key), flushed to disk, then renamed into place
// and the directory flushed too, so a reader sees the whole object or none of it. The key's
// subdirectories are created as needed; the bucket directory itself must exist, as an S3
// bucket must. The root and the bucket directory may be symbolic links; the key's directories
// are walked one by one without following any (openat with O_NOFOLLOW), so a link planted
// inside the bucket cannot lead an object outside it.
//
// Results: Success; FilePathError for a missing bucket directory, a bucket or key that is not a
// plain relative path (empty, absolute, with "." or ".." parts: nothing is ever written outside
// the bucket directory), or a key whose directories pass through a symbolic link or a file;
// InternalError for write errors (full disk, read-only file system, I/O error), after which no
// temporary file is left behind; TimeOut once Cancel was called. Credentials are not used.
// Write errors that may pass (I/O error, full disk, no file descriptors) are tried again within
// the Put as RetryPolicy says.
//
// Threads: Put runs on the caller's thread and blocks; Cancel may come from any thread and stops
// a running Put between chunks of at most 1 MiB, or its wait before another attempt, at once.
// Several Puts may run at once (each uses its own temporary file).
#pragma once

#include <string>
#include <vector>

#include "platform/transfer/ObjectStore.h"
#include "platform/transfer/RetryPacing.h"

class LocalDirectoryStore : public IObjectStore {
  public:
    // `root`: the directory that holds the bucket directories (absolute path).
    explicit LocalDirectoryStore(std::string root, RetryPolicy retry = RetryPolicy());

    FileTransferResult Put(const ObjectToStore& object, const StoreCredentials& credentials,
                           FileTransferInfo* info) override;
    void Cancel() override;

    const std::string& Root() const { return root_; }

    // Whether a key can name a file below a bucket directory: its '/'-separated parts are not
    // empty, "." or "..", and it holds no NUL byte. False with a reason.
    static bool ValidKey(const std::string& key, std::string& why);

  private:
    // Checks the names, then writes with retries.
    FileTransferResult store(const ObjectToStore& object);
    // One attempt at writing the object to <root>/<bucket>/<parts...>.
    AttemptOutcome writeOnce(const ObjectToStore& object, const std::vector<std::string>& parts);

    const std::string root_;
    const RetryPolicy retry_;
    CancelSignal cancel_;  // raised by Cancel
};
