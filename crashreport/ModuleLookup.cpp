// Module, segment and offset of an address from dladdr and the program headers (see
// ModuleLookup.h).
#include "crashreport/ModuleLookup.h"

#include <dlfcn.h>
#include <elf.h>
#include <link.h>

#include <cstring>

namespace Tracewright {
namespace {

constexpr uintptr_t kPageMask = 4096 - 1;  // the loader maps segments page by page

const char* mainProgramPath = "";
uintptr_t mainProgramBase = 0;  // where the main program's ELF header is mapped

int findMainProgram(struct dl_phdr_info* info, size_t, void*) {
    // The first object that dl_iterate_phdr reports is the main program.
    for (int i = 0; i < info->dlpi_phnum; ++i) {
        const ElfW(Phdr)& header = info->dlpi_phdr[i];
        if (header.p_type == PT_LOAD && header.p_offset == 0) {
            mainProgramBase = info->dlpi_addr + header.p_vaddr;
            break;
        }
    }
    return 1;
}

}  // namespace

void PrepareModuleLookup(const char* executablePath) {
    mainProgramPath = executablePath;
    dl_iterate_phdr(findMainProgram, nullptr);
}

ModuleLocation LocateAddress(uintptr_t address) {
    ModuleLocation location;
    Dl_info info;
    std::memset(&info, 0, sizeof(info));
    if (dladdr(reinterpret_cast<void*>(address), &info) == 0 || info.dli_fbase == nullptr) {
        location.path = "Unknown";
        return location;
    }
    auto base = reinterpret_cast<uintptr_t>(info.dli_fbase);
    location.path = info.dli_fname != nullptr ? info.dli_fname : "";
    if (base == mainProgramBase || location.path[0] == '\0') location.path = mainProgramPath;

    // The ELF header and the program headers lie in the first, file-offset-0 segment, which
    // the loader maps at the module's base.
    const auto* elf = reinterpret_cast<const ElfW(Ehdr)*>(base);
    if (std::memcmp(elf->e_ident, ELFMAG, SELFMAG) != 0) return location;
    const auto* headers = reinterpret_cast<const ElfW(Phdr)*>(base + elf->e_phoff);
    // The load bias: base is the page-aligned start of the first PT_LOAD.
    uintptr_t bias = 0;
    bool haveBias = false;
    for (int i = 0; i < elf->e_phnum && !haveBias; ++i) {
        if (headers[i].p_type != PT_LOAD) continue;
        bias = base - (headers[i].p_vaddr & ~kPageMask);
        haveBias = true;
    }
    if (!haveBias) return location;
    location.bias = bias;
    location.found = true;
    uint32_t number = 0;
    for (int i = 0; i < elf->e_phnum; ++i) {
        const ElfW(Phdr)& header = headers[i];
        if (header.p_type != PT_LOAD) continue;
        ++number;
        uintptr_t start = bias + header.p_vaddr;
        if (address >= start && address - start < header.p_memsz) {
            location.segment = number;
            location.offset = address - start;
            break;
        }
    }
    return location;
}

}  // namespace Tracewright
