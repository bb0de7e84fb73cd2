// Allocation-free demangling through libiberty's callback demangler (see Demangle.h).
#include "crashreport/Demangle.h"

// libiberty declares basename() in a way that clashes with glibc's C++ overloads.
#define HAVE_DECL_BASENAME 1
#include <libiberty/demangle.h>

namespace Tracewright {
namespace {

struct Output {
    char* text;
    size_t size;
    size_t used;  // characters in text, without the NUL
};

void appendPiece(const char* piece, size_t length, void* opaque) {
    auto* out = static_cast<Output*>(opaque);
    for (size_t i = 0; i < length && out->used + 1 < out->size; ++i) {
        out->text[out->used++] = piece[i];
    }
    out->text[out->used] = '\0';
}

// Mangled names beyond this are not demangled: the demangler's work space on the stack
// grows with the name, and the crash handler may run on a small alternate stack.
constexpr size_t kMaxMangled = 2048;

}  // namespace

bool Demangle(const char* mangled, char* out, size_t size, bool isType) {
    if (mangled == nullptr || size == 0) return false;
    if (!isType && (mangled[0] != '_' || mangled[1] != 'Z')) return false;
    size_t length = 0;
    while (mangled[length] != '\0') {
        if (++length > kMaxMangled) return false;
    }
    char scratch[1024];
    Output output{scratch, sizeof(scratch), 0};
    scratch[0] = '\0';
    int options = DMGL_PARAMS | DMGL_ANSI | (isType ? DMGL_TYPES : 0);
    if (cplus_demangle_v3_callback(mangled, options, appendPiece, &output) == 0) return false;
    if (output.used == 0) return false;
    size_t i = 0;
    for (; i + 1 < size && i < output.used; ++i) out[i] = scratch[i];
    out[i] = '\0';
    return true;
}

}  // namespace Tracewright
