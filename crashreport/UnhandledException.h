// The unhandled C++ exception that is about to abort the process.
//
// An exception that leaves a thread reaches std::terminate, which aborts; the SIGABRT report
// alone would only say "Aborted". InstallTerminateHandler() (installation only) puts a
// terminate handler in front of the previous one: it keeps the exception's type and what()
// text in a process-wide buffer, remembers which thread it was, and then calls the previous
// handler, which prints its own message and aborts as before.
//
// UnhandledExceptionText() is async-signal-safe: the crash handler calls it for the SIGABRT.
#pragma once

namespace Tracewright {

void InstallTerminateHandler();

// "Unhandled C++ exception <type>: <what>" when the calling thread is terminating because of
// an exception; null otherwise.
const char* UnhandledExceptionText();

}  // namespace Tracewright
