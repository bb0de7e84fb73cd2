// Pacer: reads a file input at `-readrate` times real time.
//
// The receive thread calls Pace with each packet's decode time on the shared clock before it
// hands the packet over; Pace blocks (a timed wait, no polling) until the wall clock has caught
// up with that time divided by the rate. The first packet sets the start. To keep wake-ups few
// (each costs a futex round trip on this thread and on the workers it feeds), packets go in
// bursts: a packet due within the slack goes at once, and a packet that is not waits until it
// is due, so each wake-up opens a burst of one slack's worth. The input thus runs ahead of its
// schedule by at most kSlack of wall-clock time and at most kMediaSlack of media time (at high
// rates the latter bounds the bursts that the module's queues must absorb).
//
// Threads: one thread (the receive thread) calls Pace; the StopSignal may be raised from any
// thread and ends a wait at once.
#pragma once

#include <chrono>
#include <cstdint>

#include "platform/framework/StopSignal.h"

class Pacer {
  public:
    static constexpr std::chrono::milliseconds kSlack{100};
    static constexpr std::chrono::milliseconds kMediaSlack{200};

    // `rate` <= 0: no pacing (Pace returns at once unless stopped).
    Pacer(double rate, StopSignal& stop);

    // Waits until the packet with decode time `dtsUs` (µs, shared clock) is due. False when
    // the stop signal was raised.
    bool Pace(int64_t dtsUs);
    // True when Pace would let the packet go without waiting.
    bool IsDue(int64_t dtsUs);
    bool Paced() const { return rate_ > 0; }

  private:
    // Wall-clock time at which the packet is due; the first call sets the start.
    std::chrono::steady_clock::time_point dueTime(int64_t dtsUs);

    double rate_;
    StopSignal& stop_;
    std::chrono::steady_clock::duration slack_;  // the smaller of the two slacks, wall clock
    bool started_ = false;
    int64_t firstUs_ = 0;  // decode time of the first packet
    std::chrono::steady_clock::time_point wallStart_;
};
