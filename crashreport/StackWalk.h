// StackWalk: the call stack section of a crash report.
//
// Walks the crashing thread's stack with libunwind, starting from the interrupted context
// of the signal (so the first frame is the faulting instruction), and writes one line per
// frame: "<pc>  <function>+<displacement>(<segment>:<offset> <module>)", or without a
// symbol "<pc>  <segment>:<offset> <module>".
//
// A runaway recursion can leave hundreds of thousands of frames. Those are all walked (up to
// kMaxFrames), but only the innermost kHeadFrames and the outermost kTailFrames are written,
// with one line counting the frames left out between them: the innermost show the
// recursion, the outermost show how the thread got there, and the report stays small and is
// written within a second or so.
//
// Called only by the thread that holds the crash handler's busy flag; no heap.
#pragma once

#include <ucontext.h>

#include <cstdint>

#include "crashreport/ReportFile.h"

namespace Tracewright {

constexpr int kHeadFrames = 256;           // innermost frames written
constexpr int kTailFrames = 64;            // outermost frames written
constexpr uint32_t kMaxFrames = 1u << 22;  // frames walked at most (a looping walk ends)

// Writes "Address \r\n" and the frames of the stack interrupted at `context`.
void WalkStack(ucontext_t* context, ReportFile& file);

}  // namespace Tracewright
