// ModuleLookup: which loaded module, and which of its segments, holds a code address.
//
// The report gives every address as module path, segment number and offset, so that an
// engineer can find it in the module file with its own load address taken out. The module
// comes from dladdr; the segment is the 1-based number of the module's PT_LOAD program
// header that holds the address, read from the program headers mapped at the module's base;
// the offset is the distance from that segment's start. The main program's path is the one
// /proc/self/exe gave at installation (dladdr only knows argv[0] for it).
//
// PrepareModuleLookup() is called once at installation; LocateAddress is async-signal-safe
// as far as dladdr is (it takes the loader's lock; a crash inside dlopen is not reported).
#pragma once

#include <cstdint>

namespace Tracewright {

struct ModuleLocation {
    const char* path = "";  // module path; "Unknown" when no module holds the address
    uint32_t segment = 0;   // 1-based PT_LOAD number; 0 when not found
    uint64_t offset = 0;    // bytes from the start of that segment
    uintptr_t bias = 0;     // load bias: address - bias is the address in the module file
    bool found = false;     // a module with readable program headers holds the address
};

// Remembers the main program's path (`executablePath`, kept by the caller for the process's
// life) and base.
void PrepareModuleLookup(const char* executablePath);

ModuleLocation LocateAddress(uintptr_t address);

}  // namespace Tracewright
