// Demangling of C++ symbol and type names without the heap.
//
// abi::__cxa_demangle always allocates, which a signal handler must not do; this uses the
// callback form of the GNU demangler (libiberty), which works on the caller's stack only
// (a few times the mangled name's length). Async-signal-safe and thread-safe.
#pragma once

#include <cstddef>

namespace Tracewright {

// Writes the demangled form of `mangled` into `out` (capacity `size`, NUL-terminated, cut if
// too long). `mangled` is a symbol ("_ZN1a1bEv"; names without the _Z prefix, like C
// functions, are left alone) or, with `isType`, a type_info name ("St13runtime_error"). False
// and `out` untouched when `mangled` cannot be demangled.
bool Demangle(const char* mangled, char* out, size_t size, bool isType = false);

}  // namespace Tracewright
