// The crash report's sections (see ReportWriter.h).
#include "crashreport/ReportWriter.h"

#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include "crashreport/ExceptionName.h"
#include "crashreport/ModuleLookup.h"
#include "crashreport/ReportLine.h"
#include "crashreport/StackWalk.h"
#include "crashreport/SymbolLookup.h"

namespace Tracewright {
namespace {

constexpr const char* kEquals =
    "=============================================================================\r\n";
constexpr const char* kHyphens =
    "-----------------------------------------------------------------------------\r\n";

// x86-64 page-fault error code bit: the access was a write.
constexpr greg_t kPageFaultWrite = 0x2;
// uc_flags bit: the kernel saved SS in the fourth 16-bit field of REG_CSGSFS.
constexpr unsigned long kSigcontextHasSs = 0x2;

void writeTitle(const CrashReportInput& input, ReportFile& file) {
    struct timespec now {};
    clock_gettime(CLOCK_REALTIME, &now);
    struct tm local {};
    localtime_r(&now.tv_sec, &local);
    ReportLine line;
    line.Text("  Tracewright's Report --- ").Dec(local.tm_year + 1900).Text("/");
    line.Dec(local.tm_mon + 1, 2).Text("/").Dec(local.tm_mday, 2).Text(" ");
    line.Dec(local.tm_hour, 2).Text(":").Dec(local.tm_min, 2).Text(":").Dec(local.tm_sec, 2);
    line.Text(".").Dec(now.tv_nsec / 1000000, 3).Text(" at ").Text(input.computerName);
    line.Text("\r\n");
    file.Write(kEquals);
    file.Write(line);
    file.Write(kEquals);
}

uintptr_t faultPc(const CrashReportInput& input) {
    if (input.context == nullptr) return 0;
    return static_cast<uintptr_t>(input.context->uc_mcontext.gregs[REG_RIP]);
}

void writeExceptionInfo(const CrashReportInput& input, bool stackOverflow, ReportFile& file) {
    ExceptionName name = NameException(input.signal, input.info, stackOverflow);
    ReportLine codeLine;
    codeLine.Text("Exception code: ").Hex(name.code, 8).Text(" ").Text(name.name).Text("\r\n");
    file.Write(codeLine);

    uintptr_t pc = faultPc(input);
    ModuleLocation where = LocateAddress(pc);
    ReportLine faultLine;
    faultLine.Text("Fault address : ").Hex(pc, 16).Text(" ").Hex(where.segment, 2).Text(":");
    faultLine.Hex(where.offset, 16).Text("\r\n");
    file.Write(faultLine);

    if (name.code == kAccessViolation && IsFault(input.info)) {
        bool write = input.context != nullptr &&
                     (input.context->uc_mcontext.gregs[REG_ERR] & kPageFaultWrite) != 0;
        ReportLine accessLine;
        accessLine.Text("Access address: ")
            .Hex(reinterpret_cast<uintptr_t>(input.info->si_addr), 0);
        accessLine.Text(write ? "(Write)\r\n" : "(Read)\r\n");
        file.Write(accessLine);
    }

    ReportLine moduleLine;
    moduleLine.Text("Module        : ").Text(where.path).Text("\r\n");
    file.Write(moduleLine);

    auto thread = static_cast<uint32_t>(syscall(SYS_gettid));
    ReportLine threadLine;
    threadLine.Text("Current thread: ").Hex(thread, 8).Text("(").Dec(thread).Text(")\r\n");
    file.Write(threadLine);
}

void writeFaultFunction(const CrashReportInput& input, ReportFile& file) {
    uintptr_t pc = faultPc(input);
    char name[ReportLine::kCapacity / 2];
    uint64_t displacement = 0;
    if (!FunctionName(pc, name, sizeof(name), &displacement)) return;
    ReportLine functionLine;
    functionLine.Text("Function      : ").Text(name).Text("\r\n");
    file.Write(functionLine);
    const char* source = nullptr;
    int number = 0;
    if (!SourceLine(pc, &source, &number)) return;
    ReportLine sourceLine;
    sourceLine.Text("Source file   : ").Text(source).Text(" Line:").Dec(number).Text("\r\n");
    file.Write(sourceLine);
}

void writeRegister(const char* label, uint64_t value, int width, ReportFile& file) {
    ReportLine line;
    line.Text(label).Hex(value, width).Text("\r\n");
    file.Write(line);
}

void writeRegisters(const ucontext_t& context, ReportFile& file) {
    const greg_t* r = context.uc_mcontext.gregs;
    auto csgsfs = static_cast<uint64_t>(r[REG_CSGSFS]);
    uint64_t cs = csgsfs & 0xFFFF;
    uint64_t gs = (csgsfs >> 16) & 0xFFFF;
    uint64_t fs = (csgsfs >> 32) & 0xFFFF;
    uint64_t ss = (context.uc_flags & kSigcontextHasSs) != 0 ? (csgsfs >> 48) & 0xFFFF : 0;
    writeRegister("Registers     : EAX: ", r[REG_RAX], 16, file);
    writeRegister("                EBX: ", r[REG_RBX], 16, file);
    writeRegister("                ECX: ", r[REG_RCX], 16, file);
    writeRegister("                EDX: ", r[REG_RDX], 16, file);
    writeRegister("                ESI: ", r[REG_RSI], 16, file);
    writeRegister("                EDI: ", r[REG_RDI], 16, file);
    writeRegister("                EBP: ", r[REG_RBP], 16, file);
    // The kernel does not save DS and ES in a signal frame.
    writeRegister("                DS : ", 0, 4, file);
    writeRegister("                ES : ", 0, 4, file);
    writeRegister("                FS : ", fs, 4, file);
    writeRegister("                GS : ", gs, 4, file);
    ReportLine ip;
    ip.Text("                CS:EIP: ").Hex(cs, 4).Text(":").Hex(r[REG_RIP], 16).Text("\r\n");
    file.Write(ip);
    ReportLine sp;
    sp.Text("                SS:ESP: ").Hex(ss, 4).Text(":").Hex(r[REG_RSP], 16).Text("\r\n");
    file.Write(sp);
    writeRegister("                Flags : ", r[REG_EFL] & 0xFFFFFFFF, 8, file);
}

}  // namespace

void WriteReport(const CrashReportInput& input, ReportFile& file) {
    writeTitle(input, file);
    bool stackOverflow = IsStackOverflow(input.signal, input.info, input.context);
    writeExceptionInfo(input, stackOverflow, file);
    file.Flush();  // what happened and where is on disk before the riskier lookups
    if (input.hook != nullptr) input.hook();
    if (input.context != nullptr) {
        // A stack overflow skips the symbol lookup of the fault; its frames still get names.
        if (!stackOverflow) writeFaultFunction(input, file);
        file.Write("\r\nCall stack    :\r\n");
        file.Write(kHyphens);
        WalkStack(input.context, file);
        file.Write(kHyphens);
        file.Write("\r\n");
        writeRegisters(*input.context, file);
    }
    file.Write("\r\n\r\n");
}

}  // namespace Tracewright
