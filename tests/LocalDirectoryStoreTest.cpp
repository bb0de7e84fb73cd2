// The local-directory store: whole objects or none, paths that stay inside the bucket, write
// errors, cancellation.
#include <dirent.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "platform/transfer/LocalDirectoryStore.h"
#include "tests/support/TestSupport.h"

using namespace testsupport;

namespace {

class LocalDirectoryStoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        char templ[] = "/tmp/sfr-store-XXXXXX";
        root_ = mkdtemp(templ);
        mkdir((root_ + "/rec").c_str(), 0755);
    }
    void TearDown() override {
        if (mounted_) umount(mountPoint_.c_str());
        RunProcess({"rm", "-rf", root_});
    }

    ObjectToStore Object(const std::string& key, const std::string& bytes) {
        ObjectToStore object;
        object.bucket = "rec";
        object.key = key;
        object.data = reinterpret_cast<const uint8_t*>(bytes.data());
        object.size = bytes.size();
        return object;
    }

    // Names in a directory other than . and ..
    static std::vector<std::string> Entries(const std::string& directory) {
        std::vector<std::string> names;
        if (DIR* d = opendir(directory.c_str())) {
            while (dirent* e = readdir(d)) {
                std::string name = e->d_name;
                if (name != "." && name != "..") names.push_back(name);
            }
            closedir(d);
        }
        return names;
    }

    std::string root_;
    std::string mountPoint_;
    bool mounted_ = false;
};

TEST_F(LocalDirectoryStoreTest, ReaderSeesTheWholeObjectOrNothing) {
    LocalDirectoryStore store(root_);
    const std::string key = "cam1/2026/12/06/cam1_20261206T110000.000Z_1.ts";
    const std::string path = root_ + "/rec/" + key;
    std::string bytes(48 << 20, '\0');
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(i * 7);

    // A reader that opens the key as often as it can while the object is written: whenever
    // the key exists, it already has every byte.
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
    FileTransferInfo info;
    FileTransferResult result = store.Put(Object(key, bytes), StoreCredentials(), &info);
    ASSERT_TRUE(WaitUntil([&] { return sightings > 0; }));
    done = true;
    reader.join();

    EXPECT_EQ(Success, result);
    EXPECT_EQ(bytes.size(), info.fileSize);
    EXPECT_EQ(0u, partialSightings.load());
    EXPECT_TRUE(ReadFile(path) == bytes);
    // Only the object is left in its directory: no temporary file.
    EXPECT_EQ(std::vector<std::string>{"cam1_20261206T110000.000Z_1.ts"},
              Entries(root_ + "/rec/cam1/2026/12/06"));

    // Storing the same key again replaces the object whole.
    EXPECT_EQ(Success, store.Put(Object(key, "second"), StoreCredentials(), &info));
    EXPECT_EQ("second", ReadFile(path));
}

TEST_F(LocalDirectoryStoreTest, PathsOutsideAnExistingBucketAreFilePathErrors) {
    LocalDirectoryStore store(root_);
    FileTransferInfo info;
    ObjectToStore object = Object("cam1/a.ts", "x");
    object.bucket = "missing";
    EXPECT_EQ(FilePathError, store.Put(object, StoreCredentials(), &info));
    EXPECT_TRUE(Entries(root_) == std::vector<std::string>{"rec"});

    LocalDirectoryStore noRoot(root_ + "/nowhere");
    EXPECT_EQ(FilePathError, noRoot.Put(Object("a.ts", "x"), StoreCredentials(), &info));

    for (const char* key :
         {"", "/etc/a.ts", "../a.ts", "cam1/../../a.ts", "cam1//a.ts", "cam1/./a.ts", "cam1/"}) {
        EXPECT_EQ(FilePathError, store.Put(Object(key, "x"), StoreCredentials(), &info)) << key;
    }
    for (const char* bucket : {"", "..", ".", "rec/sub"}) {
        object = Object("a.ts", "x");
        object.bucket = bucket;
        EXPECT_EQ(FilePathError, store.Put(object, StoreCredentials(), &info)) << bucket;
    }
    // A key part that is a file where a directory must be.
    ASSERT_EQ(Success, store.Put(Object("cam1", "x"), StoreCredentials(), &info));
    EXPECT_EQ(FilePathError, store.Put(Object("cam1/a.ts", "x"), StoreCredentials(), &info));
    EXPECT_TRUE(Entries(root_).size() == 1 && Entries(root_ + "/rec").size() == 1);
}

