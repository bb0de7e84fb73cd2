// VqStreamFileData: one finished stream file: the samples of one upload interval.
//
// A plain value. Samples are StreamData copies that share their payloads with the samples
// they were copied from, so copying a file never copies payload bytes. Every sample's
// timestamp is below the file's end time; each list is in arrival order. An "empty" file has
// duration 0 and three empty lists; only the data controller's wake-up record is one.
#pragma once

#include <cstdint>
#include <vector>

#include "platform/framework/StreamData.h"

struct VqStreamFileData {
    uint32_t duration = 0;  // ms of stream the file covers (32-bit arithmetic, wraps)
    std::vector<StreamData> video;
    std::vector<StreamData> audio;
    std::vector<StreamData> meta;

    bool IsEmpty() const { return duration == 0 && video.empty() && audio.empty() && meta.empty(); }
};
