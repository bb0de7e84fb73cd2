// FrameworkOptions: the framework's own command-line options (the module's options are read
// by the module through BaseProcess::GetArgument_*).
//
// Options are `-name value` pairs; when one is given twice the last one wins.
#pragma once

#include <string>
#include <vector>

#include "platform/framework/UploadOptions.h"

// Reads `-name value` pairs out of argv. Thread-safe after construction (read-only).
class CommandLine {
  public:
    CommandLine(int argc, char** argv);
    // True and the value when `-name` is given with a value.
    bool Find(const std::string& name, std::string& value) const;
    // Whole decimal number within int range; false when absent or not a number.
    static bool ParseInt(const std::string& text, int& value);
    static bool ParseDouble(const std::string& text, double& value);

  private:
    std::vector<std::string> args_;
};

struct FrameworkOptions {
    std::string input;                 // -input: file or URL to record; empty: none
    std::string streamingId;           // -streamingid, default: the input's base name
    std::string parent = "host";       // -parent: destination of every message
    double readRate = -1;              // -readrate: <0 default (1 for files)
    double durationSeconds = -1;       // -duration: <0 none
    double drainTimeoutSeconds = 30;   // -draintimeout
    std::string endpoint;              // -endpoint or AWS_ENDPOINT_URL_S3 / AWS_ENDPOINT_URL
    std::string region;                // -region or AWS_REGION / AWS_DEFAULT_REGION / us-east-1
    std::string credentialProcess;     // -credentialprocess
    std::string segmentFormat = "ts";  // -segmentformat
    std::string keyPrefix;             // -keyprefix
    int logLevel = 11;                 // -loglevel
    std::string logFile;               // -logfile, empty: stderr
    std::string statusPath = "-";      // -status, "-": stdout
    UploadOptions upload;              // -sse, -storageclass, -acl, -tagging, -addressing, ...

    // Reads every option; problems (unreadable numbers) are appended to `errors`, and the
    // option keeps its default.
    static FrameworkOptions Read(const CommandLine& commandLine, std::vector<std::string>& errors);
};

// The options of the running process, set once by BaseProcess's constructor; the transfer
// library and the hosts read them. Empty defaults before any BaseProcess exists.
const FrameworkOptions& CurrentFrameworkOptions();
void SetCurrentFrameworkOptions(const FrameworkOptions& options);
