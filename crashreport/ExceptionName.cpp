// Naming of crash signals by Windows-style exception codes (see ExceptionName.h).
#include "crashreport/ExceptionName.h"

#include <cstring>

#include "crashreport/ReportLine.h"
#include "crashreport/UnhandledException.h"

namespace Tracewright {
namespace {

struct CodeName {
    uint32_t code;
    const char* name;
};

constexpr CodeName kTable[] = {
    {0xC0000005, "ACCESS_VIOLATION"},
    {0x80000002, "DATATYPE_MISALIGNMENT"},
    {0x80000003, "BREAKPOINT"},
    {0x80000004, "SINGLE_STEP"},
    {0xC000008C, "ARRAY_BOUNDS_EXCEEDED"},
    {0xC000008D, "FLT_DENORMAL_OPERAND"},
    {0xC000008E, "FLT_DIVIDE_BY_ZERO"},
    {0xC000008F, "FLT_INEXACT_RESULT"},
    {0xC0000090, "FLT_INVALID_OPERATION"},
    {0xC0000091, "FLT_OVERFLOW"},
    {0xC0000092, "FLT_STACK_CHECK"},
    {0xC0000093, "FLT_UNDERFLOW"},
    {0xC0000094, "INT_DIVIDE_BY_ZERO"},
    {0xC0000095, "INT_OVERFLOW"},
    {0xC0000096, "PRIV_INSTRUCTION"},
    {0xC0000006, "IN_PAGE_ERROR"},
    {0xC000001D, "ILLEGAL_INSTRUCTION"},
    {0xC0000025, "NONCONTINUABLE_EXCEPTION"},
    {0xC00000FD, "STACK_OVERFLOW"},
    {0xC0000026, "INVALID_DISPOSITION"},
    {0x80000001, "GUARD_PAGE"},
    {0xC0000008, "INVALID_HANDLE"},
};

// How far below the stack pointer a fault still counts as running into the guard page: a
// frame set-up touches at most a few pages below it before the first push (large locals).
constexpr uintptr_t kGuardReachBelow = 64 * 1024;
// A call or push faults at or a little above the new stack pointer.
constexpr uintptr_t kGuardReachAbove = 256;

constexpr int kNameSize = 128;
char signalNames[NSIG][kNameSize];  // strsignal texts, filled at installation

uint32_t codeForSignal(int signal, int siCode, bool stackOverflow) {
    switch (signal) {
        case SIGSEGV:
            return stackOverflow ? kStackOverflow : kAccessViolation;
        case SIGBUS:
            if (stackOverflow) return kStackOverflow;
            return siCode == BUS_ADRALN ? 0x80000002 : 0xC0000006;
        case SIGFPE:
            switch (siCode) {
                case FPE_INTDIV:
                    return 0xC0000094;
                case FPE_INTOVF:
                    return 0xC0000095;
                case FPE_FLTDIV:
                    return 0xC000008E;
                case FPE_FLTOVF:
                    return 0xC0000091;
                case FPE_FLTUND:
                    return 0xC0000093;
                case FPE_FLTRES:
                    return 0xC000008F;
                case FPE_FLTINV:
                    return 0xC0000090;
                case FPE_FLTSUB:
                    return 0xC000008C;
                default:
                    break;
            }
            break;
        case SIGILL:
            return siCode == ILL_PRVOPC ? 0xC0000096 : 0xC000001D;
        case SIGTRAP:
            return siCode == TRAP_TRACE ? 0x80000004 : 0x80000003;
        default:
            break;
    }
    return kSignalCodeBase + static_cast<uint32_t>(signal);
}

}  // namespace

void PrepareSignalNames() {
    for (int signal = 1; signal < NSIG; ++signal) {
        CopyText(signalNames[signal], kNameSize, strsignal(signal));
    }
}

const char* TableName(uint32_t code) {
    for (const auto& entry : kTable) {
        if (entry.code == code) return entry.name;
    }
    return nullptr;
}

bool IsFault(const siginfo_t* info) {
    return info != nullptr && info->si_code > 0;
}

bool IsStackOverflow(int signal, const siginfo_t* info, const ucontext_t* context) {
    if ((signal != SIGSEGV && signal != SIGBUS) || !IsFault(info) || context == nullptr) {
        return false;
    }
    auto address = reinterpret_cast<uintptr_t>(info->si_addr);
    auto sp = static_cast<uintptr_t>(context->uc_mcontext.gregs[REG_RSP]);
    if (address >= sp) return address - sp <= kGuardReachAbove;
    return sp - address <= kGuardReachBelow;
}

ExceptionName NameException(int signal, const siginfo_t* info, bool stackOverflow) {
    int siCode = info != nullptr ? info->si_code : 0;
    uint32_t code = codeForSignal(signal, siCode, stackOverflow);
    ExceptionName result;
    result.code = code;
    if (const char* name = TableName(code)) {
        result.name = name;
    } else if (signal == SIGABRT && UnhandledExceptionText() != nullptr) {
        result.name = UnhandledExceptionText();
    } else if (signal > 0 && signal < NSIG) {
        result.name = signalNames[signal];
    }
    return result;
}

}  // namespace Tracewright
