// Call stack of the crashing thread through libunwind (see StackWalk.h).
#include "crashreport/StackWalk.h"

#define UNW_LOCAL_ONLY
#include <libunwind.h>

#include "crashreport/ModuleLookup.h"
#include "crashreport/ReportLine.h"
#include "crashreport/SymbolLookup.h"

namespace Tracewright {
namespace {

struct Frame {
    uintptr_t pc = 0;
    bool interrupted = false;  // the pc is the interrupted instruction, not a return address
};

void writeFrame(const Frame& frame, ReportFile& file) {
    ReportLine line;
    line.Hex(frame.pc, 16).Text("  ");
    // A return address may already lie past the end of its caller (a call to a function that
    // does not return is often the caller's last instruction): look up the call itself.
    uintptr_t lookup = frame.interrupted || frame.pc == 0 ? frame.pc : frame.pc - 1;
    char name[ReportLine::kCapacity / 2];
    uint64_t displacement = 0;
    bool haveName = FunctionName(lookup, name, sizeof(name), &displacement);
    if (haveName && lookup != frame.pc) ++displacement;
    ModuleLocation where = LocateAddress(lookup);
    if (lookup != frame.pc && where.segment != 0) ++where.offset;
    if (haveName) {
        line.Text(name).Text("+").Hex(displacement, 0).Text("(");
        line.Hex(where.segment, 4).Text(":").Hex(where.offset, 16).Text(" ");
        line.Text(where.path).Text(")\r\n");
    } else {
        line.Hex(where.segment, 4).Text(":").Hex(where.offset, 16).Text(" ");
        line.Text(where.path).Text("\r\n");
    }
    file.Write(line);
}

}  // namespace

void WalkStack(ucontext_t* context, ReportFile& file) {
    file.Write("Address \r\n");
    unw_cursor_t cursor;
    if (unw_init_local2(&cursor, context, UNW_INIT_SIGNAL_FRAME) != 0) return;
    Frame tail[kTailFrames];  // ring of the latest frames past the head
    uint32_t count = 0;       // frames walked
    bool afterSignal = true;  // this frame was interrupted by a signal (the first one is)
    while (count < kMaxFrames) {
        unw_word_t pc = 0;
        if (unw_get_reg(&cursor, UNW_REG_IP, &pc) != 0 || pc == 0) break;
        Frame frame;
        frame.pc = pc;
        frame.interrupted = afterSignal;
        afterSignal = unw_is_signal_frame(&cursor) > 0;
        if (count < static_cast<uint32_t>(kHeadFrames)) {
            writeFrame(frame, file);
        } else {
            tail[(count - kHeadFrames) % kTailFrames] = frame;
        }
        ++count;
        if (unw_step(&cursor) <= 0) break;
    }
    if (count <= static_cast<uint32_t>(kHeadFrames)) return;
    uint32_t past = count - kHeadFrames;  // frames after the head
    uint32_t shown = past < kTailFrames ? past : kTailFrames;
    if (past > shown) {
        ReportLine line;
        line.Text("                  ... ").Dec(past - shown).Text(" frames not shown ...\r\n");
        file.Write(line);
    }
    for (uint32_t i = past - shown; i < past; ++i) writeFrame(tail[i % kTailFrames], file);
}

}  // namespace Tracewright
