// Terminate handler that records the unhandled exception for the crash report (see
// UnhandledException.h).
#include "crashreport/UnhandledException.h"

#include <cxxabi.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <exception>
#include <typeinfo>

#include "crashreport/Demangle.h"
#include "crashreport/ReportLine.h"

namespace Tracewright {
namespace {

std::terminate_handler previousTerminate = nullptr;
char exceptionText[512];
std::atomic<pid_t> exceptionThread{0};  // thread that owns exceptionText; 0: none yet
std::atomic<bool> textReady{false};     // exceptionText is complete

void onTerminate() {
    // Only the first terminating thread records; a second one must not overwrite the text
    // that the first one's report may be reading.
    pid_t none = 0;
    pid_t self = static_cast<pid_t>(syscall(SYS_gettid));
    std::type_info* type = abi::__cxa_current_exception_type();
    if (type != nullptr && exceptionThread.compare_exchange_strong(none, self)) {
        ReportLine line;
        char typeName[256];
        if (!Demangle(type->name(), typeName, sizeof(typeName), true)) {
            CopyText(typeName, sizeof(typeName), type->name());
        }
        line.Text("Unhandled C++ exception ").Text(typeName);
        try {
            throw;
        } catch (const std::exception& error) {
            line.Text(": ").Text(error.what());
        } catch (...) {
        }
        CopyText(exceptionText, sizeof(exceptionText), line.Data());
        textReady.store(true);
    }
    if (previousTerminate != nullptr) previousTerminate();
    std::abort();
}

}  // namespace

void InstallTerminateHandler() {
    previousTerminate = std::set_terminate(onTerminate);
}

const char* UnhandledExceptionText() {
    pid_t self = static_cast<pid_t>(syscall(SYS_gettid));
    return exceptionThread.load() == self && textReady.load() ? exceptionText : nullptr;
}

}  // namespace Tracewright
