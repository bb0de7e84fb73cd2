// SymbolLookup: function names and source lines of code addresses for the crash report.
//
// Function names come from the modules' symbol tables (ElfSymbols.h, no heap) and are
// demangled without the heap (Demangle.h). Source lines come
// from the modules' DWARF line tables through libdw: its session is set up at installation,
// where allocating is allowed, so that the handler only looks up. libdw allocates while it
// reads the line table of a module for the first time; that is the one heap use on the
// report path, and it is the library's, not ours (see the crash report's header comment for
// what that means for a crash inside malloc).
//
// PrepareSourceLines() is called once at installation. The lookups are called only by the
// thread that holds the crash handler's busy flag.
#pragma once

#include <cstddef>
#include <cstdint>

namespace Tracewright {

// Demangled name of the function that holds the instruction at `address` and the distance of
// `address` from the function's start. False when no symbol covers it.
bool FunctionName(uintptr_t address, char* name, size_t size, uint64_t* displacement);

// Reports the modules loaded now to libdw. Modules loaded later get no source lines.
void PrepareSourceLines();

// Source file and line of the instruction at `address`; false when no debug information
// covers it. `file` points into libdw's data, valid until the process ends.
bool SourceLine(uintptr_t address, const char** file, int* line);

}  // namespace Tracewright
