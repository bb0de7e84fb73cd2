// LocalDirectoryStore: a directory on the local file system as an object store (`file:///dir`).
//
// An object goes to <root>/<bucket>/<key>. It is written under a temporary name in the key's
// own directory (a hidden name that is never a key), flushed to disk (fsync), then renamed into
// place and the directory flushed too, so a reader sees the whole object or none of it. The
// key's subdirectories are created as needed; the bucket directory itself must exist, as an S3
// bucket must.
//
// Results: Success; FilePathError for a missing bucket directory, or a bucket or key that is
// not a plain relative path (empty, absolute, with "." or ".." parts: nothing is ever written
// outside the bucket directory); InternalError for write errors (full disk, read-only file
// system, I/O error), after which no temporary file is left behind; TimeOut once Cancel was
// called. Credentials are not used.
//
// Threads: Put runs on the caller's thread and blocks; Cancel may come from any thread and stops
// a running Put between chunks of at most 1 MiB. Several Puts may run at once (each uses its own
// temporary file).
#pragma once

#include <atomic>
#include <string>

#include "platform/transfer/ObjectStore.h"

class LocalDirectoryStore : public IObjectStore {
  public:
    // `root`: the directory that holds the bucket directories (absolute path).
    explicit LocalDirectoryStore(std::string root);

    FileTransferResult Put(const ObjectToStore& object, const StoreCredentials& credentials,
                           FileTransferInfo* info) override;
    void Cancel() override;

    const std::string& Root() const { return root_; }

  private:
    const std::string root_;
    std::atomic<bool> cancelled_{false};
};
