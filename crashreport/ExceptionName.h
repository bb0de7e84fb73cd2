// Exception codes and names of crash signals.
//
// A crash report names what happened with the Windows-style exception code and name that
// the report format uses (C0000005 ACCESS_VIOLATION and so on), derived from the signal, its
// si_code and the interrupted context. Signals outside the table get the code
// 0xE0000000 + signal number and the signal's strsignal text; those texts are copied at
// installation so that naming a signal in the handler neither allocates nor reads locale
// data. An unhandled C++ exception (recorded by the terminate handler, see
// UnhandledException.h) names the SIGABRT that follows it.
//
// PrepareSignalNames() is called once at installation, before any crash; everything else is
// async-signal-safe.
#pragma once

#include <signal.h>
#include <ucontext.h>

#include <cstdint>

namespace Tracewright {

constexpr uint32_t kAccessViolation = 0xC0000005;
constexpr uint32_t kStackOverflow = 0xC00000FD;
constexpr uint32_t kSignalCodeBase = 0xE0000000;  // + signal number, for signals off the table

struct ExceptionName {
    uint32_t code = 0;
    const char* name = "";  // static text or a process-wide buffer; never null
};

// Copies the strsignal texts of all signals. Installation only.
void PrepareSignalNames();

// The code and name for `signal` with `info` (may be null). `stackOverflow` says that the
// fault hit the stack's guard area (see IsStackOverflow).
ExceptionName NameException(int signal, const siginfo_t* info, bool stackOverflow);

// The name of a code from the Windows-style table; null if the code is not in it.
const char* TableName(uint32_t code);

// True when a SIGSEGV/SIGBUS fault address lies just below or at the interrupted stack
// pointer: a push, call or frame set-up that ran into the stack's guard page. A fault far
// from the stack pointer (a bad pointer) is not an overflow.
bool IsStackOverflow(int signal, const siginfo_t* info, const ucontext_t* context);

// True when the kernel raised the signal for a fault of the interrupted instruction (as
// opposed to kill, raise, tgkill or sigqueue).
bool IsFault(const siginfo_t* info);

}  // namespace Tracewright