// A full file system, where mounting a small tmpfs is allowed (root in a privileged container).
TEST_F(LocalDirectoryStoreTest, FullDiskIsAnInternalErrorAndLeavesNothing) {
    mountPoint_ = root_ + "/small";
    mkdir(mountPoint_.c_str(), 0755);
    if (mount("tmpfs", mountPoint_.c_str(), "tmpfs", 0, "size=64k") != 0)
        GTEST_SKIP() << "cannot mount a tmpfs here; the file size limit test covers write errors";
    mounted_ = true;
    mkdir((mountPoint_ + "/rec").c_str(), 0755);
    LocalDirectoryStore store(mountPoint_);
    FileTransferInfo info;
    std::string big(256 << 10, 'x');
    EXPECT_EQ(InternalError, store.Put(Object("cam1/a.ts", big), StoreCredentials(), &info));
    EXPECT_EQ(0u, info.fileSize);
    EXPECT_TRUE(Entries(mountPoint_ + "/rec/cam1").empty());
    // The space is free again: a small object still fits.
    EXPECT_EQ(Success, store.Put(Object("cam1/b.ts", "small"), StoreCredentials(), &info));
}

// A write error anywhere: RLIMIT_FSIZE stops writes past the limit with EFBIG, also for root.
TEST_F(LocalDirectoryStoreTest, WriteErrorIsAnInternalErrorAndLeavesNothing) {
    LocalDirectoryStore store(root_);
    FileTransferInfo info;
    std::string big(3 << 20, 'x');
    struct rlimit saved {};
    getrlimit(RLIMIT_FSIZE, &saved);
    struct sigaction ignore {
    }, previous{};
    ignore.sa_handler = SIG_IGN;
    sigaction(SIGXFSZ, &ignore, &previous);
    struct rlimit limit = saved;
    limit.rlim_cur = 1 << 20;
    ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
    FileTransferResult result = store.Put(Object("cam1/a.ts", big), StoreCredentials(), &info);
    setrlimit(RLIMIT_FSIZE, &saved);
    sigaction(SIGXFSZ, &previous, nullptr);
    EXPECT_EQ(InternalError, result);
    EXPECT_TRUE(Entries(root_ + "/rec/cam1").empty());
}

TEST_F(LocalDirectoryStoreTest, CancelEndsARunningPutAndEveryLaterOne) {
    LocalDirectoryStore store(root_);
    FileTransferInfo info;
    // Cancel while a large object is being written: the Put ends with TimeOut (or had already
    // stored it whole), and no temporary file stays behind.
    std::string big(128 << 20, 'x');
    std::atomic<bool> started{false};
    FileTransferResult running = Success;
    std::thread writer([&] {
        started = true;
        running = store.Put(Object("cam1/big.ts", big), StoreCredentials(), &info);
    });
    ASSERT_TRUE(WaitUntil([&] { return started.load(); }));
    store.Cancel();
    writer.join();
    EXPECT_TRUE(running == TimeOut || running == Success);
    std::vector<std::string> left = Entries(root_ + "/rec/cam1");
    for (const std::string& name : left) EXPECT_EQ("big.ts", name);

    EXPECT_EQ(TimeOut, store.Put(Object("cam1/later.ts", "x"), StoreCredentials(), &info));
    EXPECT_EQ(0u, info.fileSize);
    EXPECT_NE(0, access((root_ + "/rec/cam1/later.ts").c_str(), F_OK));
}

}  // namespace
