// The cut rule: where the next stream file ends and which held samples it takes.
//
// Pure functions over plain timestamps: no locks, threads, clocks or logging. The filing thread
// copies the timestamps of its holding lists into a CutInput (each list under its own lock),
// decides, and then moves exactly the samples the CutPlan names from the fronts of its lists.
//
// A cut time is an exclusive end in ms: from the front of each list a file takes the samples
// whose timestamp is below the cut, up to the first one at or past it (which stays held with all
// after it, even if a later one is below the cut). A cut time of 0 means "no file now".
//
// The rule: a file covers one interval of stream time from fileStart and ends just before the
// IDR that opens the last GOP at or before the boundary (fileStart + interval), so that every
// file begins with a decodable picture. A GOP longer than the time left to the boundary is
// split at the boundary, and the next file takes the remainder of that GOP whole. Held video
// that began long after fileStart (a gap) makes the file end within its own GOPs.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <vector>

namespace Orvane {

struct CutInput {
    // Timestamps (ms) of the held video: one non-empty vector per GOP, oldest GOP first, each
    // in arrival order. The last GOP is the one still growing.
    std::vector<std::vector<uint64_t>> gops;
    // Whether GOP i begins with an IDR picture; false for the remainder of a GOP that an
    // earlier cut split. Asked only for the GOPs the rule passes over, in order, at most once
    // each, on the calling thread (the filing thread asks its NAL analyzer under the GOP lock).
    std::function<bool(size_t)> startsWithIdr;
    std::vector<uint64_t> audio;  // timestamps (ms) of the held audio, arrival order
    std::vector<uint64_t> meta;   // timestamps (ms) of the held meta, arrival order
    uint64_t fileStart = 0;       // ms: recording origin + time filed so far (64-bit, wraps)
    int32_t interval = 0;         // ms: upload interval; widened with its sign to 64 bits
};

struct CutPlan {
    uint64_t cut = 0;       // exclusive end (ms); 0: no file now and nothing below
    uint32_t duration = 0;  // ms the file covers: cut - fileStart in 32-bit arithmetic
    // Video: this many GOPs are emptied from the front; if GOPs remain, `splitTaken` samples
    // (possibly none) are then taken from the front of the next one, which stays held.
    size_t wholeGops = 0;
    size_t splitTaken = 0;
    size_t audio = 0;  // samples taken from the front of the audio list
    size_t meta = 0;   // samples taken from the front of the meta list
};

// The end of the next file by the rule above; 0 when none is due (no video held, or a single
// GOP that has not yet passed the boundary).
uint64_t ChooseCut(const CutInput& in);

// What a file ending at `cut` takes from `in` (any cut, also one the caller chose itself).
CutPlan PlanCut(const CutInput& in, uint64_t cut);

// ChooseCut, then PlanCut; an all-zero plan when no cut is due.
CutPlan DecideCut(const CutInput& in);

}  // namespace Orvane
