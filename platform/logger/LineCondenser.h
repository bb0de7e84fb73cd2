// LineCondenser: keeps a fault that repeats from flooding the log. Of identical failure and
// warning lines, the first is written; repeats within the window that it opened are counted
// instead; the first repeat after the window is written with the count of those it stood for
// ("... (and 1234 more like it in the last 30 s)"), and opens the next window. A storm of one line
// thus writes one line per window, however fast it comes.
//
// It never waits and keeps no timer: a count is written with the next repeat, so the count of
// a storm's last window is not written at all. Lines are told apart by their whole key (the
// caller's location and text); the least recently seen of more than `capacity` keys is
// forgotten.
//
// Thread-safe (one mutex); only lines that are written anyway come here, so the cost is paid
// by failures and warnings alone.
#pragma once

#include <chrono>
#include <cstdint>
#include <list>
#include <mutex>
#include <string>
#include <unordered_map>

class LineCondenser {
  public:
    using Clock = std::chrono::steady_clock;
    static constexpr std::chrono::seconds kWindow{30};

    explicit LineCondenser(Clock::duration window = kWindow, size_t capacity = 64);

    // For a line with this key at `now`: false when it is to be left out; true when it is to be
    // written, with *repeats the number of lines it stands for that were left out before it
    // (0 for the first of its kind).
    bool Offer(const std::string& key, Clock::time_point now, uint64_t* repeats);

  private:
    struct Seen {
        Clock::time_point windowStart;
        uint64_t leftOut = 0;
        std::list<std::string>::iterator age;  // position in order_
    };

    const Clock::duration window_;
    const size_t capacity_;
    std::mutex mutex_;  // guards the fields below
    std::unordered_map<std::string, Seen> seen_;
    std::list<std::string> order_;  // keys, most recently seen first
};
