// FrameworkOptions: the framework's own command-line options (the module's options are read
// by the module through BaseProcess::GetArgument_*).
//
// Options are `-name value` pairs; when one is given twice the last one wins. The input may
// also come from the environment variable SFR_INPUT_URL, so that a URL with a password need not
// stand in the process list.
#pragma once

#include <string>
#include <vector>

#include "platform/framework/CommandLine.h"
#include "platform/framework/UploadOptions.h"
#include "platform/framework/Usage.h"

struct FrameworkOptions {
    std::string input;                 // -input or SFR_INPUT_URL: file or URL; empty: none
    std::string streamingId;           // -streamingid, default: the input's base name
    std::string parent = "host";       // -parent: destination of every message
    double readRate = -1;              // -readrate: <0 default (1 for files)
    double durationSeconds = -1;       // -duration: <0 none
    double drainTimeoutSeconds = 30;   // -draintimeout
    std::string endpoint;              // -endpoint or AWS_ENDPOINT_URL_S3 / AWS_ENDPOINT_URL
    std::string region;                // -region or AWS_REGION / AWS_DEFAULT_REGION / us-east-1
    std::string regionSource;          // where `region` came from, for messages: "-region", ...
    std::string credentialProcess;     // -credentialprocess
    std::string segmentFormat = "ts";  // -segmentformat
    std::string keyPrefix;             // -keyprefix
    bool playlist = true;              // -playlist on|off: HLS playlists beside the objects
    int logLevel = 11;                 // -loglevel
    std::string logFile;               // -logfile, empty: stderr
    std::string statusPath = "-";      // -status, "-": stdout
    std::string metrics;               // -metrics IP:PORT where /metrics is served; empty: off
    UploadOptions upload;              // -sse, -storageclass, -acl, -tagging, -addressing, ...

    // Reads every option; problems (unreadable numbers) are appended to `errors`, one sentence
    // each, and the option keeps its default.
    static FrameworkOptions Read(const CommandLine& commandLine, std::vector<std::string>& errors);
    // Every framework option with its value, default and meaning, for the usage text.
    static std::vector<OptionHelp> Help();
};

// The options of the running process, set once by BaseProcess's constructor; the transfer
// library and the hosts read them. Empty defaults before any BaseProcess exists. A copy, taken
// under the lock, so that a later Set never changes what a reader holds.
FrameworkOptions CurrentFrameworkOptions();
void SetCurrentFrameworkOptions(const FrameworkOptions& options);
