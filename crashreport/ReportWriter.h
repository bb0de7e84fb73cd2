// ReportWriter: the text of one crash report.
//
// A report is, in this order: a separator of 77 '=', the title line with the local time
// and the computer's name, the separator again; the exception lines (code and name, fault
// address with its module segment and offset, for an access violation the inaccessible
// address and whether it was read or written, the module, the current thread); the function
// and source line of the fault (left out for a stack overflow and when unknown); the call
// stack between separators of 77 '-'; the registers; an empty line. Every line ends in
// CR LF.
//
// Called by the crash handler on the crashing thread while it holds the busy flag. Async-
// signal-safe apart from libdw's first read of a module's line table (SymbolLookup.h).
#pragma once

#include <signal.h>
#include <ucontext.h>

#include "crashreport/ReportFile.h"

namespace Tracewright {

struct CrashReportInput {
    int signal = 0;
    const siginfo_t* info = nullptr;  // may be null
    ucontext_t* context = nullptr;    // the interrupted context; may be null
    const char* computerName = "";
    void (*hook)() = nullptr;  // called after the exception lines; tests fault in it
};

// Writes the whole report to `file`, which the caller has opened.
void WriteReport(const CrashReportInput& input, ReportFile& file);

}  // namespace Tracewright
