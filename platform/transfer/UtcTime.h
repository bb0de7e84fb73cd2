// UtcTime: wall-clock instants as the texts the recorder writes (keys, metadata, status lines).
// Pure functions; safe on any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

// `micros` (µs since the Unix epoch) as 20261206T110010.012Z.
std::string CompactUtcTime(uint64_t micros);
// `micros` as 2026-12-06T11:00:10.012Z.
std::string IsoUtcTime(uint64_t micros);
// `micros` as the folders of its day, 2026/12/06.
std::string UtcDatePath(uint64_t micros);
// `time` to the second in UTC through strftime's `format` ("%Y%m%dT%H%M%SZ" for AWS's
// X-Amz-Date, "%Y-%m-%dT%H:%M:%SZ" for the ISO times AWS services answer with).
std::string FormatUtc(std::chrono::system_clock::time_point time, const char* format);
// The wall clock now, in µs since the Unix epoch.
uint64_t UtcNowMicros();
