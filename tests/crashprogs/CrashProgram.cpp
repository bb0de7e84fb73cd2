// A program that crashes in the way its first argument names (see main), for the crash
// reporter's tests. Built with the reporter (SFR_WITH_REPORTER) and without, so that a test can
// compare how the two processes end. With the reporter, the report can fault, hang (1 s
// deadline), meet a second thread's crash, or count the heap allocations made while it is
// written, which a SIGSEGV handler installed before the reporter prints when the signal is
// passed on to it.
#include <pthread.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>

#ifdef SFR_WITH_REPORTER
#include <dlfcn.h>

#include "crashreport/CrashReport.h"
#define UNW_LOCAL_ONLY
#include <libunwind.h>
#endif

namespace {

// Below the kernel's mmap_min_addr: never mapped.
int* const kInvalidAddress = reinterpret_cast<int*>(0xBAD0);

volatile int sink = 0;

void printLine(const char* text) {
    ssize_t ignored = write(1, text, std::strlen(text));
    (void)ignored;
}

__attribute__((noinline)) void WriteToInvalidAddress(int* target) {
    *const_cast<volatile int*>(target) = 42;
}

__attribute__((noinline)) int ReadFromInvalidAddress(const int* source) {
    return *const_cast<const volatile int*>(source);
}

__attribute__((noinline)) int DivideBy(int divisor) {
    volatile int dividend = 1000;
    return dividend / divisor;
}

volatile int recursionLimit = -1;  // never reached; keeps the compiler from calling it endless

__attribute__((noinline)) int RecurseForever(int depth) {
    volatile char pad[32];
    pad[depth % 32] = static_cast<char>(depth);
    if (depth == recursionLimit) return 0;
    return RecurseForever(depth + 1) + pad[0];
}

__attribute__((noinline)) void ThrowUnhandled() {
    throw std::runtime_error("disk full on /data");
}

__attribute__((noinline)) void CallerOfTheFault(void (*fault)(int*)) {
    fault(kInvalidAddress);
}

#ifdef SFR_WITH_REPORTER
void faultInsideReport() {
    WriteToInvalidAddress(kInvalidAddress + 2);
}

void hangInsideReport() {
    while (true) pause();
}

// two-threads: the first crashing thread's report waits until the second thread is inside
// the crash handler too (its SIGSEGV is then blocked), within a deadline.
std::atomic<int> secondThreadId{0};
std::atomic<bool> secondMayCrash{false};

bool threadBlocksSegv(int tid) {
    char path[64], line[256];
    std::snprintf(path, sizeof(path), "/proc/self/task/%d/status", tid);
    FILE* file = std::fopen(path, "r");
    bool blocked = false;
    while (file != nullptr && std::fgets(line, sizeof(line), file) != nullptr) {
        if (std::strncmp(line, "SigBlk:", 7) == 0)
            blocked = (std::strtoull(line + 7, nullptr, 16) & (1ULL << (SIGSEGV - 1))) != 0;
    }
    if (file != nullptr) std::fclose(file);
    return blocked;
}

void letSecondThreadCrash() {
    secondMayCrash.store(true);
    for (int i = 0; i < 5000 && !threadBlocksSegv(secondThreadId.load()); ++i) usleep(1000);
    printLine(threadBlocksSegv(secondThreadId.load()) ? "second thread is in the handler\n"
                                                      : "second thread did not crash\n");
}

void* secondThread(void*) {
    secondThreadId.store(static_cast<int>(syscall(SYS_gettid)));
    while (!secondMayCrash.load()) usleep(1000);
    WriteToInvalidAddress(kInvalidAddress + 4);
    return nullptr;
}

// count-allocations: every allocation made while `counting` is set is counted, as made by
// libdw (its frames are on the stack) or by anything else.
std::atomic<bool> counting{false};
std::atomic<int> libraryAllocations{0};
std::atomic<int> ownAllocations{0};
thread_local bool insideCount = false;

extern "C" void* __libc_malloc(size_t);
extern "C" void* __libc_calloc(size_t, size_t);
extern "C" void* __libc_realloc(void*, size_t);
extern "C" void* __libc_memalign(size_t, size_t);

bool inLibdw(void* address) {
    Dl_info info;
    if (dladdr(address, &info) == 0 || info.dli_fname == nullptr) return false;
    return std::strstr(info.dli_fname, "libdw") != nullptr ||
           std::strstr(info.dli_fname, "libelf") != nullptr;
}

void countAllocation() {
    if (!counting.load() || insideCount) return;
    insideCount = true;
    void* frames[128];
    int count = unw_backtrace(frames, 128);
    bool library = false;
    for (int i = 0; i < count && !library; ++i) library = inLibdw(frames[i]);
    (library ? libraryAllocations : ownAllocations).fetch_add(1);
    insideCount = false;
}

void printCountsAndPassOn(int signalNumber) {
    char text[128];
    // snprintf of integers does not allocate.
    std::snprintf(text, sizeof(text),
                  "previous handler: own-allocations=%d library-allocations=%d\n",
                  ownAllocations.load(), libraryAllocations.load());
    printLine(text);
    ::signal(signalNumber, SIG_DFL);  // the fault repeats and ends the process
}

// Runs before the reporter's static initialiser: the reporter then keeps this handler as the
// previous action of SIGSEGV and passes the signal on to it.
__attribute__((constructor(101))) void installHandlerBeforeReporter() {
    const char* mode = std::getenv("CRASH_PROGRAM_PREVIOUS_HANDLER");
    if (mode != nullptr) ::signal(SIGSEGV, printCountsAndPassOn);
}
#endif

}  // namespace

