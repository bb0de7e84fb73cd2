// Tracewright, the crash reporter: a report of every fatal signal, appended to
// "_Tracewright<year><month>.log" beside the executable.
//
// Linking the crashreport objects into an executable is all it takes: a static initialiser
// installs the reporter before main. Installation finds the executable's directory
// (/proc/self/exe), the computer's name, the log file of the current local month (a process
// that runs into the next month keeps writing to the file of the month it started in),
// prepares the symbol lookups, and installs the crash handler for SIGSEGV, SIGBUS, SIGFPE,
// SIGILL, SIGTRAP and SIGABRT with SA_ONSTACK, plus an alternate signal stack for the
// installing (main) thread so that a stack overflow there is reported too. Other threads
// have no alternate stack: a stack overflow on them ends the process without a report. A
// terminate handler records an unhandled C++ exception for the SIGABRT that follows.
// At exit the previous signal actions are put back.
//
// The crash handler, on the crashing thread:
//  - takes the busy flag (the crashing thread's id, atomically); a second thread that
//    crashes while a report is being written waits (at most kWaitForReportSeconds) for it
//    to finish, without writing one, because the first thread is about to end the process;
//    a crash inside the report writer on the same thread goes straight on;
//  - opens the log file, appends the report (ReportWriter.h), closes it;
//  - puts the previous action of the signal back and lets the signal happen again: a fault
//    is re-executed, a sent signal is re-sent to the thread. So the process ends the way it
//    would have without the reporter (same signal, core dump as the system is set up).
// A report that takes longer than the deadline (kReportDeadlineSeconds unless set; a lock
// held by the crashed code, a hung disk) is cut short: a SIGALRM ends the process with the
// crash signal and its default action.
//
// No heap memory is allocated by the reporter's own code on the report path: all buffers
// are static or on the stack. libdw allocates when it reads a module's line table for the
// source line of the fault; a crash inside malloc with the heap lock held can make that
// wait, which the deadline above ends.
#pragma once

namespace Tracewright {

constexpr unsigned kReportDeadlineSeconds = 20;
constexpr unsigned kWaitForReportSeconds = 30;

// For tests only: `hook` is called on the crashing thread inside the report, after the
// exception lines (null: none). Lets a test crash while a report is being written.
void SetReportHook(void (*hook)());

// Sets the report deadline in seconds (> 0). For tests; call before any crash.
void SetReportDeadline(unsigned seconds);

}  // namespace Tracewright
