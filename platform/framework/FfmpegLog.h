// FfmpegLog: FFmpeg's words in the recorder's texts. Its own messages (a demuxer's warning, a
// protocol's connection error) go through the Logger like every other line, with its level, file,
// escaping and masking of URL secrets, instead of straight to stderr.
//
// Levels: error and worse -> priority 5, warning -> 6, info -> 11, verbose -> 12, debug and
// trace -> 13; lines above the logger's level are dropped before FFmpeg formats them.
// FFmpeg may print one line in several calls; the pieces are gathered per thread until the
// line ends.
#pragma once

#include <string>

// Installs the route once per process; later calls do nothing. Any thread.
void RouteFfmpegLogToLogger();

// The text of an FFmpeg error code (AVERROR(...)), for messages.
std::string FfmpegErrorText(int code);