#ifdef SFR_WITH_REPORTER
extern "C" void* malloc(size_t size) {
    countAllocation();
    return __libc_malloc(size);
}
extern "C" void* calloc(size_t count, size_t size) {
    countAllocation();
    return __libc_calloc(count, size);
}
extern "C" void* realloc(void* pointer, size_t size) {
    countAllocation();
    return __libc_realloc(pointer, size);
}
extern "C" void* memalign(size_t alignment, size_t size) {
    countAllocation();
    return __libc_memalign(alignment, size);
}
extern "C" int posix_memalign(void** result, size_t alignment, size_t size) {
    countAllocation();
    *result = __libc_memalign(alignment, size);
    return *result != nullptr ? 0 : ENOMEM;
}
extern "C" void* aligned_alloc(size_t alignment, size_t size) {
    countAllocation();
    return __libc_memalign(alignment, size);
}
#endif

int main(int argc, char** argv) {
    std::string mode = argc > 1 ? argv[1] : "";
    if (mode == "write-invalid") CallerOfTheFault(WriteToInvalidAddress);
    if (mode == "read-invalid") sink = ReadFromInvalidAddress(kInvalidAddress);
    if (mode == "divide") sink = DivideBy(argc - 2);
    if (mode == "recurse") sink = RecurseForever(0);
    if (mode == "throw") ThrowUnhandled();
    if (mode == "abort") std::abort();
#ifdef SFR_WITH_REPORTER
    // A fault while something happens to the report: SIGFPE ("-other") or SIGSEGV.
    if (mode == "fault-in-report-same" || mode == "fault-in-report-other")
        Tracewright::SetReportHook(faultInsideReport);
    if (mode == "fault-in-report-other") sink = DivideBy(argc - 2);
    if (mode == "hang-in-report") {
        Tracewright::SetReportHook(hangInsideReport);
        Tracewright::SetReportDeadline(1);
    }
    if (mode == "two-threads") {
        pthread_t thread;
        pthread_create(&thread, nullptr, secondThread, nullptr);
        while (secondThreadId.load() == 0) usleep(1000);
        Tracewright::SetReportHook(letSecondThreadCrash);
    }
    counting.store(mode == "count-allocations");
    if (mode == "fault-in-report-same" || mode == "hang-in-report" || mode == "two-threads" ||
        mode == "count-allocations")
        CallerOfTheFault(WriteToInvalidAddress);
#endif
    printLine("no such crash mode\n");
    return 2;
}
