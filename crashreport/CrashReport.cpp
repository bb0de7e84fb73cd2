// Installation of the crash reporter and its signal handler (see CrashReport.h).
#include "crashreport/CrashReport.h"

#include <linux/futex.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "crashreport/ExceptionName.h"
#include "crashreport/ModuleLookup.h"
#include "crashreport/ReportFile.h"
#include "crashreport/ReportLine.h"
#include "crashreport/ReportWriter.h"
#include "crashreport/SymbolLookup.h"
#include "crashreport/UnhandledException.h"

namespace Tracewright {
namespace {

constexpr int kSignals[] = {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGABRT};
// Room for the handler, libunwind, the demangler and libdw on the alternate stack.
constexpr size_t kAltStackSize = 512 * 1024;

// Process-wide state, written only at installation (and the busy flag by the handler).
char executablePath[PATH_MAX];
char logPath[PATH_MAX];  // empty: no report can be written
char computerName[HOST_NAME_MAX + 1];
struct sigaction previousActions[NSIG];
bool installed = false;
std::atomic<void (*)()> reportHook{nullptr};
std::atomic<unsigned> reportDeadline{kReportDeadlineSeconds};  // seconds

// Thread id of the thread writing a report; 0 when none. Waited on as a futex.
std::atomic<int> busy{0};
static_assert(sizeof(std::atomic<int>) == sizeof(int), "the busy flag is used as a futex");

ReportFile reportFile;            // open only while a report is written
std::atomic<int> crashSignal{0};  // the signal being reported, for the deadline handler
struct sigaction previousAlarm;

int currentThread() {
    return static_cast<int>(syscall(SYS_gettid));
}

void restorePrevious(int signal) {
    if (signal > 0 && signal < NSIG) sigaction(signal, &previousActions[signal], nullptr);
}

// Lets the signal take the course it would have taken without the reporter.
void passOn(int signal, const siginfo_t* info) {
    restorePrevious(signal);
    // A faulting instruction faults again when the handler returns, now under the previous
    // action. A sent signal (and a trap, which does not repeat) must be sent again; it stays
    // pending until this handler returns.
    if (!IsFault(info) || signal == SIGTRAP) syscall(SYS_tgkill, getpid(), currentThread(), signal);
}

void onReportDeadline(int) {
    // The report hangs: end the process by its crash signal with the default action.
    int signal = crashSignal.load();
    if (signal == 0) return;
    struct sigaction fallback {};
    fallback.sa_handler = SIG_DFL;
    sigemptyset(&fallback.sa_mask);
    sigaction(signal, &fallback, nullptr);
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, signal);
    syscall(SYS_tgkill, getpid(), currentThread(), signal);
    sigprocmask(SIG_UNBLOCK, &set, nullptr);
}

void startDeadline(int signal) {
    crashSignal.store(signal);
    struct sigaction action {};
    action.sa_handler = onReportDeadline;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_ONSTACK;
    sigaction(SIGALRM, &action, &previousAlarm);
    alarm(reportDeadline.load());
}

void stopDeadline() {
    alarm(0);
    sigaction(SIGALRM, &previousAlarm, nullptr);
    crashSignal.store(0);
}

// Another thread writes a report and will end the process; wait for it, within a bound.
void waitForReport() {
    struct timespec start {};
    clock_gettime(CLOCK_MONOTONIC, &start);
    while (true) {
        int owner = busy.load();
        if (owner == 0) return;
        struct timespec now {};
        clock_gettime(CLOCK_MONOTONIC, &now);
        long long waitedNs =
            (now.tv_sec - start.tv_sec) * 1000000000LL + now.tv_nsec - start.tv_nsec;
        long long leftNs = kWaitForReportSeconds * 1000000000LL - waitedNs;
        if (leftNs <= 0) return;
        struct timespec timeout {};
        timeout.tv_sec = leftNs / 1000000000LL;
        timeout.tv_nsec = leftNs % 1000000000LL;
        syscall(SYS_futex, reinterpret_cast<int*>(&busy), FUTEX_WAIT_PRIVATE, owner, &timeout,
                nullptr, 0);
    }
}

void onCrash(int signal, siginfo_t* info, void* rawContext) {
    int savedErrno = errno;
    int self = currentThread();
    int owner = 0;
    if (!busy.compare_exchange_strong(owner, self)) {
        if (owner != self) waitForReport();
        passOn(signal, info);
        errno = savedErrno;
        return;
    }
    startDeadline(signal);
    if (logPath[0] != '\0' && reportFile.Open(logPath)) {
        CrashReportInput input;
        input.signal = signal;
        input.info = info;
        input.context = static_cast<ucontext_t*>(rawContext);
        input.computerName = computerName;
        input.hook = reportHook.load();
        WriteReport(input, reportFile);
        reportFile.Close();
    }
    stopDeadline();
    busy.store(0);
    syscall(SYS_futex, reinterpret_cast<int*>(&busy), FUTEX_WAKE_PRIVATE, INT_MAX, nullptr, nullptr,
            0);
    passOn(signal, info);
    errno = savedErrno;
}

void restoreAtExit() {
    if (!installed) return;
    for (int signal : kSignals) restorePrevious(signal);
    installed = false;
}

bool findPaths() {
    ssize_t length = readlink("/proc/self/exe", executablePath, sizeof(executablePath) - 1);
    if (length <= 0) return false;
    executablePath[length] = '\0';
    const char* slash = std::strrchr(executablePath, '/');
    if (slash == nullptr) return false;
    struct tm local {};
    time_t now = time(nullptr);
    localtime_r(&now, &local);
    ReportLine path;
    path.Text(executablePath, static_cast<size_t>(slash - executablePath) + 1);
    path.Text("_Tracewright").Dec(local.tm_year + 1900).Dec(local.tm_mon + 1, 2).Text(".log");
    // A cut path would name another file: then no report at all.
    if (path.Size() + 1 >= ReportLine::kCapacity || path.Size() + 1 > sizeof(logPath)) {
        return false;
    }
    return CopyText(logPath, sizeof(logPath), path.Data());
}

void installAlternateStack() {
    stack_t current{};
    if (sigaltstack(nullptr, &current) == 0 && (current.ss_flags & SS_DISABLE) == 0 &&
        current.ss_size >= kAltStackSize) {
        return;  // somebody set up a big enough one already
    }
    // One guard page below the stack so that an overflow of the handler itself faults.
    size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    void* memory = mmap(nullptr, kAltStackSize + page, PROT_READ | PROT_WRITE,
                        MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return;
    mprotect(memory, page, PROT_NONE);
    stack_t stack{};
    stack.ss_sp = static_cast<char*>(memory) + page;
    stack.ss_size = kAltStackSize;
    stack.ss_flags = 0;
    if (sigaltstack(&stack, nullptr) != 0) munmap(memory, kAltStackSize + page);
}

void install() {
    if (!findPaths()) logPath[0] = '\0';
    if (gethostname(computerName, sizeof(computerName)) != 0) computerName[0] = '\0';
    computerName[sizeof(computerName) - 1] = '\0';
    tzset();  // localtime_r in the handler then needs no file and no allocation
    PrepareSignalNames();
    PrepareModuleLookup(executablePath);
    PrepareSourceLines();
    installAlternateStack();

    struct sigaction action {};
    action.sa_sigaction = onCrash;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_SIGINFO | SA_ONSTACK;
    for (int signal : kSignals) sigaction(signal, &action, &previousActions[signal]);
    InstallTerminateHandler();
    installed = true;
    atexit(restoreAtExit);
}

// Installs the reporter during static initialisation, before main.
struct Installer {
    Installer() { install(); }
} installer;

}  // namespace

void SetReportHook(void (*hook)()) {
    reportHook.store(hook);
}

void SetReportDeadline(unsigned seconds) {
    if (seconds > 0) reportDeadline.store(seconds);
}

}  // namespace Tracewright
