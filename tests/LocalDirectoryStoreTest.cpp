// The local-directory store. Faults guarded: a reader seeing a partial object or a temporary
// file left behind; a key or bucket that leaves the bucket (absolute, "..", ".", empty parts) or
// follows a symbolic link planted in it; a write error taken for success or leaving a partial
// file; Cancel not ending a running Put and every later one.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "platform/transfer/LocalDirectoryStore.h"
#include "tests/support/StoreRoot.h"
#include "tests/support/TestSupport.h"

using namespace testsupport;

namespace {

const auto Entries = StoreRoot::Entries;

class LocalDirectoryStoreTest : public ::testing::Test {
  protected:
    FileTransferResult Put(const std::string& key, const std::string& bytes,
                           const std::string& bucket = "rec") {
        return store_.Put(ObjectFor(bucket, key, bytes), StoreCredentials(), &info_);
    }

    StoreRoot dir_;
    const std::string root_ = dir_.Root();
    LocalDirectoryStore store_{root_};
    FileTransferInfo info_;
};

TEST_F(LocalDirectoryStoreTest, ReaderSeesTheWholeObjectOrNothing) {
    const std::string key = "cam1/2026/12/06/cam1_20261206T110000.000Z_1.ts";
    const std::string path = dir_.Path(key);
    std::string bytes(48 << 20, '\0');
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(i * 7);

    // A reader looking at the key as often as it can: whenever it exists, it has every byte.
    std::atomic<bool> done{false};
    std::atomic<size_t> partialSightings{0}, sightings{0};
    std::thread reader([&] {
        while (!done) {
            struct stat st {};
            if (stat(path.c_str(), &st) != 0) continue;
            ++sightings;
            if (static_cast<size_t>(st.st_size) != bytes.size()) ++partialSightings;
        }
    });
    FileTransferResult result = Put(key, bytes);
    ASSERT_TRUE(WaitUntil([&] { return sightings > 0; }));
    done = true;
    reader.join();
    EXPECT_EQ(Success, result);
    EXPECT_EQ(bytes.size(), info_.fileSize);
    EXPECT_EQ(0u, partialSightings.load());
    EXPECT_TRUE(ReadFile(path) == bytes);
    // Only the object is left in its directory: no temporary file.
    EXPECT_EQ(std::vector<std::string>{"cam1_20261206T110000.000Z_1.ts"},
              Entries(root_ + "/rec/cam1/2026/12/06"));
    // Storing the same key again replaces the object whole.
    EXPECT_EQ(Success, Put(key, "second"));
    EXPECT_EQ("second", ReadFile(path));
}

TEST_F(LocalDirectoryStoreTest, PathsOutsideAnExistingBucketAreFilePathErrors) {
    const std::pair<const char*, const char*> refused[] = {
        // bucket, key
        {"missing", "cam1/a.ts"},
        {"", "a.ts"},
        {"..", "a.ts"},
        {".", "a.ts"},
        {"rec/sub", "a.ts"},
        {"rec", ""},
        {"rec", "/etc/a.ts"},
        {"rec", "../a.ts"},
        {"rec", "cam1/../../a.ts"},
        {"rec", "cam1//a.ts"},
        {"rec", "cam1/./a.ts"},
        {"rec", "cam1/"},
    };
    for (const auto& [bucket, key] : refused)
        EXPECT_EQ(FilePathError, Put(key, "x", bucket)) << bucket << " " << key;
    // Directories of the key that are symbolic links, to the outside or inside the bucket.
    StoreRoot outside;
    ASSERT_EQ(0, symlink(outside.Root().c_str(), (root_ + "/rec/out").c_str()));
    ASSERT_EQ(0, symlink(".", (root_ + "/rec/in").c_str()));
    for (const char* key : {"out/a.ts", "out/rec/a.ts", "in/a.ts"})
        EXPECT_EQ(FilePathError, Put(key, "x")) << key;
    EXPECT_EQ(std::vector<std::string>{"rec"}, Entries(outside.Root()));
    for (const char* link : {"out", "in"}) unlink(dir_.Path(link).c_str());
    LocalDirectoryStore noRoot(root_ + "/nowhere");
    EXPECT_EQ(FilePathError, noRoot.Put(ObjectFor("rec", "a.ts", "x"), StoreCredentials(), &info_));
    // A key part that is a file where a directory must be.
    ASSERT_EQ(Success, Put("cam1", "x"));
    EXPECT_EQ(FilePathError, Put("cam1/a.ts", "x"));
    EXPECT_EQ(Entries(root_), std::vector<std::string>{"rec"});
    EXPECT_EQ(Entries(root_ + "/rec"), std::vector<std::string>{"cam1"});
}

// A write error: RLIMIT_FSIZE stops writes past the limit with EFBIG, also for root.
TEST_F(LocalDirectoryStoreTest, WriteErrorIsAnInternalErrorAndLeavesNothing) {
    std::string big(3 << 20, 'x');
    struct rlimit saved {};
    getrlimit(RLIMIT_FSIZE, &saved);
    const auto previous = signal(SIGXFSZ, SIG_IGN);
    struct rlimit limit = saved;
    limit.rlim_cur = 1 << 20;
    ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
    FileTransferResult result = Put("cam1/a.ts", big);
    setrlimit(RLIMIT_FSIZE, &saved);
    signal(SIGXFSZ, previous);
    EXPECT_EQ(InternalError, result);
    EXPECT_EQ(0u, info_.fileSize);
    EXPECT_TRUE(Entries(root_ + "/rec/cam1").empty());
}

TEST_F(LocalDirectoryStoreTest, CancelEndsARunningPutAndEveryLaterOne) {
    // Cancelled while writing: TimeOut (or already stored whole), and no temporary file left.
    std::string big(128 << 20, 'x');
    std::atomic<bool> started{false};
    FileTransferResult running = Success;
    std::thread writer([&] {
        started = true;
        running = Put("cam1/big.ts", big);
    });
    ASSERT_TRUE(WaitUntil([&] { return started.load(); }));
    store_.Cancel();
    writer.join();
    EXPECT_TRUE(running == TimeOut || running == Success);
    for (const std::string& name : Entries(root_ + "/rec/cam1")) EXPECT_EQ("big.ts", name);

    EXPECT_EQ(TimeOut, Put("cam1/later.ts", "x"));
    EXPECT_EQ(0u, info_.fileSize);
    EXPECT_NE(0, access(dir_.Path("cam1/later.ts").c_str(), F_OK));
}

}  // namespace
