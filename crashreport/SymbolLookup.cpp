// Function names through libunwind, source lines through libdw (see SymbolLookup.h).
#include "crashreport/SymbolLookup.h"

#include <elfutils/libdwfl.h>
#include <unistd.h>

#include "crashreport/Demangle.h"
#include "crashreport/ElfSymbols.h"
#include "crashreport/ModuleLookup.h"
#include "crashreport/ReportLine.h"

namespace Tracewright {
namespace {

Dwfl* session = nullptr;  // set once at installation; null when libdw could not start

char* debugInfoPath = nullptr;  // libdw's search path for separate debug files: the default
const Dwfl_Callbacks kCallbacks = {
    dwfl_linux_proc_find_elf,
    dwfl_standard_find_debuginfo,
    nullptr,
    &debugInfoPath,
};

}  // namespace

bool FunctionName(uintptr_t address, char* name, size_t size, uint64_t* displacement) {
    ModuleLocation where = LocateAddress(address);
    if (!where.found) return false;
    char mangled[ReportLine::kCapacity / 2];
    if (!FindFunctionSymbol(where.path, address - where.bias, mangled, sizeof(mangled),
                            displacement)) {
        return false;
    }
    if (!Demangle(mangled, name, size)) CopyText(name, size, mangled);
    return true;
}

void PrepareSourceLines() {
    Dwfl* dwfl = dwfl_begin(&kCallbacks);
    if (dwfl == nullptr) return;
    dwfl_report_begin(dwfl);
    if (dwfl_linux_proc_report(dwfl, getpid()) != 0 || dwfl_report_end(dwfl, nullptr, nullptr)) {
        dwfl_end(dwfl);
        return;
    }
    session = dwfl;
}

bool SourceLine(uintptr_t address, const char** file, int* line) {
    if (session == nullptr) return false;
    Dwfl_Module* module = dwfl_addrmodule(session, address);
    if (module == nullptr) return false;
    Dwfl_Line* entry = dwfl_module_getsrc(module, address);
    if (entry == nullptr) return false;
    const char* name = dwfl_lineinfo(entry, nullptr, line, nullptr, nullptr, nullptr);
    if (name == nullptr) return false;
    *file = name;
    return true;
}

}  // namespace Tracewright
