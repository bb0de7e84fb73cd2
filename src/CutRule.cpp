// The cut rule and the plan of what a file takes; see CutRule.h.
#include "src/CutRule.h"

#include <algorithm>

namespace Orvane {

namespace {
// Samples taken from the front of a list: those below the cut, up to the first at or past it.
size_t takenBelow(const std::vector<uint64_t>& timestamps, uint64_t cut) {
    size_t taken = 0;
    while (taken < timestamps.size() && timestamps[taken] < cut) ++taken;
    return taken;
}
}  // namespace

uint64_t ChooseCut(const CutInput& in) {
    if (in.gops.empty()) return 0;  // no file without video, even if audio is held
    const uint64_t interval = static_cast<uint64_t>(static_cast<int64_t>(in.interval));
    const uint64_t boundary = in.fileStart + interval;
    bool firstSet = false;
    uint64_t first = 0;  // timestamp of the oldest held GOP's first sample

    for (size_t i = 0; i + 1 < in.gops.size(); ++i) {
        const std::vector<uint64_t>& gop = in.gops[i];
        const uint64_t last = gop.back();
        if (last >= boundary) {
            // The oldest GOP already reaches past the boundary: split it there.
            if (!firstSet) return boundary;
            // The held video began well after the previous cut: run on into this GOP.
            if (last - first < interval) return last;
            // Otherwise end just before this GOP.
            return std::min(gop.front() - 1, boundary);
        }
        if (!firstSet) {
            first = gop.front();
            firstSet = true;
        }
        // The remainder of a split GOP: this file takes it whole and no more.
        if (!in.startsWithIdr(i)) return std::min(last + 1, boundary);
    }

    const std::vector<uint64_t>& growing = in.gops.back();
    // Every older GOP ends before the boundary: take them all, end before the growing GOP.
    if (firstSet) return growing.front() - 1;
    // A single GOP: split it at the boundary once it reaches past it.
    return growing.back() > boundary ? boundary : 0;
}

CutPlan PlanCut(const CutInput& in, uint64_t cut) {
    CutPlan plan;
    plan.cut = cut;
    plan.duration = static_cast<uint32_t>(cut) - static_cast<uint32_t>(in.fileStart);
    for (const std::vector<uint64_t>& gop : in.gops) {
        const size_t taken = takenBelow(gop, cut);
        if (taken < gop.size()) {
            plan.splitTaken = taken;
            break;
        }
        ++plan.wholeGops;
    }
    plan.audio = takenBelow(in.audio, cut);
    plan.meta = takenBelow(in.meta, cut);
    return plan;
}

CutPlan DecideCut(const CutInput& in) {
    const uint64_t cut = ChooseCut(in);
    return cut == 0 ? CutPlan() : PlanCut(in, cut);
}

}  // namespace Orvane
