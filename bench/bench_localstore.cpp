// Storing a 10 s, 4 Mbit/s object (5,000,000 bytes) into the local directory store, and what
// making it durable costs: the store's own Put, and the same steps by hand (write a temporary
// file, flush it one way or another, rename it into place, flush the directory) with each way
// of flushing the file. Runs in a fresh directory under /tmp (the file system the store would
// use on this machine).
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <random>
#include <string>

#include "platform/transfer/LocalDirectoryStore.h"

namespace {

const size_t kObjectBytes = 4'000'000 / 8 * 10;

const std::string& Object() {
    static const std::string bytes = [] {
        std::mt19937 random(7);
        std::string out(kObjectBytes, '\0');
        for (char& c : out) c = static_cast<char>(random());
        return out;
    }();
    return bytes;
}

// A store root with the bucket "rec", removed at exit.
const std::string& Root() {
    static const struct Dir {
        std::string path;
        Dir() {
            char templ[] = "/tmp/sfr-bench-store-XXXXXX";
            path = mkdtemp(templ);
            std::filesystem::create_directories(path + "/rec/cam1");
        }
        ~Dir() { std::filesystem::remove_all(path); }
    } dir;
    return dir.path;
}

void BM_LocalStorePut(benchmark::State& state) {
    LocalDirectoryStore store(Root());
    ObjectToStore object;
    object.bucket = "rec";
    object.data = reinterpret_cast<const uint8_t*>(Object().data());
    object.size = Object().size();
    int n = 0;
    for (auto _ : state) {
        object.key = "cam1/put-" + std::to_string(n++ % 8) + ".ts";
        FileTransferInfo info;
        if (store.Put(object, StoreCredentials(), &info) != Success) {
            state.SkipWithError("Put failed");
            return;
        }
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kObjectBytes));
}
BENCHMARK(BM_LocalStorePut)->Unit(benchmark::kMillisecond)->UseRealTime();

// state.range(0): 0 fsync, 1 fdatasync, 2 sync_file_range (write out and wait; no metadata,
// no disk cache flush), 3 no flush at all.
void BM_FlushBeforeRename(benchmark::State& state) {
    const std::string dir = Root() + "/rec/cam1";
    const int dirFd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    const std::string& bytes = Object();
    int n = 0;
    for (auto _ : state) {
        const std::string name = "flush-" + std::to_string(n++ % 8) + ".ts";
        int fd = openat(dirFd, ".tmp", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd < 0 || write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size())) {
            state.SkipWithError("write failed");
            return;
        }
        switch (state.range(0)) {
            case 0:
                fsync(fd);
                break;
            case 1:
                fdatasync(fd);
                break;
            case 2:
                sync_file_range(fd, 0, 0,
                                SYNC_FILE_RANGE_WAIT_BEFORE | SYNC_FILE_RANGE_WRITE |
                                    SYNC_FILE_RANGE_WAIT_AFTER);
                break;
            default:
                break;
        }
        close(fd);
        renameat(dirFd, ".tmp", dirFd, name.c_str());
        if (state.range(0) != 3) fsync(dirFd);
    }
    close(dirFd);
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kObjectBytes));
}
BENCHMARK(BM_FlushBeforeRename)
    ->ArgName("fsync0_fdatasync1_range2_none3")
    ->DenseRange(0, 3)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

}  // namespace
