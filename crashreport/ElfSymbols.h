// ElfSymbols: the function symbol that covers an address in a module file, without the heap.
//
// Reads the module file's symbol table (.symtab, else .dynsym) through a read-only mapping
// of the file, and takes only a function symbol whose [value, value + size) holds the
// address: in a stripped library the nearest exported symbol below an address usually
// belongs to another function, and naming that would mislead. The mapping of the last
// module looked up is kept for the next lookup (a stack mostly stays in few modules).
//
// Called only by the thread that holds the crash handler's busy flag (the cache is not
// locked); async-signal-safe (open, fstat, mmap, munmap, close).
#pragma once

#include <cstddef>
#include <cstdint>

namespace Tracewright {

// `fileAddress` is the address as the module file sees it (run-time address - load bias).
// Writes the (mangled) symbol name into `name` (capacity `size`, cut if longer) and the
// distance from the symbol's start into `displacement`. False when no function covers it.
bool FindFunctionSymbol(const char* path, uint64_t fileAddress, char* name, size_t size,
                        uint64_t* displacement);

}  // namespace Tracewright
